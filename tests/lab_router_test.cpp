// The properties of the simulated router on which scenarios rely when they test wccpd: it refuses messages
// that are stale, cut or wrongly signed, its view has the assignment that it adopted, byte by byte, and it
// sends each packet to the owner of its bucket.
#include <gtest/gtest.h>

#include <algorithm>

#include "lab/router/forward.h"
#include "tests/support/wire_bytes.h"

using namespace lab;

namespace {

constexpr address ROUTER = 0x0a000001; // 10.0.0.1
constexpr address LOW = 0x0a000065;    // 10.0.0.101
constexpr address HIGH = 0x0a000066;   // 10.0.0.102

std::string hex_word(uint32_t value) {
    char text[9];
    snprintf(text, sizeof text, "%08x", value);
    return text;
}
// No security; dynamic service 51, priority 5, protocol 6 (TCP), hash on the destination address.
const std::string PLAIN = "0000 0004 00000000";
const std::string SERVICE_51 = " 0001 0018 01 33 05 06 00000002 00*16 ";

// Receive id 0: the router is not in the view of the message.
bytes make_here_i_am(address id, uint16_t weight, uint32_t receive_id, const std::string &security = PLAIN) {
    const std::string identity =
        "0003 002c" + hex_word(id) + " 0000 0000 00*32 " + hex_word(weight).substr(4) + "0000";
    const std::string view = receive_id == 0
                                 ? "0005 000c 00000001 00000000 00000000"
                                 : "0005 0014 00000001 00000001 0a000001" + hex_word(receive_id) + "00000000";
    return wire_message(10, {hex(security + SERVICE_51 + identity + view)});
}
// Two appliances: 100 buckets for the first, 156 for the second.
bytes hash_assignment(address key, uint32_t receive_id, uint32_t change_number) {
    return wire_message(12, {hex(PLAIN + SERVICE_51 + "0006 0124" + hex_word(key) +
                                 "00000001 00000001 0a000001" + hex_word(receive_id) +
                                 hex_word(change_number) + "00000002 0a000065 0a000066 00*100 01*156")});
}

struct bench {
    router self;
    output out;

