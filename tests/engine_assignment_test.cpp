// The table of the designated appliance: the split, the order behind it, down entries, and the mask's values.
#include "engine/wccp_assignment.h"

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "engine/wccp_hash_assignment.h"
#include "engine/wccp_mask_assignment.h"
#include "engine/wccp_utils.h"

namespace {

constexpr be32 ip(uint32_t a, uint32_t b, uint32_t c, uint32_t d) {
    return to_be32(a << 24 | b << 16 | c << 8 | d);
}
constexpr be32 host(uint32_t d) {
    return ip(10, 0, 0, d);
}

using run = std::pair<std::string, uint32_t>; // owner and length
using runs = std::vector<run>;

run of(be32 address, uint32_t length) {
    return {addr_text(address).s, length};
}
runs runs_of(const be32 *table, uint32_t slots) {
    runs found;
    for (uint32_t i = 0; i < slots; i++) {
        const std::string owner = addr_text(table[i]).s;
        if (found.empty() || found.back().first != owner)
            found.push_back({owner, 0});
        found.back().second++;
    }
    return found;
}

wccp_dsg_appliance up(be32 address, uint16_t weight) {
    return {.ipa = address, .up = 1, .weight = weight, .assigned = 0};
}
wccp_dsg_appliance down(be32 address, uint16_t weight) {
    return {.ipa = address, .up = 0, .weight = weight, .assigned = 0};
}
runs table_of(std::vector<wccp_dsg_appliance> entries, uint32_t slots = 256) {
    std::vector<be32> table(slots, ip(9, 9, 9, 9));
    wccp_compute_assignment_table(static_cast<uint32_t>(entries.size()), entries.data(), slots, table.data(),
                                  0);
    return runs_of(table.data(), slots);
}

// A group that nobody else knows, and its computation.
struct AssignmentTest : testing::Test {
    AssignmentTest() { group->id = 51; }
    void compute(const std::vector<std::pair<be32, uint16_t>> &appliances) {
        wccp_designated_appliance_assignment_start(group.get());
        for (const auto &[address, weight] : appliances) {
            const wccp_view_appliance entry = {
                .next = nullptr, .prev_link = nullptr, .ipa = address, .weight = weight, .ref_count = 1};
            wccp_designated_appliance_assignment_add(group.get(), &entry);
            ASSERT_LE(group->dsg_appliance_count, WCCP_MAX_APPLIANCES);
            ASSERT_EQ(group->bucket_count, 0u); // lies right behind the entries
        }
        wccp_designated_appliance_assignment_finish(group.get());
    }
    uint32_t assigned_in_all() {
        uint32_t sum = 0;
        for (uint32_t i = 0; i < group->dsg_active_count; i++)
            sum += group->dsg_appliances[i].assigned;
        return sum;
    }
    std::unique_ptr<wccp_service_group> group = std::make_unique<wccp_service_group>();
};

TEST(AssignmentTable, SplitsInProportionAndTheRemainderGoesOn) {
    const struct {
        std::vector<uint16_t> weights;
        uint32_t slots;
        std::vector<uint32_t> shares;
    } cases[] = {
        {{100, 100, 100}, 256, {85, 85, 86}},
        {{1, 2}, 256, {85, 171}},
        {{10, 20, 30, 40}, 256, {25, 51, 77, 103}},
        {{7}, 256, {256}},
        {{0, 9}, 256, {0, 256}},
        {{3, 3}, 16, {8, 8}},
        {{3, 3, 3}, 16, {5, 5, 6}},
        {{65535, 1, 65535}, 256, {127, 1, 128}},
        {{1, 1, 1}, 1, {0, 0, 1}},
    };
    for (const auto &c : cases) {
        std::vector<wccp_dsg_appliance> entries;
        runs expected;
        for (uint32_t i = 0; i < c.weights.size(); i++) {
            entries.push_back(up(host(i + 1), c.weights[i]));
            if (c.shares[i])
                expected.push_back(of(host(i + 1), c.shares[i]));
        }
        EXPECT_EQ(table_of(entries, c.slots), expected);
    }
}

TEST(AssignmentTable, OnlyTheRunOfADownEntryIsSplit) {
    EXPECT_EQ(table_of({up(host(1), 100), down(host(2), 100), up(host(3), 100)}),
              (runs{of(host(1), 85 + 42), of(host(3), 43 + 86)}));
    EXPECT_EQ(table_of({up(host(1), 100), up(host(3), 100)}), (runs{of(host(1), 128), of(host(3), 128)}));
    // Two of four: B's run of 64 goes to A and D by their weights, so does C's.
    EXPECT_EQ(table_of({up(host(1), 30), down(host(2), 30), down(host(3), 30), up(host(4), 30)}),
              (runs{of(host(1), 64 + 32), of(host(4), 32), of(host(1), 32), of(host(4), 32 + 64)}));
    EXPECT_EQ(table_of({down(host(1), 65535), up(host(2), 1)}), (runs{of(host(2), 256)}));
    // Too light to hold a slot of its own.
    EXPECT_EQ(table_of({down(host(1), 1), up(host(2), 60000)}), (runs{of(host(2), 256)}));
}

TEST(AssignmentTable, WithoutWeightsTheLargestWordTakesAll) {
    EXPECT_EQ(table_of({up(host(2), 0), up(host(1), 0)}), (runs{of(host(2), 256)}));
    EXPECT_EQ(table_of({up(ip(10, 9, 9, 1), 0), up(ip(10, 0, 0, 2), 0)}), (runs{of(ip(10, 0, 0, 2), 256)}));
    // A down entry's weight doesn't count.
    EXPECT_EQ(table_of({down(host(9), 500), up(host(3), 0)}), (runs{of(host(3), 256)}));
    EXPECT_EQ(table_of({down(host(9), 500), down(host(3), 0)}), (runs{of(ip(9, 9, 9, 9), 256)}));
    EXPECT_EQ(table_of({}), (runs{of(ip(9, 9, 9, 9), 256)}));
}

TEST(AssignmentTable, TheLastOctetLeadsTheOrderAndTheDifferenceWrapsAround) {
    EXPECT_EQ(table_of({up(ip(10, 0, 0, 2), 1), up(ip(10, 0, 1, 1), 1), up(ip(10, 0, 0, 1), 2)}),
              (runs{of(ip(10, 0, 0, 1), 128), of(ip(10, 0, 1, 1), 64), of(ip(10, 0, 0, 2), 64)}));
    EXPECT_EQ(table_of({up(host(10), 1), up(host(200), 3)}), (runs{of(host(200), 192), of(host(10), 64)}));
    EXPECT_EQ(table_of({up(host(200), 3), up(host(10), 1)}), (runs{of(host(200), 192), of(host(10), 64)}));
    // Three in a circle: 1 before 100, 100 before 200, 200 before 1. What comes out is what a merge sort,
    // which glibc's qsort is, makes of each order: the first is merged into the sorted pair of the others.
    EXPECT_EQ(table_of({up(host(1), 1), up(host(100), 1), up(host(200), 2)}),
              (runs{of(host(1), 64), of(host(100), 64), of(host(200), 128)}));
    EXPECT_EQ(table_of({up(host(200), 2), up(host(100), 1), up(host(1), 1)}),
              (runs{of(host(200), 128), of(host(1), 64), of(host(100), 64)}));
    EXPECT_EQ(table_of({up(host(100), 1), up(host(1), 1), up(host(200), 2)}),
              (runs{of(host(100), 64), of(host(200), 128), of(host(1), 64)}));
}

TEST(AssignmentTable, ShuffleKeepsSmallValuesAndFollowsTheSeed) {
    be32 first[256], second[256];
    for (uint32_t i = 0; i < 256; i++)
        first[i] = second[i] = from_raw_word(i);
    scramble_u8_array(256, first, 7);
    scramble_u8_array(256, second, 7);
    EXPECT_EQ(memcmp(first, second, sizeof first), 0);
    std::vector<uint32_t> values;
    for (const be32 value : first)
        values.push_back(raw_word(value));
    EXPECT_FALSE(std::is_sorted(values.begin(), values.end()));
    std::sort(values.begin(), values.end());
    for (uint32_t i = 0; i < 256; i++)
        EXPECT_EQ(values[i], i);
}

// Whatever the weights, each slot has an active owner, and the same input gives the same table.
TEST_F(AssignmentTest, AnyWeightsFillTheTable) {
    uint32_t state = 20011;
    const auto random = [&state](uint32_t below) {
        state = state * 1664525 + 1013904223;
        return (state >> 8) % below;
    };
    for (int round = 0; round < 2000; round++) {
        *group = {};
        group->assign_method = random(2) ? WCCP_ASSIGN_HASH : WCCP_ASSIGN_MASK;
        group->mask_dst_ip = 0x7f >> random(8);
        group->mask_bits = static_cast<uint32_t>(__builtin_popcount(group->mask_dst_ip));
        std::vector<std::pair<be32, uint16_t>> appliances;
        const uint32_t count = 1 + random(32);
        for (uint32_t i = 0; i < count; i++) {
            const uint32_t kind = random(4);
            const uint32_t weight = kind == 0 ? 0 : kind == 1 ? 65535 : random(65536);
            appliances.push_back({ip(10, 0, random(256), i * 8 + random(8)), static_cast<uint16_t>(weight)});
        }
        compute(appliances);
        const std::vector<be32> whole(group->bucket_ipa, group->bucket_ipa + 256);
        ASSERT_EQ(assigned_in_all(), group->bucket_count);
        compute(appliances);
        ASSERT_EQ(memcmp(whole.data(), group->bucket_ipa, sizeof group->bucket_ipa), 0);

        // Some leave: the slots of those that stay don't move.
        std::vector<std::pair<be32, uint16_t>> staying;
        for (uint32_t i = 0; i < count; i++)
            if (i == 0 || random(3))
                staying.push_back(appliances[i]);
        uint32_t weight = 0;
        for (const auto &appliance : staying)
            weight += appliance.second;
        compute(staying);
        ASSERT_EQ(assigned_in_all(), group->bucket_count);
        ASSERT_EQ(group->dsg_active_count, staying.size());
        for (uint32_t slot = 0; weight != 0 && slot < group->bucket_count; slot++)
            if (wccp_find_dsg_appliance(group.get(), group->dsg_active_count, whole[slot])) {
                ASSERT_EQ(group->bucket_ipa[slot], whole[slot]);
            }
    }
}

TEST_F(AssignmentTest, AnApplianceThatLeavesIsDownForOneComputation) {
    group->assign_method = WCCP_ASSIGN_HASH;
    compute({{host(3), 100}, {host(1), 100}, {host(2), 100}});
    // Entries stand in order of arrival, runs in sorted order.
    EXPECT_EQ(group->dsg_appliances[0].ipa, host(3));
    EXPECT_EQ(group->bucket_index[0], 1);
    EXPECT_EQ(group->bucket_index[85], 2);
    EXPECT_EQ(group->bucket_index[255], 0);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 86);
    EXPECT_EQ(group->dsg_appliances[1].assigned, 85);

