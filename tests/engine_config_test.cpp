// Groups as configuration adds, changes, starts, stops and queries them, on a real interface whose other end
// is in another namespace. At the end of each test the tables must be consistent.

#include "engine/wccp_query.h"

#include <set>

#include "engine/wccp_router_utils.h"
#include "engine/wccp_view_utils.h"
#include "tests/support/engine_fixture.h"

namespace {

using bytes = std::vector<uint8_t>;
using numbers = std::vector<uint32_t>;

// All three tables have the same groups, with the right links.
void tables_agree() {
    std::multiset<const wccp_service_group *> slots, listed, on_interfaces;
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id++)
        if (wccp_g.groups[id] && wccp_g.groups[id]->id == id)
            slots.insert(wccp_g.groups[id]);
    for (wccp_service_group **link = &wccp_g.group_list; *link; link = &(*link)->next)
        if ((*link)->prev_link == link)
            listed.insert(*link);
    for (wccp_interface &each : wccp_g.interfaces)
        for (wccp_service_group **link = &each.groups; *link; link = &(*link)->if_next)
            if ((*link)->if_prev_link == link && (*link)->interfaces[0] == &each)
                on_interfaces.insert(*link);
    EXPECT_TRUE(slots.size() == wccp_g.group_count && listed == slots && on_interfaces == slots);
}

struct Config : testing::Test {
    void SetUp() override { engine.router_socket("10.0.0.2"); }
    void TearDown() override { tables_agree(); }

    static wccp_grp_config config(uint8_t id) { return engine_fixture::group_config(id, {"10.0.0.2"}); }
    static int modify(uint8_t id, uint32_t flags, wccp_grp_config update = {}) {
        update.group_id = id;
        update.config_flags = flags;
        return wccp_modify_grp(&update);
    }
    // By L2 and hash.
    static wccp_sending_router *add_router(wccp_service_group *group) {
        const wccp_rtr_capabilities offered = {WCCP_METHOD_L2, WCCP_ASSIGN_HASH, WCCP_METHOD_L2};
        return wccp_create_sending_router(group, ipa("10.0.0.2"), &offered, &offered);
    }
    engine_fixture engine;
};

TEST_F(Config, TheFirstMulticastAddressEndsTheRouterList) {
    // The number of unicast routers, from the first.
    const std::tuple<std::vector<std::string>, size_t, const char *> cases[] = {
        {{"10.0.0.1", "224.0.0.5", "10.0.0.2"}, 1, "224.0.0.5"},
        {{"239.255.255.255", "10.0.0.1"}, 0, "239.255.255.255"},
        {{"223.255.255.255", "240.0.0.1", "10.0.0.3"}, 3, "0.0.0.0"},
        {{}, 0, "0.0.0.0"},
    };
    uint8_t id = 0;
    for (const auto &[given, unicast, multicast] : cases) {
        const wccp_service_group *group = engine.add_group(engine_fixture::group_config(id++, given));
        ASSERT_EQ(group->ucast_router_count, unicast);
        for (size_t i = 0; i < unicast; i++)
            EXPECT_EQ(group->ucast_routers[i], ipa(given[i]));
        EXPECT_EQ(std::pair(group->mcast_ipa, group->mcast_configured != 0),
                  std::pair(ipa(multicast), multicast != std::string("0.0.0.0")));
    }
    wccp_grp_config full = config(id);
    full.router_count = 65535; // more than there is room for
    EXPECT_EQ(engine.add_group(full)->ucast_router_count, 32);
}

TEST_F(Config, ARecordIsCopiedFieldByField) {
    wccp_grp_config with = config(61);
    memcpy(with.password, "12345678", 8);
    with.hash_src_ip = with.hash_dst_port = 1;
    with.hash_dst_ip = 2; // only 1 counts
    with.mask_src_ip = 0xf0000001;
    with.mask_dst_port = 0x0003;
    with.compatibility = 3; // invalid: 1 is used
    const wccp_service_group *group = engine.add_group(with);
    EXPECT_EQ((numbers{group->service_flags, group->mask_bits, group->compat_mode, group->state_flags,
                       group->hia_timer.countdown, group->hia_timer.period, group->monitor_timer.countdown}),
              (numbers{0x9, 7, 1, WCCP_STATE_INIT, 1, 10, 5}));
    EXPECT_EQ(memcmp(group->password, "12345678", 8), 0);
    EXPECT_EQ(group->appliance_ipa, ipa("10.0.0.100"));

    wccp_grp_config other = config(62);
    other.compatibility = WCCP_COMPAT_NEXUS;
    const wccp_service_group *second = engine.add_group(other);
    EXPECT_TRUE(second->security_option == 0 && second->compat_mode == 2);
    EXPECT_EQ(wccp_g.group_list, second) << "newest first";

    // A group that cannot be added changes nothing.
    EXPECT_EQ(wccp_add_group(nullptr) + wccp_add_group(&with) + wccp_del_group(60), 3);
    EXPECT_TRUE(wccp_find_group(61) == group && wccp_find_group(61 + 256) == group);
    memset(other.interface, 'x', sizeof other.interface); // not terminated
    other.group_id = 63;
    EXPECT_STREQ(engine.add_group(other)->interfaces[0]->name, "xxxxxxxxxxxxxxx");
}

