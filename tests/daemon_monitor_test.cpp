// The monitoring tree over an engine without threads: every node's type and value, what is listed, and what
// is answered for that which isn't there.
#include "daemon/wccpd_monitor.h"
#include "engine/wccp_utils.h"
#include "runtime/list.h"

#include <map>
#include <vector>

#include "tests/support/daemon_engine.h"

namespace {

const std::string STATE = "/qv/wccpd/wccp/srv_grp/state";
const std::string SYSTEM = "/qv/wccpd/system/state/";

be32 address(uint32_t last_octet) {
    return to_be32(0x0a000000 | last_octet);
}

// Type and text of the one binding that answers, or what came in its place.
std::string one(uint32_t type, const std::string &text) {
    return "type " + std::to_string(type) + ": " + text;
}
const std::string NOTHING = "nothing";

std::string get(const std::string &name, bool in_walk = false) {
    owner<tstr_array, tstr_array_free> parts;
    EXPECT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, nullptr), LC_OK);
    binding_list out;
    const lc_status status = wccpd_mon_handle_get(name.c_str(), parts, &in_walk, out.array);
    const uint32_t count = bn_binding_array_length_quick(out.array);
    if (status != LC_OK || count != 1)
        return status ? "status " + std::to_string(status) : count ? "too much" : NOTHING;
    uint32_t type = 0;
    EXPECT_EQ(bn_binding_get_name_quick(out.last()), name);
    EXPECT_EQ(bn_binding_get_type(out.last(), bn_attrib_value, &type, nullptr), LC_OK);
    return one(type, text_of([&](char **text) {
                   return bn_binding_get_str(out.last(), bn_attrib_value, 0, nullptr, text);
               }));
}
std::string children(const std::string &name) {
    owner<tstr_array, tstr_array_free> parts, names;
    EXPECT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, nullptr), LC_OK);
    EXPECT_EQ(tstr_array_new(&names, nullptr), LC_OK);
    EXPECT_EQ(wccpd_mon_handle_iterate(name.c_str(), parts, nullptr, names), LC_OK);
    std::string list;
    for (uint32_t i = 0; i < tstr_array_length_quick(names); i++)
        list += std::string(tstr_array_get_str_quick(names, i)) + " ";
    return list;
}

struct DaemonMonitor : testing::Test {
    daemon_engine engine;
    wccp_service_group *group = add_group(51);

    static wccp_service_group *add_group(uint8_t id) {
        wccp_grp_config config = {};
        config.group_id = id;
        config.weight = 100;
        config.compatibility = WCCP_COMPAT_IOS;
        strcpy(config.interface, "lan0");
        EXPECT_EQ(wccp_add_group(&config), 0);
        return wccp_find_group(id);
    }
    wccp_sending_router *add_router(uint32_t last_octet) const {
        auto *router = static_cast<wccp_sending_router *>(wccp_malloc(sizeof(wccp_sending_router)));
        router->router_id = address(last_octet);
        router->src_ipa = address(last_octet + 10);
        router->state_time = wccp_g.seconds;
        list_push_head(&group->sending_routers, router);
        group->sending_router_count++;
        return router;
    }
    void add_appliance(uint32_t last_octet, uint16_t weight) const {
        auto *appliance = static_cast<wccp_view_appliance *>(wccp_malloc(sizeof(wccp_view_appliance)));
        appliance->ipa = address(last_octet);
        appliance->weight = weight;
        list_push_head(&group->appliance_view, appliance);
        group->appliance_view_count++;
    }
    static std::string of_51(const std::string &node) { return get(STATE + "/51/" + node); }
    int said(const std::string &line) { return engine.log.count(line); }
};

