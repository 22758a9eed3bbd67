// The chained hash table. A bucket is a singly linked list of entries; new entries are added at its end.
// After each insertion and deletion the number of buckets is adapted: it grows at more than 3 entries per
// bucket and shrinks at less than one entry per 6 buckets. If there is no memory for that, the table keeps
// the buckets that it has.
#include "runtime/hash_table.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/logging.h"

// --- Hash: Jenkins' lookup2 over the key's bytes

namespace {

struct jenkins_state {
    uint32_t a, b, c;

    void mix() {
        a = (a - b - c) ^ (c >> 13);
        b = (b - c - a) ^ (a << 8);
        c = (c - a - b) ^ (b >> 13);
        a = (a - b - c) ^ (c >> 12);
        b = (b - c - a) ^ (a << 16);
        c = (c - a - b) ^ (b >> 5);
        a = (a - b - c) ^ (c >> 3);
        b = (b - c - a) ^ (a << 10);
        c = (c - a - b) ^ (b >> 15);
    }
};

uint32_t little_endian(const uint8_t *bytes, uint32_t count) {
    uint32_t value = 0;
    for (uint32_t i = 0; i < std::min(count, 4u); i++)
        value |= uint32_t{bytes[i]} << (8 * i);
    return value;
}

} // namespace

uint32_t ht_bjh_hash(const void *key, uint32_t length, uint32_t initial) {
    const auto *bytes = static_cast<const uint8_t *>(key);
    jenkins_state state{0x9e3779b9, 0x9e3779b9, initial};
    uint32_t rest = length;
    for (; rest >= 12; rest -= 12, bytes += 12) {
        state.a += little_endian(bytes, 4);
        state.b += little_endian(bytes + 4, 4);
        state.c += little_endian(bytes + 8, 4);
        state.mix();
    }
    // The lowest byte of c is reserved for the length; the remaining key bytes go into the other three.
    state.c += length;
    state.a += little_endian(bytes, rest);
    if (rest > 4)
        state.b += little_endian(bytes + 4, rest - 4);
    if (rest > 8)
        state.c += little_endian(bytes + 8, rest - 8) << 8;
    state.mix();
    return state.c;
}
uint32_t ht_hash_string_func(const void *key, uint32_t length) {
    return ht_bjh_hash(key, length, 0x12345678);
}
int ht_key_equal_string_func(const void *a, uint32_t a_length, const void *b, uint32_t b_length) {
    return a_length == b_length && memcmp(a, b, a_length) == 0;
}

// --- Creation and release

void ht_default_options(ht_options *out) {
    *out = ht_options{};
    out->hash_function = ht_hash_string_func;
    out->key_equal_function = ht_key_equal_string_func;
}

namespace {

ht_entry **new_buckets(uint32_t count) {
    // NOLINTNEXTLINE(bugprone-sizeof-expression): a bucket is the pointer to its first entry
    return static_cast<ht_entry **>(calloc(count, sizeof(ht_entry *)));
}

void free_table_record(ht *table) {
    free(table);
}
void free_entry_record(ht_entry *entry) {
    free(entry);
}

} // namespace

lc_status ht_new(ht **out, const ht_options *options) {
    CHECK_NULL(out);
    *out = nullptr;
    ht_options defaults;
    ht_default_options(&defaults);
    if (!options)
        options = &defaults;
    owned<ht, free_table_record> made(static_cast<ht *>(calloc(1, sizeof(ht))));
    ht *table = made.pointer;
    CHECK_NULL(table);
    table->buckets = new_buckets(ht_table_size_initial);
    CHECK_NULL(table->buckets);
    table->bucket_count = ht_table_size_initial;
    table->refuse_duplicates = options->refuse_duplicates;
    table->hash_function = options->hash_function ? options->hash_function : defaults.hash_function;
    table->key_equal_function =
        options->key_equal_function ? options->key_equal_function : defaults.key_equal_function;
    table->insert_function = options->insert_function;
    table->user_word = options->user_word;
    table->free_function = options->free_function;
    *out = made.take();
    return LC_OK;
}