TEST_F(Config, DisablingStopsOnceAndEnablingStartsOnce) {
    wccp_service_group *group = engine.add_group(config(61));
    const std::tuple<uint32_t, bool, uint32_t> steps[] = {
        {1, false, 1}, {7, true, 2}, {2, false, 2}, {1, true, 1}};
    for (const auto &[admin, changes, state] : steps) {
        group->change_number = 5;
        engine.set_admin(61, admin);
        EXPECT_EQ(std::tuple(group->admin_state, group->change_number, group->hia_timer.active),
                  std::tuple(state, changes ? 0 : 5, state == 1));
        engine.set_admin(99, admin); // a missing group is not a failure here
    }
    // Stopping all skips disabled groups.
    wccp_service_group *down = engine.add_group(config(2)), *unset = engine.add_group(config(3));
    down->admin_state = WCCP_ADMIN_DOWN;
    unset->admin_state = 0;
    group->change_number = down->change_number = unset->change_number = 3;
    EXPECT_EQ(wccp_stop_all_service_groups(), 0);
    engine.set_admin(3, 0); // disabled once more
    EXPECT_EQ((numbers{group->change_number, down->change_number, unset->change_number, group->admin_state,
                       unset->admin_state}),
              (numbers{0, 3, 3, WCCP_ADMIN_UP, 0}));
    // Without an address nothing starts.
    engine.interface->ready_flags = WCCP_LINK_READY;
    wccp_start_service_groups_by_interface(engine.interface);
    EXPECT_EQ(group->hia_timer.active, 0);
}

// tests/daemon_config_test.cpp has the update of each field.
TEST_F(Config, AnUpdateActsOnOneFlagOrIsRefused) {
    wccp_grp_config fill = {};
    fill.admin = WCCP_ADMIN_UP;
    fill.weight = 7;
    fill.hash_src_ip = fill.hash_dst_ip = 1;
    fill.mask_src_ip = 0x3;
    fill.mask_dst_port = 0x1f;
    memcpy(fill.password, "secret", 6);
    const wccp_service_group *group = engine.add_group(config(61));
    // Afterwards: weight, service flags, mask bits; and the refusal.
    const std::tuple<uint32_t, uint32_t, uint32_t, uint32_t, const char *> rows[] = {
        {WCCP_CFG_ADMIN | WCCP_CFG_WEIGHT, 100, 0, 0, ""}, // of several, the first in order acts
        {WCCP_CFG_WEIGHT | WCCP_CFG_COMPATIBILITY, 7, 0, 0, ""},
        {WCCP_CFG_HASH_SRC_IP | WCCP_CFG_HASH_DST_IP, 7, 0, 0, "wccp_set_hash: unknown config_flag 0x300"},
        {WCCP_CFG_HASH_DST_PORT | WCCP_CFG_COMPATIBILITY, 7, 0, 0, "unknown config_flag 0x880"},
        {WCCP_CFG_HASH_DST_IP, 7, 2, 0, ""},
        {WCCP_CFG_MASK_SRC_IP | WCCP_CFG_MASK_DST_IP, 7, 2, 0, "wccp_set_mask: unknown config_flag 0x3000"},
        {WCCP_CFG_MASK_DST_PORT | WCCP_CFG_ROUTERS, 7, 2, 0, "unknown config_flag 0x8001"},
        {WCCP_CFG_MASK_DST_PORT, 7, 2, 5, ""},
        {WCCP_CFG_MASK_SRC_IP, 7, 2, 7, ""},
        {WCCP_CFG_PASSWORD, 7, 2, 7, ""},
    };
    log_lines log;
    for (const auto &[flags, weight, service, bits, refusal] : rows) {
        SCOPED_TRACE(flags);
        log.take();
        EXPECT_EQ(modify(61, flags, fill), *refusal ? 1 : 0);
        EXPECT_EQ((numbers{group->weight, group->service_flags, group->mask_bits}),
                  (numbers{weight, service, bits}));
        EXPECT_TRUE(log.say(refusal));
    }
    for (uint32_t flag = WCCP_CFG_ADMIN; flag <= WCCP_CFG_MASK_DST_PORT; flag <<= 1) { // a missing group
        EXPECT_EQ(modify(99, flag, fill), flag == WCCP_CFG_ADMIN ? 0 : 1) << flag;
        EXPECT_TRUE(log.say("WCCP GRP 99 ")) << flag;
    }
    EXPECT_EQ(memcmp(group->password, "secret\0\0", 8), 0);
    EXPECT_EQ(modify(61, WCCP_CFG_PASSWORD), 0);
    EXPECT_TRUE(group->security_option == 0 && memcmp(group->password, "\0\0\0\0\0\0\0", 8) == 0);
    EXPECT_TRUE(modify(61, WCCP_CFG_HASH_DST_IP) == 0 && group->service_flags == 0);
    EXPECT_EQ(modify(99, WCCP_CFG_ROUTERS, fill) + modify(99, 0, fill), 0);
    EXPECT_EQ(wccp_modify_grp(nullptr), 1);
}