TEST_F(DaemonMonitor, TheGroup) {
    add_router(201);
    add_router(202);
    add_appliance(1, 100);
    add_appliance(2, 65535);
    EXPECT_EQ(of_51("oper"), one(bn_type_str, "INIT"));
    EXPECT_EQ(of_51("uptime"), one(bn_type_duration_ms, "0"));
    EXPECT_EQ(of_51("app_id"), one(bn_type_str, "10.0.0.1"));
    EXPECT_EQ(of_51("num_routers"), one(bn_type_uint32, "2"));
    EXPECT_EQ(of_51("num_appliances"), one(bn_type_uint32, "2"));
    EXPECT_EQ(of_51("appliance/1/ipaddr"), one(bn_type_ipv4addr, "10.0.0.2"));
    EXPECT_EQ(of_51("appliance/1/weight"), one(bn_type_uint32, "65535"));
    EXPECT_EQ(of_51("appliance/2/ipaddr"), one(bn_type_ipv4addr, "10.0.0.1"));
    EXPECT_EQ(of_51("appliance/3/ipaddr"), one(bn_type_ipv4addr, "0.0.0.0"));
    EXPECT_EQ(of_51("appliance/3/weight"), one(bn_type_uint32, "0"));
    group->state_flags = WCCP_STATE_ACTIVE;
    group->designated = 1;
    wccp_g.seconds = group->state_time + 5000000; // more milliseconds than 32 bits hold
    EXPECT_EQ(of_51("uptime"), one(bn_type_duration_ms, "5000000000"));
    EXPECT_EQ(get(STATE + "/307/oper"), one(bn_type_str, "ACTIVE, DESIGNATED")); // 51 in eight bits
    group->designated = 0;
    group->state_flags = WCCP_STATE_BACKUP;
    EXPECT_EQ(of_51("oper"), one(bn_type_str, "BACKUP"));
    group->state_flags = 0;
    EXPECT_EQ(of_51("oper"), one(bn_type_str, "not-set"));
}

TEST_F(DaemonMonitor, RoutersAreCountedByTheirPlace) {
    wccp_sending_router *second = add_router(201);
    wccp_sending_router *first = add_router(202);
    first->state_time = wccp_g.seconds - 7;
    first->last_icu_time = wccp_g.seconds - 3;
    EXPECT_EQ(of_51("router/1/heard"), one(bn_type_duration_ms, "3000"));
    first->flags = WCCP_RTR_TWO_WAY;
    second->flags = WCCP_RTR_ONE_WAY;
    EXPECT_EQ(of_51("router/1/id"), one(bn_type_ipv4addr, "10.0.0.202"));
    EXPECT_EQ(of_51("router/1/ipaddr"), one(bn_type_ipv4addr, "10.0.0.212"));
    EXPECT_EQ(of_51("router/1/conn_time"), one(bn_type_duration_ms, "7000"));
    EXPECT_EQ(of_51("router/1/state"), one(bn_type_str, "TWO-WAY connected"));
    EXPECT_EQ(of_51("router/2/id"), one(bn_type_ipv4addr, "10.0.0.201"));
    EXPECT_EQ(of_51("router/2/state"), one(bn_type_str, "ONE-WAY connected"));
    group->fwd_method = WCCP_METHOD_L2;
    group->ret_method = WCCP_METHOD_GRE;
    for (const std::string node : {"fwd_method", "ret_method", "assign_method"})
        EXPECT_EQ(of_51("router/1/" + node), one(bn_type_str, "not-set"));
    group->state_flags |= WCCP_CAPABILITIES_SET;
    EXPECT_EQ(of_51("router/1/fwd_method"), one(bn_type_str, "L2"));
    EXPECT_EQ(of_51("router/1/ret_method"), one(bn_type_str, "GRE"));
    EXPECT_EQ(of_51("router/1/assign_method"), one(bn_type_str, "not set"));
    group->assign_method = WCCP_ASSIGN_MASK;
    EXPECT_EQ(of_51("router/2/assign_method"), one(bn_type_str, "MASK"));
    // A number that isn't there is answered from nothing.
    for (const std::string number : {"0", "3", "4294967296"}) {
        EXPECT_EQ(of_51("router/" + number + "/state"), one(bn_type_str, ""));
        EXPECT_EQ(of_51("router/" + number + "/id"), one(bn_type_ipv4addr, "0.0.0.0"));
    }

    first->view_appliance_count = 2;
    first->view_appliances[0] = {address(1), 100, 0, 85, 256, {}};
    first->view_appliances[1] = {address(2), 100, 0, 0, 256, {}};
    EXPECT_EQ(of_51("router/1/appliance/10.0.0.1/load_dist"), one(bn_type_uint32, "33"));
    EXPECT_EQ(of_51("router/1/appliance/10.0.0.2/load_dist"), one(bn_type_uint32, "0"));
    first->view_appliances[0].buckets_total = 0;
    EXPECT_EQ(of_51("router/1/appliance/10.0.0.1/load_dist"), one(bn_type_uint32, "0"));
    EXPECT_EQ(of_51("router/1/appliance/10.0.0.3/load_dist"), NOTHING);
    EXPECT_EQ(said("wccp_get_router_appliance_info: failed: status=1"), 1);
    EXPECT_EQ(of_51("router/1/appliance/nobody/load_dist"), NOTHING);
    EXPECT_EQ(said("wccp_get_router_appliance_info: failed: status=14020"), 1);
}

