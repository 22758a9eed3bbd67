// Views: the union over the routers' reports, connections, weights, and the role that follows from what
// routers assign.
#include "engine/wccp_view_utils.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "engine/wccp_state.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_wire.h"
#include "tests/support/log_lines.h"
#include "tests/support/reported_group.h"

namespace {

using appliances = reported_appliances;
using counts = std::map<std::string, int>; // mentions of an address

struct ViewTest : testing::Test {
    ~ViewTest() override {
        shared.reset();
        EXPECT_EQ(wccp_g.stat_allocs.load(), wccp_g.stat_frees.load());
    }
    wccp_sending_router *router(be32 id) { return shared->router(id); }
    int report_routers(be32 from, const std::vector<be32> &list) {
        return shared->report_routers(from, list);
    }
    int report(be32 from, const appliances &list) { return shared->report(from, list); }
    template <typename Entry>
    static counts mentions(const Entry *entry) {
        counts found;
        for (; entry; entry = entry->next)
            found[addr_text(entry->ipa).s] += entry->ref_count;
        return found;
    }
    std::vector<uint16_t> weights_in_order() {
        std::vector<uint16_t> found;
        for (const wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next)
            found.push_back(entry->weight);
        return found;
    }
    // Whether the views have changed since the last call, as the group notes it.
    uint32_t changes() {
        const uint32_t risen = group->change_number - seen_change_number;
        EXPECT_EQ((group->state_flags & WCCP_DESG_ELECT_PENDING) != 0, risen != 0);
        group->state_flags &= ~WCCP_DESG_ELECT_PENDING;
        seen_change_number = group->change_number;
        return risen;
    }
    std::unique_ptr<reported_group> shared = std::make_unique<reported_group>(false);
    wccp_service_group *group = shared->group;
    uint32_t seen_change_number = 0;
};

TEST_F(ViewTest, OnlyTheHeadIsComparedInASortedInsertion) {
    report(ROUTER_A, {{host(10), 100}, {host(11), 50}, {host(12), 75}, {host(13), 60}});
    EXPECT_EQ(weights_in_order(), (std::vector<uint16_t>{100, 60, 75, 50}));
    report(ROUTER_A, {});
    report(ROUTER_A, {{host(10), 50}, {host(11), 60}, {host(12), 55}, {host(13), 70}});
    EXPECT_EQ(weights_in_order(), (std::vector<uint16_t>{70, 60, 55, 50}));
    // Of equal weights the higher address, as a number, goes first.
    for (const bool lower_first : {true, false}) {
        const be32 low = to_be32(0x0a000002), high = to_be32(0x0a000101);
        report(ROUTER_A, {});
        report(ROUTER_A, lower_first ? appliances{{low, 9}, {high, 9}} : appliances{{high, 9}, {low, 9}});
        EXPECT_EQ(group->appliance_view->ipa, high);
    }
}

TEST_F(ViewTest, AnAddressThatIsThereAlreadyIsToldAndStaysBehindTheHead) {
    report(ROUTER_A, {{host(10), 100}, {host(11), 50}});
    auto *again = static_cast<wccp_view_appliance *>(wccp_malloc(sizeof(wccp_view_appliance)));
    again->ipa = host(10);
    again->weight = 100;
    EXPECT_EQ(wccp_view_list_add_appliance_sorted(group, again), 1);
    EXPECT_EQ(group->appliance_view->next, again);
}

TEST_F(ViewTest, TheUnionCountsMentionsAndForgetsWithTheLast) {
    report_routers(ROUTER_A, {ROUTER_A, ROUTER_B});
    report(ROUTER_A, {{US, 100}, {host(2), 100}});
    EXPECT_EQ(changes(), 2u);
    report_routers(ROUTER_B, {ROUTER_B});
    report(ROUTER_B, {{host(2), 100}});
    EXPECT_EQ(changes(), 2u);
    EXPECT_EQ(mentions(group->router_view), (counts{{"10.0.0.201", 1}, {"10.0.0.202", 2}}));
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.1", 1}, {"10.0.0.2", 2}}));

    report(ROUTER_A, {{US, 100}});
    EXPECT_EQ(changes(), 1u);
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.1", 1}, {"10.0.0.2", 1}}));
    report(ROUTER_B, {});
    report_routers(ROUTER_B, {});
    EXPECT_EQ(changes(), 2u);
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.1", 1}}));
    EXPECT_EQ(mentions(group->router_view), (counts{{"10.0.0.201", 1}, {"10.0.0.202", 1}}));
    EXPECT_EQ(group->appliance_view_count, 1u);
    EXPECT_EQ(group->router_view_count, 2u);
}

TEST_F(ViewTest, TheSameReportInAnyOrderIsNoChange) {
    std::vector<be32> routers;
    appliances list;
    for (uint32_t i = 0; i < 32; i++) {
        routers.push_back(host(200 - i));
        list.push_back({host(i + 1), 100});
    }
    report_routers(ROUTER_A, routers);
    report(ROUTER_A, list);
    EXPECT_EQ(changes(), 2u);
    const uint32_t allocations = wccp_g.stat_allocs;
    for (int round = 0; round < 2; round++) {
        report_routers(ROUTER_A, routers);
        report(ROUTER_A, list);
        std::swap(routers[3], routers[31]);
        std::swap(list[0], list[17]);
    }
    EXPECT_EQ(changes(), 0u);
    EXPECT_EQ(wccp_g.stat_allocs, allocations);
    EXPECT_EQ(router(ROUTER_A)->view_appliances[17].ipa, US); // the arrays follow the report's order
}

TEST_F(ViewTest, AnAddressNamedTwiceKeepsUnionAndArraysInStep) {
    const appliances twice = {{US, 100}, {host(2), 100}, {US, 50}, {host(2), 100}};
    report_routers(ROUTER_A, {ROUTER_A, ROUTER_A});
    report(ROUTER_A, twice);
    report(ROUTER_B, {{host(2), 100}});
    changes();
    for (int round = 0; round < 3; round++) {
        report_routers(ROUTER_A, {ROUTER_A, ROUTER_A});
        report(ROUTER_A, twice);
        EXPECT_EQ(changes(), 0u);
    }
    report(ROUTER_A, {{host(2), 100}, {US, 100}, {host(2), 100}, {US, 50}});
    EXPECT_EQ(changes(), 0u);
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.1", 2}, {"10.0.0.2", 3}}));
    report(ROUTER_A, {{host(2), 100}, {US, 100}});
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.1", 1}, {"10.0.0.2", 2}}));
    EXPECT_TRUE(router(ROUTER_A)->flags & WCCP_RTR_TWO_WAY) << "it is still listed once";
    report(ROUTER_A, {});
    report_routers(ROUTER_A, {});
    EXPECT_EQ(mentions(group->appliance_view), (counts{{"10.0.0.2", 1}}));
    EXPECT_EQ(group->router_view, nullptr);
}

TEST_F(ViewTest, ARouterIsTwoWayWhileItListsUs) {
    group->ucast_router_count = 1;
    wccp_g.seconds = 100;
    wccp_sending_router *a = router(ROUTER_A);
    EXPECT_EQ(a->flags, WCCP_RTR_ONE_WAY);
    wccp_g.seconds = 110;
    report(ROUTER_A, {{host(2), 100}});
    EXPECT_EQ(a->flags, WCCP_RTR_ONE_WAY);
    EXPECT_EQ(a->state_time, 100u);
    report(ROUTER_A, {{host(2), 100}, {US, 100}});
    EXPECT_EQ(a->flags, WCCP_RTR_TWO_WAY);
    EXPECT_EQ(a->state_time, 110u);
    wccp_g.seconds = 120;
    report(ROUTER_A, {{host(2), 100}, {US, 100}});
    EXPECT_EQ(a->state_time, 110u);
    EXPECT_EQ(group->raised_alarms, 0);
    report(ROUTER_A, {{host(2), 100}});
    EXPECT_EQ(a->flags, WCCP_RTR_ONE_WAY);
    EXPECT_EQ(a->state_time, 120u);
    EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ADJACENCY);
    wccp_g.seconds = 0;
}

