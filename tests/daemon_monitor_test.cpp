// The monitoring tree over an engine without threads: the type and value of every node, what is listed, and
// the answers for groups, routers and nodes that do not exist.
#include "daemon/wccpd_monitor.h"
#include "runtime/list.h"

#include "tests/support/daemon_engine.h"

namespace {
const std::string STATE = "/qv/wccpd/wccp/srv_grp/state", SYSTEM = "/qv/wccpd/system/state/";

// Type and text of the one binding that answers, "uint32 2" for example.
std::string get_value(const std::string &name, bool in_walk = false) {
    static const std::map<uint32_t, std::string> types = {{bn_type_str, "str "},
                                                          {bn_type_uint32, "uint32 "},
                                                          {bn_type_ipv4addr, "ipv4addr "},
                                                          {bn_type_duration_ms, "ms "}};
    owner<tstr_array, tstr_array_free> parts;
    EXPECT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, nullptr), LC_OK);
    binding_list out;
    wccpd_mon_request request = {in_walk, false};
    const lc_status status = wccpd_mon_handle_get(name.c_str(), parts, &request, out.array);
    const uint32_t count = bn_binding_array_length_quick(out.array);
    if (status != LC_OK || count != 1)
        return status ? "status " + std::to_string(status) : count ? "several" : "nothing";
    uint32_t type = 0;
    EXPECT_EQ(bn_binding_get_name_quick(out.last()), name);
    EXPECT_EQ(bn_binding_get_type(out.last(), bn_attrib_value, &type, nullptr), LC_OK);
    return types.at(type) + text_of([&](char **value) {
               return bn_binding_get_str(out.last(), bn_attrib_value, 0, nullptr, value);
           });
}
std::string child_names(const std::string &name) {
    owner<tstr_array, tstr_array_free> parts, names;
    EXPECT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, nullptr), LC_OK);
    EXPECT_EQ(tstr_array_new(&names, nullptr), LC_OK);
    EXPECT_EQ(wccpd_mon_handle_iterate(name.c_str(), parts, nullptr, names), LC_OK);
    std::string list;
    for (uint32_t i = 0; i < tstr_array_length_quick(names); i++)
        list += (i ? " " : "") + std::string(tstr_array_get_str_quick(names, i));
    return list;
}

struct DaemonMonitor : daemon_test {
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
    // The text of a node below group 51.
    static std::string of_51(const std::string &node) { return get_value(STATE + "/51/" + node); }
    // "NODE VALUE; NODE VALUE" and so on. Nodes are below group 51, with a dot below the system, with a slash
    // below the state of all groups. The value of NODE/* is the list of its children.
    static void are(const std::string &wanted) {
        for (size_t at = 0, end; at < wanted.size(); at = end + 2) {
            end = std::min(wanted.find("; ", at), wanted.size());
            const std::string node = wanted.substr(at, wanted.find(' ', at) - at);
            const std::string name = node[0] == '.'   ? SYSTEM + node.substr(1)
                                     : node[0] == '/' ? STATE + node
                                                      : STATE + "/51/" + node;
            EXPECT_EQ(name.ends_with("/*") ? child_names(name.substr(0, name.size() - 2)) : get_value(name),
                      wanted.substr(at + node.size() + 1, end - at - node.size() - 1))
                << node;
        }
    }
};

TEST_F(DaemonMonitor, Group) {
    add_router(201);
    add_router(202);
    add_appliance(1, 100);
    add_appliance(2, 65535);
    are("oper str INIT; uptime ms 0; app_id str 10.0.0.1; num_routers uint32 2; num_appliances uint32 2; "
        "appliance/1/ipaddr ipv4addr 10.0.0.2; appliance/1/weight uint32 65535; "
        "appliance/2/ipaddr ipv4addr 10.0.0.1; "
        "appliance/3/ipaddr ipv4addr 0.0.0.0; appliance/3/weight uint32 0"); // does not exist
    group->state_flags = WCCP_STATE_ACTIVE;
    group->designated = 1;
    wccp_g.seconds = group->state_time + 5000000;                  // in milliseconds more than 32 bits
    are("uptime ms 5000000000; /307/oper str ACTIVE, DESIGNATED"); // 307 in 8 bits is 51
    group->state_flags = group->designated = 0;
    are("oper str not-set");
}

