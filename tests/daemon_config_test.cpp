// The configuration applied to an engine that stands still: what a group is made of, what each change does,
// and what is said of values that make no sense.
#include "daemon/wccpd_config.h"

#include <map>
#include <vector>

#include "daemon/protocol_names.h"
#include "tests/support/daemon_engine.h"

namespace {

const std::string CONFIG = "/qv/wccpd/wccp/srv_grp/config/";
const std::string POLICIES = "/qv/wccpd/wccp/policy_grp/config/";

be32 address(uint32_t last_octet) {
    return to_be32(0x0a000000 | last_octet);
}

struct DaemonConfig : testing::Test {
    daemon_engine engine;

    static lc_status apply(binding_list &changes) { return wccpd_config_apply(changes.array); }
    static lc_status change(const std::string &name, uint32_t type, const std::string &text,
                            uint32_t flags = 0) {
        binding_list changes;
        changes.add(name, type, text, flags);
        return apply(changes);
    }
    static lc_status change_51(const std::string &node, uint32_t type, const std::string &text) {
        return change(CONFIG + "51/" + node, type, text);
    }
    static void delete_root(const std::string &id) {
        EXPECT_EQ(change(CONFIG + id, bn_type_uint8, "51", bn_flag_deleted), LC_OK);
    }
    // A group's root node and what it needs to find its interface.
    static binding_list &add_root(binding_list &list, const std::string &id) {
        return list.add(CONFIG + id, bn_type_uint8, "51")
            .add(CONFIG + id + "/interface", bn_type_str, "lan0");
    }
    static wccp_service_group *make(const std::string &id) {
        binding_list list;
        EXPECT_EQ(apply(add_root(list, id)), LC_OK);
        return wccp_find_group(atoi(id.c_str()));
    }
    int said(const std::string &line) { return engine.log.count(line); }
};

TEST_F(DaemonConfig, AGroupIsMadeOfItsWholeSubtree) {
    binding_list list;
    const std::string root = CONFIG + "51/";
    add_root(list, "51");
    // In an order of their own: places in the array say nothing.
    list.add(root + "router/2", bn_type_uint8, "2")
        .add(root + "router/2/ipaddr", bn_type_ipv4addr, "10.0.0.202")
        .add(root + "compatibility", bn_type_str, "nexus")
        .add(root + "admin", bn_type_str, "down")
        .add(root + "weight", bn_type_uint32, "65636") // 100 in 16 bits
        .add(root + "priority", bn_type_uint32, "496") // 240 in 8 bits
        .add(root + "protocol", bn_type_str, "tcp")
        .add(root + "password", bn_type_str, "twelve bytes")
        .add(root + "encap", bn_type_str, "l2")
        .add(root + "assign_method", bn_type_str, "mask")
        .add(root + "assign_detail", bn_type_str, "anything")
        .add(root + "force_l2_return", bn_type_bool, "true")
        .add(root + "hash_src_ip", bn_type_bool, "true")
        .add(root + "hash_dst_ip", bn_type_bool, "false")
        .add(root + "hash_src_port", bn_type_bool, "false")
        .add(root + "hash_dst_port", bn_type_bool, "true")
        .add(root + "mask_src_ip", bn_type_uint32, "5953")
        .add(root + "mask_dst_ip", bn_type_uint32, "1")
        .add(root + "mask_src_port", bn_type_uint16, "3")
        .add(root + "mask_dst_port", bn_type_uint16, "65535")
        .add(root + "router/1", bn_type_uint8, "1")
        .add(root + "router/1/ipaddr", bn_type_ipv4addr, "10.0.0.201");
    ASSERT_EQ(apply(list), LC_OK);
    const wccp_service_group *group = wccp_find_group(51);
    ASSERT_NE(group, nullptr);
    EXPECT_EQ(group->interfaces[0], engine.interface);
    EXPECT_EQ(group->ucast_router_count, 2);
    EXPECT_EQ(group->ucast_routers[0], address(201));
    EXPECT_EQ(group->ucast_routers[1], address(202));
    EXPECT_EQ(group->compat_mode, WCCP_COMPAT_NEXUS);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_DOWN);
    EXPECT_EQ(group->weight, 100);
    EXPECT_EQ(group->priority, 240);
    EXPECT_EQ(group->protocol, 6);
    EXPECT_EQ(memcmp(group->password, "twelve b", 8), 0);
    EXPECT_EQ(group->security_option, 1u);
    EXPECT_EQ(group->cfg_fwd_method, WCCP_METHOD_L2);
    EXPECT_EQ(group->cfg_assign_method, WCCP_ASSIGN_MASK);
    EXPECT_EQ(group->force_l2_return, 1u);
    EXPECT_EQ(group->service_flags & 0xf, 0x9u);
    EXPECT_EQ(group->mask_src_ip, 5953u);
    EXPECT_EQ(group->mask_dst_ip, 1u);
    EXPECT_EQ(group->mask_src_port, 3);
    EXPECT_EQ(group->mask_dst_port, 65535);
    EXPECT_EQ(said("WCCP config query group 51(51) - " + CONFIG + "51"), 1);
    EXPECT_EQ(said("WCCP config: set router ip to 10.0.0.202, position 1"), 1);
    EXPECT_EQ(said("WCCP config: set force l2 return to yes"), 1);
    EXPECT_EQ(said("WCCP config: set hash dst ip to no"), 1);
    EXPECT_EQ(said("WCCP config: set mask src ip to 0x1741"), 1);
    EXPECT_EQ(said("WCCP config: set compatibility mode to nexus(2)"), 1);
    EXPECT_EQ(said("WCCP config: set password"), 1);
    EXPECT_EQ(said("twelve"), 0);
    EXPECT_EQ(said("Created WCCP group 51"), 1);

