#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "runtime/hash_table.h"
#include "runtime/tree.h"
#include "runtime/tstr_array.h"
#include "runtime/typed_arrays.h"
#include "tests/support/log_lines.cpp" // this program is linked without the engine's helpers
#include "tests/support/owners.h"

using numbers_owner = owner<uint32_array, uint32_array_free>;
using strings_owner = owner<tstr_array, tstr_array_free>;
using array_owner = owner<array, array_free>;
using table_owner = owner<ht, ht_free>;
using tree_owner = owner<tree, tree_free>;

using numbers = std::vector<uint32_t>;
static void fill(numbers_owner &list, const numbers &values) {
    ASSERT_EQ(uint32_array_new(&list), LC_OK);
    for (const uint32_t value : values)
        ASSERT_EQ(uint32_array_append(list, value), LC_OK);
}
static numbers values(const uint32_array *list) {
    numbers all;
    for (uint32_t i = 0; i < uint32_array_length_quick(list); i++)
        all.push_back(uint32_array_get_quick(list, i));
    return all;
}

// ---- Arrays

TEST(Arrays, CapacityAndPlaces) {
    array_owner list;
    ASSERT_EQ(array_new(&list, nullptr), LC_OK);
    EXPECT_TRUE(list->capacity == 10 && list->sorted);
    int places[32];
    for (int i = 0; i < 11; i++) {
        void *element = &places[i];
        ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
        EXPECT_EQ(element, nullptr);
    }
    EXPECT_EQ(list->capacity, 20u);
    void *out = &places[0], *element = &places[20];
    EXPECT_EQ(array_get(list, 11, &out), LC_NOT_FOUND);
    EXPECT_EQ(out, nullptr);
    EXPECT_EQ(array_set_takeover(list, 13, &element), LC_OK);
    EXPECT_TRUE(list->length == 14 && !list->sorted);
    EXPECT_EQ(array_get_quick(list, 11), nullptr);
    EXPECT_EQ(array_get_quick(list, 13), &places[20]);
    list->sorted = 1;
    element = nullptr;
    EXPECT_EQ(array_set_takeover(list, 15, &element), LC_OK); // nulls are in no order either
    EXPECT_TRUE(list->length == 16 && !list->sorted);
    element = &places[20];
    EXPECT_EQ(array_set_takeover(list, 0xffffffff, &element), LC_ASSERTION);
    EXPECT_EQ(array_append(list, &places[0]), LC_ASSERTION); // no function to copy it
    EXPECT_EQ(array_empty(list), LC_OK);
    EXPECT_TRUE(list->capacity == 10 && list->length == 0);
}

TEST(Arrays, KnowWhetherTheyAreInOrder) {
    numbers_owner list;
    fill(list, {1, 2, 2, 2, 3});
    uint32_t index = 99, out = 0;
    EXPECT_TRUE(uint32_array_binary_search(list, 2, &index) == LC_OK && index == 1);
    EXPECT_EQ(uint32_array_binary_search(list, 4, &index), LC_NOT_FOUND);
    ASSERT_EQ(uint32_array_append(list, 1), LC_OK);
    EXPECT_EQ(uint32_array_binary_search(list, 2, &index), LC_ASSERTION);
    EXPECT_TRUE(uint32_array_best_search(list, 3, &index) == LC_OK && index == 4);
    EXPECT_EQ(uint32_array_insert_sorted(list, 2), LC_ASSERTION);
    EXPECT_EQ(uint32_array_sort(list), LC_OK);
    EXPECT_EQ(uint32_array_insert_sorted(list, 2), LC_OK);
    EXPECT_EQ(uint32_array_insert_sorted(list, 0), LC_OK);
    EXPECT_EQ(values(list), (numbers{0, 1, 1, 2, 2, 2, 2, 3}));
    out = 9;
    EXPECT_EQ(uint32_array_insert_takeover(list, 1, &out), LC_OK); // out of order
    EXPECT_EQ(uint32_array_binary_search(list, 2, &index), LC_ASSERTION);
    EXPECT_TRUE(uint32_array_remove(list, 1, &out) == LC_OK && out == 9);
    EXPECT_TRUE(uint32_array_pop(list, &out) == LC_OK && out == 3);
    EXPECT_EQ(uint32_array_delete(list, 0), LC_OK);
    EXPECT_EQ(values(list), (numbers{1, 1, 2, 2, 2, 2}));
}

