// Arrays with their index, and the hash table. The tree is tested by the monitoring queries of
// mgmt_client_test.
#include <gtest/gtest.h>

#include <algorithm>
#include <numeric>
#include <random>

#include "runtime/hash_table.h"
#include "runtime/typed_arrays.h"
#include "tests/support/log_lines.h"
#include "tests/support/owners.h"

namespace {

using numbers_owner = owner<uint32_array, uint32_array_free>;
using array_owner = owner<array, array_free>;
using table_owner = owner<ht, ht_free>;

// --- Arrays

TEST(Arrays, WalksAreSteered) {
    log_lines log;
    numbers_owner list;
    ASSERT_EQ(uint32_array_new(&list), LC_OK);
    for (const uint32_t value : {1u, 2u, 3u})
        ASSERT_EQ(uint32_array_append(list, value), LC_OK);
    using calls = std::pair<uint32_t, lc_status>; // their number, and the result of the second
    const auto steer = [](uint32_array *, uint32_t, uint32_t value, void *data) {
        auto *counted = static_cast<calls *>(data);
        EXPECT_EQ(value, ++counted->first);
        return value == 2 ? counted->second : LC_OK;
    };
    const auto check = [&](lc_status second, lc_status result, uint32_t count, const std::string &line) {
        calls got = {0, second};
        EXPECT_TRUE(uint32_array_foreach(list, steer, &got) == result && got.first == count) << second;
        const std::string lines = log.take();
        EXPECT_TRUE(line.empty() ? lines.empty() : lines.find(line) != std::string::npos) << lines;
    };
    check(LC_FOREACH_DELETE, LC_ASSERTION, 2, "to delete element #1, but array_foreach_delete()");
    check(LC_FOREACH_HALT_ERROR, LC_GENERIC, 2, "Array element 1 halted iteration");
    check(LC_FOREACH_HALT_OK, LC_OK, 2, "");
    check(LC_CANCELLED, LC_OK, 2, "");
    check(LC_EXISTS, LC_GENERIC, 3, "Got return code 14005 from foreach function");
    calls deleting = {0, LC_FOREACH_DELETE};
    EXPECT_EQ(uint32_array_foreach_delete(list, steer, &deleting), LC_OK);
    EXPECT_TRUE(uint32_array_length_quick(list) == 2 && uint32_array_get_quick(list, 1) == 3);
}

struct keyed {
    uint32_t key;
};
size_t compared;
int compare_keyed(const void *a, const void *b) {
    const auto *left = *static_cast<const keyed *const *>(a), *right = *static_cast<const keyed *const *>(b);
    compared++;
    if (!left || !right)
        return (left ? 0 : 1) - (right ? 0 : 1);
    return (left->key > right->key) - (left->key < right->key);
}
bool less_keyed(const keyed *a, const keyed *b) {
    return compare_keyed(&a, &b) < 0;
}
void new_keyed(array_owner &list, array_hash_function hash, const std::atomic<uint32_t> *changes,
               uint32_t policy) {
    array_options options;
    ASSERT_EQ(array_options_get_defaults(&options), LC_OK);
    options.compare = compare_keyed;
    options.hash = hash;
    options.key_changes = changes;
    options.duplicate_policy = policy;
    ASSERT_EQ(array_new(&list, &options), LC_OK);
}

// Whatever happens to an array, it holds what a vector does, knows when it is unsorted, and all searches find
// the first of the equal elements: by bisection, by the index with its colliding hashes, or one by one.
TEST(Arrays, AgreeWithAModel) {
    for (const uint32_t policy : {array_dup_allow, array_dup_replace, array_dup_drop, array_dup_refuse}) {
        std::atomic<uint32_t> changes{0};
        array_owner list;
        new_keyed(
            list, [](const void *element) { return static_cast<const keyed *>(element)->key % 61; }, &changes,
            policy);
        std::vector<keyed> store(6000);
        std::vector<keyed *> model;
        auto random = [engine = std::mt19937(policy)]() mutable { return static_cast<uint32_t>(engine()); };
        uint32_t used = 0;
        for (int step = 0; step < 2500; step++) {
            SCOPED_TRACE(testing::Message() << "policy " << policy << ", step " << step);
            keyed *fresh = &store[used];
            fresh->key = random() % 200;
            void *element = fresh, *out = nullptr;
            const uint32_t place = model.empty() ? 0 : random() % static_cast<uint32_t>(model.size());
            const auto at = model.begin() + place;
            const uint32_t change = model.size() < 30 ? random() % 8 : random() % 15;
            lc_status status = LC_OK, wanted = LC_OK;
            if (change < 6 || (change < 8 && list->sorted)) { // the operations that follow the policy
                auto where = change < 6 ? model.end()
                                        : std::upper_bound(model.begin(), model.end(), fresh, less_keyed);
                auto equal =
                    std::ranges::find_if(model, [&](auto *old) { return old && old->key == fresh->key; });
                if (change >= 6 && equal != model.end())
                    equal = where - 1; // the last of several equal ones
                const bool twice = policy != array_dup_allow && equal != model.end();
                status = change < 6 ? array_append_takeover(list, &element)
                                    : array_insert_sorted_takeover(list, &element);
                wanted = twice && policy == array_dup_refuse ? LC_EXISTS : LC_OK;
                if (!twice)
                    model.insert(where, fresh);
                else if (policy == array_dup_replace)
                    *std::rotate(equal, equal + 1, where) = fresh;
            } else if (change == 8) {
                status = array_insert_takeover(list, place, &element);
                model.insert(at, fresh);
            } else if (change == 9) {
                status = array_remove(list, place, &out);
                ASSERT_EQ(out, *at);
                model.erase(at);
            } else if (change == 10) {
                status = array_remove_no_shift(list, place, &out);
                *at = nullptr;
            } else if (change == 11) {
                status = array_set_takeover(list, place + 2, &element); // past the end as well
                model.resize(std::max<size_t>(model.size(), place + 3));
                model[place + 2] = fresh;
            } else if (change == 12) {
                status = array_sort(list);
                std::copy_n(reinterpret_cast<keyed **>(list->elements), model.size(), model.begin());
            } else if (model.size() > 30 && *at) {
                (*at)->key = random() % 200, changes++, list->sorted = 0;
            }
            ASSERT_EQ(status, wanted);
            used += element == nullptr;
            ASSERT_EQ(list->length, model.size());
            for (uint32_t i = 0; i < model.size(); i++)
                ASSERT_EQ(array_get_quick(list, i), model[i]);
            ASSERT_TRUE(!list->sorted || std::is_sorted(model.begin(), model.end(), less_keyed));
            const keyed key{random() % 220};
            uint32_t best = 0, linear = 0;
            status = array_linear_search(list, &key, 0, &linear);
            ASSERT_TRUE(array_best_search(list, &key, &best) == status && best == linear);
            ASSERT_TRUE(list->sorted || array_binary_search(list, &key, &best) == LC_ASSERTION);
        }
        void *none = &store;
        EXPECT_TRUE(array_get(list, list->length, &none) == LC_NOT_FOUND && !none);
        EXPECT_TRUE(array_append(list, &store[0]) == LC_ASSERTION && array_empty(list) == LC_OK &&
                    list->sorted);
    }
    array_owner list; // with few comparisons
    new_keyed(
        list, [](const void *element) { return static_cast<const keyed *>(element)->key * 2654435761u; },
        nullptr, array_dup_allow);
    std::vector<keyed> store(4000);
    for (uint32_t i = 0; i < store.size(); i++) {
        store[i].key = (i * 7919) % 4001;
        void *element = &store[i];
        ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
    }
    compared = 0;
    for (const keyed &wanted : store)
        ASSERT_EQ(array_best_search(list, &wanted, nullptr), LC_OK);
    EXPECT_LT(compared, 10 * store.size());
}

// --- Hash table

TEST(Hash, IsThePublishedOne) {
    const std::string name = "/qv/wccpd/wccp/srv_grp/config/51/weight"; // three rounds and a rest
    EXPECT_TRUE(ht_bjh_hash("", 0, 0) == 0xbd49d10du && ht_bjh_hash("hello world", 11, 0) == 0x1aa919e6u);
    EXPECT_EQ(ht_hash_string_func(name.data(), static_cast<uint32_t>(name.size())), 0x6227581au);
}

struct HashTable : testing::Test {
    int freed = 0;
    lc_status status = LC_OK; // of the free function
    table_owner table;
    HashTable() {
        ht_options options;
        ht_default_options(&options);
        options.user_word = this;
        options.free_function = [](void *, uint32_t, void *, void *user_word) {
            auto *self = static_cast<HashTable *>(user_word);
            self->freed++;
            return self->status;
        };
        EXPECT_EQ(ht_new(&table, &options), LC_OK);
    }
};
TEST_F(HashTable, GrowsAndShrinks) {
    std::vector<uint32_t> keys(2000);
    std::iota(keys.begin(), keys.end(), 0);
    const uint32_t cases[][2] = {{93, 31}, {94, 124}, {21, 124}, {20, 31}, {2000, 1984}};
    for (const auto &[entries, buckets] : cases) { // the number of buckets once there are so many entries
        while (table->entry_count < entries) {
            uint32_t *key = &keys[table->entry_count];
            ASSERT_EQ(ht_insert(table, key, sizeof *key, key), LC_OK);
        }
        while (table->entry_count > entries)
            ASSERT_EQ(ht_delete(table, &keys[table->entry_count - 1], sizeof(uint32_t)), LC_OK);
        EXPECT_EQ(table->bucket_count, buckets) << entries;
    }
    for (uint32_t &key : keys) {
        void *value = nullptr;
        ASSERT_TRUE(ht_lookup(table, &key, sizeof key, nullptr, nullptr, nullptr, &value) == LC_OK &&
                    value == &key);
    }
    EXPECT_TRUE(ht_empty(table) == LC_OK && table->bucket_count == 31 && freed == 74 + 2000);
}

TEST_F(HashTable, DuplicatesMissesAndFailingFrees) {
    int one = 1, two = 2, found = 7;
    void *value = &one;
    EXPECT_EQ(ht_lookup(table, "k", -1, &found, nullptr, nullptr, &value), LC_OK);
    EXPECT_TRUE(found == 0 && value == nullptr);
    EXPECT_TRUE(ht_insert(table, "k", -1, &one) == LC_OK && ht_insert(table, "k", -1, &two) == LC_OK);
    EXPECT_EQ(ht_lookup(table, "kx", 1, &found, nullptr, nullptr, &value), LC_OK);
    EXPECT_TRUE(value == &two && freed == 1 && table->entry_count == 1);
    table->refuse_duplicates = 1;
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_EXISTS);
    table->refuse_duplicates = 0;
    status = LC_IO_ERROR; // the old entry is gone all the same
    EXPECT_TRUE(ht_insert(table, "k", -1, &one) == LC_GENERIC && freed == 2 && table->entry_count == 0);
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_OK);
    EXPECT_TRUE(ht_delete(table, "k", -1) == LC_GENERIC && table->entry_count == 0);
}

} // namespace

// --- Memory that runs out

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
        EXPECT_TRUE(array_new(&list, nullptr) == LC_NULL && log.say("array_new(), array.cpp:"));
        failing_calloc = call;
        EXPECT_TRUE(ht_new(&table, nullptr) == LC_NULL && log.say("ht_new(), hash_table.cpp:"));
    }
}
#endif