    // The same number again is a failure that doesn't end the walk.
    binding_list again;
    add_root(again, "51");
    add_root(again, "52");
    EXPECT_EQ(apply(again), LC_OK);
    EXPECT_EQ(said("FAILED to create WCCP group 51"), 1);
    EXPECT_NE(wccp_find_group(52), nullptr);
}

TEST_F(DaemonConfig, ABareGroupStandsStill) {
    const wccp_service_group *group = make("51");
    ASSERT_NE(group, nullptr);
    EXPECT_EQ(group->admin_state, 0u);
    EXPECT_EQ(group->hia_timer.active, 0);
    EXPECT_EQ(group->ucast_router_count, 0);
    EXPECT_EQ(group->compat_mode, WCCP_COMPAT_IOS);
    EXPECT_EQ(said("<139>"), 0); // facility local1, level error
}

TEST_F(DaemonConfig, ProtocolsByNameAndNumber) {
    const struct {
        const char *text;
        int protocol; // 99: refused, what was there stays
    } cases[] = {
        {"tcp", 6},           {"6", 6},
        {"icmp", 1},          {"udp", 17},
        {"mpls", 137},        {"ipproto-138", 138},
        {"ipproto-254", 254}, {"raw", 255},
        {"255", 255},         {"gre", 47},
        {"ospf", 89},         {"sctp", 132},
        {"ip", 99},           {"0", 99},
        {"256", 99},          {"-1", 99},
        {"TCP", 99},          {"", 99},
        {"ipproto-255", 99},  {"99999999999999999999", 99},
    };
    for (const auto &[text, protocol] : cases) {
        wccp_grp_config config = {};
        config.protocol = 99;
        binding_list list;
        list.add("/x", bn_type_str, text);
        EXPECT_EQ(wccpd_config_update_group_binding(&config, list.last(), 3), LC_OK);
        EXPECT_EQ(config.protocol, protocol) << text;
        EXPECT_EQ(config.config_flags, 0u);
    }
    EXPECT_EQ(said("Bad wccp protocol: 256"), 1);
    EXPECT_EQ(said("WCCP config: Bad wccp protocol"), 0);
    EXPECT_EQ(said("WCCP config: set protocol raw to 255"), 1);
}

