// Groups as configuration adds, changes, starts, stops and asks after them, on a real interface whose other
// end is in a namespace of its own. Whatever a test does, the tables agree with each other at its end.

#include "engine/wccp_config.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <new>
#include <set>
#include <string>
#include <thread>

#include "engine/cthread.h"
#include "engine/wccp_host.h"
#include "engine/wccp_link_mgr.h"
#include "engine/wccp_network.h"
#include "runtime/common.h"
#include "tests/support/peer_network.h"

namespace {

be32 ipa(const std::string &text) {
    return from_raw_word(address_word(text));
}

void tables_agree() {
    uint32_t slots = 0, listed = 0, on_interfaces = 0;
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id++)
        if (wccp_g.groups[id]) {
            slots++;
            EXPECT_EQ(wccp_g.groups[id]->id, id);
        }
    for (wccp_service_group **link = &wccp_g.group_list; *link; link = &(*link)->next) {
        listed++;
        EXPECT_EQ((*link)->prev_link, link);
        EXPECT_EQ(wccp_g.groups[(*link)->id], *link);
    }
    for (uint32_t i = 0; i < wccp_g.if_count; i++)
        for (wccp_service_group **link = &wccp_g.interfaces[i].groups; *link; link = &(*link)->if_next) {
            on_interfaces++;
            EXPECT_EQ((*link)->if_prev_link, link);
            EXPECT_EQ((*link)->interfaces[0], &wccp_g.interfaces[i]);
        }
    EXPECT_EQ(slots, wccp_g.group_count);
    EXPECT_EQ(listed, wccp_g.group_count);
    EXPECT_EQ(on_interfaces, wccp_g.group_count);
}

