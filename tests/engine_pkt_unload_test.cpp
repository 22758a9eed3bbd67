// Which received messages are accepted and which are refused, over bytes written by hand. The address
// sanitizer catches any access after the received bytes.

#include "engine/wccp_pkt_unload.h"

#include <bit>
#include <random>

#include "tests/support/engine_fixture.h"
#include "tests/support/wire_bytes.h"

namespace {

const be32 SENDER = {{10, 0, 9, 9}};

// Each decoder without its result, for tests of what is refused.
using reader = std::function<int(wccp_service_group *, wccp_pkt *)>;
template <typename Out>
reader reader_of(int (*read)(wccp_service_group *, wccp_pkt *, Out *)) {
    return [read, out = Out{}](auto *group, auto *pkt) mutable { return read(group, pkt, &out); };
}
template <typename Out>
reader reader_of(int (*read)(wccp_pkt *, Out *)) {
    return [read, out = Out{}](auto *, auto *pkt) mutable { return read(pkt, &out); };
}
int read_security(wccp_service_group *, wccp_pkt *pkt) {
    const wccp_wire_security_info *out;
    uint8_t *digest;
    return wccp_pkt_unload_security_info_component(pkt, &out, &digest);
}
const reader read_header = reader_of(wccp_pkt_unload_msg_header),
             read_service = reader_of(wccp_pkt_unload_service_info_component),
             read_identity = reader_of(wccp_pkt_unload_router_identity_info_component),
             read_view = reader_of(wccp_pkt_unload_router_view_component),
             read_map = reader_of(wccp_pkt_unload_assignment_map_component),
             read_capabilities = reader_of(wccp_pkt_unload_capability_info_component),
             read_command = reader_of(wccp_pkt_unload_command_ext_component),
             read_query = reader_of(wccp_pkt_unload_router_query_component),
             read_unknown = wccp_pkt_unload_unknown_component;

const wire_bytes hash_element = hex("0a000001 0000 0000 11*32 0064 0000");
const wire_bytes mask_element = hex("0a000002 0000 0002 22*20 0064 0000"); // that redirects, in Nexus mode
const wire_bytes idle_element = hex("0a000003 0000 0003 22*20 0064 0000");
const wire_bytes short_element = hex("0a000004 0000 0002 33*4 0064 0000"); // that redirects, in IOS mode
// The declared counts, and what is really there.
wire_bytes view(uint32_t routers = 0, uint32_t addresses = 0, uint32_t appliances = 0,
                const std::vector<wire_bytes> &elements = {}, uint32_t type = 4, int length_error = 0) {
    wire_bytes out = wire_bytes().u16(type).hex("0000 c1c2c3c4 0a000064 0a0b0c0d").u32(routers);
    for (uint32_t i = 1; i <= addresses; i++)
        out.ip(1, i);
    out.u32(appliances);
    for (const wire_bytes &element : elements)
        out.add(element);
    return out.put16(2, static_cast<uint32_t>(static_cast<int>(out.size()) - 4 + length_error));
}
struct Unload : testing::Test {
    void SetUp() override {
        group.id = 51;
        group.compat_mode = WCCP_COMPAT_IOS;
    }
    // At an odd offset as well, since components of odd length are legal.
    received_packet at(const wire_bytes &bytes, uint32_t shift = 0) {
        received_packet pkt = make_received(wire_bytes().fill(shift, 0xee).add(bytes).bytes, SENDER);
        pkt->offset = shift;
        pkt->cursor = pkt->data + shift;
        return pkt;
    }
    // The bytes that a decoder skipped, or -1 when it refused and left the cursor.
    int passed(reader read, const wire_bytes &bytes, uint32_t shift = 0) {
        const received_packet pkt = at(bytes, shift);
        const int result = read(&group, pkt.get());
        EXPECT_EQ(pkt->cursor, pkt->data + pkt->offset);
        const int moved = static_cast<int>(pkt->offset - shift);
        EXPECT_TRUE(result == 0 || moved == 0);
        return result == 0 ? moved : -1;
    }
    wccp_service_group group = {};
};

// Every component is refused at every length below its own.
TEST_F(Unload, TruncatedComponentsAreRefused) {
    const std::pair<reader, wire_bytes> rows[] = {
        {read_header, hex("0000000b 0200 0064")},
        {read_security, hex("0000 0004 00000000")},
        {read_security, hex("0000 0014 00000001 77*16")},
        {read_service, hex("0001 0018 01 33 c8 06 00000013 5a*16")},
        {read_identity, hex("0002 0010 0a000101 a1a2a3a4 0a000202 00000000")},
        {read_identity, hex("0002 001c 0a000101 a1a2a3a4 0a000202 00000003 07*12")},
        {read_view, view()},
        {read_view, view(2, 2)},
        {read_view, view(1, 1, 3, {hash_element, short_element, idle_element})},
        {read_view, view(32, 32, 32, std::vector<wire_bytes>(32, hash_element))},
        {read_map, hex("000e 0024 00000001 11*12 00000001 55*16")},
        {read_map, hex("000e 0064 00000001 11*12 00000005 55*80")},
        {read_capabilities, hex("0008 0000")},
        {read_capabilities, hex("0008 0010 0001 0004 00000002 0002 0004 00000003")},
        {read_command, hex("000f 0008 0001 0004 0a000001")},
        {read_command, hex("000f 000d 0001 0004 0a000001 09*5")},
        {read_query, hex("0007 0010 0a000101 00000005 0a000202 0a000064")},
        {read_unknown, hex("0063 0000")},
        {read_unknown, hex("0063 0007 01*7")},
    };
    for (const auto &[read, whole] : rows)
        for (const uint32_t shift : {0u, 1u, 3u}) {
            SCOPED_TRACE(testing::PrintToString(whole.bytes));
            wire_bytes cut = whole;
            EXPECT_EQ(passed(read, cut, shift), static_cast<int>(cut.size()));
            while (!cut.bytes.empty()) {
                cut.bytes.pop_back();
                EXPECT_EQ(passed(read, cut, shift), -1) << cut.size();
            }
        }
}

// Wrong lengths, counts and types: each is refused with its own line or without one.
TEST_F(Unload, RefusalsAndTheirLines) {
    const std::string bad_map =
        "unload assignment map: packet length is BAD or it has bogus values. rxed len: ";
    // The line after "WCCP GRP 51: " unless it begins with a W; empty: nothing is logged.
    const std::tuple<reader, wire_bytes, std::string> rows[] = {
        {read_security, hex("0003 0004 00000000"), "WCCP: expected security componenet. rxed 3"},
        {read_security, hex("0000 0008 00000000 00*16"), ""},
        {read_security, hex("0000 0015 00000001 00*20"), ""},
        {read_service, hex("0002 0018 5a*24"), "WCCP: expected service info componenet. rxed 2"},
        {read_service, hex("0001 0014 5a*24"), ""},
        {read_service, hex("0001 001c 5a*28"), ""},
        {read_identity, hex("00*19"), "static length (20) is longer than remaining pkt len (19)"},
        {read_identity, hex("0004 0010 00*16"), "expecting router id info, rxed 4"},
        {read_identity, hex("0002 0018 07*12 00000003 07*8"), "full length does not fit in pkt"},
        {read_identity, hex("0002 0010 07*12 40000000 07*32"), "full length does not fit in pkt"},
        {read_identity, hex("0002 000c 07*12 ffffffff 07*32"), "full length does not fit in pkt"},
        {read_identity, hex("0002 0014 07*12 00000002 07*8"), "rxed length (20) and expected length (24)"},
        {read_view, hex("00*19"), "static component does not fit in pkt"},
        {read_view, view(0, 0, 0, {}, 5), "WCCP: bad router view type rxed (5)"},
        {read_view, view(33, 33), "bad number of routers (33) in ICU pkt. "},
        {read_view, view(0xffffffff, 2), "bad number of routers (-1) in ICU pkt. "},
        {read_view, view(32, 30), "number of routers does not fit in pkt"},
        {read_view, view(0, 0, 33), "bad number of appliances (33) in ICU pkt."},
        {read_view, view(0, 0, 0x80000000), "bad number of appliances"},
        {read_view, view(0, 0, 4, {hash_element, hash_element, hash_element}),
         "# of appliances (4 x 44 bytes) does not fit in pkt length (0)"},
        {read_view, view(0, 0, 1, {hex("00*43")}, 4, 1), "# of appliances (1 x 44 bytes) does not fit"},
        {read_view, view(0, 0, 1, {hash_element}, 4, -1),
         "bad length. rxed length 63 pkt length 64 (check compatibility mode (IOS/Nexus))"},
        {read_view, view(0, 0, 1, {mask_element}),
         "bad length. rxed length 52 pkt length 36 (check compatibility mode (IOS/Nexus))"},
        {read_map, hex("000e 0023 00*35"),
         "minimum assignment map (len = 40) does not fit in the packet. router src ip : 10.0.9.9 "},
        {read_map, hex("000e 0023 00000001 11*12 00000001 55*16"),
         " assignment map length: 35 does not include at least one mask/value set (expected "
         "minimum len: 36)  router src ip : 10.0.9.9 "},
        {read_map, hex("000e 0024 00000001 11*12 00000002 55*32"), bad_map + "36 current len 52."},
        {read_map, hex("000e 0034 00000001 11*12 00000002 55*16"), bad_map + "52 current len 52."},
        {read_map, hex("000e 0024 00000001 11*12 10000000 55*16"), bad_map + "36"},
        {read_map, hex("000e 0024 00000001 11*12 0fffffff 55*32"), bad_map + "36"},
        {read_map, hex("000e ffff 00000001 11*12 ffffffff 55*16"), bad_map + "65535"},
        {read_map, hex("000e ffff 00000002 11*12 00000001 55*16"), bad_map + "65535"},
        {read_map, hex("000e ffff ffffffff 11*12 00000000 00*320"), bad_map + "65535"},
        {read_capabilities, hex("0008 000c 0001 0004 00000002 00*4"),
         "capability component length is not aligned. length 12 individual element size 8"},
        {read_capabilities, hex("0008 0010 0001 0004 00000002"), ""},
        {read_command, hex("000f 0008 0001 0004 0000"), "no commands in pkt"},
        {read_command, hex("000f 0009 0001 0004 00000000"), "bogus component length (9): does not  fit"},
        {read_query, hex("00*19"), "router query comp. does not fit in packet."},
        {read_query, hex("0008 0010 00*16"), "bad router query type rxed (8)"},
        {read_query, hex("0007 0014 00*20"), "bad length. rxed length 20 pkt length 16"},
        {read_unknown, hex("0063 0005 00000000"),
         "unkown pkt length does not fit in the packet. component type: 99 length 5 "},
    };
    log_lines log;
    for (const auto &[read, message, line] : rows) {
        EXPECT_EQ(passed(read, message), -1) << line;
        const std::string lines = log.take();
        EXPECT_TRUE(line.empty() ? lines.empty()
                                 : count_of(line[0] == 'W' ? line : "WCCP GRP 51: " + line, lines) > 0)
            << line << lines;
    }
    EXPECT_EQ(group.rx_unknown_capabilities, 0u);
    EXPECT_EQ(passed(read_security, hex("0000 0002 00000002 00*16")), 8) << "a shorter length passes";
}

// The compatibility mode only decides the form of one element.
TEST_F(Unload, TheFormOfAnElementFollowsFlagsAndMode) {
    // Flags and mode; form, size, and place of the weight.
    const std::tuple<uint16_t, uint32_t, int, uint32_t, uint32_t> rows[] = {
        {1, 1, WCCP_ELEMENT_HASH, 44, 40},        {0x80, 2, WCCP_ELEMENT_HASH, 44, 40},
        {3, 1, WCCP_ELEMENT_NO_REDIRECT, 32, 28}, {3, 2, WCCP_ELEMENT_NO_REDIRECT, 32, 28},
        {2, 1, WCCP_ELEMENT_REDIRECT, 16, 12},    {2, 2, WCCP_ELEMENT_REDIRECT, 32, 28}};
    for (const auto &[flags, mode, form, size, weight_at] : rows) {
        const wccp_element_shape shape = wccp_view_element_shape(flags, mode);
        EXPECT_EQ(std::tuple(flags, mode, static_cast<int>(shape.form), shape.size, shape.weight_at),
                  std::tuple(flags, mode, form, size, weight_at));
    }
    const wire_bytes ios = view(0, 0, 1, {short_element}), nexus = view(0, 0, 1, {mask_element});
    EXPECT_TRUE(passed(read_view, ios) == 40 && passed(read_view, nexus) == -1);
    group.compat_mode = WCCP_COMPAT_NEXUS;
    EXPECT_TRUE(passed(read_view, ios) == -1 && passed(read_view, nexus) == 56);
}

// --- Elements of a Router View

const be32 OURS = {{10, 0, 0, 1}};

wire_bytes element(uint32_t octet, uint32_t revision, uint32_t flags, const wire_bytes &middle,
                   uint32_t weight) {
    return wire_bytes().ip(0, octet).u16(revision).u16(flags).add(middle).u16(weight).u16(0);
}
wire_bytes hash_form(uint32_t last_octet, uint32_t weight, wire_bytes buckets, uint32_t flags = 0,
                     uint32_t revision = 0) {
    return element(last_octet, revision, flags, buckets.zeros(32 - buckets.size()), weight);
}
struct decoded_elements {
    wccp_rtr_view_appliance list[WCCP_MAX_APPLIANCES] = {};
    wccp_assign_summary hash = {9, 9, 9, 9};
    int result = -1;
};
// Without the last `cut` bytes.
decoded_elements decode_elements(wccp_service_group *group, const std::vector<wire_bytes> &elements,
                                 size_t cut = 0) {
    group->appliance_ipa = OURS;
    decoded_elements out;
    wire_bytes all; // at an odd address, without a byte to spare
    all.u8(0);
    for (const wire_bytes &each : elements)
        all.add(each);
    const std::vector<uint8_t> place(all.bytes.begin(), all.bytes.end() - static_cast<long>(cut));
    out.result = wccp_process_router_view_web_cache_id_elements(
        group, static_cast<uint32_t>(elements.size()),
        {place.data() + 1, static_cast<uint32_t>(place.size() - 1)}, out.list, &out.hash);
    return out;
}

TEST_F(Unload, ElementsAreDecodedByTheirForm) {
    const wire_bytes full = wire_bytes().fill(32, 0xff);
    const std::vector<wire_bytes> elements = {
        hash_form(1, 100, hex("80010000 ff")),
        hash_form(2, 0x1234, full),
        hash_form(3, 7, full, WCCP_IDENTITY_HISTORICAL),
        element(4, 0, 3, wire_bytes().zeros(20), 44),
    };
    const decoded_elements out = decode_elements(&group, elements);
    ASSERT_EQ(out.result, 0);
    EXPECT_TRUE(out.hash.valid == 1 && out.hash.self_count == 10);
    EXPECT_EQ(out.hash.total_count, 256) << "266, limited";
    const std::tuple<uint16_t, uint16_t, uint16_t> expected[] = {
        {100, 10, 256}, {0x1234, 256, 256}, {7, 0, 0}, {44, 0, 0}};
    for (uint8_t i = 0; i < 4; i++) {
        EXPECT_EQ(out.list[i].ipa, (be32{{10, 0, 0, static_cast<uint8_t>(i + 1)}}));
        EXPECT_EQ(std::tuple(out.list[i].weight, out.list[i].buckets_assigned, out.list[i].buckets_total),
                  expected[i]);
    }
    EXPECT_TRUE(out.list[0].bucket_bits[0] == 0x80010000 && out.list[0].bucket_bits[1] == 0xff000000);
    EXPECT_EQ(decode_elements(&group, {}).result + decode_elements(&group, {}).hash.total_count, 0);
    // Another hash revision is refused, historical or not, and so are truncated elements and null arguments.
    EXPECT_EQ(decode_elements(&group, {hash_form(1, 100, full), hash_form(2, 1, full, 0x80, 1)}).result, 1);
    for (const wire_bytes &last : elements)
        for (size_t cut = 3; cut <= last.size(); cut++) // the last two bytes, the status, are not read
            EXPECT_EQ(decode_elements(&group, {elements[3], last}, cut).result, 1)
                << last.size() << " - " << cut;
    decoded_elements none;
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(nullptr, 0, {}, none.list, &none.hash), 1);
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(&group, 0, {}, nullptr, &none.hash), 1);
    EXPECT_EQ(wccp_process_router_view_web_cache_id_elements(&group, 0, {}, none.list, nullptr), 1);
}