namespace {

void set_bucket_count(ht *table, uint32_t bucket_count) {
    ht_entry **buckets = new_buckets(bucket_count);
    if (!buckets)
        return;
    LC_LOG(LC_LOG_DEBUG, "resize ht from %d to %d", static_cast<int32_t>(table->bucket_count),
           static_cast<int32_t>(bucket_count));
    for (uint32_t i = 0; i < table->bucket_count; i++) {
        while (ht_entry *entry = table->buckets[i]) {
            table->buckets[i] = entry->next;
            // The order of a chain doesn't matter: no two of its entries have the same key.
            ht_entry **head = &buckets[table->hash_function(entry->key, entry->key_length) % bucket_count];
            entry->next = *head;
            *head = entry;
        }
    }
    free(table->buckets);
    table->buckets = buckets;
    table->bucket_count = bucket_count;
}

// Grows or shrinks the table if its load is out of bounds.
void adapt_bucket_count(ht *table) {
    const uint64_t entries = table->entry_count;
    uint32_t buckets = table->bucket_count;
    if (entries > uint64_t{ht_table_resize_growth_load_factor} * buckets && buckets < ht_table_size_max) {
        set_bucket_count(table, std::min(buckets * ht_table_resize_factor, ht_table_size_max));
    } else if (buckets >
               std::max<uint64_t>(ht_table_resize_shrink_load_factor * entries, ht_table_size_initial)) {
        uint32_t before;
        // In one step, however far: ht_empty of a large table leads here.
        do {
            before = buckets;
            buckets /= ht_table_resize_factor;
        } while (before >= 128 && ht_table_resize_shrink_load_factor * entries < buckets);
        set_bucket_count(table, std::max(buckets, ht_table_size_initial));
    }
}

// Unlinks one entry and frees it. It is gone even if its free function fails, which gives LC_GENERIC.
lc_status delete_entry(ht *table, ht_entry **link) {
    ht_entry *entry = *link;
    *link = entry->next;
    table->entry_count--;
    lc_status status = LC_OK;
    if (table->free_function)
        status = table->free_function(entry->key, entry->key_length, entry->value, table->user_word);
    free(entry);
    return status == LC_OK ? LC_OK : LC_GENERIC;
}

lc_status delete_all_entries(ht *table) {
    lc_status result = LC_OK;
    for (uint32_t i = 0; i < table->bucket_count; i++) {
        while (table->buckets[i]) {
            // A free function that fails doesn't keep the other entries from being freed.
            const lc_status status = delete_entry(table, &table->buckets[i]);
            if (status != LC_OK)
                result = status;
        }
    }
    return result;
}

} // namespace

lc_status ht_empty(ht *table) {
    CHECK_NULL(table);
    const lc_status status = delete_all_entries(table);
    adapt_bucket_count(table);
    CHECK_STATUS(status);
    return LC_OK;
}
lc_status ht_free(ht **inout) {
    CHECK_NULL(inout);
    ht *table = *inout;
    *inout = nullptr;
    if (!table)
        return LC_OK;
    const lc_status status = delete_all_entries(table);
    free(table->buckets);
    free(table);
    CHECK_STATUS(status);
    return LC_OK;
}

// --- Entries

namespace {

uint32_t key_bytes(const void *key, int32_t key_length) {
    return key_length < 0 ? static_cast<uint32_t>(strlen(static_cast<const char *>(key)))
                          : static_cast<uint32_t>(key_length);
}

// The pointer that points to this key's entry, or the null pointer at the end of its chain.
ht_entry **find_link(const ht *table, const void *key, uint32_t length) {
    ht_entry **link = &table->buckets[table->hash_function(key, length) % table->bucket_count];
    while (*link && !table->key_equal_function((*link)->key, (*link)->key_length, key, length))
        link = &(*link)->next;
    return link;
}

} // namespace

lc_status ht_insert(ht *table, const void *key, int32_t key_length, void *value) {
    CHECK_NULL(table);
    CHECK_NULL(key);
    const uint32_t length = key_bytes(key, key_length);
    if (table->refuse_duplicates && *find_link(table, key, length))
        return LC_EXISTS;
    owned<ht_entry, free_entry_record> entry(static_cast<ht_entry *>(calloc(1, sizeof(ht_entry))));
    CHECK_NULL(entry.pointer);
    *entry.pointer = {const_cast<void *>(key), length, value, nullptr};
    // Deletes an old entry of this key. This may resize the table; therefore the place is looked up only
    // afterwards.
    CHECK_STATUS(ht_delete(table, key, key_length));
    // Such a table stores copies of key and value; any other keeps the caller's pointers and owns them from
    // now on.
    if (table->insert_function)
        CHECK_STATUS(table->insert_function(key, length, value, table->user_word, &entry.pointer->key,
                                            &entry.pointer->value));
    *find_link(table, key, length) = entry.take(); // the key is absent: this is the end of its chain
    table->entry_count++;
    adapt_bucket_count(table);
    return LC_OK;
}
lc_status ht_lookup(const ht *table, const void *key, int32_t key_length, int *out_found, void **out_key,
                    int32_t *out_key_length, void **out_value) {
    if (out_found)
        *out_found = 0;
    if (out_key)
        *out_key = nullptr;
    if (out_key_length)
        *out_key_length = -1;
    if (out_value)
        *out_value = nullptr;
    CHECK_NULL(table);
    CHECK_NULL(key);
    const ht_entry *entry = *find_link(table, key, key_bytes(key, key_length));
    if (!entry)
        return LC_OK;
    if (out_found)
        *out_found = 1;
    if (out_key)
        *out_key = entry->key;
    if (out_key_length)
        *out_key_length = static_cast<int32_t>(entry->key_length);
    if (out_value)
        *out_value = entry->value;
    return LC_OK;
}
lc_status ht_delete(ht *table, const void *key, int32_t key_length) {
    CHECK_NULL(table);
    CHECK_NULL(key);
    ht_entry **link = find_link(table, key, key_bytes(key, key_length));
    if (!*link)
        return LC_OK;
    const lc_status status = delete_entry(table, link);
    adapt_bucket_count(table);
    CHECK_STATUS(status);
    return LC_OK;
}