    compute({{host(1), 100}, {host(3), 100}});
    EXPECT_EQ(runs_of(group->bucket_ipa, 256), (runs{of(host(1), 127), of(host(3), 129)}));
    EXPECT_EQ(group->dsg_appliance_count, 2u);
    EXPECT_EQ(group->dsg_active_count, 2u);
    EXPECT_EQ(group->dsg_appliances[0].ipa, host(3));
    EXPECT_EQ(group->dsg_appliances[0].assigned, 129);
    EXPECT_EQ(group->dsg_appliances[1].ipa, host(1));
    EXPECT_TRUE(is_zero(group->dsg_appliances[2].ipa));
    EXPECT_EQ(group->bucket_index[0], 1);

    compute({{host(1), 100}, {host(3), 100}});
    EXPECT_EQ(runs_of(group->bucket_ipa, 256), (runs{of(host(1), 128), of(host(3), 128)}));

    compute({{host(1), 300}, {host(3), 100}}); // a new weight is taken over
    EXPECT_EQ(runs_of(group->bucket_ipa, 256), (runs{of(host(1), 192), of(host(3), 64)}));

    compute({});
    EXPECT_EQ(group->dsg_appliance_count, 0u);
    EXPECT_EQ(group->bucket_count, 0u);
    EXPECT_TRUE(is_zero(group->bucket_ipa[17]));
    EXPECT_TRUE(is_zero(group->dsg_appliances[0].ipa));
}

