// A chained hash table; a key is a sequence of bytes. Without an insert function the table stores the
// caller's key and value pointers, and its free function, if any, has to free them. Not locked: the owner's
// lock guards it.
#pragma once

#include <cstdint>

#include "runtime/common.h"

constexpr uint32_t ht_table_size_initial = 31;
constexpr uint32_t ht_table_size_max = 0xa00000;
constexpr uint32_t ht_table_resize_factor = 4;
constexpr uint32_t ht_table_resize_growth_load_factor = 3;
constexpr uint32_t ht_table_resize_shrink_load_factor = 6;

using ht_hash_function = uint32_t (*)(const void *key, uint32_t key_length);
using ht_key_equal_function = int (*)(const void *a, uint32_t a_length, const void *b, uint32_t b_length);
// Makes the key and the value that are stored, copies for example, of those that the caller passes to
// ht_insert.
using ht_insert_function = lc_status (*)(const void *key, uint32_t key_length, void *value, void *user_word,
                                         void **out_key, void **out_value);
using ht_free_function = lc_status (*)(void *key, uint32_t key_length, void *value, void *user_word);

struct ht_options {
    ht_hash_function hash_function;
    ht_key_equal_function key_equal_function;
    ht_insert_function insert_function;
    void *user_word;
    ht_free_function free_function;
    int refuse_duplicates;
};

struct ht_entry {
    void *key;
    uint32_t key_length;
    void *value;
    ht_entry *next;
};
struct ht {
    uint32_t bucket_count;
    uint32_t entry_count;
    int refuse_duplicates;
    ht_entry **buckets;
    ht_hash_function hash_function;
    ht_key_equal_function key_equal_function;
    ht_insert_function insert_function;
    void *user_word;
    ht_free_function free_function;
};

void ht_default_options(ht_options *out);
// Bob Jenkins' lookup2 hash; `length` in bytes.
uint32_t ht_bjh_hash(const void *key, uint32_t length, uint32_t initial);
uint32_t ht_hash_string_func(const void *key, uint32_t length);
int ht_key_equal_string_func(const void *a, uint32_t a_length, const void *b, uint32_t b_length);

lc_status ht_new(ht **out, const ht_options *options);
lc_status ht_empty(ht *table);
lc_status ht_free(ht **inout);
// `key_length` in bytes; -1 means strlen(key). A key that is in the table already is LC_EXISTS if duplicates
// are refused; otherwise its entry is deleted before the new one is made. If the free function fails for the
// old entry, the result is LC_GENERIC: the old entry is gone, and the new key and value stay the caller's.
lc_status ht_insert(ht *table, const void *key, int32_t key_length, void *value);
// A missing key is not a failure: `out_found` is 0 and `out_key_length` -1. Outs may be null. The results
// stay the table's.
lc_status ht_lookup(const ht *table, const void *key, int32_t key_length, int *out_found, void **out_key,
                    int32_t *out_key_length, void **out_value);
lc_status ht_delete(ht *table, const void *key, int32_t key_length); // 0 for a missing key