bool wait_for_link(const char *name, uint32_t wanted) {
    for (int i = 0; i < 300; i++) {
        if (wccp_get_if_status(name) == wanted)
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

class Config : public testing::Test {
protected:
    void SetUp() override {
        wccpd_exiting = 0;
        new (&wccp_g) wccp_global{};
        wccp_g.mcast_ttl = 5;
        wccp_init_network();
        peer.link("wan0", "10.1.0.1/24", "rt0", "10.1.0.2/24");
        peer.link("wan1", "", "rt1", "10.2.0.2/24");
        ASSERT_TRUE(wait_for_link("wan0", 1) && wait_for_link("wan1", 1));
        router = peer.udp_socket("10.1.0.2", 2048);
    }
    void TearDown() override {
        tables_agree();
        wccp_del_all_groups();
        EXPECT_EQ(wccp_g.group_count, 0u);
        EXPECT_EQ(wccp_g.group_list, nullptr);
        EXPECT_EQ(wccp_g.stat_allocs, wccp_g.stat_frees);
        cthread_cancel_all();
        for (wccp_interface &interface : wccp_g.interfaces)
            wccp_close_sockets(&interface);
        close(router);
        run_command("ip link del wan0");
        run_command("ip link del wan1");
    }

    static wccp_grp_config config(uint8_t id, const char *interface = "wan0") {
        wccp_grp_config out = {};
        out.group_id = id;
        out.admin = WCCP_ADMIN_UP;
        out.weight = 100;
        out.fwd_method = WCCP_METHOD_GRE;
        out.assign_method = WCCP_ASSIGN_HASH;
        out.compatibility = WCCP_COMPAT_IOS;
        out.interface_set = 1;
        strlcpy(out.interface, interface, sizeof out.interface);
        out.routers[out.router_count++] = ipa("10.1.0.2");
        return out;
    }
    static wccp_service_group *add(const wccp_grp_config &with) {
        EXPECT_EQ(wccp_add_group(&with), 0);
        return wccp_find_group(with.group_id);
    }
    static int modify(uint8_t id, uint32_t flags, void (*fill)(wccp_grp_config *) = nullptr) {
        wccp_grp_config update = {};
        update.group_id = id;
        update.config_flags = flags;
        if (fill)
            fill(&update);
        return wccp_modify_grp(&update);
    }
    static wccp_sending_router *add_router(wccp_service_group *group, const std::string &id) {
        auto *record = static_cast<wccp_sending_router *>(wccp_calloc(1, sizeof(wccp_sending_router)));
        record->router_id = ipa(id);
        list_push_head(&group->sending_routers, record);
        group->sending_router_count++;
        return record;
    }
    static void add_appliance(wccp_service_group *group, const std::string &address, uint16_t weight) {
        auto *record = static_cast<wccp_view_appliance *>(wccp_calloc(1, sizeof(wccp_view_appliance)));
        record->ipa = ipa(address);
        record->weight = weight;
        list_push_head(&group->appliance_view, record);
        group->appliance_view_count++;
    }
    static void make_active(wccp_service_group *group) {
        group->state_flags = (group->state_flags & ~WCCP_STATE_MASK) | WCCP_STATE_ACTIVE;
    }

    peer_network peer;
    int router = -1;
};

TEST_F(Config, AddressesAreSortedUntilTheFirstMulticastOne) {
    struct {
        std::vector<const char *> given, unicast;
        const char *multicast;
    } cases[] = {
        {{"10.0.0.1", "224.0.0.5", "10.0.0.2"}, {"10.0.0.1"}, "224.0.0.5"},
        {{"239.255.255.255", "10.0.0.1"}, {}, "239.255.255.255"},
        {{"223.255.255.255", "240.0.0.1", "10.0.0.3"}, {"223.255.255.255", "240.0.0.1", "10.0.0.3"}, nullptr},
        {{}, {}, nullptr},
    };
    uint8_t id = 0;
    for (const auto &one : cases) {
        wccp_grp_config with = config(id++);
        with.router_count = 0;
        for (const char *address : one.given)
            with.routers[with.router_count++] = ipa(address);
        const wccp_service_group *group = add(with);
        ASSERT_NE(group, nullptr);
        ASSERT_EQ(group->ucast_router_count, one.unicast.size());
        for (size_t i = 0; i < one.unicast.size(); i++)
            EXPECT_EQ(group->ucast_routers[i], ipa(one.unicast[i]));
        EXPECT_EQ(group->mcast_configured, one.multicast ? 1u : 0u);
        EXPECT_EQ(group->mcast_ipa, one.multicast ? ipa(one.multicast) : be32{});
    }
    wccp_grp_config full = config(id);
    full.router_count = 65535; // more than there is room for
    for (be32 &address : full.routers)
        address = ipa("10.0.0.7");
    EXPECT_EQ(add(full)->ucast_router_count, 32);
}

TEST_F(Config, ARecordIsTakenOverFieldByField) {
    wccp_grp_config with = config(61);
    with.priority = 7;
    with.protocol = 6;
    memcpy(with.password, "12345678", 8);
    with.hash_src_ip = 1;
    with.hash_dst_ip = 2; // only 1 counts
    with.hash_dst_port = 1;
    with.mask_src_ip = 0xf0000001;
    with.mask_dst_port = 0x0003;
    with.force_l2_return = 1;
    with.compatibility = 3;
    const wccp_service_group *group = add(with);
    EXPECT_EQ(group->priority, 7);
    EXPECT_EQ(group->protocol, 6);
    EXPECT_EQ(group->security_option, 1u);
    EXPECT_EQ(memcmp(group->password, "12345678", 8), 0);
    EXPECT_EQ(group->service_flags, 0x9u);
    EXPECT_EQ(group->mask_bits, 7u);
    EXPECT_EQ(group->force_l2_return, 1u);
    EXPECT_EQ(group->compat_mode, 1u) << "a value out of range becomes 1";
    EXPECT_EQ(group->appliance_ipa, ipa("10.1.0.1"));
    EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
    EXPECT_EQ(group->hia_timer.countdown, 1u);
    EXPECT_EQ(group->hia_timer.period, 10u);
    EXPECT_EQ(group->monitor_timer.countdown, 5u);
    EXPECT_EQ(wccp_find_group(61 + 256), group);

    wccp_grp_config other = config(62);
    other.compatibility = WCCP_COMPAT_NEXUS;
    EXPECT_EQ(add(other)->security_option, 0u);
    EXPECT_EQ(wccp_g.group_list->id, 62) << "newest first";
    EXPECT_EQ(wccp_find_group(62)->compat_mode, 2u);
}

TEST_F(Config, WhatCannotBeAddedChangesNothing) {
    EXPECT_EQ(wccp_add_group(nullptr), 1);
    const wccp_grp_config with = config(61);
    wccp_service_group *group = add(with);
    EXPECT_EQ(wccp_add_group(&with), 1);
    EXPECT_EQ(wccp_find_group(61), group);
    EXPECT_EQ(wccp_g.group_count, 1u);
    EXPECT_EQ(wccp_del_group(60), 1);
    wccp_grp_config unterminated = config(60);
    memset(unterminated.interface, 'x', sizeof unterminated.interface);
    EXPECT_EQ(wccp_add_group(&unterminated), 0);
    EXPECT_STREQ(wccp_find_group(60)->interfaces[0]->name, "xxxxxxxxxxxxxxx");
}

TEST_F(Config, AMulticastGroupWaitsForAnAddress) {
    wccp_grp_config with = config(61, "wan1");
    with.routers[0] = ipa("224.0.1.5");
    EXPECT_EQ(wccp_add_group(&with), 1);
    const wccp_service_group *group = wccp_find_group(61);
    ASSERT_NE(group, nullptr) << "it stays";
    EXPECT_EQ(group->state_flags, 0u) << "not started";
    wccp_grp_info info = {};
    EXPECT_EQ(wccp_get_grp_info(61, &info), 0);
    EXPECT_STREQ(info.oper, "not-set");

    run_command("ip addr add 10.2.0.1/24 dev wan1");
    wccp_process_if_ipa_update("wan1");
    EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
    EXPECT_EQ(group->hia_timer.active, 1);
    EXPECT_EQ(group->appliance_ipa, ipa("10.2.0.1"));
    EXPECT_EQ(group->interfaces[0]->mcast_bound, 1u);
    run_command("ip maddr show dev wan1 | grep -q 224.0.1.5");
}

TEST_F(Config, AGroupStartsAsFarAsItCan) {
    // Enabled, on an interface that isn't ready: the connectivity alarm alone runs.
    const wccp_service_group *waiting = add(config(10, "wan1"));
    EXPECT_EQ(waiting->hia_timer.active, 0);
    EXPECT_EQ(waiting->monitor_timer.active, 0);
    EXPECT_EQ(waiting->router_alarm_timer.active, 1);
    // Disabled, or nothing said: no timer runs.
    for (const uint32_t admin : {WCCP_ADMIN_DOWN + 0u, 0u}) {
        wccp_grp_config with = config(static_cast<uint8_t>(11 + admin));
        with.admin = admin;
        const wccp_service_group *group = add(with);
        EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
        EXPECT_EQ(group->hia_timer.active + group->router_alarm_timer.active, 0);
        EXPECT_EQ(modify(group->id, WCCP_CFG_ADMIN, [](wccp_grp_config *c) { c->admin = WCCP_ADMIN_UP; }), 0);
        EXPECT_EQ(group->hia_timer.active, 1);
        EXPECT_EQ(group->router_alarm_timer.active, 1);
    }
}

TEST_F(Config, DisablingStopsOnceAndEnablingStartsOnce) {
    wccp_service_group *group = add(config(61));
    const auto up = [](wccp_grp_config *c) { c->admin = WCCP_ADMIN_UP; };
    const auto down = [](wccp_grp_config *c) { c->admin = 7; };
    group->change_number = 5;
    EXPECT_EQ(modify(61, WCCP_CFG_ADMIN, up), 0);
    EXPECT_EQ(group->change_number, 5u) << "it ran already";
    EXPECT_EQ(modify(61, WCCP_CFG_ADMIN, down), 0);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_DOWN);
    EXPECT_EQ(group->hia_timer.active, 0);
    EXPECT_EQ(group->change_number, 0u);
    group->change_number = 5;
    EXPECT_EQ(modify(61, WCCP_CFG_ADMIN, down), 0);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_DOWN);
    EXPECT_EQ(group->change_number, 5u) << "nothing was done the second time";
    EXPECT_EQ(modify(61, WCCP_CFG_ADMIN, up), 0);
    EXPECT_EQ(group->change_number, 0u);
    EXPECT_EQ(modify(99, WCCP_CFG_ADMIN, up), 0) << "a group that isn't there is no failure here";
    EXPECT_EQ(modify(99, WCCP_CFG_ADMIN, down), 0);
}