TEST(Arrays, PoliciesForDuplicates) {
    const struct {
        uint32_t policy;
        lc_status status;
        size_t length;
        bool first_is_old;
    } cases[] = {{array_dup_allow, LC_OK, 3, true},
                 {array_dup_replace, LC_OK, 2, false},
                 {array_dup_drop, LC_OK, 2, true},
                 {array_dup_refuse, LC_EXISTS, 2, true}};
    for (const auto &each : cases) {
        for (const bool sorted : {false, true}) {
            const tstr_array_options options{each.policy};
            strings_owner list;
            owner<tstring, ts_free> again;
            ASSERT_EQ(tstr_array_new(&list, &options), LC_OK);
            ASSERT_EQ(tstr_array_append_str(list, "a"), LC_OK);
            ASSERT_EQ(tstr_array_append_str(list, "b"), LC_OK);
            ASSERT_EQ(ts_new_str(&again, "a"), LC_OK);
            const tstring *old = tstr_array_get_quick(list, 0);
            const auto add = sorted ? tstr_array_insert_sorted_takeover : tstr_array_append_takeover;
            EXPECT_EQ(add(list, &again.pointer), each.status) << each.policy;
            EXPECT_EQ(again.pointer == nullptr, each.status == LC_OK) << each.policy;
            EXPECT_EQ(tstr_array_length_quick(list), each.length) << each.policy;
            EXPECT_EQ(tstr_array_get_quick(list, 0) == old, each.first_is_old) << each.policy << sorted;
        }
    }
}

TEST(Arrays, CopiesAndWholes) {
    strings_owner list, copy;
    ASSERT_EQ(tstr_array_new(&list, nullptr), LC_OK);
    ASSERT_EQ(tstr_array_append_str(list, "x"), LC_OK);
    ASSERT_EQ(tstr_array_set(list, 3, tstr_array_get_quick(list, 0)), LC_OK);
    ASSERT_EQ(tstr_array_duplicate(list, &copy), LC_OK);
    EXPECT_TRUE(tstr_array_equal(list, copy));
    EXPECT_NE(tstr_array_get_quick(list, 3), tstr_array_get_quick(copy, 3));
    EXPECT_EQ(tstr_array_delete_no_shift(copy, 3), LC_OK);
    EXPECT_FALSE(tstr_array_equal(list, copy));
    EXPECT_EQ(tstr_array_concat(list, copy), LC_OK);
    EXPECT_TRUE(tstr_array_length_quick(list) == 8 && tstr_array_length_quick(copy) == 0);
}

static lc_status steer(uint32_array *, uint32_t, uint32_t, void *data) {
    auto *script = static_cast<std::vector<lc_status> *>(data);
    const lc_status status = script->front();
    script->erase(script->begin());
    return status;
}
TEST(Arrays, WalksAreSteered) {
    const lc_status del = LC_FOREACH_DELETE;
    const struct {
        std::vector<lc_status> script;
        bool deletes;
        lc_status result;
        size_t left_in_script;
        numbers left;
        const char *line;
    } cases[] = {
        {{0, 0, 0}, false, LC_OK, 0, {1, 2, 3}, ""},
        {{del, del, del}, true, LC_OK, 0, {}, ""},
        {{0, del, 0}, true, LC_OK, 0, {1, 3}, ""},
        {{0, del, 0}, false, LC_ASSERTION, 1, {1, 2, 3}, "to delete element #1, but array_foreach_delete()"},
        {{0, LC_FOREACH_HALT_ERROR, 0}, false, LC_GENERIC, 1, {1, 2, 3}, "Array element 1 halted iteration"},
        {{LC_FOREACH_HALT_OK, 0, 0}, false, LC_OK, 2, {1, 2, 3}, ""},
        {{LC_CANCELLED, 0, 0}, true, LC_OK, 2, {1, 2, 3}, ""},
        {{LC_EXISTS, 0, 0}, true, LC_GENERIC, 0, {1, 2, 3}, "Got return code 14005 from foreach function"},
    };
    log_lines log;
    for (const auto &each : cases) {
        numbers_owner list;
        fill(list, {1, 2, 3});
        std::vector<lc_status> script = each.script;
        const auto walk = each.deletes ? uint32_array_foreach_delete : uint32_array_foreach;
        EXPECT_EQ(walk(list, steer, &script), each.result);
        EXPECT_EQ(script.size(), each.left_in_script);
        EXPECT_EQ(values(list), each.left);
        const std::string lines = log.take();
        EXPECT_EQ(lines.empty(), *each.line == 0) << lines;
        EXPECT_NE(lines.find(each.line), std::string::npos) << lines;
    }
}

