#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "runtime/fdintrcb.h"
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

static void fill(numbers_owner &list, std::initializer_list<uint32_t> values) {
    ASSERT_EQ(uint32_array_new(&list), LC_OK);
    for (const uint32_t value : values)
        ASSERT_EQ(uint32_array_append(list, value), LC_OK);
}
static std::vector<uint32_t> values(const uint32_array *list) {
    std::vector<uint32_t> all;
    for (uint32_t i = 0; i < uint32_array_length_quick(list); i++)
        all.push_back(uint32_array_get_quick(list, i));
    return all;
}
using numbers = std::vector<uint32_t>;

// ---- Arrays

TEST(Arrays, CapacityAndPlaces) {
    array_owner list;
    ASSERT_EQ(array_new(&list, nullptr), LC_OK);
    EXPECT_EQ(list->capacity, 10u);
    EXPECT_EQ(list->sorted, 1u);
    int places[32];
    for (uint32_t i = 0; i < 11; i++) {
        void *element = &places[i];
        ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
        EXPECT_EQ(element, nullptr);
    }
    EXPECT_EQ(list->capacity, 20u);
    void *out = &places[0];
    EXPECT_EQ(array_get(list, 11, &out), LC_NOT_FOUND);
    EXPECT_EQ(out, nullptr);
    void *element = &places[20];
    EXPECT_EQ(array_set_takeover(list, 13, &element), LC_OK);
    EXPECT_EQ(list->length, 14u);
    EXPECT_EQ(array_get_quick(list, 11), nullptr);
    EXPECT_EQ(array_get_quick(list, 13), &places[20]);
    EXPECT_EQ(list->sorted, 0u);
    element = &places[1];
    EXPECT_EQ(array_set_takeover(list, 0xffffffff, &element), LC_ASSERTION);
    EXPECT_EQ(array_append(list, &places[0]), LC_ASSERTION); // no function to copy it
    EXPECT_EQ(array_empty(list), LC_OK);
    EXPECT_EQ(list->capacity, 10u);
    EXPECT_EQ(list->length, 0u);
    EXPECT_EQ(array_length(nullptr, &list->length), LC_NULL);
}

TEST(Arrays, KnowWhetherTheyAreInOrder) {
    numbers_owner list;
    fill(list, {1, 2, 2, 2, 3});
    uint32_t index = 99;
    EXPECT_EQ(uint32_array_binary_search(list, 2, &index), LC_OK);
    EXPECT_EQ(index, 1u);
    EXPECT_EQ(uint32_array_binary_search(list, 4, &index), LC_NOT_FOUND);
    ASSERT_EQ(uint32_array_append(list, 1), LC_OK);
    EXPECT_EQ(uint32_array_binary_search(list, 2, &index), LC_ASSERTION);
    EXPECT_EQ(uint32_array_best_search(list, 3, &index), LC_OK);
    EXPECT_EQ(index, 4u);
    EXPECT_EQ(uint32_array_insert_sorted(list, 2), LC_ASSERTION);
    EXPECT_EQ(uint32_array_sort(list), LC_OK);
    EXPECT_EQ(values(list), (numbers{1, 1, 2, 2, 2, 3}));
    EXPECT_EQ(uint32_array_insert_sorted(list, 2), LC_OK);
    EXPECT_EQ(uint32_array_insert_sorted(list, 0), LC_OK);
    EXPECT_EQ(values(list), (numbers{0, 1, 1, 2, 2, 2, 2, 3}));
    EXPECT_EQ(uint32_array_insert(list, 1, 9), LC_OK); // out of order
    EXPECT_EQ(uint32_array_binary_search(list, 2, &index), LC_ASSERTION);
    uint32_t out = 0;
    EXPECT_EQ(uint32_array_remove(list, 1, &out), LC_OK);
    EXPECT_EQ(out, 9u);
    EXPECT_EQ(uint32_array_pop(list, &out), LC_OK);
    EXPECT_EQ(out, 3u);
    EXPECT_EQ(uint32_array_delete(list, 0), LC_OK);
    EXPECT_EQ(values(list), (numbers{1, 1, 2, 2, 2, 2}));
}