TEST_F(Config, EachUpdateChangesItsOneField) {
    const wccp_service_group *group = add(config(61));
    const auto fill = [](wccp_grp_config *c) {
        c->weight = 7;
        memcpy(c->password, "secret", 6);
        c->fwd_method = 3;
        c->force_l2_return = 1;
        c->assign_method = 2;
        c->hash_src_ip = c->hash_dst_ip = c->hash_src_port = c->hash_dst_port = 1;
        c->mask_src_ip = 0x3;
        c->mask_dst_ip = 0x7;
        c->mask_src_port = 0xf;
        c->mask_dst_port = 0x1f;
        c->compatibility = 0;
    };
    const struct {
        uint32_t flag;
        uint32_t (*read)(const wccp_service_group *);
        uint32_t before, after;
    } fields[] = {
        {WCCP_CFG_WEIGHT, [](const wccp_service_group *g) { return uint32_t{g->weight}; }, 100, 7},
        {WCCP_CFG_PASSWORD, [](const wccp_service_group *g) { return g->security_option; }, 0, 1},
        {WCCP_CFG_FWD_METHOD, [](const wccp_service_group *g) { return g->cfg_fwd_method; }, 1, 3},
        {WCCP_CFG_FORCE_L2_RETURN, [](const wccp_service_group *g) { return g->force_l2_return; }, 0, 1},
        {WCCP_CFG_ASSIGN_METHOD, [](const wccp_service_group *g) { return g->cfg_assign_method; }, 1, 2},
        {WCCP_CFG_HASH_SRC_IP, [](const wccp_service_group *g) { return g->service_flags; }, 0, 1},
        {WCCP_CFG_HASH_DST_IP, [](const wccp_service_group *g) { return g->service_flags; }, 1, 3},
        {WCCP_CFG_HASH_SRC_PORT, [](const wccp_service_group *g) { return g->service_flags; }, 3, 7},
        {WCCP_CFG_HASH_DST_PORT, [](const wccp_service_group *g) { return g->service_flags; }, 7, 15},
        {WCCP_CFG_MASK_SRC_IP, [](const wccp_service_group *g) { return g->mask_bits; }, 0, 2},
        {WCCP_CFG_MASK_DST_IP, [](const wccp_service_group *g) { return g->mask_bits; }, 2, 5},
        {WCCP_CFG_MASK_SRC_PORT, [](const wccp_service_group *g) { return g->mask_bits; }, 5, 9},
        {WCCP_CFG_MASK_DST_PORT, [](const wccp_service_group *g) { return g->mask_bits; }, 9, 14},
        {WCCP_CFG_COMPATIBILITY, [](const wccp_service_group *g) { return g->compat_mode; }, 1, 0},
    };
    for (const auto &field : fields) {
        SCOPED_TRACE(field.flag);
        EXPECT_EQ(field.read(group), field.before);
        EXPECT_EQ(modify(61, field.flag, fill), 0);
        EXPECT_EQ(field.read(group), field.after);
        EXPECT_EQ(modify(99, field.flag, fill), 1);
    }
    EXPECT_EQ(memcmp(group->password, "secret\0\0", 8), 0);
    EXPECT_EQ(modify(61, WCCP_CFG_PASSWORD), 0);
    EXPECT_EQ(group->security_option, 0u);
    EXPECT_EQ(memcmp(group->password, "\0\0\0\0\0\0\0\0", 8), 0);
    EXPECT_EQ(modify(61, WCCP_CFG_HASH_DST_IP), 0);
    EXPECT_EQ(group->service_flags, 0xdu);
}

