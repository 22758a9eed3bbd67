// Owners of the runtime's strings and buffers, and their contents.
#pragma once

#include <string>
#include <vector>

#include "runtime/tbuffer.h"
#include "runtime/tstr_array.h"
#include "tests/support/owners.h"

using string_owner = owner<tstring, ts_free>;
using tokens_owner = owner<tstr_array, tstr_array_free>;
using buffer_owner = owner<tbuffer, tb_free>;

inline std::string text(const tstring *string) {
    return string ? std::string(string->buffer, static_cast<size_t>(string->length)) : "(null)";
}
inline std::string bytes_of(const tbuffer *buffer) {
    return {reinterpret_cast<const char *>(tb_buf(buffer)), static_cast<size_t>(tb_length(buffer))};
}
inline std::vector<std::string> list_of(const tstr_array *parts) {
    std::vector<std::string> all;
    for (uint32_t i = 0; i < tstr_array_length_quick(parts); i++)
        all.push_back(text(tstr_array_get_quick(parts, i)));
    return all;
}