TEST_F(DaemonMonitor, NodesThatOnlyStandForTheirChildren) {
    for (const auto &[node, last] : std::map<std::string, std::string>{
             {"/51", "51"}, {"/7/router/99", "99"}, {"/7/router/1/appliance/10.0.0.9", "10.0.0.9"}})
        EXPECT_EQ(get(STATE + node), one(bn_type_str, last));
    EXPECT_EQ(said("cannot find group"), 0); // the engine isn't asked
}

TEST_F(DaemonMonitor, WhatIsNotThere) {
    for (const std::string node : {"oper", "debug", "appliance/1/weight"})
        EXPECT_EQ(get(STATE + "/7/" + node), NOTHING);
    EXPECT_EQ(said("wccp_get_grp_info failed: 1"), 3);
    EXPECT_EQ(get(STATE + "/7/router/1/state"), "status 1");
    for (const char *node :
         {"colour", "router/1/colour", "oper/deeper", "router", "appliance", "router/1/appliance"})
        EXPECT_EQ(of_51(node), NOTHING);
    EXPECT_EQ(said("Appliance number (at 9th) not found in " + STATE + "/51/router/1/appliance"), 1);
    EXPECT_EQ(said("MonGet: last_name_part=deeper"), 1);
    EXPECT_EQ(get("/qv/tunneld/system/state/proto_ver"), NOTHING);
    EXPECT_EQ(said("MonGet not for wccpd, bailing - /qv/tunneld/system/state/proto_ver"), 1);
}

