// The lab's router, driven by packets written out by hand and a clock turned by hand.
#include <gtest/gtest.h>

#include <algorithm>

#include "lab/router/router.h"

using namespace lab;

constexpr address ROUTER = 0x0a000001; // 10.0.0.1
constexpr address LOW = 0x0a000065;    // 10.0.0.101
constexpr address HIGH = 0x0a000066;   // 10.0.0.102

static bytes hex(const std::string &text) {
    bytes out;
    std::string digits;
    std::copy_if(text.begin(), text.end(), std::back_inserter(digits), [](char c) { return c != ' '; });
    for (size_t i = 0; i + 1 < digits.size(); i += 2)
        out.push_back(static_cast<uint8_t>(std::stoi(digits.substr(i, 2), nullptr, 16)));
    return out;
}
static std::string word(uint32_t value) {
    char text[9];
    snprintf(text, sizeof text, "%08x", value);
    return text;
}
static std::string zeros(size_t count) {
    return std::string(2 * count, '0');
}
static bytes message(uint32_t type, const std::string &components) {
    bytes body = hex(components);
    bytes out = hex(word(type) + "0200" + word(static_cast<uint32_t>(body.size())).substr(4));
    out.insert(out.end(), body.begin(), body.end());
    return out;
}
// No security; dynamic service 51, priority 5, protocol 6 (TCP), hash on the destination address.
static const std::string PLAIN = "0000 0004 00000000";
static const std::string SERVICE_51 = "0001 0018 01 33 05 06 00000002 00000000000000000000000000000000";

// Receive id 0: the router is not in the view of the message.
static bytes hello(address id, uint16_t weight, uint32_t receive_id, const std::string &tail = "") {
    const std::string identity =
        "0003 002c" + word(id) + "0000 0000" + zeros(32) + word(weight).substr(4) + "0000";
    const std::string view = receive_id == 0
                                 ? "0005 000c 00000001 00000000 00000000"
                                 : "0005 0014 00000001 00000001 0a000001" + word(receive_id) + "00000000";
    return message(10, PLAIN + SERVICE_51 + identity + view + tail);
}
static bytes mask_hello(address id, uint32_t receive_id) {
    return message(10, PLAIN + SERVICE_51 + "0003 0020" + word(id) +
                           "0000 0002 00000001 00000000 00000f00 0000 0000 00000000 0064 0000"
                           "0005 0014 00000001 00000001 0a000001" +
                           word(receive_id) + "00000000 0008 0008 0002 0004 00000002");
}
// The first 100 buckets to the first of two appliances.
static bytes hash_assignment(address key, uint32_t receive_id, uint32_t change_number) {
    std::string buckets;
    for (int i = 0; i < 256; i++)
        buckets += i < 100 ? "00" : "01";
    return message(12, PLAIN + SERVICE_51 + "0006 0124" + word(key) + "00000001 00000001 0a000001" +
                           word(receive_id) + word(change_number) + "00000002 0a000065 0a000066" + buckets);
}

struct bench {
    router self;
    double now = 0;
    output out;

    bench() { self.options.self = ROUTER; }
    const bytes &send(address from, const bytes &data) {
        out = {};
        router_receive(&self, now, from, ROUTER, data, &out);
        static const bytes none;
        return out.send.empty() ? none : out.send.back().data;
    }
    void tick(double at) {
        now = at;
        out = {};
        router_tick(&self, now, &out);
    }
    std::string result() const { return out.events.empty() ? "" : out.events.front().value("result", ""); }
    void join(address id, uint16_t weight) {
        send(id, hello(id, weight, 0));
        send(id, hello(id, weight, members(id).sent_ids.back()));
        ASSERT_EQ(result(), "joined");
    }
    group &in() { return self.groups[51]; }
    member &members(address id) { return in().members[id]; }
    std::string tell(const std::vector<std::string> &words) {
        out = {};
        return router_command(&self, now, words, &out);
    }
};