TEST(Arrays, PoliciesForDuplicates) {
    struct policy_case {
        uint32_t policy;
        lc_status status;
        size_t length;
        bool first_is_old;
    };
    for (const policy_case &c : {policy_case{array_dup_allow, LC_OK, 3, true},
                                 {array_dup_replace, LC_OK, 2, false},
                                 {array_dup_drop, LC_OK, 2, true},
                                 {array_dup_refuse, LC_EXISTS, 2, true}}) {
        for (const bool sorted : {false, true}) {
            const tstr_array_options options{c.policy};
            strings_owner list;
            ASSERT_EQ(tstr_array_new(&list, &options), LC_OK);
            ASSERT_EQ(tstr_array_append_str(list, "a"), LC_OK);
            ASSERT_EQ(tstr_array_append_str(list, "b"), LC_OK);
            const tstring *old = tstr_array_get_quick(list, 0);
            owner<tstring, ts_free> again;
            ASSERT_EQ(ts_new_str(&again, "a"), LC_OK);
            const lc_status status = sorted ? tstr_array_insert_sorted_takeover(list, &again.pointer)
                                            : tstr_array_append_takeover(list, &again.pointer);
            EXPECT_EQ(status, c.status) << c.policy;
            EXPECT_EQ(again.pointer == nullptr, c.status == LC_OK) << c.policy;
            EXPECT_EQ(tstr_array_length_quick(list), c.length) << c.policy;
            EXPECT_EQ(tstr_array_get_quick(list, 0) == old, c.first_is_old) << c.policy << sorted;
        }
    }
}

TEST(Arrays, CopiesAndWholes) {
    strings_owner list, copy, other;
    ASSERT_EQ(tstr_array_new(&list, nullptr), LC_OK);
    ASSERT_EQ(tstr_array_append_str(list, "x"), LC_OK);
    ASSERT_EQ(tstr_array_set(list, 3, tstr_array_get_quick(list, 0)), LC_OK);
    ASSERT_EQ(tstr_array_duplicate(list, &copy), LC_OK);
    EXPECT_TRUE(tstr_array_equal(list, copy));
    EXPECT_NE(tstr_array_get_quick(list, 3), tstr_array_get_quick(copy, 3));
    EXPECT_STREQ(tstr_array_get_str_quick(copy, 3), "x");
    EXPECT_EQ(tstr_array_get_str_quick(copy, 1), nullptr);
    EXPECT_EQ(tstr_array_delete_no_shift(copy, 3), LC_OK);
    EXPECT_FALSE(tstr_array_equal(list, copy));
    EXPECT_EQ(tstr_array_length_quick(copy), 4u);
    EXPECT_EQ(tstr_array_concat(list, copy), LC_OK);
    EXPECT_EQ(tstr_array_length_quick(list), 8u);
    EXPECT_EQ(tstr_array_length_quick(copy), 0u);
    char *given = strdup("taken");
    EXPECT_EQ(tstr_array_append_str_takeover(list, &given), LC_OK);
    EXPECT_EQ(given, nullptr);
    EXPECT_EQ(tstr_array_insert_str(list, 0, "first"), LC_OK);
    EXPECT_STREQ(tstr_array_get_str_quick(list, 9), "taken");
    EXPECT_STREQ(tstr_array_get_str_quick(list, 0), "first");
    EXPECT_EQ(tstr_array_append_str(nullptr, "x"), LC_NULL);
}

