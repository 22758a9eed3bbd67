// Interfaces that are added, deleted and changed: whatever happens, and in whatever order and number a
// program gets the notifications, in the end it knows the state of the kernel.

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <pthread.h>
#include <sys/ioctl.h>

#include <algorithm>
#include <condition_variable>
#include <filesystem>
#include <map>
#include <random>
#include <thread>

#include "platform/qvcommon.h"

using namespace std::chrono_literals;

namespace {

// Of an interface: "1/1" for administratively up, and running; its first address, or "".
using interface_state = std::pair<std::string, std::string>;
std::map<std::string, interface_state> find_kernel_states() {
    std::map<std::string, interface_state> states;
    ifaddrs *all = nullptr;
    EXPECT_EQ(getifaddrs(&all), 0);
    for (const ifaddrs *at = all; at; at = at->ifa_next) {
        if (strchr(at->ifa_name, ':')) // the label of a further address
            continue;
        auto &[link, address] = states[at->ifa_name];
        link = std::string(at->ifa_flags & IFF_UP ? "1" : "0") + (at->ifa_flags & IFF_RUNNING ? "/1" : "/0");
        if (address.empty() && at->ifa_addr && at->ifa_addr->sa_family == AF_INET)
            address = inet_ntoa(reinterpret_cast<const sockaddr_in *>(at->ifa_addr)->sin_addr);
    }
    freeifaddrs(all);
    return states;
}

// What a program knows that follows the notifications, and queries an address when it has changed, as the
// engine does.
struct known_state {
    std::mutex mutex;
    std::condition_variable changed;
    std::map<std::string, interface_state> interfaces;
    std::vector<std::string> reported; // "name 1/1", "name 10.9.0.1"
    size_t stack = 0;                  // of the library's thread
    bool held = false;                 // callbacks wait
    bool waiting = false;              // a callback waits