TEST_F(Config, OfSeveralFlagsTheFirstInOrderActs) {
    const wccp_service_group *group = add(config(61));
    const auto fill = [](wccp_grp_config *c) {
        c->admin = WCCP_ADMIN_UP;
        c->weight = 7;
        c->hash_src_port = c->hash_dst_port = 1;
        c->mask_src_port = c->mask_dst_port = 1;
        c->compatibility = 2;
    };
    EXPECT_EQ(modify(61, WCCP_CFG_ADMIN | WCCP_CFG_WEIGHT, fill), 0);
    EXPECT_EQ(group->weight, 100);
    EXPECT_EQ(modify(61, WCCP_CFG_COMPATIBILITY | WCCP_CFG_HASH_SRC_PORT | WCCP_CFG_HASH_DST_PORT, fill), 0);
    EXPECT_EQ(group->service_flags, 4u);
    EXPECT_EQ(modify(61, WCCP_CFG_COMPATIBILITY | WCCP_CFG_MASK_SRC_PORT | WCCP_CFG_MASK_DST_PORT, fill), 0);
    EXPECT_EQ(group->mask_bits, 1u);
    EXPECT_EQ(group->mask_src_port, 1);
    EXPECT_EQ(group->compat_mode, 1u);
    EXPECT_EQ(modify(99, WCCP_CFG_ROUTERS, fill), 0);
    EXPECT_EQ(modify(99, 0, fill), 0);
    EXPECT_EQ(wccp_modify_grp(nullptr), 1);
}