TEST_F(Config, AStopSendsAShutdownMessageAndKeepsTheConfiguration) {
    wccp_grp_config with = config(61);
    with.mask_src_ip = 0xf;
    wccp_service_group *group = engine.add_group(with);
    make_active(group);
    group->designated = group->redirecting_routers = group->assign_timer.active = 1;
    group->dsg_key_change = group->pending_acks = 9;
    group->dsg_appliances[31].weight = 5;
    group->rx_icus = 12;
    const wccp_rtr_view_appliance seen = {ipa("10.0.0.100"), 100, 0, 0, 0, {}};
    wccp_update_appliance_view(group, add_router(group), 1, &seen);
    group->router_alarm_timer.countdown = 7;

    wccp_stop_service_group(group);
    const bytes shutdown = engine.sent_to("10.0.0.2");
    ASSERT_GE(shutdown.size(), 20u);
    EXPECT_EQ(shutdown[3], 10) << "a Here-I-Am";
    EXPECT_EQ(bytes(shutdown.end() - 12, shutdown.end()), (bytes{0, 15, 0, 8, 0, 1, 0, 4, 10, 0, 0, 100}));
    EXPECT_EQ(
        (numbers{group->hia_timer.active, group->assign_timer.active, group->monitor_timer.active,
                 group->fwd_method, group->assign_method, group->ret_method, group->designated,
                 group->change_number, group->dsg_key_change, group->pending_acks, group->redirecting_routers,
                 group->dsg_appliances[31].weight, group->sending_router_count, group->appliance_view_count}),
        numbers(14, 0));
    EXPECT_EQ((numbers{group->state_flags, group->rx_icus, group->weight, group->mask_bits,
                       group->router_alarm_timer.active, group->router_alarm_timer.countdown}),
              (numbers{WCCP_STATE_INIT, 12, 100, 4, 1, 60}));
    wccp_stop_service_group(group);
    EXPECT_EQ(engine.sent_to("10.0.0.2"), bytes{}) << "nothing to withdraw a second time";
    EXPECT_EQ(group->tx_here_i_am, 1u);
}

TEST_F(Config, ADeletedGroupSendsAShutdownMessageUnlessItIsInInit) {
    for (const uint8_t id : bytes{5, 255, 7, 0, 3})
        engine.add_group(config(id));
    EXPECT_TRUE(wccp_del_group(7) == 0 && engine.sent_to("10.0.0.2").empty());
    tables_agree();
    wccp_grp_list list = {};
    EXPECT_TRUE(wccp_get_grp_list(&list) == 0 && list.count == 4 && list.ids[3] == 255);
    for (wccp_service_group *group = wccp_g.group_list; group; group = group->next)
        make_active(group);
    EXPECT_TRUE(wccp_del_group(3 + 256) == 0 && wccp_del_all_groups() == 0);
    for (const uint8_t id : bytes{3, 0, 5, 255})
        EXPECT_EQ(engine.sent_to("10.0.0.2").at(8 + 8 + 5), id) << "in ascending order of ids";
}

// What the tests of the monitoring tree cannot see of the queries.
TEST_F(Config, QueriesForUnknownValuesAndAbsentRecords) {
    wccp_service_group *group = engine.add_group(config(61));
    wccp_grp_info info = {};
    for (const auto &[flags, word] : {std::pair{6u, "uknown"}, {3u, "unknown"}}) {
        group->state_flags = flags;
        EXPECT_EQ(wccp_get_grp_info(61, &info), 0);
        EXPECT_STREQ(info.oper, word);
    }
    add_router(group);
    group->assign_method = 9;
    wccp_grp_router_info router = {};
    router.router_num = 1;
    EXPECT_EQ(wccp_get_grp_router_info(61, &router), 0);
    EXPECT_STREQ(router.assign, "unknown");
    for (const uint32_t nobody : {0u, 2u}) {
        router.router_num = nobody;
        router.conn_time = 4711;
        EXPECT_TRUE(wccp_get_grp_router_info(61, &router) == 0 && router.conn_time == 4711);
    }
    wccp_grp_appliance_info appliance = {.appliance_num = 1, .ipa = {}, .weight = 4711};
    EXPECT_EQ(wccp_get_grp_appliance_info(61, &appliance) + wccp_get_grp_appliance_info(60, &appliance), 0);
    EXPECT_TRUE(appliance.weight == 4711 && wccp_get_grp_router_info(60, &router) == 1);
}

} // namespace