TEST_F(AssignmentTest, WithoutAMethodThereIsNoTable) {
    compute({{host(1), 100}});
    EXPECT_EQ(group->bucket_count, 0u);
    EXPECT_TRUE(is_zero(group->bucket_ipa[0]));
    EXPECT_EQ(group->dsg_active_count, 1u);
}

TEST_F(AssignmentTest, DownEntriesGiveWayWhereThereIsNoRoom) {
    group->assign_method = WCCP_ASSIGN_HASH;
    std::vector<std::pair<be32, uint16_t>> first, second, third;
    for (uint32_t i = 1; i <= 32; i++) {
        // Nothing of the light ones is left of the split, so they go first.
        first.push_back({host(i), i <= 10 ? 1 : 6000});
        second.push_back({host(i + 50), 100});
        if (i > 20)
            third.push_back({host(i), 6000});
    }
    compute(first);
    for (uint32_t i = 0; i < 20; i++)
        third.push_back(second[i]);
    compute(third); // 12 stay, 20 come, 20 are gone
    ASSERT_EQ(group->dsg_active_count, 32u);
    for (const auto &appliance : third)
        EXPECT_TRUE(wccp_find_dsg_appliance(group.get(), 32, appliance.first));
    EXPECT_EQ(assigned_in_all(), 256u);
    compute(second); // all but 20 replaced
    ASSERT_EQ(group->dsg_active_count, 32u);
    EXPECT_EQ(runs_of(group->bucket_ipa, 256).front(), of(host(51), 8));
    second.push_back({host(99), 100}); // more than anybody can report: the last one is left out
    compute(second);
    EXPECT_EQ(group->dsg_active_count, 32u);
    EXPECT_FALSE(wccp_find_dsg_appliance(group.get(), 32, host(99)));
}