    void take(const std::string &name, bool address, const std::string &link) {
        std::unique_lock lock(mutex);
        waiting = held;
        changed.notify_all();
        changed.wait(lock, [this] { return !held; });
        waiting = false;
        const std::string now = address ? find_kernel_states()[name].second : link;
        (address ? interfaces[name].second : interfaces[name].first) = now;
        reported.push_back(name + " " + now);
        pthread_attr_t attributes;
        pthread_getattr_np(pthread_self(), &attributes);
        pthread_attr_getstacksize(&attributes, &stack);
        pthread_attr_destroy(&attributes);
        changed.notify_all();
    }
};
known_state *seen; // never freed, since the library's thread runs to the end

void on_link(const void *argument) {
    const auto *info = static_cast<const qv_if_state_info *>(argument);
    seen->take(info->name, false, std::to_string(info->admin_up) + "/" + std::to_string(info->link_up));
}
void on_address(const void *argument) {
    seen->take(static_cast<const char *>(argument), true, "");
}

void set_held(bool on) {
    std::unique_lock lock(seen->mutex);
    seen->held = on;
    seen->changed.notify_all();
}

void run_shell(const std::string &command) {
    const std::string functions =
        "add() { ip link add $1 type veth peer name $2; }; up() { ip link set $1 up; };"
        "down() { ip link set $1 down; }; name() { ip link set $1 name $2; };"
        "va() { add va vb && up vb && up va && ip addr add 10.9.0.1/24 dev va; };";
    ASSERT_EQ(system((functions + command).c_str()), 0) << command;
}

void wait_until(bool (*condition)()) {
    std::unique_lock lock(seen->mutex);
    ASSERT_TRUE(seen->changed.wait_for(lock, 10s, condition));
}
// A callback waits until hold(false).
void hold_callback() {
    set_held(true);
    run_shell("down lo && up lo");
    wait_until([] { return seen->waiting; });
}

void start_notifications(void (*between_the_kinds)() = [] {}) {
    if (seen)
        return;
    seen = new known_state;
    qvif_network_init_sockets();
    EXPECT_NE(qv_start_netlink_monitor(QV_NOTIFY_LINK_STATE), 0) << "without a callback";
    EXPECT_NE(qv_register_netlink_notifier(2, on_link), 0);
    EXPECT_NE(qv_register_netlink_notifier(0, nullptr), 0);
    ASSERT_EQ(qv_register_netlink_notifier(QV_NOTIFY_LINK_STATE, on_link), 0);
    ASSERT_EQ(qv_start_netlink_monitor(QV_NOTIFY_LINK_STATE), 0);
    between_the_kinds();
    ASSERT_EQ(qv_register_netlink_notifier(QV_NOTIFY_IPA_CHANGE, on_address), 0);
    ASSERT_EQ(qv_start_netlink_monitor(QV_NOTIFY_IPA_CHANGE), 0);
}

// Leaves a change of a link in the queue, which the start of the other kind empties, while a callback waits.
void change_early() {
    run_shell("add early other && up other && up early");
    wait_until([] { return seen->interfaces["early"].first == "1/1"; });
    hold_callback();
    run_shell("down early");
}

int flip_link(const char *name, bool up) {
    ifreq request = {};
    strncpy(request.ifr_name, name, IFNAMSIZ - 1);
    request.ifr_flags = up ? IFF_UP : 0;
    return ioctl(g_qvif_skfd, SIOCSIFFLAGS, &request);
}

std::string difference_to_the_kernel() { // seen->mutex held
    std::map<std::string, interface_state> states = find_kernel_states();
    for (const auto &known : seen->interfaces)
        states.insert({known.first, {"0/0", ""}}); // unless it exists
    std::string difference;
    for (const auto &[name, state] : states)
        if (const interface_state &known = seen->interfaces[name]; known != state)
            difference += " " + name + " " + known.first + " '" + known.second + "'";
    return difference;
}

// Once nothing has been reported for a while, the state of all interfaces that exist or were ever reported is
// that of the kernel.
testing::AssertionResult state_is_the_kernels() {
    const auto give_up = std::chrono::steady_clock::now() + 10s;
    std::unique_lock lock(seen->mutex);
    std::string difference = "not compared";
    while (!difference.empty() && std::chrono::steady_clock::now() < give_up)
        if (seen->changed.wait_for(lock, 60ms) == std::cv_status::timeout)
            difference = difference_to_the_kernel();
    return testing::AssertionResult(difference.empty()) << "wrong:" << difference;
}

// What has been reported since the last call.
std::vector<std::string> take_reported() {
    std::unique_lock lock(seen->mutex);
    return std::exchange(seen->reported, {});
}

struct Netlink : testing::Test {
    void SetUp() override {
        start_notifications(change_early);
        set_held(false);
        run_shell("va");
        ASSERT_TRUE(state_is_the_kernels());
        ASSERT_EQ(seen->interfaces["va"].second, "10.9.0.1");
    }
    void TearDown() override {
        set_held(false);
        for (const auto &[name, state] : find_kernel_states())
            if (name != "lo")
                (void)!system(("ip link del " + name + " 2>/dev/null").c_str()); // the end of a pair is gone
        EXPECT_TRUE(state_is_the_kernels());
    }
};

#define REMAKE "ip link del va && va"
#define OTHER_NAMESPACE                                                                                      \
    "unshare -n sleep 60 & other=$!; "                                                                       \
    "while [ $(readlink /proc/$other/ns/net) = $(readlink /proc/self/ns/net) ]; do sleep .01; done; "        \
    "ip link set va netns $other; "
// Changes, and what is reported of them.
const struct {
    const char *commands, *reported, *never_reported;
} changes[] = {
    {"down vb", "va 1/0", nullptr},
    {"down va", "va 0/0", nullptr},
    {"ip addr del 10.9.0.1/24 dev va", "va ", nullptr},
    {"ip addr add 10.8.0.1/24 dev va && ip addr del 10.9.0.1/24 dev va", "va 10.8.0.1", nullptr},
    {"down vb && up vb && ip addr flush dev va && ip addr add 10.6.0.1/24 dev va", "va 1/1", nullptr},
    {"down va && up vb", nullptr, nullptr},
    {"ip link del va", "va 0/0", nullptr},
    {REMAKE, "va 0/0", nullptr}, // another interface with the old name
    {"down va && name va vc && up vc", "va 0/0", nullptr},
    {"down va && name va vc && name vb va && name vc vb", nullptr, nullptr},
    {OTHER_NAMESPACE "kill $other", "va 0/0", nullptr},
    {OTHER_NAMESPACE "nsenter --net=/proc/$other/ns/net ip link set va netns $$ && kill $other && "
                     "ip addr add 10.9.0.3/24 dev va && up va",
     "va 0/0", nullptr},
    // A port that leaves its bridge stays up.
    {"ip link add bridge0 type bridge && up bridge0 && ip link set va master bridge0 && "
     "sleep .1 && ip link set va nomaster && ip link del bridge0",
     "bridge0 0/0", "va 0/0"},
};

// The texts of the engine show that of an address.
TEST(Closed, AddressText) {
    char buffer[46];
    EXPECT_STREQ(get_addr_str(4, to_be32(0xFFFFFFFF), 0, buffer, 15), "") << "no room for the terminator";
    EXPECT_STREQ(get_addr_str(6, to_be32(1), 0, buffer, sizeof buffer), "");
}

TEST_F(Netlink, TheThreadIsSmallAndTakesNoSignal) {
    const int fd = g_qvif_skfd;
    qvif_network_init_sockets();
    EXPECT_EQ(g_qvif_skfd, fd) << "opened once";
    EXPECT_EQ(seen->interfaces["lo"].first, "1/1") << "reported at the start";
#ifndef WCCP_SANITIZED
    EXPECT_LE(seen->stack, 128u * 1024);
#endif
    // One thread, which blocks all but SIGKILL, SIGSTOP and the C library's own two.
    run_shell("name=$(grep -lx qv_netlink /proc/" + std::to_string(getpid()) +
              "/task/*/comm) && grep -qE 'SigBlk:.fffffff[ef][7f]ffbfeff' \"${name%/comm}/status\"");
}

// Also when a callback is blocked while the kernel's queue overruns many times; the notifications that matter
// are among those that are lost.
TEST_F(Netlink, EachChangeIsReported) {
    for (const bool overrun : {false, true})
        for (const auto &[commands, expected, never_expected] : changes) {
            SCOPED_TRACE(commands);
            if (overrun && strstr(commands, "sleep"))
                continue; // slow
            if (overrun)
                hold_callback();
            for (int i = 0; overrun && i < 3000; i++)
                ASSERT_EQ(flip_link("va", i % 2), 0);
            (void)take_reported();
            run_shell(commands);
            set_held(false);
            ASSERT_TRUE(state_is_the_kernels());
            const std::vector<std::string> lines = take_reported();
            EXPECT_FALSE(overrun && lines.size() >= 2000) << "the queue did not overrun";
            const bool lost = overrun && strcmp(commands, REMAKE) != 0;
            const auto has = [&](const char *text) { return std::count(lines.begin(), lines.end(), text); };
            EXPECT_TRUE(lost || !expected || has(expected));
            EXPECT_FALSE(never_expected && has(never_expected));
            TearDown();
            SetUp();
        }
}

TEST_F(Netlink, AnyOrderOfEverythingEndsInTheRightState) {
    std::mt19937 random(7);
    const auto name = [&] { return std::string("v") + static_cast<char>('a' + random() % 5); };
    for (int round = 0; round < 15; round++) {
        std::string commands;
        for (int i = 0; i < 300; i++) {
            const std::string one = name(), other = name();
            const std::string address = "10." + std::to_string(random() % 4) + ".0.1/24 dev " + one;
            const std::string all[] = {"link add " + one + " type veth peer name " + other,
                                       random() % 4 ? "" : "link del " + one,
                                       "link set " + one + " name " + other,
                                       "addr add " + address,
                                       "addr del " + address,
                                       "link set " + one + " down",
                                       "link set " + one + " up",
                                       "link set " + one + " up"};
            commands += all[random() % 8] + "\n";
        }
        if (round % 3 == 0)
            set_held(true);
        commands = "ip -force -batch - >/dev/null 2>&1 <<.\n" + commands + ".\n";
        (void)!system(commands.c_str()); // some of them may fail
        set_held(false);
        ASSERT_TRUE(state_is_the_kernels()) << "round " << round;
    }
}

// The library's thread is busy while exit() runs. Streams are flushed after the last destructor, also after
// those of libraries.
ssize_t draw_out(void *, const char *, size_t count) {
    usleep(100000);
    return static_cast<ssize_t>(count);
}

TEST(Exit, DISABLED_Child) {
    start_notifications();
    std::thread([] {
        for (bool up = true;; up = !up)
            if (flip_link("lo", up) != 0)
                _exit(3); // the test would not test anything
    }).detach();
    std::this_thread::sleep_for(50ms);
    fputs("unflushed", fopencookie(nullptr, "w", {nullptr, draw_out, nullptr, nullptr}));
    exit(0);
}

TEST(Exit, NothingThatTheThreadUsesIsDestroyed) {
    const std::string self = std::filesystem::read_symlink("/proc/self/exe");
    const std::string command = self + " --gtest_also_run_disabled_tests --gtest_filter=Exit.DISABLED_Child "
                                       "--gtest_brief=1";
    for (int i = 0; i < 10; i++)
        ASSERT_EQ(system(command.c_str()), 0);
}

} // namespace