TEST_F(Config, AStopSaysFarewellAndForgetsAllButTheConfiguration) {
    wccp_grp_config with = config(61);
    with.mask_src_ip = 0xf;
    wccp_service_group *group = add(with);
    make_active(group);
    group->fwd_method = group->assign_method = group->ret_method = 1;
    group->state_flags |= WCCP_CAPABILITIES_SET;
    group->designated = 1;
    group->change_number = 9;
    group->dsg_key_change = 4;
    group->pending_acks = 2;
    group->redirecting_routers = 1;
    group->dsg_appliances[31].weight = 5;
    group->assign_timer.active = 1;
    group->rx_icus = 12;
    add_router(group, "10.1.0.2")->flags = WCCP_RTR_TWO_WAY;
    add_appliance(group, "10.1.0.1", 100);

    wccp_stop_service_group(group);
    const datagram farewell = receive_datagram(router);
    ASSERT_GE(farewell.bytes.size(), 20u);
    EXPECT_EQ(farewell.bytes[3], 10) << "a Here-I-Am";
    const std::vector<uint8_t> shutdown = {0, 15, 0, 8, 0, 1, 0, 4, 10, 1, 0, 1};
    EXPECT_EQ(std::vector<uint8_t>(farewell.bytes.end() - 12, farewell.bytes.end()), shutdown);

    EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
    EXPECT_EQ(group->hia_timer.active + group->assign_timer.active + group->monitor_timer.active, 0);
    EXPECT_EQ(group->fwd_method + group->assign_method + group->ret_method + group->designated, 0u);
    EXPECT_EQ(group->change_number + group->dsg_key_change + group->pending_acks + group->redirecting_routers,
              0u);
    EXPECT_EQ(group->dsg_appliances[31].weight, 0);
    EXPECT_EQ(group->sending_routers, nullptr);
    EXPECT_EQ(group->sending_router_count + group->appliance_view_count, 0u);
    EXPECT_EQ(group->rx_icus, 12u);
    EXPECT_EQ(group->weight, 100);
    EXPECT_EQ(group->mask_bits, 4u);
    EXPECT_EQ(group->router_alarm_timer.active, 1);
    EXPECT_EQ(group->router_alarm_timer.countdown, 60u);

    wccp_stop_service_group(group);
    EXPECT_TRUE(receive_datagram(router, 50).bytes.empty()) << "nothing to take back a second time";
    EXPECT_EQ(group->tx_here_i_am, 1u);
}

TEST_F(Config, ADeletedGroupSaysFarewellUnlessItIsInInit) {
    add(config(60));
    EXPECT_EQ(wccp_del_group(60), 0);
    EXPECT_TRUE(receive_datagram(router, 50).bytes.empty());

    for (const uint8_t id : {uint8_t{5}, uint8_t{3}, uint8_t{255}, uint8_t{0}})
        make_active(add(config(id)));
    EXPECT_EQ(wccp_del_group(3 + 256), 0);
    tables_agree();
    EXPECT_EQ(receive_datagram(router).bytes.at(8 + 8 + 5), 3) << "its service id";
    EXPECT_EQ(wccp_del_all_groups(), 0);
    for (const uint8_t id : {uint8_t{0}, uint8_t{5}, uint8_t{255}})
        EXPECT_EQ(receive_datagram(router).bytes.at(8 + 8 + 5), id) << "by rising id";
}