TEST_F(AssignmentTest, TheLightestDownEntryGivesWayFirst) {
    group->assign_method = WCCP_ASSIGN_HASH;
    std::vector<std::pair<be32, uint16_t>> appliances;
    for (uint32_t i = 1; i <= 32; i++)
        appliances.push_back({host(i), i == 5 ? 10 : 100});
    compute(appliances);
    // 5 and 6 leave and 40 comes. 6 keeps its place for this once, so its run of 8 slots is split among all
    // that are there; had 5 kept its place, there would be one slot to split.
    appliances.erase(appliances.begin() + 4, appliances.begin() + 6);
    appliances.push_back({host(40), 0});
    compute(appliances);
    EXPECT_GE(runs_of(group->bucket_ipa, 256).size(), 30u + 6u);
    EXPECT_EQ(group->dsg_appliances[30].ipa, host(40)); // at the end of the order
}

struct value { // source and destination address, source and destination port
    uint32_t src_ip, dst_ip;
    uint32_t src_port, dst_port;
    bool operator==(const value &) const = default;
};

struct MaskTest : AssignmentTest {
    MaskTest() { group->assign_method = WCCP_ASSIGN_MASK; }
    void set_mask(const wccp_mask &mask) {
        group->mask_src_ip = mask.src_ip;
        group->mask_dst_ip = mask.dst_ip;
        group->mask_src_port = mask.src_port;
        group->mask_dst_port = mask.dst_port;
        group->mask_bits = util_wccp_mask_get_bits_set(&mask);
        wccp_mask_assignment_calculate_value_table(group.get());
    }
    std::vector<value> values() {
        std::vector<value> found;
        for (uint32_t i = 0; i < group->mask_value_count; i++) {
            const wccp_mask_value &v = group->mask_values[i];
            found.push_back({v.src_ip, v.dst_ip, v.src_port, v.dst_port});
        }
        return found;
    }
};

