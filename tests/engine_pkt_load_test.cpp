// Encoded messages, compared byte by byte with messages written by hand.

#include "engine/wccp_pkt_load.h"

#include <algorithm>

#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_wire.h"
#include "tests/support/reported_group.h"
#include "tests/support/wire_bytes.h"

namespace {

using bytes = std::vector<uint8_t>;
using builder = int (*)(wccp_service_group *, wccp_pkt *);

// A group outside the engine's tables, and a packet.
struct Load : testing::Test {
    void SetUp() override {
        group->id = 50;
        group->priority = 200;
        group->protocol = 6;
        group->service_flags = 0x13;
        group->appliance_ipa = host(100);
        group->weight = 0x0102;
        group->change_number = 0x01020304;
    }
    // Into a zeroed packet that has `used` bytes already.
    int build(builder loads, uint32_t used = 0) {
        *pkt = {};
        pkt->cursor = pkt->data;
        pkt->length = pkt->offset = used;
        return loads(group.get(), pkt.get());
    }
    void add_routers(uint32_t count) {
        for (uint32_t i = 0; i < count; i++) {
            wccp_sending_router *router = &routers[i];
            router->router_id = host(0x101 + i);
            router->receive_id = to_be32(0xa1a2a300 + i);
            router->change_number = to_be32(0xc1c2c300 + i);
            router->next = group->sending_routers;
            group->sending_routers = router;
        }
        group->sending_router_count = count;
    }
    void add_appliances(uint32_t count) {
        for (uint32_t i = 0; i < count; i++) {
            appliances[i].ipa = host((i & 0xffff00) | ((100 + i) & 0xff));
            appliances[i].next = group->appliance_view;
            group->appliance_view = &appliances[i];
        }
        group->appliance_view_count = count;
    }
    void designate(uint32_t active) {
        group->designated = 1;
        group->dsg_key_change = 0x0a0b0c0d;
        group->dsg_appliance_count = group->dsg_active_count = active;
        for (uint32_t i = 0; i < active; i++)
            group->dsg_appliances[i].ipa = host(100 + i);
    }
    bytes loaded() const { return {pkt->data, pkt->data + pkt->length}; }