TEST_F(DaemonMonitor, RoutersByTheirPlaceInTheList) {
    wccp_sending_router *second = add_router(201), *first = add_router(202);
    first->state_time = wccp_g.seconds - 7;
    first->last_icu_time = wccp_g.seconds - 3;
    first->flags = WCCP_RTR_TWO_WAY;
    second->flags = WCCP_RTR_ONE_WAY;
    group->fwd_method = WCCP_METHOD_L2;
    group->ret_method = WCCP_METHOD_GRE;
    are("router/1/heard ms 3000; router/1/id ipv4addr 10.0.0.202; router/1/ipaddr ipv4addr 10.0.0.212; "
        "router/1/conn_time ms 7000; router/1/state str TWO-WAY connected; router/2/id ipv4addr 10.0.0.201; "
        "router/2/state str ONE-WAY connected; router/1/fwd_method str not-set; "
        "router/1/ret_method str not-set; router/1/assign_method str not-set");
    group->state_flags |= WCCP_CAPABILITIES_SET;
    are("router/1/fwd_method str L2; router/1/ret_method str GRE; router/1/assign_method str not set");
    group->assign_method = WCCP_ASSIGN_MASK;
    are("router/2/assign_method str MASK");
    for (const std::string number : {"0", "3", "4294967296"}) // do not exist
        are("router/" + number + "/state str ; router/" + number + "/id ipv4addr 0.0.0.0");

    first->view_appliance_count = 2;
    first->view_appliances[0] = {address(2), 100, 0, 0, 256, {}};
    first->view_appliances[1] = {address(1), 100, 0, 85, 256, {}};
    are("router/1/appliance/10.0.0.1/load_dist uint32 33; router/1/appliance/10.0.0.2/load_dist uint32 0");
    first->view_appliances[1].buckets_total = 0;
    are("router/1/appliance/10.0.0.1/load_dist uint32 0; router/1/appliance/10.0.0.3/load_dist nothing; "
        "router/1/appliance/nobody/load_dist nothing");
    EXPECT_EQ(said("wccp_get_router_appliance_info: failed: status=1"), 2); // the second is 14020

    add_group(200);
    add_group(0);
    are("/* 0 51 200; router/* 1 2; router/1/appliance/* 10.0.0.2 10.0.0.1; /51/* ; /200/router/* ; "
        "router/2/appliance/* ; appliance/* ; /7/router/* ; router/3/appliance/* ");
    EXPECT_EQ(said("wccp_get_router_list: failed: status=1"), 1);
    EXPECT_EQ(said("wccp_get_router_appliance_list failed: status=1"), 1);
}

TEST_F(DaemonMonitor, ParentsAndAbsentNodes) {
    are("/51 str 51; /7/router/99 str 99; /7/router/1/appliance/10.0.0.9 str 10.0.0.9");
    EXPECT_EQ(said("cannot find group"), 0); // the engine is not asked for a parent
    are("/7/oper nothing; /7/debug nothing; /7/appliance/1/weight nothing; /7/router/1/state status 1; "
        "colour nothing; router/1/colour nothing; oper/deeper nothing; router nothing; appliance nothing; "
        "router/1/appliance nothing");
    EXPECT_EQ(get_value("/qv/tunneld/system/state/proto_ver"), "nothing");
    EXPECT_EQ(said("wccp_get_grp_info failed: 1"), 3);
    EXPECT_EQ(said("MonGet not for wccpd, bailing - /qv/tunneld/system/state/proto_ver"), 1);
}