TEST_F(DaemonConfig, WordsAreComparedExactly) {
    const struct {
        int kind;
        const char *text;
        uint32_t wccp_grp_config::*field;
        uint32_t value, flags;
        const char *line;
    } cases[] = {
        {1, "up", &wccp_grp_config::admin, 1, 0x2, "set admin up:1"},
        {1, "down", &wccp_grp_config::admin, 2, 0x2, "set admin down:2"},
        {1, "UP", &wccp_grp_config::admin, 77, 0, "Invalid admin: UP, ignoring"},
        {5, "gre", &wccp_grp_config::fwd_method, 1, 0x10, "set encap gre to 1"},
        {5, "either", &wccp_grp_config::fwd_method, 3, 0x10, "set encap either to 3"},
        {5, "GRE", &wccp_grp_config::fwd_method, 3, 0x10, "Invalid forwarding method: GRE, using EITHER"},
        {11, "hash", &wccp_grp_config::assign_method, 1, 0x40, "set assignment method to hash"},
        {11, "hash ", &wccp_grp_config::assign_method, 3, 0x40,
         "Invalid assignment method: hash , using EITHER"},
        {21, "nexus", &wccp_grp_config::compatibility, 2, 0x80, "set compatibility mode to nexus(2)"},
        {21, "Ios", &wccp_grp_config::compatibility, 1, 0x80, "Invalid compatibility mode: Ios, using ios"},
    };
    for (const auto &each : cases) {
        wccp_grp_config config = {};
        config.*each.field = 77;
        binding_list list;
        list.add("/x", bn_type_str, each.text);
        EXPECT_EQ(wccpd_config_update_group_binding(&config, list.last(), each.kind), LC_OK);
        EXPECT_EQ(config.*each.field, each.value) << each.text;
        EXPECT_EQ(config.config_flags, each.flags) << each.text;
        EXPECT_GE(said(std::string("WCCP config: ") + each.line), 1) << each.line;
    }
    wccp_grp_config config = {};
    binding_list list;
    list.add("/x", bn_type_str, "sixteen letters.");
    EXPECT_EQ(wccpd_config_update_group_binding(&config, list.last(), 9), LC_OK);
    EXPECT_STREQ(config.interface, "sixteen letters");
    EXPECT_EQ(config.interface_set, 1);
    EXPECT_EQ(wccpd_config_update_group_binding(&config, list.last(), 12), LC_OK);
    EXPECT_EQ(said("WCCP config: node type 12 unknown"), 1);
}

TEST_F(DaemonConfig, RoutersInTheOrderOfTheirNumbersWithoutAGap) {
    binding_list list;
    add_root(list, "51");
    for (const char *number : {"4", "2", "1"}) {
        const std::string node = CONFIG + "51/router/" + number;
        list.add(node, bn_type_uint8, number);
        list.add(node + "/ipaddr", bn_type_ipv4addr, std::string("10.0.0.20") + number);
    }
    ASSERT_EQ(apply(list), LC_OK);
    const wccp_service_group *group = wccp_find_group(51);
    ASSERT_NE(group, nullptr);
    EXPECT_EQ(group->ucast_router_count, 2); // three numbers are looked at, and the third isn't there
    EXPECT_EQ(group->ucast_routers[0], address(201));
    EXPECT_EQ(group->ucast_routers[1], address(202));

    wccp_grp_config config = {};
    for (uint32_t number = 1; number <= WCCP_MAX_ROUTERS + 1; number++) {
        config.config_flags = 0;
        binding_list one;
        one.add("/x", bn_type_ipv4addr, "10.0.1." + std::to_string(number));
        EXPECT_EQ(wccpd_config_update_group_binding(&config, one.last(), 2), LC_OK);
        EXPECT_EQ(config.config_flags, WCCP_CFG_ROUTERS);
    }
    EXPECT_EQ(config.router_count, WCCP_MAX_ROUTERS);
    EXPECT_EQ(config.routers[31], to_be32(0x0a000120));
}