    bench() { self.options.self = ROUTER; }
    bytes send(address from, const bytes &data) {
        out = {};
        router_receive(&self, 0, from, ROUTER, data, &out);
        return out.send.empty() ? bytes() : out.send.back().data;
    }
    std::string result_of(address from, const bytes &data) {
        send(from, data);
        return out.events.empty() ? "" : out.events.front().value("result", "");
    }
    void join(address id, uint16_t weight) {
        send(id, make_here_i_am(id, weight, 0));
        ASSERT_EQ(result_of(id, make_here_i_am(id, weight, newest(id))), "joined");
    }
    group &in() { return self.groups[51]; }
    uint32_t newest(address id) { return in().members[id].sent_ids.back(); } // receive id
};

TEST(LabRouter, EchoesTheHashAssignmentItAdopted) {
    bench lab;
    lab.join(LOW, 100);
    lab.join(HIGH, 200);
    const uint32_t change = lab.in().change_number;
    const auto assign = [&](address from, address key, uint32_t receive_id, uint32_t number) {
        return lab.result_of(from, hash_assignment(key, receive_id, number));
    };
    EXPECT_EQ(assign(HIGH, HIGH, lab.newest(HIGH), change), "ignored: not from the designated appliance");
    EXPECT_EQ(assign(HIGH, LOW, lab.newest(LOW), change), "ignored: not from a member");
    EXPECT_EQ(assign(LOW, LOW, lab.newest(LOW), change - 1), "ignored: stale change number");
    lab.send(LOW, make_here_i_am(LOW, 100, lab.newest(LOW)));
    EXPECT_EQ(assign(LOW, LOW, lab.newest(LOW) - 7, change), "ignored: stale receive id");
    EXPECT_EQ(lab.in().current.by, kind::none);
    EXPECT_EQ(assign(LOW, LOW, lab.newest(LOW), change), "adopted");
    EXPECT_EQ(assign(LOW, LOW, lab.newest(LOW), change), "adopted again");
    const bytes answer = lab.send(LOW, make_here_i_am(LOW, 100, lab.newest(LOW)));
    // The view follows header, security, service and an identity with two addresses.
    const bytes wanted =
        hex("0004 0070" + hex_word(change) + "0a000065 00000001 00000001 0a000001 00000002" +
            "0a000065 0000 0000 ff*12 0f 00*19 0064 0000 0a000066 0000 0000 00*12 f0 ff*19 00c8 0000")
            .bytes;
    ASSERT_GE(answer.size(), 72 + wanted.size());
    EXPECT_EQ(bytes(answer.begin() + 72, answer.begin() + 72 + 0x74), wanted);
}

TEST(LabRouter, RefusesMalformedMessages) {
    bench lab;
    bytes good = make_here_i_am(LOW, 100, 0);
    const auto refused = [&](bytes data) {
        return lab.result_of(LOW, data).starts_with("refused: ") && lab.out.send.empty();
    };
    for (size_t length = 0; length < good.size(); length++)
        EXPECT_TRUE(refused(bytes(good.begin(), good.begin() + static_cast<std::ptrdiff_t>(length))))
            << length;
    for (const size_t place : {4u, 7u, 9u, 11u, 16u, 47u, 93u, 103u}) {
        bytes bad = good;
        bad[place] ^= 0x10;
        EXPECT_TRUE(refused(bad)) << place;
    }
    bytes third = hash_assignment(LOW, 1, 1);
    third[third.size() - 1] = 2; // a bucket of a third appliance, of two
    EXPECT_TRUE(refused(third));
    EXPECT_TRUE(lab.self.groups.empty());
}

TEST(LabRouter, SignsAndChecks) {
    bench lab;
    lab.self.options.password = "secret";
    bytes signed_hello = make_here_i_am(LOW, 100, 0, "0000 0014 00000001 00*16");
    EXPECT_EQ(lab.result_of(LOW, signed_hello), "refused: wrong digest");
    // Computed with md5sum: "secret\0\0" and the message with a digest of zeros.
    const bytes digest = hex("bc76b5520d4b344b2f9ce814b8dbb9f3").bytes;
    std::copy(digest.begin(), digest.end(), signed_hello.begin() + 16);
    const bytes answer = lab.send(LOW, signed_hello);
    ASSERT_FALSE(answer.empty());
    bytes copy = answer;
    sign_message(&copy, "secret");
    EXPECT_EQ(copy, answer);
    sign_message(&copy, "Secret");
    EXPECT_NE(copy, answer);
    EXPECT_EQ(lab.result_of(LOW, make_here_i_am(LOW, 100, 0)), "refused: not signed");
}

// --- The data path

// IPv4 with the first bytes of TCP.
bytes client_packet(const std::string &src, const std::string &dst, const std::string &ports) {
    return hex("4500 002c 0001 4000 40 06 0000" + src + dst + ports + "00*20").bytes;
}

TEST(LabRouter, FindsTheOwnerOfAPacket) {
    bench lab;
    lab.join(LOW, 100);
    lab.join(HIGH, 200);
    const auto ask = [&](const bytes &data, const std::set<uint8_t> &services = {51}) {
        packet_fields fields;
        EXPECT_TRUE(read_packet(data.data(), data.size(), &fields));
        return find_owner(lab.self, services, fields);
    };
    const bytes web = client_packet("0a010080", "0a020002", "c0000050");
    EXPECT_EQ(ask(web).owner, 0u); // no table yet
    lab.send(LOW, make_here_i_am(LOW, 100, lab.newest(LOW)));
    ASSERT_EQ(lab.result_of(LOW, hash_assignment(LOW, lab.newest(LOW), lab.in().change_number)), "adopted");
    EXPECT_EQ(ask(web).owner, ask(client_packet("0a0100ff", "0a020002", "00010002")).owner); // by destination
    EXPECT_EQ(ask(web, {52}).owner, 0u);
    std::map<address, int> owners;
    for (uint32_t i = 0; i < 512; i++)
        owners[ask(client_packet("0a010080", hex_word(0x0a020000 + i), "c0000050")).owner]++;
    EXPECT_NEAR(owners[LOW], 200, 60); // 100 buckets of 256
    EXPECT_EQ(owners[LOW] + owners[HIGH], 512);

    // Both directions go to the same appliance: the other service hashes the source address.
    group &back = lab.self.groups[52] = lab.in();
    back.service.id = 52;
    back.service.flags = 1;
    EXPECT_EQ(ask(client_packet("0a020002", "0a010080", "0050c000"), {52}).bucket, ask(web).bucket);
    back.service.flags = 0x31;
    back.service.ports = {80};
    EXPECT_NE(ask(client_packet("0a020002", "0a010080", "0050c000"), {52}).owner, 0u);
    EXPECT_EQ(ask(web, {52}).owner, 0u);
    back.service.priority = 9;
    EXPECT_EQ(ask(client_packet("0a020002", "0a010080", "00500050"), {51, 52}).in, &back);

    const verdict found = ask(web);
    EXPECT_EQ(gre_header(lab.self, found),
              hex("0000 883e 80 33 00" + hex_word(found.bucket).substr(6)).bytes);
    // scenario_traffic has the router's other headers.
    for (const auto &[gre, offset] : {std::pair{"0000 0800 45000014", 4u},
                                      {"0000 883e 45000014", 4u},
                                      {"0000 883e 80330007 45000014", 8u},
                                      {"2000 0800 45000014", 0u},
                                      {"0000 86dd 60000014", 0u}})
        EXPECT_EQ(inner_offset(hex(gre).bytes.data(), hex(gre).size()), offset) << gre;

    lab.in().current.buckets.fill(0);
    EXPECT_EQ(ask(web).owner, 0u);
    lab.in().current = {
        kind::mask, LOW, 1, {}, {{{0, 0, 0, 3}, {{{0, 0, 0, 0}, LOW}, {{0, 0, 0, 2}, HIGH}}}}};
    EXPECT_EQ(ask(web).owner, LOW);
    EXPECT_EQ(ask(client_packet("0a010080", "0a020002", "c0000052")).owner, HIGH);
    EXPECT_EQ(ask(client_packet("0a010080", "0a020002", "c0000051")).owner, 0u);

    packet_fields fields;
    for (const size_t place : {0u, 3u}) { // version, total length
        bytes bad = web;
        bad[place] = 0x2f;
        EXPECT_FALSE(read_packet(bad.data(), bad.size(), &fields)) << place;
    }
    EXPECT_FALSE(read_packet(web.data(), 43, &fields));
}

} // namespace