static lc_status steer(uint32_array *list, uint32_t index, uint32_t element, void *data) {
    auto *script = static_cast<std::vector<lc_status> *>(data);
    (void)list, (void)index, (void)element;
    const lc_status status = script->front();
    script->erase(script->begin());
    return status;
}
TEST(Arrays, WalksAreSteered) {
    struct walk_case {
        std::vector<lc_status> script;
        bool deletes;
        lc_status result;
        size_t left_in_script;
        numbers left;
        const char *line;
    };
    const lc_status del = LC_FOREACH_DELETE;
    const walk_case cases[] = {
        {{0, 0, 0}, false, LC_OK, 0, {1, 2, 3}, ""},
        {{del, del, del}, true, LC_OK, 0, {}, ""},
        {{0, del, 0}, true, LC_OK, 0, {1, 3}, ""},
        {{0, del, 0},
         false,
         LC_ASSERTION,
         1,
         {1, 2, 3},
         "Array foreach callback returned lc_err_foreach_delete to delete element #1, but "
         "array_foreach_delete() was not called"},
        {{0, LC_FOREACH_HALT_ERROR, 0}, false, LC_GENERIC, 1, {1, 2, 3}, "Array element 1 halted iteration"},
        {{LC_FOREACH_HALT_OK, 0, 0}, false, LC_OK, 2, {1, 2, 3}, ""},
        {{LC_CANCELLED, 0, 0}, true, LC_OK, 2, {1, 2, 3}, ""},
        {{LC_EXISTS, 0, 0}, true, LC_GENERIC, 0, {1, 2, 3}, "Got return code 14005 from foreach function"},
    };
    log_lines log;
    for (const walk_case &c : cases) {
        numbers_owner list;
        fill(list, {1, 2, 3});
        std::vector<lc_status> script = c.script;
        const auto walk = c.deletes ? uint32_array_foreach_delete : uint32_array_foreach;
        EXPECT_EQ(walk(list, steer, &script), c.result);
        EXPECT_EQ(script.size(), c.left_in_script);
        EXPECT_EQ(values(list), c.left);
        const std::string lines = log.take();
        EXPECT_EQ(lines.empty(), *c.line == 0) << lines;
        EXPECT_NE(lines.find(c.line), std::string::npos) << lines;
    }
}

TEST(Arrays, InterestsReplaceTheirOlderForm) {
    owner<fdic_event_array, fdic_event_array_free> events;
    ASSERT_EQ(fdic_event_array_new(&events), LC_OK);
    fdic_event event{};
    for (const uint32_t id : {7u, 3u, 7u}) {
        event.id = id;
        event.fd++;
        ASSERT_EQ(fdic_event_array_insert_sorted(events, &event), LC_OK);
    }
    ASSERT_EQ(fdic_event_array_length_quick(events), 2u);
    EXPECT_EQ(fdic_event_array_get_quick(events, 0)->id, 3u);
    EXPECT_EQ(fdic_event_array_get_quick(events, 1)->fd, 3);
}