TEST_F(ViewTest, AWeightFollowsTheLastReportThatDiffersFromItsRoutersOwn) {
    report(ROUTER_A, {{host(2), 100}, {host(3), 90}});
    report(ROUTER_B, {{host(2), 70}, {host(3), 90}}); // known already: the entry keeps its weight
    EXPECT_EQ(weights_in_order(), (std::vector<uint16_t>{100, 90}));
    changes();
    report(ROUTER_B, {{host(2), 60}, {host(3), 90}});
    EXPECT_EQ(weights_in_order(), (std::vector<uint16_t>{90, 60}));
    report(ROUTER_A, {{host(2), 100}, {host(3), 90}}); // nothing new from this one
    EXPECT_EQ(weights_in_order(), (std::vector<uint16_t>{90, 60}));
    EXPECT_EQ(changes(), 0u);
}

TEST_F(ViewTest, AWeightChangeMakesTheDesignatedApplianceAssignAgain) {
    report_routers(ROUTER_A, {ROUTER_A});
    report(ROUTER_A, {{US, 100}, {host(2), 100}});
    group->designated = 1;
    ASSERT_EQ(wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_ELECTION), 0);
    EXPECT_EQ(group->assign_timer.countdown, 16u);
    changes();
    router(ROUTER_A)->assign_tx_count = 3;
    report(ROUTER_A, {{US, 100}, {host(2), 300}});
    EXPECT_EQ(changes(), 0u);
    EXPECT_EQ(group->dsg_key_change, 2u);
    EXPECT_EQ(group->dsg_appliances[1].assigned + group->dsg_appliances[0].assigned, 256);
    EXPECT_EQ(std::max(group->dsg_appliances[0].assigned, group->dsg_appliances[1].assigned), 192);
    EXPECT_EQ(group->assign_timer.countdown, 1u);
    EXPECT_EQ(group->pending_acks, 1);
    EXPECT_EQ(router(ROUTER_A)->assign_tx_count, 0u);

    // With nobody left that all routers report, the update ends there and the router's arrays stay.
    report(ROUTER_B, {{host(3), 100}});
    EXPECT_EQ(report(ROUTER_A, {{US, 150}, {host(2), 300}, {host(4), 1}}), 1);
    EXPECT_EQ(router(ROUTER_A)->view_appliance_count, 2u);
    EXPECT_EQ(router(ROUTER_A)->view_appliances[0].weight, 100);
}