TEST_F(DaemonConfig, OneNodeOfARunningGroup) {
    wccp_service_group *group = make("51");
    ASSERT_NE(group, nullptr);
    EXPECT_EQ(change_51("password", bn_type_str, "0123456789ab"), LC_OK);
    EXPECT_EQ(memcmp(group->password, "01234567", 8), 0);
    EXPECT_EQ(group->security_option, 1u);
    EXPECT_EQ(change_51("password", bn_type_str, ""), LC_OK);
    EXPECT_EQ(group->security_option, 0u);
    EXPECT_EQ(group->password[0], 0);
    EXPECT_EQ(change_51("weight", bn_type_uint32, "7"), LC_OK);
    EXPECT_EQ(group->weight, 7);
    EXPECT_EQ(change_51("encap", bn_type_str, "gre"), LC_OK);
    EXPECT_EQ(group->cfg_fwd_method, WCCP_METHOD_GRE);
    EXPECT_EQ(change_51("encap", bn_type_str, "GRE"), LC_OK);
    EXPECT_EQ(group->cfg_fwd_method, WCCP_METHOD_EITHER);
    EXPECT_EQ(change_51("assign_method", bn_type_str, "hash"), LC_OK);
    EXPECT_EQ(group->cfg_assign_method, WCCP_ASSIGN_HASH);
    EXPECT_EQ(change_51("force_l2_return", bn_type_bool, "true"), LC_OK);
    EXPECT_EQ(group->force_l2_return, 1u);
    EXPECT_EQ(change_51("compatibility", bn_type_str, "nexus"), LC_OK);
    EXPECT_EQ(group->compat_mode, WCCP_COMPAT_NEXUS);
    const char *const hashes[] = {"hash_src_ip", "hash_dst_ip", "hash_src_port", "hash_dst_port"};
    for (uint32_t bit = 0; bit < 4; bit++) {
        EXPECT_EQ(change_51(hashes[bit], bn_type_bool, "true"), LC_OK);
        EXPECT_EQ(group->service_flags & 0xf, (2u << bit) - 1);
    }
    EXPECT_EQ(change_51("mask_src_ip", bn_type_uint32, "1"), LC_OK);
    EXPECT_EQ(change_51("mask_dst_ip", bn_type_uint32, "2"), LC_OK);
    EXPECT_EQ(change_51("mask_src_port", bn_type_uint16, "4"), LC_OK);
    EXPECT_EQ(change_51("mask_dst_port", bn_type_uint16, "8"), LC_OK);
    EXPECT_EQ(group->mask_src_ip, 1u);
    EXPECT_EQ(group->mask_dst_ip, 2u);
    EXPECT_EQ(group->mask_src_port, 4);
    EXPECT_EQ(group->mask_dst_port, 8);
    EXPECT_EQ(change_51("admin", bn_type_str, "up"), LC_OK);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_UP);
    EXPECT_EQ(change_51("admin", bn_type_str, "sideways"), LC_OK);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_UP);
    EXPECT_EQ(change_51("admin", bn_type_str, "down"), LC_OK);
    EXPECT_EQ(group->admin_state, WCCP_ADMIN_DOWN);
    EXPECT_EQ(wccp_find_group(51), group);

    engine.log.clear();
    EXPECT_EQ(change_51("assign_detail", bn_type_str, "x"), LC_OK);
    EXPECT_EQ(change_51("interface", bn_type_str, "wan0"), LC_OK);
    EXPECT_EQ(group->interfaces[0], engine.interface);
    EXPECT_EQ(said("<139>"), 0);
    EXPECT_EQ(change(CONFIG + "61/weight", bn_type_uint32, "7"), LC_OK);
    EXPECT_EQ(said("WCCP update group 61 failed."), 1);
}

TEST_F(DaemonConfig, NodesThatNobodyKnowsOrThatCannotChange) {
    const wccp_service_group *group = make("51");
    ASSERT_NE(group, nullptr);
    engine.log.clear();
    for (const std::string node : {"priority", "protocol", "router/1/ipaddr", "colour", "admin/x"}) {
        EXPECT_EQ(change_51(node, bn_type_str, "6"), LC_OK);
        EXPECT_EQ(said("WCCP update: Unknown binding " + CONFIG + "51/" + node), 1) << node;
    }
    EXPECT_EQ(group->priority, 0);
    EXPECT_EQ(change("/qv/wccpd/system/config/colour", bn_type_str, "red"), LC_OK);
    EXPECT_EQ(said("WCCP update: Unknown global binding /qv/wccpd/system/config/colour"), 1);
    EXPECT_EQ(change("/qv/wccpd/other/thing", bn_type_str, "red"), LC_OK);
    EXPECT_EQ(said("WCCP update: Unsupported binding /qv/wccpd/other/thing"), 1);
    for (const std::string name : {"/qv/tunneld/system/config/bonding", "/qv/wccpdx/a", "/other"}) {
        EXPECT_EQ(change(name, bn_type_str, "x"), LC_OK);
        EXPECT_EQ(said("wccpd_config_handle_change: " + name + " not for us, discarding"), 1) << name;
    }
}