TEST_F(DaemonMonitor, Dumps) {
    const auto holds = [](const std::string &got, const std::string &part) {
        EXPECT_TRUE(got.starts_with("str ") && got.find(part) != std::string::npos) << part;
    };
    are(".proto_ver str 2.0; .is_alive str Initializing");
    holds(get_value(SYSTEM + "debug_global"), "    WCCP # of groups                 : 1\n");
    holds(get_value(SYSTEM + "debug_all"), "WCCP GROUP ID 51 END");
    holds(of_51("debug"), "WCCP GROUP 51 INFO END");
    holds(of_51("assignment"), "Received router allocation");
    // Too long: the group's own text is cut, the others have no value, and nothing fails.
    while (group->sending_router_count < WCCP_MAX_ROUTERS)
        add_router(group->sending_router_count + 20)->view_appliance_count = WCCP_MAX_APPLIANCES;
    const std::string cut = of_51("debug");
    holds(cut, "WCCP GROUP 51 INFO START");
    EXPECT_TRUE(cut.size() > 16000 && cut.size() < 16384 && cut.back() == '\n');
    are("assignment nothing");
    EXPECT_GT(said(".ERR]"), 1);
    log.clear();
    EXPECT_EQ(get_value(STATE + "/51/debug", true), cut); // in a walk that is no error
    for (const std::string &each : {STATE + "/51/assignment", SYSTEM + "debug_all"})
        EXPECT_EQ(get_value(each, true), "nothing");
    EXPECT_EQ(said(".ERR]"), 0);
    are(".debug_all nothing");
    EXPECT_GE(said(".ERR]"), 1);
    holds(get_value(SYSTEM + "debug_global"), "debug buffer: used");
}

// None until there is an agreement, then what routers report, then what this appliance has computed.
TEST_F(DaemonMonitor, Owners) {
    const auto is_owners = [](const std::string &text) { EXPECT_EQ(of_51("owners"), "str " + text); };
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
    group->assign_method = WCCP_ASSIGN_MASK; // the table has another size, and the router's map is unknown
    group->mask_src_ip = 3;
    group->mask_dst_ip = 0;
    reporter->total_buckets = 4;
    is_owners("mask 3 0 0 0 members 10.0.0.1 10.0.0.2");
    reporter->map_in_order = true;
    memset(reporter->view_appliances[0].bucket_bits, 0x05, 1);
    reporter->view_appliances[1].bucket_bits[0] = 0;
    is_owners("mask 3 0 0 0 members 10.0.0.1 10.0.0.2 owners 10.0.0.2*1 0.0.0.0*1 10.0.0.2*1 0.0.0.0*1");
    group->mask_dst_ip = 0x1f10; // too many bits: the default mask
    group->designated = 0;
    is_owners("mask 0 f00 0 0 members 10.0.0.1 10.0.0.2 owners 10.0.0.2*1 0.0.0.0*1 10.0.0.2*1 0.0.0.0*13");
    for (uint32_t i = 0; i < WCCP_MAX_BUCKETS; i++) // the longest text fits
        group->bucket_ipa[i] = to_be32(0xfefefe00 + i);
    group->assign_method = WCCP_ASSIGN_HASH;
    group->designated = 1;
    EXPECT_GT(of_51("owners").size(), 16u * 256);
}

TEST_F(DaemonMonitor, ReasonsCountersAndInterfaces) {
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
    are("reason/* 2; reason/2 str 2; reason/2/code str forwarding-not-offered; "
        "reason/2/sender ipv4addr 10.0.0.202; reason/2/offered str gre; reason/2/wanted str L2; "
        "reason/2/count uint32 2; reason/2/first ms 7000; reason/2/last ms 2000; .reason/* 1; "
        ".reason/1/code str group-unknown; /7/reason/* ; reason/0/code nothing; reason/40/code nothing; "
        "reason/41/code nothing; reason/4294967297/code nothing; reason/x/code nothing");
    note(group, WCCP_REASON_ROUTER_SILENT, 202);
    note(group, WCCP_REASON_SEND_FAILED, 202);
    wccp_g.seconds += 61; // most reasons that come from packets end when they are not repeated
    are(".reason/* ; .reason/1/code nothing; reason/1/code str router-silent; reason/* 1 3");

    group->start_time = wccp_g.seconds - 9;
    group->rx_icu_failures = 4294967295;
    interface->link_down_count = 3;
    are("since ms 9000; pending_acks uint32 0; counter/rx_icu_failures uint32 4294967295; "
        "counter/weight nothing; .interface/lan0/link_downs uint32 3; "
        ".interface/lan0/address ipv4addr 10.0.0.1; .interface/lan1/link_downs nothing; .interface/* lan0");
    const std::string counters = child_names(STATE + "/51/counter") + " ";
    for (const char *word : {"rx_icu_failures ", "rx_removal_failures ", "tx_build_failures ",
                             "tx_link_drops ", "routers_timed_out "})
        EXPECT_NE(counters.find(word), std::string::npos) << word;
    EXPECT_EQ(said(".ERR]"), 0);
}

} // namespace