// Elements as they stand on the wire.
struct element_bytes {
    std::vector<uint8_t> bytes;
    uint32_t count = 0;
    void add(be32 id, uint16_t revision, uint16_t flags, size_t size, size_t weight_at, uint16_t weight,
             const std::vector<uint8_t> &buckets = {}) {
        const size_t at = bytes.size();
        bytes.resize(at + size, 0);
        memcpy(&bytes[at], &id, 4);
        const uint8_t head[] = {uint8_t(revision >> 8), uint8_t(revision), uint8_t(flags >> 8),
                                uint8_t(flags)};
        memcpy(&bytes[at + 4], head, 4);
        if (!buckets.empty())
            memcpy(&bytes[at + 8], buckets.data(), buckets.size());
        bytes[at + weight_at] = uint8_t(weight >> 8);
        bytes[at + weight_at + 1] = uint8_t(weight);
        count++;
    }
    void add_hash(be32 id, uint16_t weight, const std::vector<uint8_t> &buckets, uint16_t flags = 0,
                  uint16_t revision = 0) {
        add(id, revision, flags, 44, 40, weight, buckets);
    }
};
struct decoded_elements {
    wccp_rtr_view_appliance list[WCCP_MAX_APPLIANCES] = {};
    wccp_assign_summary hash = {9, 9, 9};
    int result = -1;
};
decoded_elements decode(wccp_service_group *group, const element_bytes &elements) {
    decoded_elements out;
    // On an odd address, and not a byte longer than what is read.
    std::vector<uint8_t> place(elements.bytes.size() + 1);
    std::copy(elements.bytes.begin(), elements.bytes.end(), place.begin() + 1);
    out.result = wccp_process_router_view_web_cache_id_elements(group, elements.count, place.data() + 1,
                                                                out.list, &out.hash);
    return out;
}

