// Message processing: how far each packet gets and which counters it moves, what an I-See-You changes in a
// group, and what is sent. The test calls the ticks, and receives what is sent on the sockets of its routers.

#include "engine/wccp_pkt_mgr.h"

#include "engine/wccp_complaints.h"
#include "engine/wccp_router_utils.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/reported_group.h"
#include "tests/support/router_messages.h"

namespace {

using bytes = std::vector<uint8_t>;
using numbers = std::vector<uint32_t>;

const wire_bytes security = security_info();
wire_bytes service_part(uint32_t id = 51, uint32_t priority = 200, uint32_t protocol = 6,
                        uint32_t flags = 0x13) {
    return service_info(id, priority, protocol, flags);
}
wire_bytes identity_part(uint32_t router, uint32_t receive_id = 0xa1a2a3a4) {
    return router_identity(host(router), host(100), receive_id);
}
struct element {
    uint32_t id, weight, bucket_byte;
};
// A view of one router.
wire_bytes view(uint32_t router, const std::vector<element> &elements, uint32_t key = 0,
                uint32_t owner = 100) {
    std::vector<hash_element> seen;
    for (const element &each : elements)
        seen.push_back(element_of(host(each.id), each.weight, each.bucket_byte));
    return router_view({host(router)}, seen, host(owner), key);
}
// The same with mask elements that redirect, in the IOS form.
wire_bytes mask_view(uint32_t router, const std::vector<uint32_t> &ids) {
    wire_bytes out = hex("0004 0000 00000001 0a000064 00000000 00000001").ip(0, router);
    out.u32(static_cast<uint32_t>(ids.size()));
    for (const uint32_t id : ids)
        out.ip(0, id).hex("0000 0002 00000000 0064 0000");
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
wire_bytes map_part(const std::vector<uint32_t> &ids) {
    wire_bytes out = hex("000e 0000 00000001 00001741 00000f00 0001 0002");
    out.u32(static_cast<uint32_t>(ids.size()));
    for (const uint32_t id : ids)
        out.u32(id).u32(0).u32(0).ip(0, id);
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
const wire_bytes by_hash = capability_info(2, 1, 2), by_mask = capability_info(2, 2, 2),
                 odd_unknown = hex("0063 0003 eeeeee"),
                 odd_command = hex("000f 000d 0001 0004 0a000001 ee*5");

bytes make_icu(uint32_t router, const wire_bytes &its_view, const std::vector<wire_bytes> &more = {by_hash}) {
    std::vector<wire_bytes> components = {security, service_part(), identity_part(router), its_view};
    components.insert(components.end(), more.begin(), more.end());
    return wire_message(11, components);
}
bytes make_query(uint32_t router, uint32_t target) {
    return wire_message(13, {security, service_part(),
                             hex("0007 0010").ip(0, router).hex("00000099 0a000064").ip(0, target)});
}

struct Messages : testing::Test {
    void SetUp() override {
        for (const char *router : {"10.0.0.1", "10.0.0.2"})
            engine.router_socket(router);
        group = engine.add_group(engine_fixture::group_config(51, {"10.0.0.1", "10.0.0.2"}));
        group->priority = 200;
        group->protocol = 6;
        group->service_flags = 0x13;
    }
    static int process(const bytes &message, be32 from = host(1)) {
        return wccp_process_received_packet(make_received(message, from).get());
    }
    wccp_sending_router *router(uint32_t id) const { return wccp_find_sending_router(group, host(id)); }
    engine_fixture engine;
    wccp_service_group *group = nullptr;
};

// For each packet: the result, and all counters that it moves.
TEST_F(Messages, EachFaultIsCountedInItsPlace) {
    // all, group; I-See-Yous, failed; queries, failed; security mismatches, service mismatches
    const numbers none(8, 0), all = {1, 0, 0, 0, 0, 0, 0, 0}, bad_option = {1, 1, 0, 0, 0, 0, 1, 0},
                              icu_alone = {0, 0, 1, 0, 0, 0, 0, 0}, bad_icu = {0, 0, 1, 1, 0, 0, 0, 0},
                              bad_service = {0, 0, 1, 1, 0, 0, 0, 1}, query_alone = {0, 0, 0, 0, 1, 0, 0, 0},
                              bad_query = {0, 0, 0, 0, 1, 1, 0, 0};
    const bytes good = make_icu(1, view(1, {{100, 100, 0}}));
    const auto changed = [&good](size_t at, uint8_t value) {
        bytes out = good;
        out.at(at) = value;
        return out;
    };
    const auto with = [](const std::vector<wire_bytes> &components) { return wire_message(11, components); };
    const auto service = [&](uint32_t priority, uint32_t protocol, uint32_t flags) {
        return with({security, service_part(51, priority, protocol, flags), identity_part(1)});
    };
    const auto optional = [](const std::vector<wire_bytes> &more) { return make_icu(1, view(1, {}), more); };
    bytes longer = good, router_0 = make_icu(0, view(1, {}));
    longer.push_back(0);
    memset(&router_0[8 + 8 + 28 + 4], 0, 4);
    const struct {
        bytes message;
        int result;
        numbers moved;
        std::string line;
        std::string reason = "message-malformed 10.0.0.1: "; // part of the reasons
    } rows[] = {
        {bytes(7, 0), 1, all, "WCCP: unloading msg header failed.", "10.0.0.1: a header of 7 bytes|8 bytes"},
        {longer, 0, none, "do not match. sender ip: 10.0.0.1",
         "message-length 10.0.0.1: 168 bytes by its header|169 bytes were received"},
        {bytes(good.begin(), good.end() - 1), 0, none,
         "header length (160) and actual packet length (167) do not match. sender ip: 10.0.0.1", "-length"},
        {changed(4, 1), 0, none, "WCCP rxed verion (256) is not supported. sender ip: 10.0.0.1",
         "message-version 10.0.0.1: 0x100|0x200"},
        {changed(3, 10), 0, none, "10.0.0.1", "message-type 10.0.0.1: type 10|11 or 13"}, // a Here-I-Am
        {changed(0, 1), 0, none, "10.0.0.1", "message-type"}, // a type of more than 16 bits
        {with({}), 1, all, "WCCP: unloading security info failed."},
        {with({security}), 1, all, "WCCP: unloading service info failed."},
        {with({security, service_part(52)}), 1, all,
         "WCCP GRP 52: rxed service group (52) is not configured.", "group-unknown 10.0.0.1: group 52|"},
        {changed(15, 2), 1, bad_option, "WCCP GRP 51: rxed mismatch security opt: 2 configured opt: 0",
         "security-unwanted 10.0.0.1: option 2|none"},
        {with({security, service_part()}), 0, bad_icu, "WCCP: unloading router identity failed."},
        {with({security, service_part(), identity_part(1)}), 0, bad_icu,
         "WCCP: unloading router view failed."},
        {service(201, 17, 3), 0, bad_service,
         "WCCP GRP 51: service group config mismatch (router id: 10.0.0.1) .priority: rxed = 201 local = "
         "200, protocol: rxed = 17 local = 6, service flags: rxed = 0x3 local =  0x13",
         "service-mismatch 10.0.0.1: priority 201, protocol 17, flags 0x3|priority 200, protocol 6, flags "
         "0x13"},
        {service(199, 6, 0x13), 0, bad_service, "config mismatch", "service-"},
        {service(200, 17, 0x13), 0, bad_service, "config mismatch", "service-"},
        {service(200, 6, 0x80000013), 0, bad_service, "config mismatch"},
        {optional({hex("000e 0000")}), 0, bad_icu, "WCCP: unloading assignment map failed."},
        {optional({hex("000f 0000")}), 0, bad_icu, "WCCP: unloading command ext comp. failed."},
        {optional({hex("0008 0004 00000000")}), 0, bad_icu, "WCCP: unloading capability comp. failed."},
        {optional({hex("0063 0001")}), 0, bad_icu, "WCCP: unloading unknown component failed."},
        {optional({hex("0063")}), 0, bad_icu, "component type: 99 length 0 "},
        {optional({by_hash, odd_command, odd_unknown, odd_unknown}), 0, bad_icu,
         "WCCP GRP 51: ICU bogus packet  (too many optional components).",
         "message-malformed 10.0.0.1: 4 optional components|3 at most"},
        {optional({}), 0, icu_alone, "incompatible capabilities", "forwarding-not-offered 10.0.0.1: gre|L2"},
        {optional({capability_info(2, 1, 0)}), 0, bad_icu, "incompatible capabilities",
         "return-not-offered 10.0.0.1: none|gre or L2"},
        {router_0, 0, icu_alone, "", "router-id-zero: |"},
        {wire_message(13, {security, service_part()}), 0, bad_query, "WCCP: unloading router query failed."},
        {make_query(1, 100), 0, query_alone,
         "removal query request. cannot find router. (router id 10.0.0.1)",
         "query-refused 10.0.0.1: a query before an I-See-You|"},
        {make_query(1, 101), 0, query_alone,
         "not for us. sending router id: 10.0.0.1 target appliance: 10.0.0.101", ""},
    };
    const auto now = [this] {
        return numbers{wccp_g.rx_failures,        group->rx_failures,          group->rx_icus,
                       group->rx_icu_failures,    group->rx_removal_queries,   group->rx_removal_failures,
                       group->rx_auth_mismatches, group->rx_service_mismatches};
    };
    log_lines log;
    for (const auto &row : rows) {
        SCOPED_TRACE("row " + std::to_string(&row - rows));
        numbers expected = now();
        for (size_t i = 0; i < expected.size(); i++)
            expected[i] += row.moved[i];
        log.take();
        EXPECT_EQ(process(row.message), row.result);
        EXPECT_EQ(now(), expected);
        EXPECT_EQ((numbers{group->sending_router_count, group->router_view_count, group->appliance_view_count,
                           group->change_number, group->fwd_method, group->state_flags}),
                  (numbers{0, 0, 0, 0, 0, WCCP_STATE_INIT}))
            << "the group is unchanged";
        const std::string reasons = take_reasons(group) + take_reasons(nullptr);
        EXPECT_NE(reasons.find(row.reason), std::string::npos) << reasons;
        EXPECT_EQ(reasons.empty(), row.reason.empty()) << reasons;
        const std::string lines = log.take();
        EXPECT_NE(lines.find(row.line), std::string::npos) << lines;
        EXPECT_EQ(count_of("processing received packet from 10.0.0.1 failed", lines), row.result);
    }
    const numbers before = now();
    for (const uint32_t state : {0u, WCCP_ADMIN_DOWN + 0u, WCCP_ADMIN_UP + 0u}) {
        EXPECT_EQ(now(), before);
        group->admin_state = state;
        EXPECT_EQ(process(good), 0);
        EXPECT_EQ(log.say("GRP 51: is disabled. dropping the rxed packet."), state != WCCP_ADMIN_UP);
    }
    EXPECT_NE(router(1), nullptr) << "the message itself is valid";
}

// Each bad packet causes two complaints; how many are logged, tick by tick.
TEST_F(Messages, ComplaintsAreBoundedForEachInterface) {
    log_lines log;
    lc_log_set_daemon_log_level(LC_LOG_WARNING);
    wccp_interface other = {};
    const auto lines_of = [&log](wccp_interface *interface, int packets, uint32_t seconds) {
        std::string lines;
        for (; packets > 0; packets--) {
            const wccp_complaint_scope complaints(interface);
            EXPECT_EQ(process(bytes(7, 0)), 1);
            lines += log.take();
        }
        pass_seconds(seconds);
        lines += log.take();
        const size_t at = lines.rfind("wan0: ");
        return std::to_string(count_of("unloading", lines) + count_of("received packet", lines)) +
               (at == std::string::npos ? "" : " " + lines.substr(at, lines.find(" more", at) - at));
    };
    wccp_interface *const wan0 = engine.interface;
    EXPECT_EQ(lines_of(wan0, 150, 1), "200"); // the burst
    EXPECT_EQ(lines_of(wan0, 15, 1), "20");   // the refill of a second
    EXPECT_EQ(lines_of(&other, 5, 0), "10");
    EXPECT_EQ(lines_of(wan0, 5, 1), "11 wan0: 110"); // the flood is over
    EXPECT_EQ(lines_of(wan0, 0, 100), "0");
    EXPECT_EQ(lines_of(wan0, 101, 0), "200"); // a whole burst again
    EXPECT_EQ(process(bytes(7, 0)), 1);
    EXPECT_TRUE(log.say("unloading msg header")) << "outside the scope";
    lc_log_set_daemon_log_level(LC_LOG_INFO);
    {
        const wccp_complaint_scope complaints(wan0);
        EXPECT_EQ(process(make_icu(1, view(1, {}))), 0);
    }
    EXPECT_TRUE(log.say("created ICU sending router")) << "which is not a complaint";
    lc_log_set_daemon_log_level(LC_LOG_WARNING);
    // A lasting flood is reported every minute, and the report counts as a line.
    pass_seconds(1);
    for (int second = 1; second < 59; second++)
        ASSERT_EQ(lines_of(wan0, 11, 1), "20") << second;
    EXPECT_EQ(lines_of(wan0, 11, 1), "21 wan0: 120");
    EXPECT_EQ(lines_of(wan0, 11, 1), "19");
    EXPECT_EQ(wccp_g.rx_failures, 150u + 15 + 5 + 5 + 101 + 1 + 60 * 11);
}

// Failures while a valid packet is processed can be repeated as often as invalid packets.
TEST_F(Messages, FailuresCausedByValidPacketsAreComplaintsToo) {
    const auto varied = [](uint32_t i) { // with an appliance that the other router does not list
        return make_icu(1, view(1, {{101 + i % 100, 1, 0}, {100, i % 2 + 1, 0}}), {by_mask});
    };
    for (const uint32_t id : {1u, 2u})
        process(make_icu(id, view(id, {{100, 100, 0}}), {by_mask}));
    group->mask_bits = WCCP_MAX_MASK_BITS + 1;
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    const std::pair<const char *, std::function<bytes(uint32_t)>> rows[] = {
        {"mask assignment: too many bits", varied},
        {"is not in all sending router views", varied},
        {"failed to add tunnel",
         [this](uint32_t i) {
             group->ret_method = WCCP_METHOD_GRE;
             return make_icu(3 + i % 60, view(3, {}), {capability_info(2, 2, 1)});
         }},
        {"here-i-am: loading web-cache view info failed.",
         [this](uint32_t) {
             group->appliance_view_count = 1000; // more than exist
             return make_query(1, 100);
         }},
    };
    log_lines log;
    lc_log_set_daemon_log_level(LC_LOG_NOTICE);
    for (const auto &[line, packet] : rows) {
        wccp_interface wan0 = {};
        int with_line = 0, lines = 0;
        for (uint32_t i = 0; i < 400; i++) {
            const wccp_complaint_scope complaints(&wan0);
            process(packet(i));
            const std::string logged = log.take();
            with_line += count_of(line, logged) > 0;
            lines += count_of("TID ", logged);
        }
        EXPECT_GT(with_line, 50) << line;
        EXPECT_LE(lines, 200) << line;
    }
}

TEST_F(Messages, AnISeeYouUpdatesRouterAndViews) {
    wccp_g.seconds = 77;
    constexpr uint32_t L2 = WCCP_METHOD_L2, HASH = WCCP_ASSIGN_HASH;
    const wire_bytes seen = view(1, {{100, 100, 0x01}, {101, 50, 0xff}}, 5);
    // Odd lengths put the capabilities at odd addresses.
    EXPECT_EQ(process(make_icu(1, seen, {odd_unknown, odd_command, by_hash}), host(7 << 8 | 7)), 0);
    EXPECT_EQ(take_reasons(group), "");
    const wccp_sending_router *made = router(1);
    ASSERT_NE(made, nullptr);
    const auto now = [&] {
        return numbers{to_host(made->receive_id),  to_host(made->change_number),
                       made->last_icu_time,        made->view_router_count,
                       made->view_appliance_count, made->self_buckets,
                       made->total_buckets,        group->fwd_method,
                       group->assign_method,       group->rx_service_mismatches,
                       group->rx_icu_failures};
    };
    EXPECT_EQ(now(), (numbers{0xa1a2a3a4, 0xc1c2c3c4, 77, 1, 2, 32, 256, L2, HASH, 0, 0}));
    EXPECT_EQ(made->src_ipa, host(7 << 8 | 7));
    EXPECT_TRUE(made->flags & WCCP_RTR_TWO_WAY && group->state_flags & WCCP_STATE_ACTIVE);
    // Another service is only counted.
    wccp_g.seconds = 78;
    EXPECT_EQ(process(wire_message(11, {security, service_part(51, 1), identity_part(1, 9), view(1, {})})),
              0);
    EXPECT_EQ(now(), (numbers{9, 0xc1c2c3c4, 78, 1, 0, 0, 0, L2, HASH, 1, 0}));
}

TEST_F(Messages, AMapIsStoredInTheRoutersReport) {
    // 102 is not in the view, and the view has 100 twice.
    const std::vector<uint32_t> owners = {100, 100, 101, 102, 102, 100, 101, 101, 101, 100};
    EXPECT_EQ(process(make_icu(1, mask_view(1, {100, 101, 100}), {odd_unknown, map_part(owners), by_mask})),
              0);
    EXPECT_EQ(take_reasons(group), "mask-differs 10.0.0.1: src 0x1741 dst 0xf00 ports 0x1 0x2|src 0x0 dst "
                                   "0x0 ports 0x0 0x0");
    const wccp_sending_router *made = router(1);
    ASSERT_NE(made, nullptr);
    const auto bits = [made](uint32_t entry) {
        uint8_t out[32];
        memcpy(out, made->view_appliances[entry].bucket_bits, sizeof out);
        return out[0] | out[1] << 8 | out[2] << 16 | out[31] << 24;
    };
    EXPECT_EQ((numbers{made->map_src_ip, made->map_dst_ip, made->map_src_port, made->self_buckets,
                       made->total_buckets, made->view_appliances[0].buckets_assigned,
                       made->view_appliances[0].buckets_total, made->view_appliance_count}),
              (numbers{0x1741, 0xf00, 0, 4, 10, 4, 10, 2}));
    EXPECT_TRUE(bits(0) == 0b1000100011 && bits(1) == 0b0111000100 && !made->map_in_order);
    EXPECT_TRUE(group->state_flags & WCCP_STATE_ACTIVE && group->rx_icu_failures == 0);

    // The next map replaces it. Even with the group's masks the values can be in another order.
    group->mask_src_ip = 0x41;
    group->mask_dst_ip = 0x100;
    group->mask_src_port = group->mask_dst_port = 0;
    const std::pair<numbers, bool> orders[] = {
        {{0x00100, 0x10000, 0x10100}, false}, {{0, 0x00100, 0x10000}, true}, {{0, 0x10000}, false}};
    for (const auto &[values, in_order] : orders) {
        wire_bytes ordered = hex("000e 0000 00000001 00000041 00000100 00000000");
        ordered.u32(static_cast<uint32_t>(values.size()));
        for (const uint32_t value : values) // one bit of the source and one of the destination
            ordered.u32(value >> 16).u32(value & 0x100).u32(0).ip(0, 101);
        ordered.put16(2, static_cast<uint32_t>(ordered.size() - 4));
        EXPECT_EQ(process(make_icu(1, mask_view(1, {100, 101}), {ordered})), 0);
        EXPECT_EQ(made->map_in_order, in_order);
    }
    // The largest one.
    const size_t others = make_icu(1, mask_view(1, {100, 101}), {map_part({})}).size();
    numbers largest((WCCP_MAX_PACKET - others) / 16, 101);
    largest.back() = 100;
    EXPECT_EQ(process(make_icu(1, mask_view(1, {100, 101}), {map_part(largest)})), 0);
    EXPECT_TRUE(made->self_buckets == 1 && made->total_buckets == largest.size() && largest.size() > 240);
    EXPECT_EQ(process(make_icu(1, mask_view(1, {100, 101}), {map_part({101, 100})})), 0);
    EXPECT_TRUE(bits(0) == 0b10 && bits(1) == 0b01 && made->self_buckets == 1 && !made->map_in_order);

    // A map without mask elements is refused, alone or after a full one, after the views have been
    // updated. Without a map the earlier bits stay.
    const wire_bytes empty = hex("000e 0024 00000000"), rest = hex("0063 001c").zeros(28);
    const bytes messages[] = {make_icu(1, mask_view(1, {100}), {empty, rest}),
                              make_icu(1, mask_view(1, {100, 101}), {map_part({100, 100}), empty, rest})};
    for (uint32_t i = 0; i < 2; i++) {
        EXPECT_EQ(process(messages[i]), 0);
        EXPECT_TRUE(group->rx_icu_failures == i + 1 && made->view_appliance_count == i + 1 &&
                    made->self_buckets == 1 && bits(0) == 0b10);
    }

    // Hash elements when mask was agreed.
    take_reasons(group);
    process(make_icu(2, view(2, {{101, 50, 0xff}}), {by_mask}));
    EXPECT_EQ(take_reasons(group), "method-differs 10.0.0.2: hash by the router|mask x2; "
                                   "not-in-view 10.0.0.2: 1 appliance|10.0.0.100");
}

TEST_F(Messages, AKeyIsAnAcknowledgementFromTheSecondAssignmentOn) {
    const auto report = [](uint32_t id, uint32_t key, uint32_t address = 100) {
        process(make_icu(id, view(id, {{100, 100, 0}}, key, address)));
    };
    report(1, 0);
    report(2, 0);
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    const uint32_t key = group->dsg_key_change;
    // Seconds that pass, router, key and its appliance; then assignments sent, acknowledged, pending, timer.
    const std::tuple<uint32_t, uint8_t, uint32_t, uint32_t, uint32_t, bool, int, int> steps[] = {
        {15, 1, key, 100, 1, false, 2, 1}, // the first assignment alone does not count
        {10, 1, key - 1, 100, 2, false, 2, 1},
        {0, 1, key, 101, 2, false, 2, 1}, // another appliance's key
        {0, 1, key, 100, 2, true, 1, 1},
        {0, 1, key, 100, 2, true, 1, 1}, // one router acknowledges once
        {0, 2, key, 100, 2, true, 0, 0},
    };
    for (const auto &[seconds, id, its_key, owner, assignments, acked, pending, timer] : steps) {
        pass_seconds(seconds);
        report(id, its_key, owner);
        EXPECT_EQ(std::tuple(group->tx_redirect_assign, !(router(id)->flags & WCCP_RTR_ASSIGN_UNACKED),
                             group->pending_acks, group->assign_timer.active),
                  std::tuple(assignments, acked, pending, timer));
        const std::string reasons = take_reasons(group);
        EXPECT_EQ(count_of("|table 10.0.0.100 number 1", reasons), assignments > 1 && !acked) << reasons;
    }
    // With no acknowledgements pending, the timer stops and the count does not wrap.
    router(1)->flags |= WCCP_RTR_ASSIGN_UNACKED;
    group->assign_timer.active = 1;
    report(1, key);
    EXPECT_TRUE(group->pending_acks == 0 && group->assign_timer.active == 0);
}

TEST_F(Messages, TheDigestDecides) {
    group->security_option = 1;
    memcpy(group->password, "secret\0", 8);
    // Computed by md5sum over the 8 bytes of the password and the message with a zero digest.
    const wire_bytes signature = hex("0000 0014 00000001 3f928e4227816919a09d11fd2b70f0f2");
    const bytes good = wire_message(11, {signature, service_part(), identity_part(1),
                                         view(1, {{100, 100, 0}}, 7), capability_info(2, 3, 2)});
    EXPECT_TRUE(process(good) == 0 && router(1));
    for (const size_t at : {size_t{16}, size_t{31}, size_t{40}, good.size() - 1}) {
        bytes changed = good;
        changed[at] ^= 1;
        EXPECT_EQ(process(changed), 1) << at;
    }
    EXPECT_EQ(process(make_icu(1, view(1, {}))), 1) << "no security although it is configured";
    memcpy(group->password, "secreT\0", 8);
    EXPECT_EQ(process(good), 1);
    group->security_option = 0;
    EXPECT_EQ(process(good), 1);
    EXPECT_EQ(take_reasons(group), "password-mismatch 10.0.0.1: | x5; security-missing 10.0.0.1: none|MD5; "
                                   "security-unwanted 10.0.0.1: MD5|none");
    // An accepted I-See-You ends them, except those of the same second and those of other senders.
    EXPECT_TRUE(process(good) == 1 && process(good, host(2)) == 1);
    for (uint32_t second = 0; second < 2; second++, wccp_g.seconds++)
        process(make_icu(1, view(1, {{100, 100, 0}})));
    EXPECT_EQ(take_reasons(group),
              "security-unwanted 10.0.0.2: MD5|none; assignment-not-offered 10.0.0.1: hash|mask x2");
    // Reasons of strangers replace those of strangers, not those of the group's routers.
    EXPECT_EQ(process(good), 1);
    for (uint32_t i = 0; i < 100; i++, wccp_g.seconds++)
        process(good, host(7 << 8 | i));
    const std::string all = take_reasons(group);
    EXPECT_EQ(count_of("unwanted 10.0.0.1: ", all) + count_of("10.0.7.99:", all), 2) << all;
    EXPECT_EQ(count_of("10.0.7.0:", all), 0) << all;
    EXPECT_EQ((numbers{group->rx_auth_failures, group->rx_auth_mismatches, group->rx_failures,
                       wccp_g.rx_failures, group->rx_icus}),
              (numbers{5, 2 + 103, 7 + 103, 7 + 103, 1 + 2}));
}

TEST_F(Messages, WhatIsSentReachesEachRouterAndIsCounted) {
    // Each message is built anew from the present state.
    for (const uint8_t weight : {uint8_t{100}, uint8_t{7}}) {
        group->weight = weight;
        EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 10), 0);
        const bytes sent = engine.sent_to("10.0.0.1");
        ASSERT_TRUE(sent.size() == 108 && sent[8 + 8 + 28 + 45] == weight);
        EXPECT_EQ(sent, engine.sent_to("10.0.0.2"));
    }
    // By kind and readiness: the result, and the counters: Here-I-Am, Redirect-Assign, failed builds,
    // failures, link drops. An attempt is counted before it is built.
    const std::tuple<uint32_t, uint32_t, uint32_t, int, numbers> rows[] = {
        {12, 3, 1, 1, {2, 1, 1, 1, 0}}, {11, 3, 1, 1, {2, 1, 1, 2, 0}}, {10, 3, 0, 1, {3, 1, 1, 3, 0}},
        {10, 0, 1, 0, {3, 1, 1, 3, 1}}, {12, 1, 1, 0, {3, 1, 1, 3, 2}}, {25, 2, 1, 0, {3, 1, 1, 3, 3}},
        {99, 2, 1, 0, {3, 1, 1, 3, 4}},
    };
    for (const auto &[kind, ready, bound, result, counted] : rows) {
        engine.interface->ready_flags = ready;
        engine.interface->ucast_bound = bound;
        EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, kind), result);
        EXPECT_EQ((numbers{group->tx_here_i_am, group->tx_redirect_assign, group->tx_build_failures,
                           group->tx_failures, group->tx_link_drops}),
                  counted);
    }
    engine.interface->ready_flags = WCCP_ALL_READY;
    group->tx_pkt->ipa = {{255, 255, 255, 255}}; // refused by the kernel: only a result of 0 is a failure
    EXPECT_TRUE(wccp_transmit_packet(group, group->tx_pkt, 25) == 0 && group->tx_removal_replies == 1);
    EXPECT_TRUE(wccp_transmit_packet(group, nullptr, 10) == 1 && group->tx_failures == 3);
    EXPECT_EQ(take_reasons(group), "table-not-built: redirect assign: groups actual assignment method is "
                                   "not set.|; send-failed 255.255.255.255: Permission denied|108 bytes");
    EXPECT_EQ(engine.sent_to("10.0.0.1"), bytes{});
}

} // namespace