TEST_F(DaemonMonitor, TheTexts) {
    const auto holds = [](const std::string &got, const std::string &part) {
        return got.starts_with(one(bn_type_str, "")) && got.find(part) != std::string::npos;
    };
    EXPECT_EQ(get(SYSTEM + "proto_ver"), one(bn_type_str, "2.0"));
    EXPECT_EQ(get(SYSTEM + "is_alive"), one(bn_type_str, "Initializing"));
    EXPECT_TRUE(holds(get(SYSTEM + "debug_global"), "    WCCP # of groups                 : 1\n"));
    EXPECT_TRUE(holds(get(SYSTEM + "debug_all"), "WCCP GROUP ID 51 END"));
    EXPECT_TRUE(holds(of_51("debug"), "WCCP GROUP 51 INFO END"));
    EXPECT_TRUE(holds(of_51("assignment"), "Received router allocation"));

    // Owners: nothing before there is an agreement, then what routers report, then what is computed here.
    const auto is_owners = [](const std::string &text) {
        EXPECT_EQ(of_51("owners"), one(bn_type_str, text));
    };
    is_owners("");
    group->assign_method = WCCP_ASSIGN_HASH;
    add_appliance(2, 100);
    add_appliance(1, 100);
    is_owners("hash members 10.0.0.1 10.0.0.2");
    wccp_sending_router *reporter = add_router(219);
    reporter->view_appliance_count = 3; // the bits of the third are those of an earlier report
    reporter->view_appliances[0] = {address(2), 100, 0, 9, 256, {0xff010000}};
    reporter->view_appliances[1] = {address(1), 100, 0, 1, 256, {0, 0, 0, 0, 0, 0, 0, 0x80}};
    reporter->view_appliances[2] = {address(3), 100, 0, 0, 256, {0x00ff0000}};
    is_owners("hash members 10.0.0.1 10.0.0.2 owners 10.0.0.2*9 0.0.0.0*246 10.0.0.1*1");
    group->designated = group->dsg_active_count = 1;
    group->bucket_count = WCCP_MAX_BUCKETS;
    std::fill_n(group->bucket_ipa, 200, address(1));
    std::fill_n(group->bucket_ipa + 200, 56, address(2));
    is_owners("hash members 10.0.0.1 10.0.0.2 owners 10.0.0.1*200 10.0.0.2*56");
    group->assign_method = WCCP_ASSIGN_MASK; // the table is of another kind, and the router's map unknown
    group->mask_src_ip = 3;
    group->mask_dst_ip = 0;
    reporter->total_buckets = 4;
    is_owners("mask 3 0 0 0 members 10.0.0.1 10.0.0.2");
    reporter->map_in_order = true;
    memset(reporter->view_appliances[0].bucket_bits, 0x05, 1);
    reporter->view_appliances[1].bucket_bits[0] = 0;
    is_owners("mask 3 0 0 0 members 10.0.0.1 10.0.0.2 owners 10.0.0.2*1 0.0.0.0*1 10.0.0.2*1 0.0.0.0*1");
    group->mask_dst_ip = 0x1f10; // too many bits: the mask that the assignment uses instead
    group->designated = 0;
    is_owners("mask 0 f00 0 0 members 10.0.0.1 10.0.0.2 owners 10.0.0.2*1 0.0.0.0*1 10.0.0.2*1 0.0.0.0*13");
    for (uint32_t i = 0; i < WCCP_MAX_BUCKETS; i++) // the longest text fits
        group->bucket_ipa[i] = to_be32(0xfefefe00 + i);
    group->assign_method = WCCP_ASSIGN_HASH;
    group->designated = 1;
    EXPECT_GT(of_51("owners").size(), 16u * 256);

    // Too long: the group's own text comes cut, the others don't come, and nothing fails.
    while (group->sending_router_count < WCCP_MAX_ROUTERS) {
        wccp_sending_router *router = add_router(group->sending_router_count + 20);
        router->view_appliance_count = WCCP_MAX_APPLIANCES;
    }
    const std::string cut = of_51("debug");
    EXPECT_TRUE(holds(cut, "WCCP GROUP 51 INFO START"));
    EXPECT_GT(cut.size(), 16000u);
    EXPECT_LT(cut.size(), 16384u);
    EXPECT_EQ(cut.back(), '\n');
    EXPECT_EQ(of_51("assignment"), NOTHING);
    EXPECT_GT(said(".ERR]"), 1);
    engine.log.clear();
    EXPECT_EQ(get(STATE + "/51/debug", true), cut);
    for (const std::string &each : {STATE + "/51/assignment", SYSTEM + "debug_all"})
        EXPECT_EQ(get(each, true), NOTHING);
    EXPECT_EQ(said(".ERR]"), 0);
    EXPECT_EQ(get(SYSTEM + "debug_all"), NOTHING);
    EXPECT_GE(said(".ERR]"), 1);
    EXPECT_TRUE(holds(get(SYSTEM + "debug_global"), "debug buffer: used"));
}

