// The designated appliance's table: the split, the order of the owners, down entries, and the values of the
// mask.
#include "engine/wccp_assignment.h"

#include <algorithm>
#include <array>

#include "engine/wccp_mask_assignment.h"
#include "engine/wccp_slot_owners.h"
#include "tests/support/reported_group.h"

namespace {

using entries = std::vector<wccp_dsg_appliance>;

wccp_dsg_appliance dsg_entry(uint32_t last_octets, uint32_t weight, bool up = true) {
    return {.ipa = host(last_octets), .up = up, .weight = static_cast<uint16_t>(weight), .assigned = 0};
}
// "1:100 -2:30 258:7": the last two octets of 10.0.0.1, 10.0.0.2 and 10.0.1.2, as numbers, with their
// weights; a minus is down.
entries parse_entries(const std::string &text) {
    std::istringstream words(text);
    entries found;
    int octets;
    char colon;
    for (uint32_t weight; words >> octets >> colon >> weight;)
        found.push_back(dsg_entry(static_cast<uint32_t>(std::abs(octets)), weight, octets > 0));
    return found;
}
// The runs of a table, in the same form: owner and length.
std::string runs_of(const be32 *table, uint32_t slots) {
    std::ostringstream text;
    for (uint32_t i = 0, length = 1; i < slots; i++, length++) {
        if (i + 1 < slots && table[i + 1] == table[i])
            continue;
        text << (text.tellp() > 0 ? " " : "") << (to_host(table[i]) & 0xffff) << ":" << length;
        length = 0;
    }
    return text.str();
}

TEST(AssignmentTable, SplitsByWeightInTheOrderOfTheWords) {
    static const std::tuple<const char *, uint32_t, const char *> cases[] = {
        // In proportion; remainders are passed on.
        {"1:100 2:100 3:100", 256, "1:85 2:85 3:86"},
        {"1:1 2:2", 256, "1:85 2:171"},
        {"1:7", 256, "1:256"},
        {"1:0 2:9", 256, "2:256"},
        {"1:65535 2:1 3:65535", 256, "1:127 2:1 3:128"},
        {"1:1 2:1 3:1", 1, "3:1"},
        // Only the run of a down entry is split again. It can be too light to have slots.
        {"1:100 -2:100 3:100", 256, "1:127 3:129"},
        {"1:30 -2:30 -3:30 4:30", 256, "1:96 4:32 1:32 4:96"},
        {"-1:65535 2:1", 256, "2:256"},
        {"-1:1 2:60000", 256, "2:256"},
        // Without active weights the largest word gets everything.
        {"2:0 1:0", 256, "2:256"},
        {"2305:0 2:0", 256, "2:256"},
        {"-9:500 3:0", 256, "3:256"},
        {"-9:500 -3:0", 256, "77:256"}, // unchanged
        {"", 256, "77:256"},
        // The last octet is the most significant, and the difference wraps around.
        {"2:1 257:1 1:2", 256, "1:128 257:64 2:64"},
        {"10:1 200:3", 256, "200:192 10:64"},
        {"200:3 10:1", 256, "200:192 10:64"},
        // Not transitive: 1 before 100, 100 before 200, 200 before 1. The results are those of a merge sort,
        // glibc's qsort, which merges the first into the sorted pair of the others.
        {"1:1 100:1 200:2", 256, "1:64 100:64 200:128"},
        {"200:2 100:1 1:1", 256, "200:128 1:64 100:64"},
        {"100:1 1:1 200:2", 256, "100:64 200:128 1:64"}};
    for (const auto &[given, slots, runs] : cases) {
        entries list = parse_entries(given);
        std::vector<be32> table(slots, host(77));
        wccp_compute_assignment_table(static_cast<uint32_t>(list.size()), list.data(), slots, table.data(),
                                      0);
        EXPECT_EQ(runs_of(table.data(), slots), runs) << given;
    }
}

TEST(AssignmentTable, ShuffleFollowsTheSeed) {
    std::vector<be32> table;
    for (uint32_t i = 0; i < 8; i++)
        table.push_back(from_raw_word(i));
    scramble_u8_array(8, table.data(), 7);
    std::string order;
    for (const be32 each : table)
        order += std::to_string(raw_word(each));
    EXPECT_EQ(order, "52641703");
}

// A group outside the engine's tables.
struct AssignmentTest : testing::Test {
    AssignmentTest() { group->assign_method = WCCP_ASSIGN_HASH; }
    void compute(const entries &appliances) {
        wccp_designated_appliance_assignment_start(group.get());
        for (const wccp_dsg_appliance &each : appliances) {
            const wccp_view_appliance reported = {{}, {}, each.ipa, each.weight, 1, WCCP_LISTED_BY_ALL};
            wccp_designated_appliance_assignment_add(group.get(), &reported);
            ASSERT_LE(group->dsg_appliance_count, WCCP_MAX_APPLIANCES);
            ASSERT_EQ(group->bucket_count, 0u); // directly after the entries in memory
        }
        wccp_designated_appliance_assignment_finish(group.get());
    }
    std::string runs() const { return runs_of(group->bucket_ipa, group->bucket_count); }
    uint32_t assigned_in_all() const {
        uint32_t sum = 0;
        for (uint32_t i = 0; i < group->dsg_active_count; i++)
            sum += group->dsg_appliances[i].assigned;
        return sum;
    }
    bool is_active(be32 address) const {
        return wccp_find_dsg_appliance(group.get(), group->dsg_active_count, address) != nullptr;
    }
    std::unique_ptr<wccp_service_group> group = std::make_unique<wccp_service_group>();
};

// With any weights, each slot has an active owner, the same input gives the same table, and when appliances
// leave, the slots of the others do not move.
TEST_F(AssignmentTest, AnyWeightsFillTheTable) {
    auto random = [state = 20011u](uint32_t below) mutable {
        return static_cast<uint32_t>(rand_r(&state)) % below;
    };
    for (int round = 0; round < 2000; round++) {
        *group = {};
        group->assign_method = random(2) ? WCCP_ASSIGN_HASH : WCCP_ASSIGN_MASK;
        group->mask_dst_ip = 0x7f >> random(8);
        group->mask_bits = static_cast<uint32_t>(__builtin_popcount(group->mask_dst_ip));
        entries appliances, staying;
        uint32_t weight = 0;
        for (uint32_t i = 0, count = 1 + random(32); i < count; i++) {
            const uint32_t weights[] = {0, 65535, random(65536), random(65536)};
            appliances.push_back(dsg_entry(random(256) << 8 | (i * 8 + random(8)), weights[random(4)]));
            if (i == 0 || random(3)) {
                staying.push_back(appliances.back());
                weight += appliances.back().weight;
            }
        }
        compute(appliances);
        const std::vector<be32> whole(group->bucket_ipa, group->bucket_ipa + 256);
        ASSERT_EQ(assigned_in_all(), group->bucket_count);
        compute(appliances);
        ASSERT_TRUE(std::equal(whole.begin(), whole.end(), group->bucket_ipa));
        compute(staying);
        ASSERT_TRUE(assigned_in_all() == group->bucket_count && group->dsg_active_count == staying.size());
        for (uint32_t slot = 0; weight != 0 && slot < group->bucket_count; slot++)
            ASSERT_TRUE(!is_active(whole[slot]) || group->bucket_ipa[slot] == whole[slot]);
    }
}

TEST_F(AssignmentTest, AnApplianceThatLeavesIsDownForOneComputation) {
    group->assign_method = WCCP_ASSIGN_NONE;
    compute(parse_entries("3:100 1:100 2:100"));
    EXPECT_TRUE(group->bucket_count == 0 && is_zero(group->bucket_ipa[0])); // no method agreed
    EXPECT_EQ(group->dsg_active_count, 3u);

    group->assign_method = WCCP_ASSIGN_HASH;
    compute(parse_entries("3:100 1:100 2:100"));
    // Entries are in order of arrival, runs in sorted order.
    EXPECT_EQ(group->dsg_appliances[0].ipa, host(3));
    EXPECT_EQ(std::tuple(group->bucket_index[0], group->bucket_index[85], group->bucket_index[255],
                         group->dsg_appliances[0].assigned, group->dsg_appliances[1].assigned),
              std::tuple(1, 2, 0, 86, 85));

    const std::tuple<const char *, const char *, uint16_t> rounds[] = {
        {"1:100 3:100", "1:127 3:129", 129},
        {"1:100 3:100", "1:128 3:128", 128},
        {"1:300 3:100", "1:192 3:64", 64}}; // a new weight
    for (const auto &[appliances, slots, of_3] : rounds) {
        compute(parse_entries(appliances));
        EXPECT_EQ(runs(), slots);
        EXPECT_EQ(std::tuple(group->dsg_appliance_count, group->dsg_active_count, group->bucket_index[0],
                             group->dsg_appliances[0].assigned),
                  std::tuple(2, 2, 1, of_3));
        for (const auto &[at, ipa] : {std::pair{0, host(3)}, {1, host(1)}, {2, be32{}}})
            EXPECT_EQ(group->dsg_appliances[at].ipa, ipa);
    }
    compute({});
    EXPECT_EQ(group->dsg_appliance_count + group->bucket_count, 0u);
    EXPECT_TRUE(is_zero(group->bucket_ipa[17]) && is_zero(group->dsg_appliances[0].ipa));
}

TEST_F(AssignmentTest, DownEntriesAreDroppedWhenThereIsNoRoom) {
    entries first, second, third;
    for (uint32_t i = 1; i <= 32; i++) {
        // The light ones have no slots, so they are dropped first.
        first.push_back(dsg_entry(i, i <= 10 ? 1 : 6000));
        second.push_back(dsg_entry(i + 50, 100));
        if (i > 20)
            third.push_back(first.back());
    }
    compute(first);
    third.insert(third.end(), second.begin(), second.begin() + 20);
    compute(third); // 12 stay, 20 are new, 20 have left
    ASSERT_EQ(group->dsg_active_count, 32u);
    for (const wccp_dsg_appliance &each : third)
        EXPECT_TRUE(is_active(each.ipa));
    EXPECT_EQ(assigned_in_all(), 256u);
    compute(second); // all but 20 are replaced
    ASSERT_EQ(group->dsg_active_count, 32u);
    EXPECT_EQ(runs().substr(0, 4), "51:8");
    second.push_back(dsg_entry(99, 100)); // more than possible: the last one is left out
    compute(second);
    EXPECT_TRUE(group->dsg_active_count == 32 && !is_active(host(99)));

    // 5 and 6 leave and 40 is new. 6 keeps its place for this computation, so its 8 slots are split among all
    // others; if 5, the lightest, kept its place, there would be one slot to split.
    *group = {};
    group->assign_method = WCCP_ASSIGN_HASH;
    entries appliances;
    for (uint32_t i = 1; i <= 32; i++)
        appliances.push_back(dsg_entry(i, i == 5 ? 10 : 100));
    compute(appliances);
    appliances.erase(appliances.begin() + 4, appliances.begin() + 6);
    appliances.push_back(dsg_entry(40, 0));
    compute(appliances);
    const std::string text = runs();
    EXPECT_GE(std::count(text.begin(), text.end(), ':'), 30 + 6);
    EXPECT_EQ(group->dsg_appliances[30].ipa, host(40)); // at the end of the order
}

struct MaskTest : AssignmentTest {
    // Source and destination address, source and destination port.
    using value = std::array<uint32_t, 4>;
    using list = std::vector<value>;