TEST_F(ViewTest, ElementsAreReadByTheirForm) {
    element_bytes elements;
    elements.add_hash(US, 100, {0x80, 0x01, 0, 0, 0xff});
    elements.add_hash(host(2), 0x1234, std::vector<uint8_t>(32, 0xff));
    elements.add_hash(host(3), 7, std::vector<uint8_t>(32, 0xff), WCCP_IDENTITY_HISTORICAL);
    elements.add(host(4), 5, WCCP_IDENTITY_MASK | WCCP_IDENTITY_NO_REDIRECT, 32, 28, 44);
    const decoded_elements out = decode(group, elements);
    ASSERT_EQ(out.result, 0);
    EXPECT_EQ(out.hash.valid, 1u);
    EXPECT_EQ(out.hash.self_count, 10);
    EXPECT_EQ(out.hash.total_count, 256); // 266, limited
    EXPECT_EQ(out.list[0].ipa, US);
    EXPECT_EQ(out.list[0].buckets_assigned, 10);
    EXPECT_EQ(out.list[0].buckets_total, 256);
    EXPECT_EQ(out.list[0].bucket_bits[0], 0x80010000u);
    EXPECT_EQ(out.list[0].bucket_bits[1], 0xff000000u);
    EXPECT_EQ(out.list[1].buckets_assigned, 256);
    EXPECT_EQ(out.list[1].weight, 0x1234);
    EXPECT_EQ(out.list[2].buckets_assigned, 0);
    EXPECT_EQ(out.list[2].buckets_total, 0);
    EXPECT_EQ(out.list[2].weight, 7);
    EXPECT_EQ(out.list[3].ipa, host(4));
    EXPECT_EQ(out.list[3].weight, 44);
}

TEST_F(ViewTest, AMaskElementWithRedirectLeavesTheAssignmentToTheMap) {
    for (const uint32_t mode : {WCCP_COMPAT_IOS, WCCP_COMPAT_NEXUS}) {
        group->compat_mode = mode;
        const size_t size = mode == WCCP_COMPAT_IOS ? 16 : 32;
        element_bytes elements;
        elements.add(US, 0, WCCP_IDENTITY_MASK, size, size - 4, 77);
        elements.add_hash(host(2), 100, {0x01});
        const decoded_elements out = decode(group, elements);
        ASSERT_EQ(out.result, 0);
        EXPECT_EQ(out.hash.valid, 0u);
        EXPECT_EQ(out.list[0].weight, 77);
        EXPECT_EQ(out.list[1].ipa, host(2));
        EXPECT_EQ(out.list[1].buckets_assigned, 1);

        const wccp_assign_summary no_map = {};
        wccp_sending_router *a = router(ROUTER_A);
        a->self_buckets = 5;
        EXPECT_EQ(wccp_update_appliance_redirect_status(group, a, &out.hash, &no_map), 1);
        EXPECT_EQ(a->self_buckets, 5);
    }
}

TEST_F(ViewTest, AnotherHashRevisionIsRefused) {
    element_bytes elements;
    elements.add_hash(US, 100, {0xff});
    elements.add_hash(host(2), 100, {0xff}, WCCP_IDENTITY_HISTORICAL, 1);
    EXPECT_EQ(decode(group, elements).result, 1);
    EXPECT_EQ(decode(group, {}).result, 0);
    EXPECT_EQ(decode(group, {}).hash.total_count, 0);
    decoded_elements out;
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(nullptr, 0, nullptr, out.list, &out.hash), 1);
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(group, 0, nullptr, nullptr, &out.hash), 1);
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(group, 0, nullptr, out.list, nullptr), 1);
}