// The index of an array out of order has to answer as a search from the start does, whatever happens to it.
struct keyed {
    uint32_t key, serial;
};
static int compare_keyed(const void *a, const void *b) {
    const auto *left = *static_cast<const keyed *const *>(a), *right = *static_cast<const keyed *const *>(b);
    if (!left || !right)
        return (left ? 0 : 1) - (right ? 0 : 1);
    return (left->key > right->key) - (left->key < right->key);
}
static size_t compared;
static int compare_counted(const void *a, const void *b) {
    compared++;
    return compare_keyed(a, b);
}
static uint32_t hash_keyed(const void *element) {
    return static_cast<const keyed *>(element)->key % 61; // collides
}
TEST(Arrays, IndexAnswersAsASearchFromTheStart) {
    std::atomic<uint32_t> changes{0};
    array_options options;
    ASSERT_EQ(array_options_get_defaults(&options), LC_OK);
    options.compare = compare_keyed;
    options.hash = hash_keyed;
    options.key_changes = &changes;
    array_owner list;
    ASSERT_EQ(array_new(&list, &options), LC_OK);
    std::vector<keyed> store(4000);
    uint32_t random = 1, used = 0;
    const auto next = [&](uint32_t below) {
        return (random = random * 1664525 + 1013904223) / 65536 % below;
    };
    for (int step = 0; step < 2500; step++) {
        void *element = used < store.size() ? &store[used] : nullptr;
        void *out = nullptr;
        const uint32_t place = list->length ? next(list->length) : 0;
        switch (list->length < 30 ? 0 : next(16)) {
        default:
            if (!element)
                break;
            store[used++] = {next(200), 0};
            ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
            break;
        case 10:
            if (!element)
                break;
            store[used++] = {next(200), 0};
            ASSERT_EQ(array_insert_takeover(list, place, &element), LC_OK);
            break;
        case 11:
            ASSERT_EQ(array_remove(list, place, &out), LC_OK);
            break;
        case 12:
            ASSERT_EQ(array_remove_no_shift(list, place, &out), LC_OK);
            break;
        case 13:
            if (auto *changed = static_cast<keyed *>(array_get_quick(list, place))) {
                changed->key = next(200);
                changes++;
            }
            break;
        case 14:
            ASSERT_EQ(array_set_takeover(list, place, &element), LC_OK);
            used += used < store.size();
            break;
        case 15:
            if (next(20) == 0) {
                ASSERT_EQ(array_sort(list), LC_OK);
            }
            break;
        }
        if (list->length > 1 && list->sorted && step % 2) // a rename may have put it out of order
            list->sorted = 0;
        if (list->sorted)
            continue;
        const keyed key{next(220), 0};
        uint32_t best = 0, linear = 0;
        const lc_status status = array_linear_search(list, &key, 0, &linear);
        ASSERT_EQ(array_best_search(list, &key, &best), status) << step;
        if (status == LC_OK) {
            ASSERT_EQ(best, linear) << step;
        }
    }
}
TEST(Arrays, IndexSparesComparisons) {
    array_options options;
    ASSERT_EQ(array_options_get_defaults(&options), LC_OK);
    options.compare = compare_counted;
    options.hash = [](const void *element) { return static_cast<const keyed *>(element)->key * 2654435761u; };
    array_owner list;
    ASSERT_EQ(array_new(&list, &options), LC_OK);
    std::vector<keyed> store(10000);
    for (uint32_t i = 0; i < store.size(); i++) {
        store[i].key = (i * 7919) % 10007;
        void *element = &store[i];
        ASSERT_EQ(array_append_takeover(list, &element), LC_OK);
    }
    ASSERT_EQ(list->sorted, 0u);
    compared = 0;
    for (const keyed &wanted : store)
        ASSERT_EQ(array_best_search(list, &wanted, nullptr), LC_OK);
    EXPECT_LT(compared, 10 * store.size());
}

// ---- Patterns of parts

static bool matches(std::vector<const char *> pattern, std::vector<const char *> parts) {
    strings_owner lists[2];
    int matched = -1;
    for (int i = 0; i < 2; i++) {
        EXPECT_EQ(tstr_array_new(&lists[i], nullptr), LC_OK);
        for (const char *part : i ? parts : pattern)
            EXPECT_EQ(tstr_array_append_str(lists[i], part), LC_OK);
    }
    EXPECT_EQ(tstr_array_wildcard_match(lists[0], lists[1], &matched), LC_OK);
    return matched == 1;
}
TEST(Arrays, Wildcards) {
    EXPECT_TRUE(matches({}, {}));
    EXPECT_FALSE(matches({"*"}, {}));
    EXPECT_FALSE(matches({}, {"a"}));
    EXPECT_TRUE(matches({"a", "*", "c"}, {"a", "b", "c"}));
    EXPECT_FALSE(matches({"a", "*"}, {"a", "b", "c"}));
    EXPECT_FALSE(matches({"a*"}, {"ab"}));
    EXPECT_TRUE(matches({"**"}, {"a"}));
    EXPECT_TRUE(matches({"a", "**"}, {"a", "b", "c"}));
    EXPECT_FALSE(matches({"a", "**"}, {"a"}));
    EXPECT_TRUE(matches({"a", "**", "b"}, {"a", "x", "y"}));
    EXPECT_FALSE(matches({"a", "**", "b"}, {"a", "x"}));
}