TEST_F(MaskTest, ValuesCountUpFromTheDestinationPortsLowestBit) {
    set_mask({.src_ip = 1, .dst_ip = 0, .src_port = 0, .dst_port = 3});
    EXPECT_EQ(values(), (std::vector<value>{{0, 0, 0, 0},
                                            {0, 0, 0, 1},
                                            {0, 0, 0, 2},
                                            {0, 0, 0, 3},
                                            {1, 0, 0, 0},
                                            {1, 0, 0, 1},
                                            {1, 0, 0, 2},
                                            {1, 0, 0, 3}}));
    set_mask({.src_ip = 0x80000000, .dst_ip = 0x10, .src_port = 0x8000, .dst_port = 0});
    EXPECT_EQ(values(), (std::vector<value>{{0, 0, 0, 0},
                                            {0, 0, 0x8000, 0},
                                            {0, 0x10, 0, 0},
                                            {0, 0x10, 0x8000, 0},
                                            {0x80000000, 0, 0, 0},
                                            {0x80000000, 0, 0x8000, 0},
                                            {0x80000000, 0x10, 0, 0},
                                            {0x80000000, 0x10, 0x8000, 0}}));
    set_mask({});
    EXPECT_EQ(values(), (std::vector<value>{{0, 0, 0, 0}}));
}

TEST_F(MaskTest, SevenBitsAreUsedAndEightAreReplaced) {
    set_mask({.src_ip = 0, .dst_ip = 0x1741, .src_port = 0, .dst_port = 1});
    EXPECT_EQ(group->mask_value_count, 128u);
    EXPECT_EQ(values().back(), (value{0, 0x1741, 0, 1}));

    set_mask({.src_ip = 0, .dst_ip = 0x1741, .src_port = 2, .dst_port = 1});
    EXPECT_EQ(group->mask_bits, 8u);
    EXPECT_EQ(group->mask_value_bits, 4u);
    EXPECT_EQ(group->mask_src_port, 2);
    EXPECT_EQ(group->mask_dst_ip, 0x1741u);
    ASSERT_EQ(group->mask_value_count, 16u);
    for (uint32_t i = 0; i < 16; i++)
        EXPECT_EQ(values()[i], (value{0, i << 8, 0, 0}));
    EXPECT_EQ(group->mask_values[16].dst_ip, 0u); // nothing left of the 128 of before
}

TEST_F(MaskTest, ValuesAreSharedLikeBuckets) {
    set_mask({.src_ip = 0, .dst_ip = 0xF00, .src_port = 0, .dst_port = 0});
    compute({{host(3), 100}, {host(2), 100}, {host(1), 100}});
    EXPECT_EQ(group->bucket_count, 16u);
    EXPECT_EQ(runs_of(group->bucket_ipa, 16), (runs{of(host(1), 5), of(host(2), 5), of(host(3), 6)}));
    for (uint32_t i = 0; i < 16; i++)
        EXPECT_EQ(group->mask_values[i].appliance_ipa, group->bucket_ipa[i]);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 6);
    EXPECT_EQ(group->dsg_appliances[2].assigned, 5);

    group->bucket_count = 17;
    EXPECT_EQ(wccp_mask_assignment_assign_mask_values(group.get()), 1);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 6);

    group->mask_dst_ip = 0; // one value, which the last one in order gets
    group->mask_bits = 0;
    compute({{host(1), 100}, {host(2), 100}});
    EXPECT_EQ(group->bucket_count, 1u);
    EXPECT_EQ(group->mask_values[0].appliance_ipa, host(2));
}

} // namespace