TEST(LabRouter, AnswersAndTakesInAfterTheEcho) {
    bench lab;
    lab.self.options.offer = {1, 1, 1};
    // First contact: one-way, the appliance is not in the view.
    EXPECT_EQ(lab.send(LOW, hello(LOW, 100, 0)),
              message(11, PLAIN + SERVICE_51 +
                              "0002 0014 0a000001 00000001 0a000001 00000001 0a000065"
                              "0004 0018 00000001 00000000 00000000 00000001 0a000001 00000000"));
    EXPECT_EQ(lab.send(LOW, hello(LOW, 100, 9)).size(), 8u + 8 + 28 + 24 + 28)
        << "a receive id that never went out";
    EXPECT_EQ(lab.send(LOW, hello(LOW, 100, 2)),
              message(11, PLAIN + SERVICE_51 +
                              "0002 0014 0a000001 00000003 0a000001 00000001 0a000065"
                              "0004 0044 00000002 00000000 00000000 00000001 0a000001 00000001"
                              "0a000065 0000 0000" +
                              zeros(32) + "0064 0000"));
    ASSERT_EQ(lab.out.send.size(), 1u);
    EXPECT_EQ(lab.out.send[0].to, LOW);
}

TEST(LabRouter, EchoesTheHashAssignmentItAdopted) {
    bench lab;
    lab.join(LOW, 100);
    lab.join(HIGH, 200);
    const uint32_t change = lab.in().change_number;
    const auto newest = [&] { return lab.members(LOW).sent_ids.back(); };

    lab.send(HIGH, hash_assignment(HIGH, lab.members(HIGH).sent_ids.back(), change));
    EXPECT_EQ(lab.result(), "ignored: not from the designated appliance");
    lab.send(HIGH, hash_assignment(LOW, newest(), change));
    EXPECT_EQ(lab.result(), "ignored: not from a member");
    lab.send(LOW, hash_assignment(LOW, newest(), change - 1));
    EXPECT_EQ(lab.result(), "ignored: stale change number");
    lab.send(LOW, hello(LOW, 100, newest()));
    lab.send(LOW, hash_assignment(LOW, newest() - 7, change));
    EXPECT_EQ(lab.result(), "ignored: stale receive id");
    EXPECT_EQ(lab.in().current.by, kind::none);

    lab.send(LOW, hash_assignment(LOW, newest(), change));
    EXPECT_EQ(lab.result(), "adopted");
    lab.send(LOW, hash_assignment(LOW, newest(), change));
    EXPECT_EQ(lab.result(), "adopted again");
    const bytes answer = lab.send(LOW, hello(LOW, 100, newest()));
    // Behind header, security, service and identity with two addresses: the view, its key and the owners'
    // bits.
    const bytes view(answer.begin() + 44 + 28, answer.end());
    const bytes wanted =
        hex("0004 0070" + word(change) + "0a000065 00000001 00000001 0a000001 00000002" +
            "0a000065 0000 0000 ffffffffffffffffffffffff 0f" + zeros(19) + "0064 0000" +
            "0a000066 0000 0000" + zeros(12) + "f0 ffffffffffffffffffffffffffffffffffffff 00c8 0000");
    EXPECT_EQ(bytes(view.begin(), view.begin() + 0x74), wanted);

    // The owner of the rest leaves: its buckets are nobody's, the others keep theirs.
    const bytes farewell =
        hello(HIGH, 200, lab.members(HIGH).sent_ids.back(), "000f 0008 0001 0004 0a000066");
    lab.send(HIGH, farewell);
    EXPECT_EQ(lab.result(), "shutdown");
    EXPECT_EQ(lab.in().change_number, change + 1);
    EXPECT_EQ(std::count(lab.in().current.buckets.begin(), lab.in().current.buckets.end(), LOW), 100);
    EXPECT_EQ(std::count(lab.in().current.buckets.begin(), lab.in().current.buckets.end(), 0u), 156);
    EXPECT_FALSE(lab.in().members.contains(HIGH));
}