    list values_of(const value &mask) {
        group->assign_method = WCCP_ASSIGN_MASK;
        group->mask_src_ip = mask[0];
        group->mask_dst_ip = mask[1];
        group->mask_src_port = static_cast<uint16_t>(mask[2]);
        group->mask_dst_port = static_cast<uint16_t>(mask[3]);
        const wccp_mask fields = {mask[0], mask[1], group->mask_src_port, group->mask_dst_port};
        group->mask_bits = util_wccp_mask_get_bits_set(&fields);
        wccp_mask_assignment_calculate_value_table(group.get());
        list found;
        for (uint32_t i = 0; i < group->mask_value_count; i++) {
            const wccp_mask_value &v = group->mask_values[i];
            found.push_back({v.src_ip, v.dst_ip, v.src_port, v.dst_port});
        }
        return found;
    }
};

TEST_F(MaskTest, ValuesCountUpFromTheDestinationPortsLowestBit) {
    constexpr uint32_t top = 0x80000000;
    const list low = {{0, 0, 0, 0}, {0, 0, 0, 1}, {0, 0, 0, 2}, {0, 0, 0, 3},
                      {1, 0, 0, 0}, {1, 0, 0, 1}, {1, 0, 0, 2}, {1, 0, 0, 3}};
    EXPECT_EQ(values_of({1, 0, 0, 3}), low);
    const list high = {{0, 0, 0, 0},   {0, 0, 0x8000, 0},   {0, 16, 0, 0},   {0, 16, 0x8000, 0},
                       {top, 0, 0, 0}, {top, 0, 0x8000, 0}, {top, 16, 0, 0}, {top, 16, 0x8000, 0}};
    EXPECT_EQ(values_of({top, 16, 0x8000, 0}), high);
    // Seven bits are used, eight are replaced.
    const list seven = values_of({0, 0x1741, 0, 1});
    EXPECT_TRUE(seven.size() == 128 && seven.back() == (value{0, 0x1741, 0, 1}));
    const list eight = values_of({0, 0x1741, 2, 1});
    EXPECT_EQ((value{group->mask_bits, group->mask_value_bits, group->mask_src_port, group->mask_dst_ip}),
              (value{8, 4, 2, 0x1741}));
    ASSERT_EQ(eight.size(), 16u);
    for (uint32_t i = 0; i < 16; i++)
        EXPECT_EQ(eight[i], (value{0, i << 8, 0, 0}));
    EXPECT_EQ(group->mask_values[16].dst_ip, 0u); // the earlier 128 values are cleared
}

TEST_F(MaskTest, ValuesAreSharedLikeBuckets) {
    values_of({0, 0xF00, 0, 0});
    compute(parse_entries("3:100 2:100 1:100"));
    EXPECT_EQ(runs(), "1:5 2:5 3:6");
    for (uint32_t i = 0; i < 16; i++)
        EXPECT_EQ(group->mask_values[i].appliance_ipa, group->bucket_ipa[i]);
    EXPECT_TRUE(group->dsg_appliances[0].assigned == 6 && group->dsg_appliances[2].assigned == 5);

    group->bucket_count = 17;
    EXPECT_EQ(wccp_mask_assignment_assign_mask_values(group.get()), 1);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 6);

    // One value, which the last appliance in order gets.
    EXPECT_EQ(values_of({}), (list{{0, 0, 0, 0}}));
    compute(parse_entries("1:100 2:100"));
    EXPECT_EQ(runs(), "2:1");
    EXPECT_EQ(group->mask_values[0].appliance_ipa, host(2));
}

} // namespace