TEST_F(Config, StoppingAllLeavesTheDisabledAlone) {
    wccp_service_group *up = add(config(1)), *down = add(config(2));
    down->admin_state = WCCP_ADMIN_DOWN;
    up->change_number = down->change_number = 3;
    EXPECT_EQ(wccp_stop_all_service_groups(), 0);
    EXPECT_EQ(up->change_number, 0u);
    EXPECT_EQ(up->admin_state, WCCP_ADMIN_UP);
    EXPECT_EQ(down->change_number, 3u);

    wccp_interface *wan = up->interfaces[0];
    wan->ready_flags = WCCP_LINK_READY;
    wccp_start_service_groups_by_interface(wan);
    EXPECT_EQ(up->hia_timer.active, 0);
    wan->ready_flags = WCCP_ALL_READY;
    wccp_start_service_groups_by_interface(wan);
    EXPECT_EQ(up->hia_timer.active, 1);
    EXPECT_EQ(wan->start_count, 2u);
    wccp_stop_service_groups_by_interface(wan);
    EXPECT_EQ(up->hia_timer.active, 0);
    EXPECT_EQ(down->change_number, 3u);
    EXPECT_EQ(wan->stop_count, 1u);
}

TEST_F(Config, AllIdsAtOnce) {
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id++)
        add(config(static_cast<uint8_t>(id)));
    EXPECT_EQ(wccp_g.group_count, 256u);
    tables_agree();
    wccp_grp_list list = {};
    EXPECT_EQ(wccp_get_grp_list(&list), 0);
    EXPECT_EQ(list.count, 256u);
    EXPECT_EQ(list.ids[0], 0);
    EXPECT_EQ(list.ids[255], 255);
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id += 2)
        EXPECT_EQ(wccp_del_group(static_cast<int>(id)), 0);
    EXPECT_EQ(wccp_get_grp_list(&list), 0);
    EXPECT_EQ(list.count, 128u);
    EXPECT_EQ(list.ids[127], 255);
}

TEST_F(Config, AGroupTellsHowItIs) {
    wccp_service_group *group = add(config(61));
    wccp_g.seconds = 100;
    group->state_time = 40;
    wccp_grp_info info = {};
    EXPECT_EQ(wccp_get_grp_info(61, nullptr), 1);
    EXPECT_EQ(wccp_get_grp_info(62, &info), 1);
    const struct {
        uint32_t flags, designated;
        const char *oper;
        uint32_t uptime;
    } cases[] = {{WCCP_STATE_INIT, 0, "INIT", 0},
                 {WCCP_STATE_ACTIVE | WCCP_CAPABILITIES_SET, 1, "ACTIVE, DESIGNATED", 60},
                 {WCCP_STATE_BACKUP, 0, "BACKUP", 60},
                 {0, 1, "not-set, DESIGNATED", 0},
                 {6, 0, "uknown", 60},
                 {3, 0, "unknown", 60}};
    for (const auto &one : cases) {
        group->state_flags = one.flags;
        group->designated = one.designated;
        EXPECT_EQ(wccp_get_grp_info(61, &info), 0);
        EXPECT_STREQ(info.oper, one.oper);
        EXPECT_EQ(info.uptime, one.uptime);
    }
    EXPECT_EQ(info.appliance_ipa, ipa("10.1.0.1"));
    group->state_flags = WCCP_STATE_INIT;
}