TEST_F(ViewTest, BucketBitsAreCountedWhateverTheirPattern) {
    uint32_t state = 1;
    for (int round = 0; round < 500; round++) {
        std::vector<uint8_t> buckets(32);
        int expected = 0;
        for (uint8_t &byte : buckets) {
            state = state * 1664525 + 1013904223;
            byte = round % 3 == 0 ? static_cast<uint8_t>(state >> 24 | state >> 16) : uint8_t(state >> 24);
            expected += std::popcount(byte);
        }
        element_bytes elements;
        elements.add_hash(US, 1, buckets);
        ASSERT_EQ(decode(group, elements).list[0].buckets_assigned, expected);
    }
}

TEST_F(ViewTest, EarlierBucketBitsStayWhereNoneAreAssigned) {
    wccp_rtr_view_appliance decoded[WCCP_MAX_APPLIANCES] = {};
    decoded[0].ipa = US;
    decoded[0].buckets_assigned = 1;
    decoded[0].bucket_bits[3] = 8;
    wccp_sending_router *a = router(ROUTER_A);
    wccp_update_appliance_view(group, a, 1, decoded);
    decoded[0].buckets_assigned = 0;
    decoded[0].bucket_bits[3] = 0;
    wccp_update_appliance_view(group, a, 1, decoded);
    EXPECT_EQ(a->view_appliances[0].buckets_assigned, 0);
    EXPECT_EQ(a->view_appliances[0].bucket_bits[3], 8u);
}

TEST_F(ViewTest, ReportedByAllMeansByEachSender) {
    EXPECT_EQ(wccp_appliance_is_reported_by_all_senders(group, US), 1);
    report(ROUTER_A, {{US, 1}, {host(2), 1}});
    report(ROUTER_B, {{US, 1}});
    EXPECT_EQ(wccp_appliance_is_reported_by_all_senders(group, US), 1);
    EXPECT_EQ(wccp_appliance_is_reported_by_all_senders(group, host(2)), 0);
    router(ROUTER_C); // not a word of appliances yet
    EXPECT_EQ(wccp_appliance_is_reported_by_all_senders(group, US), 0);
}

// What routers assign, step by step: from, to us, to anybody; then the routers that redirect here, and the
// state.
struct redirect_step {
    be32 from;
    uint16_t self, total;
    uint8_t redirecting;
    uint32_t state;
};

struct RedirectTest : ViewTest {
    void SetUp() override {
        for (const be32 id : {ROUTER_A, ROUTER_B, ROUTER_C})
            report(id, {{US, 100}, {host(2), 100}});
    }
    // The texts of the redirect lines that the steps bring.
    void follow(const std::vector<redirect_step> &steps, const std::vector<std::string> &lines = {}) {
        log_lines log;
        std::vector<std::string> told;
        for (size_t i = 0; i < steps.size(); i++) {
            const redirect_step &step = steps[i];
            wccp_sending_router *from = router(step.from);
            // As a view update leaves it: the rest goes to the other appliance.
            from->view_appliances[0].buckets_assigned = step.self;
            from->view_appliances[1].buckets_assigned = static_cast<uint16_t>(step.total - step.self);
            const wccp_assign_summary hash = {1, step.self, step.total}, mask = {};
            EXPECT_EQ(wccp_update_appliance_redirect_status(group, from, &hash, &mask), 0);
            EXPECT_EQ(group->redirecting_routers, step.redirecting) << "step " << i;
            EXPECT_EQ(group->state_flags & WCCP_STATE_MASK, step.state) << "step " << i;
            EXPECT_EQ(from->self_buckets, step.self);
            EXPECT_EQ(from->total_buckets, step.total);
            const std::string text = log.take(), begin = "WCCP GRP 51: redirect: ";
            if (const size_t at = text.find(begin); at != std::string::npos)
                told.push_back(
                    text.substr(at + begin.size(), text.find_first_of("\n<", at) - at - begin.size()));
        }
        if (!lines.empty()) {
            EXPECT_EQ(told, lines);
        }
    }
};