TEST(LabRouter, MaskViewHasTheFormOfItsKind) {
    for (const bool nexus : {false, true}) {
        bench lab;
        lab.self.options.nexus = nexus;
        lab.send(LOW, hello(LOW, 100, 0));
        lab.send(LOW, mask_hello(LOW, 1));
        ASSERT_EQ(lab.result(), "joined");
        const std::string mask = "00000000 00000f00 0000 0000";
        lab.send(
            LOW,
            message(12, PLAIN + SERVICE_51 + "000d 0050 0001 004c 0a000065 00000007 00000001 0a000001" +
                            word(2) + word(lab.in().change_number) + "00000001" + mask + "00000002" +
                            "00000000 00000000 0000 0000 0a000065 00000000 00000100 0000 0000 0a000066"));
        ASSERT_EQ(lab.result(), "adopted");
        const bytes answer = lab.send(LOW, mask_hello(LOW, 2));
        const std::string element = nexus ? "0a000065 0000 0002 00000001" + mask + "00000000 0064 0000"
                                          : "0a000065 0000 0002 00000000 0064 0000";
        // One value is owned by an address that is no member: nobody's.
        const bytes wanted = hex("0004" + word(nexus ? 0x38 : 0x28).substr(4) +
                                 "00000002 0a000065 00000007 00000001 0a000001 00000001" + element +
                                 "000e 0034 00000001" + mask + "00000002" +
                                 "00000000 00000000 0000 0000 0a000065 00000000 00000100 0000 0000 00000000" +
                                 "0008 0018 0001 0004 00000003 0002 0004 00000003 0003 0004 00000003");
        EXPECT_EQ(bytes(answer.begin() + 44 + 24, answer.end()), wanted) << nexus;
    }
}

TEST(LabRouter, AsksTheSilentAndDropsThem) {
    bench lab;
    lab.join(LOW, 100);
    lab.join(HIGH, 100);
    lab.now = 10;
    lab.send(HIGH, hello(HIGH, 100, lab.members(HIGH).sent_ids.back()));
    lab.tick(24.9);
    EXPECT_TRUE(lab.out.send.empty());
    lab.tick(25);
    ASSERT_EQ(lab.out.send.size(), 1u);
    const uint32_t asked = lab.members(LOW).sent_ids.back();
    EXPECT_EQ(lab.out.send[0].data,
              message(13, PLAIN + SERVICE_51 + "0007 0010 0a000001" + word(asked) + "0a000001 0a000065"));
    lab.tick(26);
    EXPECT_TRUE(lab.out.send.empty()) << "one query is enough";
    lab.send(LOW, hello(LOW, 100, asked));
    EXPECT_EQ(lab.result(), "member");
    lab.now = 27;
    lab.send(LOW, hello(LOW, 100, asked)); // the same answer again, as appliances do
    EXPECT_EQ(lab.result(), "member");

    const uint32_t change = lab.in().change_number;
    lab.tick(35);
    lab.tick(40);
    EXPECT_FALSE(lab.in().members.contains(HIGH));
    EXPECT_TRUE(lab.in().members.contains(LOW));
    EXPECT_EQ(lab.in().change_number, change + 1);
    // One that comes without an echo keeps nothing alive.
    lab.now = 50;
    lab.send(LOW, hello(LOW, 100, 0));
    lab.tick(52);
    lab.tick(57);
    EXPECT_TRUE(lab.in().members.empty());
}

TEST(LabRouter, RefusesWhatDoesNotFit) {
    bench lab;
    bytes good = hello(LOW, 100, 0);
    const auto refused = [&](bytes data) {
        lab.send(LOW, data);
        return lab.out.send.empty() && lab.result().starts_with("refused: ");
    };
    for (size_t length = 0; length < good.size(); length++)
        EXPECT_TRUE(refused(bytes(good.begin(), good.begin() + static_cast<std::ptrdiff_t>(length))))
            << length;
    for (const size_t place : {4u, 7u, 9u, 11u, 16u, 47u, 93u, 103u}) {
        bytes bad = good;
        bad[place] ^= 0x10;
        EXPECT_TRUE(refused(bad)) << place;
    }
    bytes liar = hash_assignment(LOW, 1, 1);
    liar[liar.size() - 1] = 2; // a third appliance, of two
    EXPECT_TRUE(refused(liar));
    lab.self.options.services = {7};
    EXPECT_TRUE(refused(good));
    EXPECT_TRUE(lab.self.groups.empty());

    lab.self.options.services.clear();
    lab.self.options.offer = {3, 1, 3};
    lab.send(LOW, good);
    lab.send(LOW, mask_hello(LOW, 1));
    EXPECT_EQ(lab.result(), "refused: assignment method not offered");
    EXPECT_EQ(lab.out.send.size(), 1u) << "it is answered all the same";
    lab.join(HIGH, 1);
}