TEST_F(Config, RoutersAreNumberedFromOneInListOrder) {
    wccp_service_group *group = add(config(61));
    wccp_g.seconds = 50;
    add_router(group, "10.1.0.8")->flags = WCCP_RTR_ONE_WAY;
    wccp_sending_router *first = add_router(group, "10.1.0.9");
    first->flags = WCCP_RTR_TWO_WAY;
    first->state_time = 20;
    first->view_appliances[first->view_appliance_count++].ipa = ipa("10.1.0.1");
    wccp_rtr_view_appliance *loaded = &first->view_appliances[first->view_appliance_count++];
    loaded->ipa = ipa("10.1.0.4");
    loaded->buckets_assigned = 2;
    loaded->buckets_total = 3;

    wccp_grp_router_info info = {};
    info.router_num = 1;
    EXPECT_EQ(wccp_get_grp_router_info(61, &info), 0);
    EXPECT_EQ(info.router_id, ipa("10.1.0.9"));
    EXPECT_EQ(info.conn_time, 30u);
    EXPECT_STREQ(info.state, "TWO-WAY connected");
    EXPECT_STREQ(info.fwd, "not-set");
    EXPECT_STREQ(info.assign, "not-set");
    group->state_flags |= WCCP_CAPABILITIES_SET;
    group->fwd_method = 2;
    group->ret_method = 0;
    group->assign_method = 9;
    info.router_num = 2;
    EXPECT_EQ(wccp_get_grp_router_info(61, &info), 0);
    EXPECT_STREQ(info.state, "ONE-WAY connected");
    EXPECT_STREQ(info.fwd, "L2");
    EXPECT_STREQ(info.ret, "not set");
    EXPECT_STREQ(info.assign, "unknown");
    for (const uint32_t nobody : {0u, 3u}) {
        info.router_num = nobody;
        info.conn_time = 4711;
        EXPECT_EQ(wccp_get_grp_router_info(61, &info), 0);
        EXPECT_EQ(info.conn_time, 4711u) << "the record is as the caller left it";
        EXPECT_EQ(wccp_find_router_instance(61, nobody), nullptr);
    }
    EXPECT_EQ(wccp_get_grp_router_info(60, &info), 1);

    wccp_router_list routers = {.group_id = 61, .count = 0, .router_nums = {}};
    EXPECT_EQ(wccp_get_router_list(&routers), 0);
    EXPECT_EQ(routers.count, 2u);
    EXPECT_EQ(routers.router_nums[1], 2u);
    routers.group_id = 60;
    EXPECT_EQ(wccp_get_router_list(&routers), 1);

    wccp_router_appliance_list appliances = {.group_id = 61, .router_num = 1, .count = 0, .ipa = {}};
    EXPECT_EQ(wccp_get_router_appliance_list(&appliances), 0);
    EXPECT_EQ(appliances.count, 2u);
    EXPECT_EQ(appliances.ipa[1], ipa("10.1.0.4"));
    appliances.router_num = 3;
    EXPECT_EQ(wccp_get_router_appliance_list(&appliances), 1);

    wccp_router_appliance_info load = {
        .group_id = 61, .router_num = 1, .ipa = ipa("10.1.0.4"), .load_percent = 0};
    EXPECT_EQ(wccp_get_router_appliance_info(&load), 0);
    EXPECT_EQ(load.load_percent, 66u);
    load.ipa = ipa("10.1.0.1");
    EXPECT_EQ(wccp_get_router_appliance_info(&load), 0);
    EXPECT_EQ(load.load_percent, 0u) << "no total";
    load.ipa = ipa("10.1.0.5");
    EXPECT_EQ(wccp_get_router_appliance_info(&load), 1);
    load.router_num = 2;
    load.ipa = ipa("10.1.0.1");
    EXPECT_EQ(wccp_get_router_appliance_info(&load), 1);
}

TEST_F(Config, AppliancesAreNumberedFromOne) {
    wccp_service_group *group = add(config(61));
    add_appliance(group, "10.1.0.4", 40);
    add_appliance(group, "10.1.0.1", 10);
    wccp_grp_appliance_info info = {.appliance_num = 2, .ipa = {}, .weight = 0};
    EXPECT_EQ(wccp_get_grp_appliance_info(61, &info), 0);
    EXPECT_EQ(info.ipa, ipa("10.1.0.4"));
    EXPECT_EQ(info.weight, 40u);
    info.appliance_num = 3;
    EXPECT_EQ(wccp_get_grp_appliance_info(61, &info), 0);
    EXPECT_EQ(wccp_get_grp_appliance_info(60, &info), 0);
    EXPECT_EQ(info.weight, 40u);
    EXPECT_EQ(wccp_get_grp_appliance_info(61, nullptr), 1);
}

} // namespace