TEST_F(RedirectTest, TheFirstRouterMakesActiveAndTheLastDecides) {
    follow(
        {
            {ROUTER_A, 128, 256, 1, WCCP_STATE_ACTIVE},
            {ROUTER_A, 100, 256, 1, WCCP_STATE_ACTIVE},
            {ROUTER_B, 128, 256, 2, WCCP_STATE_ACTIVE},
            {ROUTER_A, 0, 256, 1, WCCP_STATE_ACTIVE},
            {ROUTER_A, 0, 200, 1, WCCP_STATE_ACTIVE},
            {ROUTER_B, 0, 256, 0, WCCP_STATE_BACKUP}, // it assigns elsewhere itself
            {ROUTER_B, 256, 256, 1, WCCP_STATE_ACTIVE},
            {ROUTER_B, 0, 0, 0, WCCP_STATE_BACKUP}, // A still assigns elsewhere
            {ROUTER_A, 0, 0, 0, WCCP_STATE_INIT},   // nobody does any more
        },
        {
            "first router to self (router id 10.0.0.201 )",
            "last router stopped redirecting to self. (router id 10.0.0.202)",
            "first router to self (router id 10.0.0.202 )",
            "this rtr (id 10.0.0.202) does not redirect. but another router does",
            "no routers redirecting to group (router id 10.0.0.201)",
        });
    EXPECT_EQ(group->transitions, 4u);
}

TEST_F(RedirectTest, TheOnlyRedirectingRouterStops) {
    follow(
        {
            {ROUTER_A, 256, 256, 1, WCCP_STATE_ACTIVE},
            {ROUTER_B, 256, 256, 2, WCCP_STATE_ACTIVE},
            {ROUTER_B, 0, 0, 1, WCCP_STATE_ACTIVE},
            {ROUTER_A, 0, 0, 0, WCCP_STATE_INIT},
        },
        {
            "first router to self (router id 10.0.0.201 )",
            "rtr does not redirect. no redirecting routers (router id 10.0.0.201)",
        });
}

TEST_F(RedirectTest, EverythingElsewhereFromTheStartIsBackup) {
    follow(
        {
            {ROUTER_A, 0, 256, 0, WCCP_STATE_BACKUP},
            {ROUTER_B, 0, 256, 0, WCCP_STATE_BACKUP},
            {ROUTER_A, 0, 0, 0, WCCP_STATE_BACKUP},
            {ROUTER_C, 0, 64, 0, WCCP_STATE_BACKUP},
            {ROUTER_B, 0, 0, 0, WCCP_STATE_BACKUP},
            {ROUTER_C, 0, 0, 0, WCCP_STATE_INIT},
        },
        {
            "router id 10.0.0.201 is redirecting to other  appliance(s).",
            "no routers redirecting to group (router id 10.0.0.203)",
        });
    EXPECT_EQ(group->transitions, 1u);
}

TEST_F(RedirectTest, NothingTakenFromAnEmptyCount) {
    group->redirecting_routers = 0; // as a start of the group leaves it
    router(ROUTER_A)->self_buckets = 9;
    router(ROUTER_A)->total_buckets = 9;
    follow({{ROUTER_A, 0, 256, 0, WCCP_STATE_BACKUP}});
    router(ROUTER_A)->self_buckets = 9;
    follow({{ROUTER_A, 0, 0, 0, WCCP_STATE_INIT}});
}

TEST_F(RedirectTest, AMapWinsAndTheSameAgainCountsNothing) {
    wccp_sending_router *a = router(ROUTER_A);
    const wccp_assign_summary hash = {1, 0, 0}, mask = {1, 8, 16};
    for (int round = 0; round < 2; round++) {
        EXPECT_EQ(wccp_update_appliance_redirect_status(group, a, &hash, &mask), 0);
        EXPECT_EQ(a->self_buckets, 8);
        EXPECT_EQ(a->total_buckets, 16);
        EXPECT_EQ(group->alarm_assign_sched, 1u);
    }
    EXPECT_EQ(group->redirecting_routers, 1);
}

} // namespace
