// The message loop: which packet gets how far and is counted where, what an I-See-You does to a group, and
// what is sent. Time is turned by hand, and what is sent arrives at sockets of the test's own routers.

#include "engine/wccp_pkt_mgr.h"

#include <gtest/gtest.h>

#include <cstring>

#include "engine/wccp_pkt_load.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_state.h"
#include "engine/wccp_view_utils.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/log_lines.h"
#include "tests/support/wire_bytes.h"

namespace {

using bytes = std::vector<uint8_t>;

be32 ipa(uint8_t third, uint8_t fourth) {
    return {{10, 0, third, fourth}};
}
const be32 SENDER = ipa(0, 1);

wire_bytes security() {
    return wire_bytes().u16(0).u16(4).u32(0);
}
wire_bytes service(uint32_t id = 51, uint32_t priority = 200, uint32_t protocol = 6, uint32_t flags = 0x13) {
    return wire_bytes().u16(1).u16(24).u8(1).u8(id).u8(priority).u8(protocol).u32(flags).zeros(16);
}
wire_bytes identity(uint32_t router, uint32_t receive_id = 0xa1a2a3a4) {
    return wire_bytes().u16(2).u16(20).ip(0, router).u32(receive_id).ip(0, 100).u32(1).ip(0, 100);
}
struct element {
    uint32_t id, weight, bucket_byte;
};
// A view of one router, with hash elements. Each bucket byte stands 32 times.
wire_bytes view(uint32_t router, const std::vector<element> &elements, uint32_t key_change = 0) {
    wire_bytes out = wire_bytes().u16(4).u16(0).u32(0xc1c2c3c4).ip(0, 100).u32(key_change);
    out.u32(1).ip(0, router).u32(static_cast<uint32_t>(elements.size()));
    for (const element &each : elements)
        out.ip(0, each.id)
            .u16(0)
            .u16(0)
            .fill(32, static_cast<uint8_t>(each.bucket_byte))
            .u16(each.weight)
            .u16(0);
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
// The same with mask elements that redirect, in the IOS form.
wire_bytes mask_view(uint32_t router, const std::vector<uint32_t> &ids) {
    wire_bytes out = wire_bytes().u16(4).u16(0).u32(1).ip(0, 100).u32(0).u32(1).ip(0, router);
    out.u32(static_cast<uint32_t>(ids.size()));
    for (const uint32_t id : ids)
        out.ip(0, id).u16(0).u16(2).u32(0).u16(100).u16(0);
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
wire_bytes map(const std::vector<uint32_t> &ids) {
    wire_bytes out = wire_bytes().u16(14).u16(0).u32(1).u32(0x1741).u32(0xf00).u16(1).u16(2);
    out.u32(static_cast<uint32_t>(ids.size()));
    for (const uint32_t id : ids)
        out.u32(id).u32(0).u16(0).u16(0).ip(0, id);
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
wire_bytes capabilities(uint32_t fwd, uint32_t assign, uint32_t ret) {
    return wire_bytes().u16(8).u16(24).u16(1).u16(4).u32(fwd).u16(2).u16(4).u32(assign).u16(3).u16(4).u32(
        ret);
}
const wire_bytes by_hash = capabilities(2, 1, 2), by_mask = capabilities(2, 2, 2);
const wire_bytes odd_command = wire_bytes().u16(15).u16(13).u16(1).u16(4).ip(0, 1).fill(5, 0xee);
const wire_bytes odd_unknown = wire_bytes().u16(99).u16(3).fill(3, 0xee);

bytes icu(uint32_t router, const wire_bytes &its_view, const std::vector<wire_bytes> &more = {by_hash}) {
    std::vector<wire_bytes> components = {security(), service(), identity(router), its_view};
    components.insert(components.end(), more.begin(), more.end());
    return wire_message(11, components);
}
bytes query(uint32_t router, uint32_t target) {
    return wire_message(13, {security(), service(),
                             wire_bytes().u16(7).u16(16).ip(0, router).u32(0x99).ip(0, 100).ip(0, target)});
}

class Messages : public testing::Test {
protected:
    void SetUp() override {
        engine.router_socket("10.0.0.1");
        engine.router_socket("10.0.0.2");
        group = engine.add_group(engine_fixture::group_config(51, {"10.0.0.1", "10.0.0.2"}));
        group->priority = 200;
        group->protocol = 6;
        group->service_flags = 0x13;
    }
    static int process(const bytes &message, be32 from = SENDER) {
        return wccp_process_received_packet(make_received(message, from).get());
    }
    wccp_sending_router *router(uint8_t id) const { return wccp_find_sending_router(group, ipa(0, id)); }
    static void pass_seconds(uint32_t seconds) {
        while (seconds--)
            wccp_tick();
    }
    engine_fixture engine;
    wccp_service_group *group = nullptr;
};

// Each packet: its result, and all counters that it moves.
TEST_F(Messages, EachFaultIsCountedInItsPlace) {
    struct counters {
        uint32_t all = 0, group = 0, icus = 0, icu_failures = 0, queries = 0, query_failures = 0;
        uint32_t mismatches = 0, service = 0;
        bool operator==(const counters &) const = default;
    };
    const bytes good = icu(1, view(1, {{100, 100, 0}}));
    const auto changed = [&good](size_t at, uint8_t value) {
        bytes out = good;
        out.at(at) = value;
        return out;
    };
    bytes longer = good;
    longer.push_back(0);
    const struct {
        const char *what;
        bytes message;
        int result;
        counters moved;
        const char *line;
    } rows[] = {
        {"no header", bytes(7, 0), 1, {.all = 1}, "WCCP: unloading msg header failed."},
        {"one byte more than told", longer, 0, {}, "do not match. sender ip: 10.0.0.1"},
        {"one byte less",
         bytes(good.begin(), good.end() - 1),
         0,
         {},
         "WCCP: message header length (160) and actual packet length (167) do not match. sender ip: "
         "10.0.0.1"},
        {"version 1", changed(4, 1), 0, {}, "WCCP rxed verion (256) is not supported. sender ip: 10.0.0.1"},
        {"a Here-I-Am", changed(3, 10), 0, {}, "10.0.0.1"},
        {"a Redirect-Assign", changed(3, 12), 0, {}, "10.0.0.1"},
        {"a type of more than 16 bits", changed(0, 1), 0, {}, "10.0.0.1"},
        {"no security", wire_message(11, {}), 1, {.all = 1}, "WCCP: unloading security info failed."},
        {"no service", wire_message(11, {security()}), 1, {.all = 1}, "WCCP: unloading service info failed."},
        {"unknown group",
         wire_message(11, {security(), service(52)}),
         1,
         {.all = 1},
         "WCCP GRP 52: rxed service group (52) is not configured."},
        {"option that nobody has",
         changed(15, 2),
         1,
         {.all = 1, .group = 1, .mismatches = 1},
         "WCCP GRP 51: rxed mismatch security opt: 2 configured opt: 0"},
        {"I-See-You with nothing in it",
         wire_message(11, {security(), service()}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading router identity failed."},
        {"no view",
         wire_message(11, {security(), service(), identity(1)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading router view failed."},
        {"another service",
         wire_message(11, {security(), service(51, 201, 17, 3), identity(1)}),
         0,
         {.icus = 1, .icu_failures = 1, .service = 1},
         "WCCP GRP 51: service group config mismatch (router id: 10.0.0.1) .priority: rxed = 201 local = "
         "200, protocol: rxed = 17 local = 6, service flags: rxed = 0x3 local =  0x13"},
        {"another priority",
         wire_message(11, {security(), service(51, 199), identity(1)}),
         0,
         {.icus = 1, .icu_failures = 1, .service = 1},
         "config mismatch"},
        {"another protocol",
         wire_message(11, {security(), service(51, 200, 17), identity(1)}),
         0,
         {.icus = 1, .icu_failures = 1, .service = 1},
         "config mismatch"},
        {"another set of flags",
         wire_message(11, {security(), service(51, 200, 6, 0x80000013), identity(1)}),
         0,
         {.icus = 1, .icu_failures = 1, .service = 1},
         "config mismatch"},
        {"bad map",
         icu(1, view(1, {}), {wire_bytes().u16(14).u16(0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading assignment map failed."},
        {"bad command",
         icu(1, view(1, {}), {wire_bytes().u16(15).u16(0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading command ext comp. failed."},
        {"bad capabilities",
         icu(1, view(1, {}), {wire_bytes().u16(8).u16(4).u32(0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading capability comp. failed."},
        {"bad unknown component",
         icu(1, view(1, {}), {wire_bytes().u16(99).u16(1)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading unknown component failed."},
        {"one byte of a component",
         icu(1, view(1, {}), {wire_bytes().u8(0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading unknown component failed."},
        {"three bytes of a map",
         icu(1, view(1, {}), {wire_bytes().u16(14).u8(0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP: unloading assignment map failed."},
        {"four optional components",
         icu(1, view(1, {}), {by_hash, odd_command, odd_unknown, odd_unknown}),
         0,
         {.icus = 1, .icu_failures = 1},
         "WCCP GRP 51: ICU bogus packet  (too many optional components)."},
        {"GRE only", icu(1, view(1, {}), {}), 0, {.icus = 1}, "incompatible capabilities"},
        {"no return method",
         icu(1, view(1, {}), {capabilities(2, 1, 0)}),
         0,
         {.icus = 1, .icu_failures = 1},
         "incompatible capabilities"},
        {"router id 0", icu(0, view(1, {})), 0, {.icus = 1, .icu_failures = 0}, ""},
        {"query with nothing in it",
         wire_message(13, {security(), service()}),
         0,
         {.queries = 1, .query_failures = 1},
         "WCCP: unloading router query failed."},
        {"query for another",
         query(1, 101),
         0,
         {.queries = 1},
         "WCCP GRP 51: removal query is not for us. sending router id: 10.0.0.1 target appliance: "
         "10.0.0.101"},
    };
    const auto now = [this] {
        return counters{wccp_g.rx_failures,        group->rx_failures,          group->rx_icus,
                        group->rx_icu_failures,    group->rx_removal_queries,   group->rx_removal_failures,
                        group->rx_auth_mismatches, group->rx_service_mismatches};
    };
    log_lines log;
    for (const auto &row : rows) {
        bytes message = row.message;
        if (strcmp(row.what, "router id 0") == 0)
            memset(&message[8 + 8 + 28 + 4], 0, 4);
        counters moved = now();
        log.take();
        EXPECT_EQ(process(message), row.result) << row.what;
        const counters after = now();
        moved = {after.all - moved.all,
                 after.group - moved.group,
                 after.icus - moved.icus,
                 after.icu_failures - moved.icu_failures,
                 after.queries - moved.queries,
                 after.query_failures - moved.query_failures,
                 after.mismatches - moved.mismatches,
                 after.service - moved.service};
        EXPECT_TRUE(moved == row.moved) << row.what;
        EXPECT_EQ(group->sending_routers, nullptr) << row.what;
        const std::string lines = log.take();
        EXPECT_NE(lines.find(row.line), std::string::npos) << row.what << ": " << lines;
        EXPECT_EQ(lines.find("WCCP processing received packet from 10.0.0.1 failed") != std::string::npos,
                  row.result == 1)
            << row.what;
    }
    group->admin_state = WCCP_ADMIN_DOWN;
    const counters before = now();
    EXPECT_EQ(process(good), 0);
    EXPECT_NE(log.take().find("WCCP GRP 51: is disabled. dropping the rxed packet."), std::string::npos);
    EXPECT_TRUE(now() == before);
    group->admin_state = WCCP_ADMIN_UP;
    EXPECT_EQ(process(good), 0);
    EXPECT_NE(router(1), nullptr) << "what was refused above stood for something that passes";
}

TEST_F(Messages, AnISeeYouThatIsCutLeavesTheGroupAsItWas) {
    process(icu(2, view(2, {{100, 100, 0xff}})));
    const wire_bytes seen = view(1, {{100, 100, 0x11}, {101, 50, 0x22}});
    const bytes whole = icu(1, seen, {by_hash, odd_command, map({100, 101})});
    const size_t mandatory = 8 + 8 + 28 + 24 + seen.size();
    size_t refused = 0;
    for (size_t length = 44; length < whole.size(); length++) {
        const size_t behind = length - mandatory; // a message may end where an optional component does
        if (length >= mandatory && (behind == 0 || behind == by_hash.size() || behind == by_hash.size() + 17))
            continue;
        bytes cut(whole.begin(), whole.begin() + static_cast<long>(length));
        cut[6] = static_cast<uint8_t>((length - 8) >> 8);
        cut[7] = static_cast<uint8_t>(length - 8);
        const auto before = std::make_unique<wccp_service_group>(*group);
        const wccp_sending_router router_before = *router(2);
        EXPECT_EQ(process(cut), 0);
        EXPECT_EQ(group->rx_icu_failures, before->rx_icu_failures + 1) << length;
        before->rx_icus++;
        before->rx_icu_failures++;
        EXPECT_EQ(memcmp(before.get(), group, sizeof *group), 0) << length;
        EXPECT_EQ(memcmp(&router_before, router(2), sizeof router_before), 0) << length;
        refused++;
    }
    EXPECT_GT(refused, 200u);
    EXPECT_EQ(process(whole), 0);
    EXPECT_NE(router(1), nullptr);
}

TEST_F(Messages, AnISeeYouUpdatesRouterAndViews) {
    wccp_g.seconds = 77;
    const wire_bytes seen = view(1, {{100, 100, 0x01}, {101, 50, 0xff}}, 5);
    // Odd lengths put the capabilities, which must be found, on odd addresses.
    EXPECT_EQ(process(icu(1, seen, {odd_unknown, odd_command, by_hash}), ipa(7, 7)), 0);
    EXPECT_EQ(group->rx_icu_failures, 0u);
    const wccp_sending_router *made = router(1);
    ASSERT_NE(made, nullptr);
    EXPECT_EQ(made->receive_id, to_be32(0xa1a2a3a4));
    EXPECT_EQ(made->change_number, to_be32(0xc1c2c3c4));
    EXPECT_EQ(made->src_ipa, ipa(7, 7));
    EXPECT_EQ(made->last_icu_time, 77u);
    EXPECT_EQ(made->view_router_count, 1u);
    EXPECT_EQ(made->view_appliance_count, 2u);
    EXPECT_EQ(made->self_buckets, 32);
    EXPECT_EQ(made->total_buckets, 256);
    EXPECT_TRUE(made->flags & WCCP_RTR_TWO_WAY);
    EXPECT_EQ(group->fwd_method, WCCP_METHOD_L2);
    EXPECT_EQ(group->assign_method, WCCP_ASSIGN_HASH);
    EXPECT_TRUE(group->state_flags & WCCP_STATE_ACTIVE);

    // Another service is counted, and the message taken all the same.
    wccp_g.seconds = 78;
    EXPECT_EQ(process(wire_message(11, {security(), service(51, 1), identity(1, 9), view(1, {})})), 0);
    EXPECT_EQ(group->rx_service_mismatches, 1u);
    EXPECT_EQ(made->receive_id, to_be32(9));
    EXPECT_EQ(made->last_icu_time, 78u);
    EXPECT_EQ(made->view_appliance_count, 0u);
    EXPECT_EQ(group->rx_icu_failures, 0u);
}

TEST_F(Messages, The33rdRouterIsTurnedAway) {
    for (uint32_t id = 1; id <= 33; id++)
        EXPECT_EQ(process(icu(id, view(id, {}))), 0);
    EXPECT_EQ(group->sending_router_count, 32u);
    EXPECT_EQ(router(33), nullptr);
    EXPECT_EQ(group->rx_icu_failures, 0u);
}

TEST_F(Messages, AMapFillsTheRoutersView) {
    // 102 is in no view; the same address twice in the view is found at its first place.
    const std::vector<uint32_t> owners = {100, 100, 101, 102, 102, 100, 101, 101, 101, 100};
    EXPECT_EQ(process(icu(1, mask_view(1, {100, 101, 100}), {odd_unknown, map(owners), by_mask})), 0);
    EXPECT_EQ(group->rx_icu_failures, 0u);
    const wccp_sending_router *made = router(1);
    ASSERT_NE(made, nullptr);
    EXPECT_EQ(made->map_src_ip, 0x1741u);
    EXPECT_EQ(made->map_dst_ip, 0xf00u);
    EXPECT_EQ(made->map_src_port, 0);
    EXPECT_EQ(made->self_buckets, 4);
    EXPECT_EQ(made->total_buckets, 10);
    const auto bits = [made](uint32_t entry) {
        uint8_t out[32];
        memcpy(out, made->view_appliances[entry].bucket_bits, sizeof out);
        return out[0] | out[1] << 8 | out[2] << 16 | out[31] << 24;
    };
    EXPECT_EQ(bits(0), 0b1000100011);
    EXPECT_EQ(bits(1), 0b0111000100);
    EXPECT_EQ(bits(2), 0);
    EXPECT_EQ(made->view_appliances[0].buckets_assigned, 4);
    EXPECT_EQ(made->view_appliances[0].buckets_total, 10);
    EXPECT_EQ(made->view_appliances[2].buckets_total, 0);
    EXPECT_TRUE(group->state_flags & WCCP_STATE_ACTIVE);

    // The next map replaces it.
    EXPECT_EQ(process(icu(1, mask_view(1, {100, 101}), {map({101, 100})})), 0);
    EXPECT_EQ(bits(0), 0b10);
    EXPECT_EQ(bits(1), 0b01);
    EXPECT_EQ(made->self_buckets, 1);

    // One without a mask element is refused, once the views have been updated.
    const wire_bytes empty = wire_bytes().u16(14).u16(36).u32(0);
    const wire_bytes rest = wire_bytes().u16(99).u16(28).zeros(28);
    EXPECT_EQ(process(icu(1, mask_view(1, {100}), {empty, rest})), 0);
    EXPECT_EQ(group->rx_icu_failures, 1u);
    EXPECT_EQ(made->view_appliance_count, 1u);
    EXPECT_EQ(made->self_buckets, 1);
}

TEST_F(Messages, AMapOfAFullPacketIsTakenWhole) {
    bytes message = icu(1, mask_view(1, {100, 101}), {by_mask});
    const size_t values = (WCCP_MAX_PACKET - message.size() - 24) / 16;
    std::vector<uint32_t> owners(values, 101);
    owners.back() = 100;
    const size_t rest = WCCP_MAX_PACKET - message.size() - 24 - values * 16;
    wire_bytes filler;
    if (rest >= 4)
        filler = wire_bytes().u16(99).u16(static_cast<uint32_t>(rest - 4)).zeros(rest - 4);
    message = icu(1, mask_view(1, {100, 101}), {by_mask, map(owners), filler});
    ASSERT_EQ(message.size(), size_t{WCCP_MAX_PACKET});
    EXPECT_EQ(process(message), 0);
    EXPECT_EQ(group->rx_icu_failures, 0u);
    ASSERT_NE(router(1), nullptr);
    EXPECT_EQ(router(1)->self_buckets, 1);
    EXPECT_EQ(router(1)->total_buckets, values);

    // A longer one was cut to the buffer: dropped and not counted.
    message[7]++;
    EXPECT_EQ(process(message), 0);
    EXPECT_EQ(group->rx_icus, 1u);
    EXPECT_EQ(wccp_g.rx_failures, 0u);
}

TEST_F(Messages, AKeyIsAnAcknowledgementFromTheSecondAssignmentOn) {
    const auto report = [](uint32_t id, uint32_t key) { process(icu(id, view(id, {{100, 100, 0}}, key))); };
    for (const uint32_t id : {1u, 2u})
        report(id, 0);
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    EXPECT_EQ(group->pending_acks, 2);
    const uint32_t key = group->dsg_key_change;
    pass_seconds(15);
    EXPECT_EQ(group->tx_redirect_assign, 1u);
    report(1, key);
    EXPECT_TRUE(router(1)->flags & WCCP_RTR_ASSIGN_UNACKED)
        << "sent before the assignment could have arrived";
    pass_seconds(10);
    EXPECT_EQ(group->tx_redirect_assign, 2u);
    report(1, key - 1);
    EXPECT_TRUE(router(1)->flags & WCCP_RTR_ASSIGN_UNACKED);
    report(1, key);
    EXPECT_FALSE(router(1)->flags & WCCP_RTR_ASSIGN_UNACKED);
    EXPECT_EQ(group->pending_acks, 1);
    EXPECT_EQ(group->assign_timer.active, 1);
    report(1, key);
    EXPECT_EQ(group->pending_acks, 1) << "one router acknowledges once";
    report(2, key);
    EXPECT_EQ(group->pending_acks, 0);
    EXPECT_EQ(group->assign_timer.active, 0);

    // Nothing outstanding: the timer stops as well, and nothing wraps.
    router(1)->flags |= WCCP_RTR_ASSIGN_UNACKED;
    group->assign_timer.active = 1;
    report(1, key);
    EXPECT_EQ(group->pending_acks, 0);
    EXPECT_EQ(group->assign_timer.active, 0);
}

TEST_F(Messages, TheDigestDecides) {
    group->security_option = 1;
    memcpy(group->password, "secret\0", 8);
    // md5sum of the password's eight bytes and the message with zeros in the digest's place.
    const wire_bytes signature = wire_bytes().u16(0).u16(20).u32(1).hex("3f928e4227816919a09d11fd2b70f0f2");
    const bytes good = wire_message(
        11, {signature, service(), identity(1), view(1, {{100, 100, 0}}, 7), capabilities(2, 3, 2)});
    EXPECT_EQ(process(good), 0);
    EXPECT_EQ(group->rx_icus, 1u);
    EXPECT_NE(router(1), nullptr);
    for (const size_t at : {size_t{16}, size_t{31}, size_t{40}, good.size() - 1}) {
        bytes changed = good;
        changed[at] ^= 1;
        EXPECT_EQ(process(changed), 1) << at;
    }
    EXPECT_EQ(group->rx_auth_failures, 4u);
    EXPECT_EQ(group->rx_failures, 4u);
    EXPECT_EQ(wccp_g.rx_failures, 4u);
    EXPECT_EQ(process(icu(1, view(1, {}))), 1) << "no security where some is configured";
    EXPECT_EQ(group->rx_auth_mismatches, 1u);
    memcpy(group->password, "secreT\0", 8);
    EXPECT_EQ(process(good), 1);
    group->security_option = 0;
    EXPECT_EQ(process(good), 1);
    EXPECT_EQ(group->rx_auth_mismatches, 2u);
    EXPECT_EQ(group->rx_icus, 1u);
}

TEST_F(Messages, ARemovalQueryIsAnsweredThreeTimesWithTheSameBytes) {
    process(icu(1, view(1, {{100, 100, 0}})));
    group->hia_timer.active = 0;
    EXPECT_EQ(process(query(1, 100)), 0);
    EXPECT_EQ(group->rx_removal_failures, 0u);
    EXPECT_EQ(group->removal_reply_count, 1u);
    pass_seconds(1);
    const bytes reply = engine.sent_to("10.0.0.1");
    ASSERT_GT(reply.size(), 100u);
    EXPECT_EQ(reply[3], 10);
    EXPECT_EQ(bytes(reply.begin() + 108, reply.begin() + 112), (bytes{0, 0, 0, 0x99}))
        << "the query's receive id";
    group->weight++; // what was prepared stays as it is
    for (int i = 0; i < 2; i++) {
        pass_seconds(1);
        EXPECT_EQ(engine.sent_to("10.0.0.1"), reply);
    }
    pass_seconds(2);
    EXPECT_EQ(engine.sent_to("10.0.0.1"), bytes{});
    EXPECT_EQ(engine.sent_to("10.0.0.2"), bytes{});
    EXPECT_EQ(group->tx_removal_replies, 3u);
    EXPECT_EQ(group->removal_reply_count, 0u);
}

TEST_F(Messages, WhatIsSentReachesEachRouterAndIsCounted) {
    EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 10), 0);
    const bytes first = engine.sent_to("10.0.0.1");
    EXPECT_EQ(first.size(), 108u);
    EXPECT_EQ(first, engine.sent_to("10.0.0.2"));
    EXPECT_EQ(group->tx_here_i_am, 1u);
    group->weight = 7; // the second is written from nothing, with the state of now
    EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 10), 0);
    const bytes second = engine.sent_to("10.0.0.1");
    ASSERT_EQ(second.size(), 108u);
    EXPECT_EQ(second[8 + 8 + 28 + 45], 7);
    engine.sent_to("10.0.0.2");
    EXPECT_EQ(group->tx_failures, 0u);

    // An attempt counts before it is built.
    EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 12), 1);
    EXPECT_EQ(group->tx_redirect_assign, 1u);
    EXPECT_EQ(group->tx_build_failures, 1u);
    EXPECT_EQ(group->tx_failures, 1u);
    EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 11), 1);
    EXPECT_EQ(group->tx_failures, 2u);
    EXPECT_EQ(wccp_transmit_packet(group, nullptr, 10), 1);
    EXPECT_EQ(group->tx_failures, 2u);

    engine.interface->ucast_bound = 0;
    EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, 10), 1);
    EXPECT_EQ(group->tx_here_i_am, 3u);
    EXPECT_EQ(group->tx_failures, 3u);
    EXPECT_EQ(group->tx_build_failures, 1u);
    engine.interface->ucast_bound = 1;

    // A group without link says nothing, whatever it is asked, and that is no failure.
    for (const uint32_t ready : {0u, 1u, 2u}) {
        engine.interface->ready_flags = ready;
        for (const uint32_t kind : {10u, 12u, 25u, 99u})
            EXPECT_EQ(wccp_transmit_packet(group, group->tx_pkt, kind), 0);
    }
    EXPECT_EQ(group->tx_link_drops, 12u);
    EXPECT_EQ(group->tx_here_i_am, 3u);
    EXPECT_EQ(group->tx_failures, 3u);
    engine.interface->ready_flags = WCCP_ALL_READY;
    EXPECT_EQ(engine.sent_to("10.0.0.1"), bytes{});
}

} // namespace