// The index of an array out of order has to answer as a search from the start does, whatever happens to it.
struct keyed {
    uint32_t key;
};
static size_t compared;
static int compare_keyed(const void *a, const void *b) {
    const auto *left = *static_cast<const keyed *const *>(a), *right = *static_cast<const keyed *const *>(b);
    compared++;
    if (!left || !right)
        return (left ? 0 : 1) - (right ? 0 : 1);
    return (left->key > right->key) - (left->key < right->key);
}
static void new_indexed(array_owner &list, array_hash_function hash, const std::atomic<uint32_t> *changes) {
    array_options options;
    ASSERT_EQ(array_options_get_defaults(&options), LC_OK);
    options.compare = compare_keyed;
    options.hash = hash;
    options.key_changes = changes;
    ASSERT_EQ(array_new(&list, &options), LC_OK);
}
TEST(Arrays, IndexAnswersAsASearchFromTheStart) {
    std::atomic<uint32_t> changes{0};
    array_owner list;
    const auto colliding = [](const void *element) { return static_cast<const keyed *>(element)->key % 61; };
    new_indexed(list, colliding, &changes);
    std::vector<keyed> store(4000);
    auto random = [engine = std::mt19937(1)]() mutable { return static_cast<uint32_t>(engine()); };
    uint32_t used = 0;
    for (int step = 0; step < 2500; step++) {
        store[used].key = random() % 200;
        void *element = &store[used], *out = nullptr;
        const uint32_t place = list->length ? random() % list->length : 0;
        const uint32_t change = list->length < 30 ? 0 : random() % 16;
        lc_status status = LC_OK;
        if (change < 10)
            status = array_append_takeover(list, &element);
        else if (change == 10)
            status = array_insert_takeover(list, place, &element);
        else if (change == 11)
            status = array_remove(list, place, &out);
        else if (change == 12)
            status = array_remove_no_shift(list, place, &out);
        else if (change == 13)
            status = array_set_takeover(list, place, &element);
        else if (change == 14 && random() % 20 == 0)
            status = array_sort(list);
        else if (auto *renamed = static_cast<keyed *>(array_get_quick(list, place)))
            renamed->key = random() % 200, changes++;
        ASSERT_EQ(status, LC_OK);
        used += element == nullptr;
        if (step % 2) // a rename may have put it out of order
            list->sorted = 0;
        if (list->sorted)
            continue;
        const keyed key{random() % 220};
        uint32_t best = 0, linear = 0;
        status = array_linear_search(list, &key, 0, &linear);
        ASSERT_EQ(array_best_search(list, &key, &best), status) << step;
        ASSERT_EQ(best, linear) << step;
    }
}
TEST(Arrays, IndexSparesComparisons) {
    array_owner list;
    new_indexed(
        list, [](const void *element) { return static_cast<const keyed *>(element)->key * 2654435761u; },
        nullptr);
    std::vector<keyed> store(10000);
    for (uint32_t i = 0; i < store.size(); i++) {
        store[i].key = (i * 7919) % 10007;
        void *element = &store[i];
        ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
    }
    compared = 0;
    for (const keyed &wanted : store)
        ASSERT_EQ(array_best_search(list, &wanted, nullptr), LC_OK);
    EXPECT_LT(compared, 10 * store.size());
}

// ---- Memory that runs out

#ifndef WCCP_SANITIZED
static int failing_calloc; // counts down to the call that fails
extern "C" void *__libc_calloc(size_t count, size_t size);
extern "C" void *calloc(size_t count, size_t size) {
    return failing_calloc > 0 && --failing_calloc == 0 ? nullptr : __libc_calloc(count, size);
}
TEST(Memory, EachAllocationFailsWithTheSameLine) {
    log_lines log;
    for (const int call : {1, 2}) {
        array_owner list;
        table_owner table;
        failing_calloc = call;
        EXPECT_EQ(array_new(&list, nullptr), LC_NULL);
        failing_calloc = call;
        EXPECT_EQ(ht_new(&table, nullptr), LC_NULL);
        const std::string lines = log.take();
        for (const char *place : {"array_new(), array.cpp:", "ht_new(), hash_table.cpp:"})
            EXPECT_NE(lines.find(place), std::string::npos) << lines;
        EXPECT_EQ(lines.find("forced"), std::string::npos) << lines;
    }
}
#endif

// ---- Hash table

TEST(HashTable, PublishedHash) {
    EXPECT_EQ(ht_bjh_hash("", 0, 0), 0xbd49d10du);
    EXPECT_EQ(ht_bjh_hash("a", 1, 0), 0x29eec818u);
    EXPECT_EQ(ht_bjh_hash("hello world", 11, 0), 0x1aa919e6u);
    const std::string name = "/qv/wccpd/wccp/srv_grp/config/51/weight"; // three rounds and a rest
    EXPECT_EQ(ht_hash_string_func(name.data(), static_cast<uint32_t>(name.size())), 0x6227581au);
}