// ---- Hash table

TEST(HashTable, PublishedHash) {
    EXPECT_EQ(ht_bjh_hash("", 0, 0), 0xbd49d10du);
    EXPECT_EQ(ht_bjh_hash("a", 1, 0), 0x29eec818u);
    EXPECT_EQ(ht_bjh_hash("hello world", 11, 0), 0x1aa919e6u);
    const std::string name = "/qv/wccpd/wccp/srv_grp/config/51/weight"; // three rounds and a rest
    EXPECT_EQ(ht_hash_string_func(name.data(), static_cast<uint32_t>(name.size())), 0x6227581au);
}

struct count_frees {
    int freed = 0;
    lc_status status = LC_OK;
};
static lc_status free_counted(void *, uint32_t, void *, void *user_word) {
    auto *count = static_cast<count_frees *>(user_word);
    count->freed++;
    return count->status;
}
TEST(HashTable, GrowsAndShrinks) {
    count_frees count;
    ht_options options;
    ht_default_options(&options);
    options.free_function = free_counted;
    options.user_word = &count;
    table_owner table;
    ASSERT_EQ(ht_new(&table, &options), LC_OK);
    std::vector<uint32_t> keys(2000);
    for (uint32_t i = 0; i < keys.size(); i++)
        keys[i] = i;
    const auto insert_to = [&](uint32_t count_wanted) {
        while (table->entry_count < count_wanted) {
            uint32_t *key = &keys[table->entry_count];
            ASSERT_EQ(ht_insert(table, key, sizeof *key, key), LC_OK);
        }
    };
    const auto delete_to = [&](uint32_t count_wanted) {
        while (table->entry_count > count_wanted)
            ASSERT_EQ(ht_delete(table, &keys[table->entry_count - 1], sizeof(uint32_t)), LC_OK);
    };
    insert_to(93);
    EXPECT_EQ(table->bucket_count, 31u);
    insert_to(94);
    EXPECT_EQ(table->bucket_count, 124u);
    delete_to(21);
    EXPECT_EQ(table->bucket_count, 124u);
    delete_to(20);
    EXPECT_EQ(table->bucket_count, 31u);
    insert_to(2000);
    EXPECT_EQ(table->bucket_count, 1984u);
    for (uint32_t &key : keys) {
        int found = 0;
        void *value = nullptr;
        ASSERT_EQ(ht_lookup(table, &key, sizeof key, &found, nullptr, nullptr, &value), LC_OK);
        ASSERT_TRUE(found);
        ASSERT_EQ(value, &key);
    }
    EXPECT_EQ(ht_empty(table), LC_OK); // shrinks in one go
    EXPECT_EQ(table->bucket_count, 31u);
    EXPECT_EQ(count.freed, 74 + 2000);
}