    std::unique_ptr<wccp_service_group> group{new wccp_service_group{}};
    std::unique_ptr<wccp_pkt> pkt{new wccp_pkt{}};
    std::unique_ptr<wccp_sending_router[]> routers{new wccp_sending_router[64]{}};
    std::unique_ptr<wccp_view_appliance[]> appliances{new wccp_view_appliance[2048]{}};
};

const wire_bytes no_security = hex("0000 0004 00000000"),
                 dynamic_service = hex("0001 0018 01 33 c8 06 00000013 00*16");

// Every component of a Here-I-Am. The digest was computed by md5sum over the 8 bytes of the password and this
// message with 16 zero bytes in its place.
TEST_F(Load, AFullHereIAmWithItsDigest) {
    ASSERT_EQ(build(wccp_pkt_build_here_i_am), 0); // the first one, of a standard group
    EXPECT_EQ(loaded(), wire_message(10, {no_security, hex("0001 0018 00 32 00*22"),
                                          hex("0003 002c 0a000064 0000 0000 00*32 0102 0000"),
                                          hex("0005 000c 01020304 00000000 00000000")}));
    EXPECT_TRUE(pkt->length == 108 && pkt->offset == 108 && pkt->cursor == pkt->data + 108);

    group->id = 90;
    group->security_option = 1;
    memcpy(group->password, "pass", 4);
    group->fwd_method = group->ret_method = WCCP_METHOD_L2;
    group->assign_method = WCCP_ASSIGN_MASK;
    group->mask_src_ip = 0x1741;
    group->mask_dst_ip = 0xf00;
    group->mask_src_port = 0x21;
    group->mask_dst_port = 0x8001;
    group->mask_in_use = {1, 2, 3, 4}; // not sent
    group->state_flags = WCCP_STATE_ACTIVE | WCCP_SHUTTING_DOWN;
    add_routers(2);
    add_appliances(3);
    const wire_bytes security = hex("0000 0014 00000001 320b25f1d72ee64dfe0cd67d26c5f037");
    const wire_bytes service = hex("0001 0018 01 5a c8 06 00000013 00*16");
    const wire_bytes identity =
        hex("0003 0020 0a000064 0000 0002 00000001 00001741 00000f00 0021 8001 00000000 0102 0000");
    const wire_bytes view = hex("0005 0028 01020304 00000002 0a000102 a1a2a301 0a000101 a1a2a300 "
                                "00000003 0a000066 0a000065 0a000064");
    const wire_bytes capabilities = hex("0008 0018 0001 0004 00000002 0002 0004 00000002 0003 0004 00000002");
    const wire_bytes command = hex("000f 0008 0001 0004 0a000064");
    ASSERT_EQ(build(wccp_pkt_build_here_i_am), 0);
    EXPECT_EQ(loaded(), wire_message(10, {security, service, identity, view, capabilities, command}));

    // The digest covers all 8 bytes of the password and the whole message.
    const auto digest = [this] {
        EXPECT_EQ(build(wccp_pkt_build_here_i_am), 0);
        return bytes(pkt->data + 16, pkt->data + 32);
    };
    memcpy(group->password, "password", 8);
    const bytes of_eight = hex("a7927010949b2579b11000a16b74968a").bytes;
    EXPECT_EQ(digest(), of_eight);
    group->change_number++;
    EXPECT_NE(digest(), of_eight);
}

TEST_F(Load, CapabilitiesListWhatDiffersFromTheDefaults) {
    const std::tuple<uint32_t, uint32_t, uint32_t, const char *> rows[] = {
        {0, 1, 1, ""},
        {2, 1, 1, "0008 0008 0001 0004 00000002"},
        {1, 2, 0, "0008 0008 0002 0004 00000002"},
        {1, 1, 2, "0008 0008 0003 0004 00000002"},
        {2, 1, 2, "0008 0010 0001 0004 00000002 0003 0004 00000002"},
    };
    log_lines log;
    for (const auto &[fwd, assign, ret, expected] : rows) {
        group->fwd_method = fwd;
        group->assign_method = assign;
        group->ret_method = ret;
        EXPECT_EQ(build(wccp_pkt_load_capability_info_component), 0);
        EXPECT_EQ(loaded(), hex(expected).bytes);
        EXPECT_EQ(log.say("WCCP: GRP 50 loading capability comp. all capabilities are default."), !*expected);
    }
}

TEST_F(Load, ARedirectAssignByHash) {
    group->id = 51;
    group->assign_method = WCCP_ASSIGN_HASH;
    add_routers(2);
    designate(3);
    for (uint32_t i = 0; i < 256; i++)
        group->bucket_index[i] = static_cast<uint8_t>(i % 3);
    wire_bytes assignment = hex("0006 0134 0a000064 0a0b0c0d 00000002 "
                                "0a000102 a1a2a301 c1c2c301 0a000101 a1a2a300 c1c2c300 "
                                "00000003 0a000064 0a000065 0a000066");
    for (uint32_t i = 0; i < 256; i++)
        assignment.u8(i % 3);
    ASSERT_EQ(build(wccp_pkt_build_redirect_assign), 0);
    EXPECT_EQ(loaded(), wire_message(12, {no_security, dynamic_service, assignment}));
    ASSERT_EQ(build(wccp_pkt_build_redirect_assign), 0);
    EXPECT_EQ(std::tuple(routers[0].assign_tx_count, routers[1].assign_tx_count, routers[2].assign_tx_count),
              std::tuple(2, 2, 0));
}

TEST_F(Load, ARedirectAssignByMask) {
    group->id = 51;
    group->assign_method = WCCP_ASSIGN_MASK;
    add_routers(1);
    add_appliances(1);
    designate(1);
    group->mask_dst_ip = 0xffffffff; // configured, replaced
    group->mask_in_use = {0x01020304, 0x00000f00, 0x0506, 0x0708};
    group->mask_value_count = 2;
    group->mask_values[0] = {0, 0x100, 0, 0x0700, host(101)};
    group->mask_values[1] = {0x01000000, 0, 0x0506, 0, host(100)};
    const wire_bytes assignment = hex("000d 0050 0001 004c 0a000064 0a0b0c0d "
                                      "00000001 0a000101 a1a2a300 c1c2c300 "
                                      "00000001 01020304 00000f00 0506 0708 "
                                      "00000002 00000000 00000100 0000 0700 0a000065 "
                                      "01000000 00000000 0506 0000 0a000064");
    ASSERT_EQ(build(wccp_pkt_build_redirect_assign), 0);
    EXPECT_EQ(loaded(), wire_message(12, {no_security, dynamic_service, assignment}));
    EXPECT_EQ(routers[0].assign_tx_count, 1u);
}

TEST_F(Load, AnAssignmentNeedsADesignatedApplianceWithRoutersAndSlots) {
    add_routers(1);
    // The refusals by hash and by mask, after the state's designated appliance.
    const struct {
        uint32_t designated, routers, active, values, appliances;
        std::string by_hash, by_mask;
    } rows[] = {
        {1, 1, 1, 1, 1, "", ""},
        {0, 1, 1, 1, 1, "0 # routers 1 # active appliances 1", "0 # routers 1 appliances 1 values: 1"},
        {1, 0, 1, 1, 1, "1 # routers 0 # active appliances 1", "1 # routers 0 appliances 1 values: 1"},
        {1, 1, 0, 0, 1, "1 # routers 1 # active appliances 0", "1 # routers 1 appliances 1 values: 0"},
        {1, 1, 33, 129, 1, "1 # routers 1 # active appliances 33", "1 # routers 1 appliances 1 values: 129"},
        {1, 1, 1, 1, 0, "", "1 # routers 1 appliances 0 values: 1"}, // only the mask form needs the view
    };
    const std::string names[] = {"", "TX HASH redirect assign: ", "TX MASK redirect assign: ", ""},
                      neither = "WCCP: redirect assign: groups actual assignment method is not set. failed.",
                      state = "invalid designated appliance state. designated ",
                      unassigned = "not all buckets are assigned. assigned: 4 total: 7\n";
    log_lines log;
    group->bucket_count = 7;
    group->dsg_appliances[0].assigned = 4;
    for (const auto &row : rows) {
        group->designated = row.designated;
        group->sending_router_count = row.routers;
        group->dsg_active_count = row.active;
        group->mask_value_count = row.values;
        group->appliance_view_count = row.appliances;
        const std::string refusals[] = {
            neither, row.by_hash.empty() ? "" : "redirect assignment load: " + state + row.by_hash + "\n",
            row.by_mask.empty() ? "" : names[2] + state + row.by_mask + "\n", neither};
        for (uint32_t method = 0; method < 4; method++) {
            const std::string &refusal = refusals[method];
            group->assign_method = method;
            const uint32_t sent = routers[0].assign_tx_count;
            EXPECT_EQ(build(wccp_pkt_build_redirect_assign), refusal.empty() ? 0 : 1);
            EXPECT_EQ(routers[0].assign_tx_count, sent + (refusal.empty() ? 1 : 0));
            EXPECT_EQ(pkt->length == 44, !refusal.empty()) << "up to the failing component";
            EXPECT_TRUE(log.say(refusal.empty() ? names[method] + unassigned : refusal)) << refusal;
        }
    }
    group->bucket_count = 4; // all slots are assigned
    group->appliance_view_count = 1;
    for (const uint32_t method : {1u, 2u}) {
        group->assign_method = method;
        EXPECT_EQ(build(wccp_pkt_build_redirect_assign), 0);
        EXPECT_EQ(log.take(), "");
    }
}

// The largest messages fit. Started at an offset where a component just fits, or lacks one byte: it is
// written up to the last byte of the packet, or the packet is unchanged.
TEST_F(Load, AComponentFitsWholeOrNotAtAll) {
    group->security_option = 1;
    group->fwd_method = group->ret_method = WCCP_METHOD_L2;
    group->state_flags = WCCP_SHUTTING_DOWN;
    add_routers(32);
    add_appliances(32);
    designate(32);
    group->mask_value_count = 128;
    const std::tuple<builder, uint32_t, std::vector<uint32_t>> rows[] = {
        {wccp_pkt_build_here_i_am, 2, {8, 24, 28, 36, 16 + 8 * 32 + 4 * 32, 28, 12}},
        {wccp_pkt_build_here_i_am, 1, {8, 24, 28, 48, 16 + 8 * 32 + 4 * 32, 20, 12}},
        {wccp_pkt_build_redirect_assign, 1, {8, 24, 28, 276 + 12 * 32 + 4 * 32}},
        {wccp_pkt_build_redirect_assign, 2, {8, 24, 28, 40 + 12 * 32 + 16 * 128}},
    };
    for (const auto &[message, assign_method, sizes] : rows) {
        group->assign_method = assign_method;
        std::vector<uint32_t> starts = {0};
        uint32_t sum = 0;
        for (const uint32_t size : sizes) {
            sum += size;
            starts.insert(starts.end(), {4096 - sum, 4096 - sum + 1});
        }
        log_lines log;
        for (const uint32_t start : starts) {
            uint32_t end = start;
            size_t fitting = 0;
            while (fitting < sizes.size() && end + sizes[fitting] <= 4096)
                end += sizes[fitting++];
            EXPECT_EQ(build(message, start), fitting == sizes.size() ? 0 : 1) << start;
            EXPECT_TRUE(pkt->length == end && pkt->offset == end) << start;
            EXPECT_EQ(std::count(pkt->data + end, pkt->data + 4096, 0), 4096 - end) << start;
            EXPECT_EQ(log.say("TX MASK redirect assign: component: (len 2472) does not fit in the pkt."),
                      sizes.size() == 4 && assign_method == 2 && fitting == 3);
        }
    }
}

TEST_F(Load, AViewThatIsTooLargeOrMiscountedIsRefused) {
    add_routers(32);
    add_appliances(955); // 16 + 256 + 3820 bytes, at offset 4
    EXPECT_EQ(build(wccp_pkt_load_web_cache_view_info_component, 4), 0);
    EXPECT_EQ(pkt->length, 4096u);
    EXPECT_EQ(build(wccp_pkt_build_here_i_am), 1);
    log_lines log;
    const std::pair<uint32_t *, const char *> lists[] = {
        {&group->sending_router_count, "WCCP router count (31) mismatch with entries in router view list"},
        {&group->appliance_view_count, "web cache count (954) mismatch with entries in appliance view list"},
    };
    for (const auto &[count, line] : lists) {
        --*count;
        EXPECT_EQ(build(wccp_pkt_load_web_cache_view_info_component), 1);
        EXPECT_TRUE(pkt->length == 0 && log.say(line));
        ++*count;
    }
}

} // namespace
