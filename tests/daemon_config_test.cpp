// The configuration applied to an engine without threads: how a group is built, what each change does, and
// how invalid values are handled.
#include "daemon/wccpd_config.h"
#include "daemon/wccpd_early_changes.h"
#include "daemon/wccpd_group_nodes.h"

#include "tests/support/daemon_engine.h"

namespace {

const std::string CONFIG = "/qv/wccpd/wccp/srv_grp/config/", POLICIES = "/qv/wccpd/wccp/policy_grp/config/";

struct DaemonConfig : daemon_test {
    static lc_status apply(binding_list &changes) { return wccpd_config_apply(changes.array); }
    static lc_status change(const std::string &name, uint32_t type, std::string text, uint32_t flags = 0) {
        return apply(binding_list().add(name, type, text, flags));
    }
    static void delete_root(const std::string &id) {
        EXPECT_EQ(change(CONFIG + id, bn_type_uint8, "51", bn_flag_deleted), LC_OK);
    }
    // Applies one node to the configuration of a group.
    static void take_node(wccp_grp_config *config, int kind, uint32_t type, const std::string &text) {
        binding_list list;
        EXPECT_EQ(wccpd_config_update_group_binding(config, list.add("/x", type, text).last(), kind), LC_OK);
    }
    // A group's root node and its interface.
    static binding_list &add_root(binding_list &list, const std::string &id) {
        return list.add(CONFIG + id, bn_type_uint8, "1").add(CONFIG + id + "/interface", bn_type_str, "lan0");
    }
    static wccp_service_group *add_group(const std::string &id) {
        binding_list list;
        EXPECT_EQ(apply(add_root(list, id)), LC_OK);
        return wccp_find_group(atoi(id.c_str()));
    }
};

// A node of a group, and the field of the running group that shows it.
#define FIELD(expression) [](const wccp_service_group &group) -> uint32_t { return group.expression; }
const struct {
    std::string node;
    uint32_t type;
    const char *text;
    uint32_t (*field)(const wccp_service_group &group);
    uint32_t wanted;
    bool changes = true; // while the group runs
} nodes[] = {
    {"priority", bn_type_uint32, "496", FIELD(priority), 240, false}, // in 8 bits
    {"protocol", bn_type_str, "tcp", FIELD(protocol), 6, false},
    {"router/1/ipaddr", bn_type_ipv4addr, "10.0.0.201", FIELD(ucast_router_count), 1, false},
    {"password", bn_type_str, "twelve bytes", FIELD(security_option), 1},
    {"encap", bn_type_str, "l2", FIELD(cfg_fwd_method), WCCP_METHOD_L2},
    {"weight", bn_type_uint32, "65636", FIELD(weight), 100}, // in 16 bits
    {"admin", bn_type_str, "up", FIELD(admin_state), WCCP_ADMIN_UP},
    {"force_l2_return", bn_type_bool, "true", FIELD(force_l2_return), 1},
    {"assign_method", bn_type_str, "mask", FIELD(cfg_assign_method), WCCP_ASSIGN_MASK},
    {"hash_src_ip", bn_type_bool, "true", FIELD(service_flags & 1), 1},
    {"hash_dst_ip", bn_type_bool, "true", FIELD(service_flags & 2), 2},
    {"hash_src_port", bn_type_bool, "true", FIELD(service_flags & 4), 4},
    {"hash_dst_port", bn_type_bool, "true", FIELD(service_flags & 8), 8},
    {"mask_src_ip", bn_type_uint32, "5953", FIELD(mask_src_ip), 5953},
    {"mask_dst_ip", bn_type_uint32, "1", FIELD(mask_dst_ip), 1},
    {"mask_src_port", bn_type_uint16, "3", FIELD(mask_src_port), 3},
    {"mask_dst_port", bn_type_uint16, "65535", FIELD(mask_dst_port), 65535},
    {"compatibility", bn_type_str, "nexus", FIELD(compat_mode), WCCP_COMPAT_NEXUS},
};

TEST_F(DaemonConfig, AGroupIsBuiltFromItsWholeSubtree) {
    binding_list list;
    add_root(list, "51").add(CONFIG + "51/router/1", bn_type_uint8, "1");
    for (size_t i = std::size(nodes); i-- > 0;) // in any order
        list.add(CONFIG + "51/" + nodes[i].node, nodes[i].type, nodes[i].text);
    add_root(add_root(list, "51"), "52"); // a group that exists does not end the walk
    ASSERT_EQ(apply(list), LC_OK);
    const wccp_service_group *group = wccp_find_group(51);
    ASSERT_TRUE(group && wccp_find_group(52) && group->interfaces[0] == interface);
    EXPECT_EQ(memcmp(group->password, "twelve b", 8), 0);
    for (const auto &node : nodes)
        EXPECT_EQ(node.field(*group), node.wanted) << node.node;
    // scenario_configuration has those of the other nodes.
    EXPECT_EQ(said("WCCP config query group 51(51) - /qv/wccpd/wccp/srv_grp/config/51"), 2);
    EXPECT_EQ(said("WCCP config: set router ip to 10.0.0.201, position 0"), 2);
    EXPECT_EQ(said("WCCP config: set compatibility mode to nexus(2)"), 2);
    EXPECT_TRUE(said("twelve") == 0 && said("FAILED to create WCCP group 51") == 1);
}

// Each node changes its own field or, if a running group cannot follow it, none.
TEST_F(DaemonConfig, OneNodeOfARunningGroup) {
    wccp_service_group *group = add_group("51");
    EXPECT_EQ(group->admin_state + group->hia_timer.active, 0u); // without an admin node it does not run
    const auto fields = [group] {
        std::vector<uint32_t> found;
        for (const auto &node : nodes)
            found.push_back(node.field(*group));
        return found;
    };
    std::vector<uint32_t> expected = fields();
    for (size_t changed = 0; changed < std::size(nodes); changed++) {
        const auto &node = nodes[changed];
        EXPECT_EQ(change(CONFIG + "51/" + node.node, node.type, node.text), LC_OK);
        EXPECT_EQ(said("WCCP update: Unknown binding " + CONFIG + "51/" + node.node), !node.changes);
        if (node.changes)
            expected[changed] = node.wanted;
        EXPECT_EQ(fields(), expected) << node.node;
    }
    log.clear();
    EXPECT_EQ(change(CONFIG + "51/password", bn_type_str, ""), LC_OK);
    EXPECT_TRUE(group->security_option == 0 && group->password[0] == 0);
    for (const char *node : {"assign_detail", "interface"})
        EXPECT_EQ(change(CONFIG + "51/" + node, bn_type_str, "wan0"), LC_OK);
    EXPECT_TRUE(group->interfaces[0] == interface && said("<139>") == 0); // facility local1, level error
    EXPECT_EQ(change(CONFIG + "61/weight", bn_type_uint32, "7"), LC_OK);
    EXPECT_EQ(said("WCCP update group 61 failed."), 1);
}

TEST_F(DaemonConfig, ProtocolsByNameAndNumber) {
    std::istringstream cases(
        "tcp=6 6=6 icmp=1 gre=47 mpls=137 ipproto-138=138 ipproto-254=254 raw=255 255=255 "
        // Refused: the value stays.
        "ip=99 0=99 256=99 -1=99 TCP=99 =99 ipproto-255=99 99999999999999999999=99");
    for (std::string text, protocol; std::getline(cases, text, '=') && std::getline(cases, protocol, ' ');) {
        wccp_grp_config config = {};
        config.protocol = 99;
        take_node(&config, GROUP_NODE_PROTOCOL, bn_type_str, text);
        EXPECT_TRUE(std::to_string(config.protocol) == protocol && config.config_flags == 0) << text;
    }
    EXPECT_TRUE(said("Bad wccp protocol: 256") == 1 && said("WCCP config: Bad wccp protocol") == 0);
}

TEST_F(DaemonConfig, WordsAreComparedExactly) {
    using group = wccp_grp_config;
    wccp_grp_config config = {};
    take_node(&config, GROUP_NODE_INTERFACE, bn_type_str, "sixteen letters.");
    EXPECT_TRUE(config.interface == std::string("sixteen letters") && config.interface_set == 1);
    const auto check = [&](int kind, const char *text, uint32_t group::*field, uint32_t value, uint32_t flags,
                           const std::string &line) {
        config = {};
        config.*field = 77;
        take_node(&config, kind, bn_type_str, text);
        EXPECT_TRUE(config.*field == value && config.config_flags == flags) << text;
        EXPECT_EQ(said("WCCP config: " + line), 1) << line;
    };
    check(1, "UP", &group::admin, 77, 0, "Invalid admin: UP, ignoring");
    check(5, "either", &group::fwd_method, 3, 0x10, "set encap either to 3");
    check(5, "GRE", &group::fwd_method, 3, 0x10, "Invalid forwarding method: GRE, using EITHER");
    check(11, "h", &group::assign_method, 3, 0x40, "Invalid assignment method: h, using EITHER");
    check(21, "Ios", &group::compatibility, 1, 0x80, "Invalid compatibility mode: Ios, using ios");
    check(12, "x", &group::admin, 77, 0, "node type 12 unknown");
}

TEST_F(DaemonConfig, RoutersInTheOrderOfTheirNumbersWithoutAGap) {
    binding_list list;
    add_root(list, "51");
    for (const std::string number : {"4", "2", "1"})
        list.add(CONFIG + "51/router/" + number, bn_type_uint8, number)
            .add(CONFIG + "51/router/" + number + "/ipaddr", bn_type_ipv4addr, "10.0.0.20" + number);
    ASSERT_EQ(apply(list), LC_OK);
    const wccp_service_group *group = wccp_find_group(51);
    EXPECT_EQ(group->ucast_router_count, 2); // the numbers 1 to 3 are looked for, and 3 does not exist
    EXPECT_TRUE(group->ucast_routers[0] == address(201) && group->ucast_routers[1] == address(202));

    wccp_grp_config config = {};
    for (uint32_t number = 1; number <= WCCP_MAX_ROUTERS + 1; number++) {
        config.config_flags = 0;
        take_node(&config, GROUP_NODE_ROUTER, bn_type_ipv4addr, "10.0.1." + std::to_string(number));
        EXPECT_EQ(config.config_flags, WCCP_CFG_ROUTERS);
    }
    EXPECT_TRUE(config.router_count == WCCP_MAX_ROUTERS && config.routers[31] == address(0x120));
}

TEST_F(DaemonConfig, UnknownNodes) {
    const auto check = [&](const std::string &before, const std::string &name, const char *after = "") {
        EXPECT_EQ(change(name, bn_type_str, "x"), LC_OK);
        EXPECT_EQ(said(before + name + after), 1) << name;
    };
    check("WCCP update: Unknown binding ", CONFIG + "51/colour");
    check("WCCP update: Unknown binding ", CONFIG + "51/admin/x");
    check("WCCP update: Unknown global binding ", "/qv/wccpd/system/config/colour");
    check("WCCP update: Unsupported binding ", "/qv/wccpd/other/thing");
    for (const char *foreign : {"/qv/tunneld/system/config/bonding", "/qv/wccpdx/a"})
        check("wccpd_config_handle_change: ", foreign, " not for us, discarding");
}

TEST_F(DaemonConfig, AWrongTypeEndsTheWalkAndKeepsWhatWasApplied) {
    const wccp_service_group *group = add_group("51");
    binding_list list, roots;
    list.add(CONFIG + "51/weight", bn_type_uint32, "5")
        .add(CONFIG + "51/encap", bn_type_uint32, "1")
        .add(CONFIG + "51/weight", bn_type_uint32, "6");
    EXPECT_TRUE(apply(list) != LC_OK && group->weight == 5 && said("WCCP Modify config complete") == 0);
    add_root(add_root(roots, "52"), "53").add(CONFIG + "53/weight", bn_type_str, "5");
    add_root(roots, "54");
    EXPECT_TRUE(apply(roots) != LC_OK && wccp_find_group(52) && !wccp_find_group(53) && !wccp_find_group(54));
}

// A policy root does not.
TEST_F(DaemonConfig, AGroupRootInAChangeKeepsTheOtherNodesOut) {
    const wccp_service_group *group = add_group("51");
    for (const bool has_root : {true, false}) {
        log.clear();
        binding_list list;
        list.add(POLICIES + "5", bn_type_uint16, "5")
            .add(POLICIES + "5/name", bn_type_str, "five")
            .add(CONFIG + "51/weight", bn_type_uint32, "9")
            .add("/qv/tunneld/system/config/mode", bn_type_str, "?")
            .add("/qv/wccpd/system/config/mcast_ttl", bn_type_uint32, "300");
        if (has_root)
            add_root(list, "52");
        EXPECT_EQ(apply(list), LC_OK);
        EXPECT_TRUE(group->weight == (has_root ? 0 : 9) && wccp_g.mcast_ttl == (has_root ? 5 : 44));
        EXPECT_EQ(said("WCCP Group policy config callbacks: 1"), 1);
        EXPECT_EQ(said("WCCP update: Added policy Group 5"), 1);
        EXPECT_EQ(said("WCCP Group config callbacks: 1"), has_root);
        EXPECT_EQ(said("WCCP Group config callbacks: 0"), !has_root);
        EXPECT_EQ(said("WCCP cannot recognize new system mode: ?"), !has_root);
        EXPECT_EQ(said("WCCP Modify config complete"), !has_root);
    }
    EXPECT_NE(wccp_find_group(52), nullptr);
}

TEST_F(DaemonConfig, DeletedGroups) {
    add_group("51");
    delete_root("51");
    delete_root("51");
    // A deleted router entry deletes the group, with the first of its nodes.
    add_group("51");
    binding_list list;
    list.add(CONFIG + "51/router/1", bn_type_uint8, "1", bn_flag_deleted)
        .add(CONFIG + "51/router/1/ipaddr", bn_type_ipv4addr, "10.0.0.1", bn_flag_deleted);
    EXPECT_TRUE(apply(list) == LC_OK && !wccp_find_group(51));
    EXPECT_TRUE(said("update: Deleted Group 51") == 2 && said("update: Failed to delete Group 51") == 2);

    // Only the low eight bits of a number count.
    add_group("300");
    EXPECT_EQ(change(CONFIG + "300/weight", bn_type_uint32, "3"), LC_OK);
    ASSERT_TRUE(wccp_find_group(44) && wccp_find_group(44)->weight == 3);
    delete_root("300");
    EXPECT_EQ(wccp_find_group(44), nullptr);
}

// Members of a deleted policy group move to 300, and leave it when their own group is deleted, but not when
// that is deleted by one of its nodes.
TEST_F(DaemonConfig, PolicyMembership) {
    const auto members = [] {
        std::string all;
        for (const int policy : {5, 6, 300})
            for (const int group : {71, 72})
                if (wccp_check_policy_group(static_cast<uint16_t>(policy), static_cast<uint8_t>(group)) == 1)
                    all += std::to_string(policy) + ":" + std::to_string(group) + " ";
        return all;
    };
    binding_list list;
    list.add(POLICIES + "5", bn_type_uint16, "5");
    for (const char *id : {"71", "72"})
        add_root(list, id).add(CONFIG + id + "/policy_grp", bn_type_uint32, "65541"); // 5 in 16 bits
    ASSERT_EQ(apply(list), LC_OK);
    EXPECT_EQ(members(), "5:71 5:72 ");
    EXPECT_EQ(change(CONFIG + "72/policy_grp", bn_type_uint32, "6"), LC_OK);
    EXPECT_EQ(change(POLICIES + "5", bn_type_uint16, "5", bn_flag_deleted), LC_OK);
    EXPECT_EQ(members(), "6:72 300:71 ");
    delete_root("71");
    EXPECT_EQ(change(CONFIG + "72/weight", bn_type_uint32, "1", bn_flag_deleted), LC_OK);
    EXPECT_TRUE(!wccp_find_group(72) && members() == "6:72 ");
    delete_root("72");
    EXPECT_EQ(members(), "");
}

TEST_F(DaemonConfig, ChangesOfTheStartAreAppliedAfterIt) {
    const auto keep = [](binding_list &changes) {
        EXPECT_TRUE(keep_early_change(&changes.array.pointer) == LC_OK && !changes.array.pointer);
    };
    const auto keep_one = [&](const std::string &node, uint32_t type, const char *text, uint32_t flags = 0) {
        binding_list changes;
        keep(changes.add(CONFIG + node, type, text, flags));
    };
    const early_changes_scope scope;
    // In the answer.
    binding_list added;
    keep(add_root(added, "51").add(CONFIG + "51/weight", bn_type_uint32, "5"));
    keep_one("51/router/2/ipaddr", bn_type_ipv4addr, "10.0.0.9", bn_flag_deleted);
    keep_one("51/priority", bn_type_uint32, "9");
    keep_one("51/weight", bn_type_uint32, "6");
    keep_one("52/weight", bn_type_uint32, "6");
    keep_one("52", bn_type_uint8, "52", bn_flag_deleted);
    early_changes_are_answered();
    // Not in the answer.
    keep_one("51/weight", bn_type_uint32, "7");
    keep_one("51/weight", bn_type_uint32, "8");
    keep_one("53", bn_type_uint8, "53", bn_flag_deleted);
    keep_one("54", bn_type_uint8, "54");
    const wccp_service_group *group = add_group("51");
    add_group("53");
    EXPECT_EQ(group->weight, 0);
    apply_early_changes();
    ASSERT_TRUE(wccp_find_group(51) == group && group->weight == 8);
    EXPECT_TRUE(!wccp_find_group(52) && !wccp_find_group(53) && wccp_find_group(54) && said("<139>") == 0);

    keep_one("54/router/1/ipaddr", bn_type_ipv4addr, "10.0.0.9", bn_flag_deleted);
    apply_early_changes();
    EXPECT_EQ(wccp_find_group(54), nullptr);

    const std::string half(EARLY_CHANGES_MAX_BYTES / 2, 'x');
    keep_one("51/weight", bn_type_str, half.c_str());
    binding_list second;
    second.add(CONFIG + "51/weight", bn_type_str, half);
    EXPECT_EQ(keep_early_change(&second.array.pointer), LC_NO_SPACE);
    EXPECT_TRUE(second.array.pointer && said("Configuration change lost") == 1);
    lc_status status = LC_OK; // changes without bindings count as well
    for (size_t i = 0; status == LC_OK && i < EARLY_CHANGES_MAX_BYTES / 1000; i++) {
        binding_list empty;
        status = keep_early_change(&empty.array.pointer);
    }
    EXPECT_EQ(status, LC_NO_SPACE);
}

TEST_F(DaemonConfig, TheLogFacilityAndNoOtherLogSetting) {
    EXPECT_TRUE(lc_log_set_max_log_level("err") == LC_OK && lc_log_enable_override_log_level(1, 1) == LC_OK);
    EXPECT_EQ(lc_log_set_override_log_level("info"), LC_OK);
    EXPECT_EQ(change("/logging/syslog/facility/system", bn_type_uint32, "160"), LC_OK);
    EXPECT_EQ(said("system facility to 20(local4), wccpd"), 1);
    log.clear();
    EXPECT_TRUE(change("/qv/wccpd/other", bn_type_str, "x") == LC_OK && said("<166>") == said("wccpd["));
    EXPECT_EQ(said("WCCP update: Unsupported binding /qv/wccpd/other"), 1);
    EXPECT_TRUE(lc_log_get_daemon_log_level() == LC_LOG_DEBUG && G_log_level == LC_LOG_ERR);
    EXPECT_TRUE(lc_log_enable_override_log_level(0, 1) == LC_OK && G_log_level == LC_LOG_INFO);
}

} // namespace