TEST(HashTable, DuplicatesMissesAndFailingFrees) {
    count_frees count;
    ht_options options;
    ht_default_options(&options);
    options.free_function = free_counted;
    options.user_word = &count;
    table_owner table;
    ASSERT_EQ(ht_new(&table, &options), LC_OK);
    int one = 1, two = 2, found = 7;
    int32_t length = 0;
    void *value = &one;
    EXPECT_EQ(ht_lookup(table, "k", -1, &found, nullptr, &length, &value), LC_OK);
    EXPECT_EQ(found, 0);
    EXPECT_EQ(length, -1);
    EXPECT_EQ(value, nullptr);
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_OK);
    EXPECT_EQ(ht_insert(table, "k", -1, &two), LC_OK);
    EXPECT_EQ(count.freed, 1);
    EXPECT_EQ(table->entry_count, 1u);
    EXPECT_EQ(ht_lookup(table, "kx", 1, &found, nullptr, &length, &value), LC_OK);
    EXPECT_EQ(value, &two);
    EXPECT_EQ(length, 1);
    table->refuse_duplicates = 1;
    EXPECT_EQ(ht_insert(table, "k", -1, &one), LC_EXISTS);
    count.status = LC_IO_ERROR;
    EXPECT_EQ(ht_delete(table, "k", -1), LC_GENERIC);
    EXPECT_EQ(table->entry_count, 0u);
    EXPECT_EQ(ht_delete(table, "k", -1), LC_OK);
    count.status = LC_OK;
}

// ---- Tree

static lc_status split(const char *name, tstr_array **out, int *out_absolute) {
    *out_absolute = name[0] == '/';
    return ts_tokenize_str(name, '/', 0, 0, ts_tok_skip_leading, out);
}
static int values_freed;
TEST(Tree, PathsWildcardsAndChildren) {
    tree_options options;
    ASSERT_EQ(tree_options_get_defaults(&options), LC_OK);
    options.name_to_parts = split;
    options.free_value = [](void *) { values_freed++; };
    values_freed = 0;
    tree_owner whole;
    ASSERT_EQ(tree_new(&whole, &options), LC_OK);
    int value[4];
    tree_node *node = nullptr, *star = nullptr;
    EXPECT_EQ(tree_set_node_value_by_path_str(whole, nullptr, "/a/*", &value[0], 0, &node), LC_TREE_NO_PATH);
    EXPECT_EQ(tree_set_node_value_by_path_str(whole, nullptr, "/a/*", &value[0], 1, &star), LC_OK);
    EXPECT_EQ(tree_set_node_value_by_path_str(whole, nullptr, "/a/z", &value[1], 1, nullptr), LC_OK);
    EXPECT_EQ(tree_set_node_value_by_path_str(whole, nullptr, "/a/b", &value[2], 1, nullptr), LC_OK);
    EXPECT_EQ(tree_set_node_value_by_path_str(whole, nullptr, "/a/b", &value[3], 1, nullptr), LC_OK);
    EXPECT_EQ(values_freed, 1);

    strings_owner parts;
    ASSERT_EQ(ts_tokenize_str("a/x", '/', 0, 0, 0, &parts), LC_OK);
    EXPECT_EQ(tree_get_node_by_path_wildcarded(whole, nullptr, parts, "*", &node), LC_OK);
    EXPECT_EQ(node, star);
    EXPECT_EQ(tree_get_node_by_path_wildcarded(whole, nullptr, parts, nullptr, &node), LC_NOT_FOUND);
    EXPECT_EQ(node, nullptr);
    ASSERT_EQ(ts_tokenize_str("b", '/', 0, 0, 0, &parts), LC_OK);
    tree_node *a = static_cast<tree_node *>(array_get_quick(whole->root->children, 0));
    ASSERT_EQ(tree_get_node_by_path_wildcarded(whole, a, parts, "*", &node), LC_OK);
    void *found = nullptr;
    EXPECT_EQ(tree_node_get_value(whole, node, &found), LC_OK);
    EXPECT_EQ(found, &value[3]);
    uint32_t count = 0;
    EXPECT_EQ(tree_node_get_num_children(whole, a, &count), LC_OK);
    EXPECT_EQ(count, 3u);
    std::string names;
    const auto collect = [](tree *, tree_node *, const char *name, void *, void *data) -> lc_status {
        *static_cast<std::string *>(data) += name;
        return LC_OK;
    };
    EXPECT_EQ(tree_foreach(whole, a, 0, collect, &names), LC_OK);
    EXPECT_EQ(names, "*bz");
    whole.reset();
    EXPECT_EQ(values_freed, 4);
}