TEST(LabRouter, SignsAndChecks) {
    bench lab;
    lab.self.options.password = "secret";
    bytes signed_hello =
        message(10, "0000 0014 00000001" + zeros(16) + SERVICE_51 + "0003 002c 0a000065 0000 0000" +
                        zeros(32) + "0064 0000 0005 000c 00000001 00000000 00000000");
    lab.send(LOW, signed_hello);
    EXPECT_EQ(lab.result(), "refused: wrong digest");
    // md5sum of "secret\0\0" and the message above with an empty digest
    const bytes digest = hex("bc76b5520d4b344b2f9ce814b8dbb9f3");
    std::copy(digest.begin(), digest.end(), signed_hello.begin() + 16);
    const bytes answer = lab.send(LOW, signed_hello);
    ASSERT_FALSE(answer.empty()) << lab.result();
    bytes copy = answer;
    sign(&copy, "secret");
    EXPECT_EQ(copy, answer);
    sign(&copy, "Secret");
    EXPECT_NE(copy, answer);
    lab.send(LOW, hello(LOW, 100, 0));
    EXPECT_EQ(lab.result(), "refused: not signed");
}

TEST(LabRouter, DoesAsItIsTold) {
    bench lab;
    lab.join(LOW, 100);
    const auto again = [&] { return lab.send(LOW, hello(LOW, 100, lab.members(LOW).sent_ids.back())); };
    const bytes normal = again();

    for (const char *name :
         {"cut", "routers-33", "appliances-33", "many-components", "odd-component", "huge-map"}) {
        ASSERT_EQ(lab.tell({"fault", name}), "ok");
        EXPECT_NE(again().size(), normal.size()) << name;
        EXPECT_EQ(again().size(), normal.size()) << name << " only once";
    }
    EXPECT_EQ(lab.tell({"fault", "nonsense"}).rfind("error:", 0), 0u);

    lab.send(LOW, hash_assignment(LOW, lab.members(LOW).sent_ids.back(), lab.in().change_number));
    EXPECT_EQ(lab.tell({"assign", "51", "3", "3", "10.0.0.102"}), "ok");
    EXPECT_EQ(lab.in().current.buckets[3], HIGH);
    EXPECT_EQ(lab.in().current.buckets[4], LOW);
    EXPECT_EQ(router_state(lab.self, 0)["groups"]["51"]["assignment"]["buckets"][3], "10.0.0.102");

    const uint32_t change = lab.in().change_number;
    EXPECT_EQ(lab.tell({"list", "10.0.0.9"}), "ok");
    EXPECT_EQ(lab.in().router_view, (std::vector<address>{ROUTER, 0x0a000009}));
    EXPECT_EQ(lab.in().change_number, change + 1);

    EXPECT_EQ(lab.tell({"raw", "0011ff", "10.0.0.7"}), "ok");
    ASSERT_EQ(lab.out.send.size(), 1u);
    EXPECT_EQ(lab.out.send[0].data, hex("0011ff"));

    EXPECT_EQ(lab.tell({"stop"}), "ok");
    EXPECT_TRUE(again().empty());
    EXPECT_EQ(lab.tell({"resume"}), "ok");
    EXPECT_EQ(lab.tell({"forget", "10.0.0.101"}), "ok");
    lab.send(LOW, hello(LOW, 100, 12));
    EXPECT_FALSE(lab.members(LOW).usable) << "what it echoes was sent to one that is forgotten";
}