TEST_F(Unload, BucketBitsAreCountedWhateverTheirPattern) {
    std::minstd_rand random;
    for (int round = 0; round < 500; round++) {
        wire_bytes buckets;
        int expected = 0;
        for (int i = 0; i < 32; i++) {
            buckets.u8(static_cast<uint32_t>(random()));
            expected += std::popcount(buckets.bytes.back());
        }
        ASSERT_EQ(decode_elements(&group, {hash_form(1, 1, buckets)}).list[0].buckets_assigned, expected);
    }
}

TEST_F(Unload, AMapKeepsItsFirstMaskAndItsLastValues) {
    // Four bytes more than the elements need are not read.
    const wire_bytes two = hex("000e 0058 00000002 "
                               "00001741 00*8 00000001 00000001 00*8 0a000064 "
                               "00009999 00*8 00000002 00000002 00*8 0a000065 00000003 00*8 0a000066 00*4");
    received_packet pkt = at(two, 1);
    wccp_assign_map_info out = {};
    ASSERT_EQ(wccp_pkt_unload_assignment_map_component(&group, pkt.get(), &out), 0);
    EXPECT_TRUE(out.present == 1 && out.element_count == 2 && out.value_count == 2);
    EXPECT_TRUE(to_host(out.masks->mask.src_ip) == 0x1741 && to_host(out.values[1].value.src_ip) == 3);
    EXPECT_EQ(out.values[1].appliance_id, (be32{{10, 0, 0, 102}}));
    EXPECT_EQ(pkt->offset, 1u + 8 + 32 + 48);

    pkt = at(hex("000e 0024 00000000 11*12 00000009 55*16"));
    out = {};
    ASSERT_EQ(wccp_pkt_unload_assignment_map_component(&group, pkt.get(), &out), 0);
    EXPECT_TRUE(out.present == 1 && !out.values && pkt->offset == 8);
}

TEST_F(Unload, CapabilitiesTakeTheLastOfEachKind) {
    log_lines log;
    received_packet pkt = at(hex("0008 0028 0001 0004 00000001 0003 0004 00000002 0001 0004 00000103 "
                                 "0002 0004 00000003 004d 0004 00000005"),
                             1);
    wccp_rtr_capabilities out = {1, 1, 1};
    ASSERT_EQ(wccp_pkt_unload_capability_info_component(&group, pkt.get(), &out), 0);
    EXPECT_TRUE(out.forwarding == 0x103 && out.assignment == 3 && out.ret == 2 &&
                group.rx_unknown_capabilities == 1);
    EXPECT_NE(log.take(), "") << "more than the three known capabilities are logged";
    pkt = at(hex("0008 0018 0001 0004 00000002 0002 0004 00000002 0003 0004 00000002"));
    ASSERT_EQ(wccp_pkt_unload_capability_info_component(&group, pkt.get(), &out), 0);
    EXPECT_EQ(log.take(), "");
}

} // namespace
