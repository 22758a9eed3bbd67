// The only file that includes the library: it takes several seconds to compile.
#include "peers/mgmtctl/ctl_json.h"

#include <nlohmann/json.hpp>

namespace {
using library_json = nlohmann::ordered_json;
constexpr size_t DEPTH_MAX = 100; // values are destroyed and written recursively

library_json library_value(const ctl_json &value) {
    using kind = ctl_json::kind;
    library_json out;
    switch (value.type) {
    case kind::null:
        break;
    case kind::boolean:
        return value.number != 0;
    case kind::integer:
        return static_cast<int64_t>(value.number);
    case kind::natural:
        return value.number;
    case kind::real:
        return value.real;
    case kind::text:
        return value.text;
    case kind::array:
        out = library_json::array();
        for (const ctl_json &item : value.items)
            out.push_back(library_value(item));
        break;
    case kind::object:
        out = library_json::object();
        for (size_t i = 0; i < value.items.size(); i++)
            out[value.names[i]] = library_value(value.items[i]);
        break;
    }
    return out;
}

// The library calls these functions as it reads; false ends the reading.
struct json_builder {
    ctl_json *root;
    std::vector<ctl_json *> open; // the arrays and objects that contain one another, the innermost last

    ctl_json *store(ctl_json &&value) {
        if (open.empty()) {
            *root = std::move(value);
            return root;
        }
        return &open.back()->items.emplace_back(std::move(value));
    }
    bool open_value(ctl_json &&value) {
        if (open.size() == DEPTH_MAX)
            return false;
        open.push_back(store(std::move(value)));
        return true;
    }
    bool close_value() {
        open.pop_back();
        return true;
    }

    bool null() { return store(nullptr); }
    bool boolean(bool value) { return store(value); }
    bool number_integer(int64_t value) { return store(value); }
    bool number_unsigned(uint64_t value) { return store(value); }
    bool number_float(double value, const std::string &) { return store(value); }
    bool string(std::string &value) { return store(std::move(value)); }
    bool binary(library_json::binary_t &) { return false; }
    bool key(std::string &name) {
        open.back()->names.push_back(std::move(name));
        return true;
    }
    bool start_object(size_t) { return open_value(ctl_json::object()); }
    bool end_object() { return close_value(); }
    bool start_array(size_t) { return open_value(ctl_json::array()); }
    bool end_array() { return close_value(); }
    bool parse_error(size_t, const std::string &, const library_json::exception &) { return false; }
};
} // namespace

std::string json_text(const ctl_json &value, int indent) {
    return library_value(value).dump(indent, ' ', true, library_json::error_handler_t::replace);
}

bool parse_json(const std::string &text, ctl_json *out) {
    *out = {};
    json_builder builder = {out, {}};
    return library_json::sax_parse(text, &builder);
}