struct counted_table {
    int freed = 0;
    lc_status status = LC_OK;
    table_owner table;
    counted_table() {
        ht_options options;
        ht_default_options(&options);
        options.user_word = this;
        options.free_function = [](void *, uint32_t, void *, void *user_word) {
            auto *self = static_cast<counted_table *>(user_word);
            self->freed++;
            return self->status;
        };
        EXPECT_EQ(ht_new(&table, &options), LC_OK);
    }
};
TEST(HashTable, GrowsAndShrinks) {
    counted_table counted;
    ht *table = counted.table;
    numbers keys(2000);
    for (uint32_t i = 0; i < keys.size(); i++)
        keys[i] = i;
    // The number of buckets once there are so many entries.
    const auto buckets_at = [&](uint32_t entries) {
        for (; table->entry_count < entries;) {
            uint32_t *key = &keys[table->entry_count];
            EXPECT_EQ(ht_insert(table, key, sizeof *key, key), LC_OK);
        }
        while (table->entry_count > entries)
            EXPECT_EQ(ht_delete(table, &keys[table->entry_count - 1], sizeof(uint32_t)), LC_OK);
        return table->bucket_count;
    };
    for (const auto &[entries, buckets] :
         std::vector<std::pair<uint32_t, uint32_t>>{{93, 31}, {94, 124}, {21, 124}, {20, 31}, {2000, 1984}})
        EXPECT_EQ(buckets_at(entries), buckets) << entries;
    for (uint32_t &key : keys) {
        void *value = nullptr;
        ASSERT_EQ(ht_lookup(table, &key, sizeof key, nullptr, nullptr, nullptr, &value), LC_OK);
        ASSERT_EQ(value, &key);
    }
    EXPECT_EQ(ht_empty(table), LC_OK); // shrinks in one go
    EXPECT_EQ(table->bucket_count, 31u);
    EXPECT_EQ(counted.freed, 74 + 2000);
}

TEST(HashTable, DuplicatesMissesAndFailingFrees) {
    counted_table counted;
    ht *table = counted.table;
    int one = 1, two = 2, found = 7;
    int32_t length = 0;
    void *value = &one;
    EXPECT_EQ(ht_lookup(table, "k", -1, &found, nullptr, &length, &value), LC_OK);
    EXPECT_TRUE(found == 0 && length == -1 && value == nullptr);
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_OK);
    EXPECT_EQ(ht_insert(table, "k", -1, &two), LC_OK);
    EXPECT_TRUE(counted.freed == 1 && table->entry_count == 1);
    EXPECT_EQ(ht_lookup(table, "kx", 1, &found, nullptr, &length, &value), LC_OK);
    EXPECT_TRUE(length == 1 && value == &two);
    // The old entry goes before the new one is made.
    table->insert_function = [](const void *key, uint32_t, void *made, void *user_word, void **out_key,
                                void **out_value) -> lc_status {
        *out_key = const_cast<void *>(key);
        *out_value = made;
        return static_cast<counted_table *>(user_word)->freed == 2 ? LC_OK : LC_IO_ERROR;
    };
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_OK);
    table->refuse_duplicates = 1;
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_EXISTS);
    table->refuse_duplicates = 0;
    counted.status = LC_IO_ERROR;
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_GENERIC);
    EXPECT_TRUE(counted.freed == 3 && table->entry_count == 0);
    table->insert_function = nullptr;
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_OK);
    EXPECT_EQ(ht_delete(table, "k", -1), LC_GENERIC);
    EXPECT_EQ(table->entry_count, 0u);
    EXPECT_EQ(ht_delete(table, "k", -1), LC_OK);
}

// ---- Tree

static lc_status split(const char *name, tstr_array **out, int *out_absolute) {
    *out_absolute = name[0] == '/';
    return ts_tokenize_str(name, '/', 0, 0, ts_tok_skip_leading, out);
}
static int values_freed;
TEST(Tree, MakesPathsAndOwnsItsValues) {
    tree_options options;
    ASSERT_EQ(tree_options_get_defaults(&options), LC_OK);
    options.name_to_parts = split;
    options.free_value = [](void *) { values_freed++; };
    tree_owner whole;
    ASSERT_EQ(tree_new(&whole, &options), LC_OK);
    int value = 0, other = 0;
    const auto set = [&](const char *path, int *given, int create) {
        return tree_set_node_value_by_path_str(whole, nullptr, path, given, create, nullptr);
    };
    EXPECT_EQ(set("/z/b", &value, 0), LC_TREE_NO_PATH);
    for (const char *path : {"/z", "/z/b", "/*", "/b"})
        EXPECT_EQ(set(path, &value, 1), LC_OK);
    EXPECT_EQ(set("/z/b", &other, 0), LC_OK);
    EXPECT_EQ(values_freed, 1);
    std::string names;
    const auto collect = [](tree *, tree_node *, const char *name, void *, void *data) -> lc_status {
        *static_cast<std::string *>(data) += name;
        return LC_OK;
    };
    EXPECT_EQ(tree_foreach(whole, nullptr, 0, collect, &names), LC_OK);
    EXPECT_EQ(names, "*bz");
    whole.reset();
    EXPECT_EQ(values_freed, 5);
}