TEST_F(DaemonConfig, AWrongTypeEndsTheWalkAndKeepsWhatWasApplied) {
    wccp_service_group *group = make("51");
    ASSERT_NE(group, nullptr);
    binding_list list;
    list.add(CONFIG + "51/weight", bn_type_uint32, "5")
        .add(CONFIG + "51/encap", bn_type_uint32, "1")
        .add(CONFIG + "51/weight", bn_type_uint32, "6");
    EXPECT_NE(apply(list), LC_OK);
    EXPECT_EQ(group->weight, 5);
    EXPECT_EQ(said("weight to 6"), 0);
    EXPECT_EQ(said("WCCP Modify config complete"), 0);

    binding_list roots;
    add_root(roots, "52");
    add_root(roots, "53").add(CONFIG + "53/weight", bn_type_str, "5");
    add_root(roots, "54");
    EXPECT_NE(apply(roots), LC_OK);
    EXPECT_NE(wccp_find_group(52), nullptr);
    EXPECT_EQ(wccp_find_group(53), nullptr);
    EXPECT_EQ(wccp_find_group(54), nullptr);
}

TEST_F(DaemonConfig, ARootInAChangeKeepsTheOtherNodesOut) {
    wccp_service_group *group = make("51");
    ASSERT_NE(group, nullptr);
    engine.log.clear();
    binding_list list;
    list.add(CONFIG + "51/weight", bn_type_uint32, "9")
        .add("/qv/tunneld/system/config/mode", bn_type_str, "?");
    add_root(list, "52");
    EXPECT_EQ(apply(list), LC_OK);
    EXPECT_NE(wccp_find_group(52), nullptr);
    EXPECT_EQ(group->weight, 0);
    EXPECT_EQ(said("WCCP Group config callbacks: 1"), 1);
    EXPECT_EQ(said("cannot recognize new system mode"), 0);

    // A policy root doesn't.
    binding_list policy;
    policy.add(POLICIES + "5", bn_type_uint16, "5")
        .add(POLICIES + "5/name", bn_type_str, "five")
        .add(CONFIG + "51/weight", bn_type_uint32, "9")
        .add("/qv/tunneld/system/config/mode", bn_type_str, "?")
        .add("/qv/wccpd/system/config/mcast_ttl", bn_type_uint32, "300");
    EXPECT_EQ(apply(policy), LC_OK);
    EXPECT_EQ(group->weight, 9);
    EXPECT_EQ(wccp_g.mcast_ttl, 44);
    EXPECT_EQ(said("WCCP Group policy config callbacks: 1"), 1);
    EXPECT_EQ(said("WCCP update: Added policy Group 5"), 1);
    EXPECT_EQ(said("WCCP cannot recognize new system mode: ?"), 1);
    EXPECT_EQ(said("WCCP Modify config complete"), 1);
}