TEST_F(DaemonMonitor, ReasonsAndCounters) {
    const auto note = [](wccp_service_group *of, wccp_reason_code code, uint32_t sender) {
        wccp_note_reason(of, code, address(sender), wccp_reason_value("gre"), wccp_reason_value("L2"));
    };
    note(group, WCCP_REASON_PASSWORD_MISMATCH, 201);
    note(group, WCCP_REASON_FORWARDING_NOT_OFFERED, 202);
    note(nullptr, WCCP_REASON_GROUP_UNKNOWN, 203);
    wccp_g.seconds += 5;
    note(group, WCCP_REASON_FORWARDING_NOT_OFFERED, 202);
    wccp_g.seconds += 2;
    wccp_forget_reason(group, WCCP_REASON_PASSWORD_MISMATCH, address(201));
    const std::string of_group = children(STATE + "/51/reason"),
                      place = of_group.substr(0, of_group.find(' '));
    EXPECT_EQ(place.size() + 1, of_group.size()) << "one reason, and it keeps its place: " << of_group;
    const std::string at = "reason/" + place + "/";
    EXPECT_EQ(of_51("reason/" + place), one(bn_type_str, place));
    EXPECT_EQ(of_51(at + "code"), one(bn_type_str, "forwarding-not-offered"));
    EXPECT_EQ(of_51(at + "sender"), one(bn_type_ipv4addr, "10.0.0.202"));
    EXPECT_EQ(of_51(at + "offered"), one(bn_type_str, "gre"));
    EXPECT_EQ(of_51(at + "wanted"), one(bn_type_str, "L2"));
    EXPECT_EQ(of_51(at + "count"), one(bn_type_uint32, "2"));
    EXPECT_EQ(of_51(at + "first"), one(bn_type_duration_ms, "7000"));
    EXPECT_EQ(of_51(at + "last"), one(bn_type_duration_ms, "2000"));
    EXPECT_EQ(children(SYSTEM + "reason"), "1 ");
    EXPECT_EQ(get(SYSTEM + "reason/1/code"), one(bn_type_str, "group-unknown"));
    for (const std::string gone : {"0", "40", "41", "4294967297", "x"})
        EXPECT_EQ(of_51("reason/" + gone + "/code"), NOTHING);
    EXPECT_EQ(children(STATE + "/7/reason"), "");
    note(group, WCCP_REASON_ROUTER_SILENT, 202);
    note(group, WCCP_REASON_SEND_FAILED, 202);
    wccp_g.seconds += 61; // nothing repeats it, and what is not repeated stays
    EXPECT_EQ(children(SYSTEM + "reason"), "");
    EXPECT_EQ(get(SYSTEM + "reason/1/code"), NOTHING);
    EXPECT_EQ(of_51("reason/1/code"), one(bn_type_str, "router-silent"));
    EXPECT_EQ(children(STATE + "/51/reason").size(), 4u);

    group->start_time = wccp_g.seconds - 9;
    group->rx_icu_failures = 4294967295;
    EXPECT_EQ(of_51("since"), one(bn_type_duration_ms, "9000"));
    EXPECT_EQ(of_51("pending_acks"), one(bn_type_uint32, "0"));
    EXPECT_EQ(of_51("counter/rx_icu_failures"), one(bn_type_uint32, "4294967295"));
    EXPECT_EQ(of_51("counter/weight"), NOTHING);
    for (const char *word : {"rx_icu_failures ", "rx_removal_failures ", "tx_build_failures ",
                             "tx_link_drops ", "routers_timed_out "})
        EXPECT_NE(children(STATE + "/51/counter").find(word), std::string::npos) << word;
    engine.interface->link_down_count = 3;
    EXPECT_EQ(children(SYSTEM + "interface"), "lan0 ");
    EXPECT_EQ(get(SYSTEM + "interface/lan0/link_downs"), one(bn_type_uint32, "3"));
    EXPECT_EQ(get(SYSTEM + "interface/lan0/address"), one(bn_type_ipv4addr, "10.0.0.1"));
    EXPECT_EQ(get(SYSTEM + "interface/lan1/link_downs"), NOTHING);
    EXPECT_EQ(said(".ERR]"), 0);
}

TEST_F(DaemonMonitor, WhatIsListed) {
    add_group(200);
    add_group(0);
    wccp_sending_router *second = add_router(201);
    add_router(202);
    second->view_appliance_count = 2;
    second->view_appliances[0].ipa = address(9);
    second->view_appliances[1].ipa = address(1);
    EXPECT_EQ(children(STATE), "0 51 200 ");
    EXPECT_EQ(children(STATE + "/51/router"), "1 2 ");
    EXPECT_EQ(children(STATE + "/51/router/2/appliance"), "10.0.0.9 10.0.0.1 ");
    EXPECT_EQ(children(STATE + "/51/router/1/appliance"), "");
    EXPECT_EQ(children(STATE + "/200/router"), "");
    EXPECT_EQ(children(STATE + "/51"), "");
    EXPECT_EQ(children(STATE + "/51/appliance"), "");
    EXPECT_EQ(children(STATE + "/7/router"), "");
    EXPECT_EQ(said("wccp_get_router_list: failed: status=1"), 1);
    EXPECT_EQ(children(STATE + "/51/router/3/appliance"), "");
    EXPECT_EQ(said("wccp_get_router_appliance_list failed: status=1"), 1);
    EXPECT_EQ(said("iterate " + STATE + "/51/router/2/appliance"), 1);
}

} // namespace