TEST_F(DaemonConfig, GroupsGo) {
    ASSERT_NE(make("51"), nullptr);
    delete_root("51");
    EXPECT_EQ(wccp_find_group(51), nullptr);
    EXPECT_EQ(said("WCCP update: Deleted Group 51"), 1);
    delete_root("51");
    EXPECT_EQ(said("WCCP update: Failed to delete Group 51"), 1);

    // A router entry that goes takes the group along, its first node with success.
    ASSERT_NE(make("51"), nullptr);
    engine.log.clear();
    binding_list entry;
    entry.add(CONFIG + "51/router/1", bn_type_uint8, "1", bn_flag_deleted)
        .add(CONFIG + "51/router/1/ipaddr", bn_type_ipv4addr, "10.0.0.1", bn_flag_deleted);
    EXPECT_EQ(apply(entry), LC_OK);
    EXPECT_EQ(wccp_find_group(51), nullptr);
    EXPECT_EQ(said("WCCP update: Deleted Group 51"), 1);
    EXPECT_EQ(said("WCCP update: Failed to delete Group 51"), 1);

    // Only the low eight bits of a number count.
    ASSERT_NE(make("300"), nullptr);
    ASSERT_NE(wccp_find_group(44), nullptr);
    EXPECT_EQ(change(CONFIG + "300/weight", bn_type_uint32, "3"), LC_OK);
    EXPECT_EQ(wccp_find_group(44)->weight, 3);
    delete_root("300");
    EXPECT_EQ(wccp_find_group(44), nullptr);
}

TEST_F(DaemonConfig, PolicyMembership) {
    binding_list list;
    list.add(POLICIES + "5", bn_type_uint16, "5");
    for (const char *id : {"71", "72"})
        add_root(list, id).add(CONFIG + id + "/policy_grp", bn_type_uint32, "65541"); // 5 in 16 bits
    ASSERT_EQ(apply(list), LC_OK);
    EXPECT_EQ(wccp_check_policy_group(5, 71), 1);
    EXPECT_EQ(wccp_check_policy_group(5, 72), 1);
    EXPECT_EQ(said("WCCP config: set policy grp to 5"), 2);

    EXPECT_EQ(change(CONFIG + "72/policy_grp", bn_type_uint32, "6"), LC_OK);
    EXPECT_EQ(wccp_check_policy_group(5, 72), 0);
    EXPECT_EQ(wccp_check_policy_group(6, 72), 1);

    // Members of a policy group that goes move to 300, and leave it with their own group.
    EXPECT_EQ(change(POLICIES + "5", bn_type_uint16, "5", bn_flag_deleted), LC_OK);
    EXPECT_EQ(said("WCCP update: Deleted policy Group 5"), 1);
    EXPECT_EQ(wccp_check_policy_group(5, 71), 0);
    EXPECT_EQ(wccp_check_policy_group(300, 71), 1);
    EXPECT_EQ(wccp_check_policy_group(300, 72), 0);
    delete_root("71");
    EXPECT_EQ(wccp_check_policy_group(300, 71), 0);
    EXPECT_EQ(wccp_check_policy_group(6, 72), 1);

    // A group that goes by one of its nodes stays a member.
    EXPECT_EQ(change(CONFIG + "72/weight", bn_type_uint32, "1", bn_flag_deleted), LC_OK);
    EXPECT_EQ(wccp_find_group(72), nullptr);
    EXPECT_EQ(wccp_check_policy_group(6, 72), 1);
    delete_root("72");
    EXPECT_EQ(wccp_check_policy_group(6, 72), 0);
}

TEST_F(DaemonConfig, TheFacilityOfTheLogAndNothingElseOfIt) {
    EXPECT_EQ(lc_log_set_max_log_level("err"), LC_OK);
    EXPECT_EQ(lc_log_enable_override_log_level(1, 1), LC_OK);
    EXPECT_EQ(lc_log_set_override_log_level("info"), LC_OK);
    EXPECT_EQ(change("/logging/syslog/facility/system", bn_type_uint32, "160"), LC_OK);
    EXPECT_EQ(said("system facility to 20(local4), wccpd"), 1);
    engine.log.clear();
    EXPECT_EQ(change("/qv/wccpd/other", bn_type_str, "x"), LC_OK);
    EXPECT_EQ(said("<166>"), said("wccpd["));
    EXPECT_EQ(said("WCCP update: Unsupported binding /qv/wccpd/other"), 1);
    EXPECT_EQ(lc_log_get_daemon_log_level(), LC_LOG_DEBUG);
    EXPECT_EQ(G_log_level, LC_LOG_ERR);
    EXPECT_EQ(lc_log_enable_override_log_level(0, 1), LC_OK);
    EXPECT_EQ(G_log_level, LC_LOG_INFO);
}

} // namespace
