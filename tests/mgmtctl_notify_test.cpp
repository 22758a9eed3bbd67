// "mgmtctl notify": which changes are reported and in which order, the environment of commands, and how they
// are run.
#include <csignal>

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/notify_command.h"
#include "peers/mgmtctl/notify_words.h"
#include "runtime/ttime.h"
#include "tests/support/canned_nodes.h"
#include "tests/support/texts.h"

namespace {

constexpr notify_kind ROLE = notify_kind::role, ALARM = notify_kind::alarm, HEALTH = notify_kind::health;

struct Notify : testing::Test {
    notify_book book;
    std::string said;

    void SetUp() override {
        book.say = [this](const std::string &line) { said += line + "\n"; };
        book.clock_s = [] { return int64_t{1000}; };
    }
    // What is reported next, as "kind name previous>state merged".
    strings take_all() {
        strings out;
        for (notify_change change; notify_take(&book, &change);)
            out.push_back(std::string(notify_kind_word(change.subject.kind)) + " " + change.subject.name +
                          " " + change.previous + ">" + change.state + " " + std::to_string(change.merged));
        return out;
    }
};

TEST_F(Notify, ChangesKeepTheirOrderAndANewerStateReplacesAQueuedOne) {
    const auto note = [&](notify_kind kind, const char *name, const char *state) {
        notify_note(&book, {kind, name}, state, "");
    };
    note(ROLE, "51", "BACKUP");
    note(HEALTH, "51", "up");
    note(ALARM, "196638 eth0:grp:51", "raised");
    note(ROLE, "51", "ACTIVE");
    note(ROLE, "51", "ACTIVE");
    note(ALARM, "196638 eth0:grp:52", "cleared"); // was never raised
    EXPECT_EQ(take_all(), (strings{"role 51 UNKNOWN>ACTIVE 1", "health 51 unknown>up 0",
                                   "alarm 196638 eth0:grp:51 cleared>raised 0"}));
    EXPECT_EQ(said, "role 51: BACKUP was replaced by ACTIVE before its turn (1 replaced so far)\n");
    // Unknown health of a proxy is not a change; a state that was left and entered again is.
    note(HEALTH, "51", "unknown");
    note(HEALTH, "51", "up");
    note(ROLE, "51", "BACKUP");
    note(ROLE, "51", "ACTIVE");
    EXPECT_EQ(take_all(), (strings{"role 51 ACTIVE>ACTIVE 1"}));

    said.clear();
    for (size_t i = 0; i <= NOTIFY_WAITING_MAX; i++)
        note(ALARM, ("7 " + std::to_string(i)).c_str(), "raised");
    EXPECT_EQ(book.waiting.size(), NOTIFY_WAITING_MAX);
    EXPECT_EQ(said,
              "alarm 7 256: raised is dropped until there is room, 256 changes wait (1 dropped so far)\n");
}

// Finds changes without events, also after a restart of the service.
TEST_F(Notify, AComparisonFindsMissedChanges) {
    notify_compare(&book, ROLE, {{"51", {"ACTIVE", ""}}, {"52", {"BACKUP", ""}}});
    notify_compare(&book, ALARM, {{"196640 proxy:grp:5 1", {"raised", ""}}});
    notify_compare(&book, HEALTH, {{"51", {"up", ""}}, {"52", {"down", ""}}});
    EXPECT_EQ(take_all().size(), 5u);
    const std::string text = notify_book_text(book);
    EXPECT_EQ(text, "ACTIVE role 51\nBACKUP role 52\nraised alarm 196640 proxy:grp:5 1\nup health 51\ndown "
                    "health 52\n");
    book.reported.clear();
    EXPECT_EQ(notify_read_book(&book, text + "AKTIVE role 5\nACTIVE role\nup role 5\n\x01\n\n"), 5u);
    EXPECT_EQ(notify_book_text(book), text);
    notify_compare(&book, ROLE, {{"52", {"ACTIVE", ""}}});
    notify_compare(&book, ALARM, {});
    notify_compare(&book, HEALTH, {{"52", {"down", ""}}}); // the intercept of 51 is gone
    EXPECT_EQ(take_all(), (strings{"role 52 BACKUP>ACTIVE 0", "role 51 ACTIVE>UNKNOWN 0",
                                   "alarm 196640 proxy:grp:5 1 raised>cleared 0"}));
    EXPECT_EQ(notify_book_text(book), "ACTIVE role 52\ndown health 52\n");
}

TEST_F(Notify, ACommandGetsTheChangeAndItsReason) {
    const auto explain = [](const char *code, int group, const char *who, const char *offered = "") {
        reason out;
        std::tie(out.code, out.group, out.who, out.offered) = std::tuple(code, group, who, offered);
        fill_reason(reason_texts(), &out);
        return out;
    };
    const reason silent = explain("router-silent", 51, "10.0.0.1"), absent = explain("wccpd-absent", -1, ""),
                 loop = explain("restart-loop", -1, "tunneld", "restarted 3 times in 9 s");
    // All values but the time: KIND|GROUP|ALARM|SOURCE|STATE|PREVIOUS|REASON|CAUSE|NEXT|MERGED|
    const auto check = [](const ctl_event &event, const std::vector<reason> &reasons,
                          const std::string &wanted) {
        notify_change change = {{}, "", "before", "", 1000, 2};
        notify_state state;
        EXPECT_TRUE(read_notify_event(event, &change.subject, &state));
        change.state = state.state;
        change.detail = state.detail;
        std::string names, values;
        for (const std::string &each : notify_environment(change, reasons)) {
            names += each.substr(0, each.find('=')) + " ";
            values += each.starts_with("WCCP_TIME=") ? "" : each.substr(each.find('=') + 1) + "|";
        }
        EXPECT_EQ(names, "WCCP_KIND WCCP_GROUP WCCP_ALARM WCCP_SOURCE WCCP_STATE WCCP_PREVIOUS WCCP_REASON "
                         "WCCP_CAUSE WCCP_NEXT WCCP_TIME WCCP_MERGED ");
        EXPECT_EQ(values, wanted);
    };
    const auto words_of = [](const reason &of) { return of.cause + "|" + of.next; };
    const auto event = [](const char *name, const std::string &bindings) {
        return ctl_event{name, bindings_of("", bindings)};
    };
    check(event(EVENT_ROLE_CHANGE, "group string 51|role uint32 1"), {silent},
          "role|51|||BACKUP|before|router-silent|10.0.0.1 has stopped answering: no I-See-You for 40 s|"
          "check the router, its password for the group, and the path to it|2|");
    check(event(EVENT_ROLE_CHANGE, "group string 51|role uint32 2"), {absent, silent},
          "role|51|||UNKNOWN|before|wccpd-absent|" + words_of(absent) + "|2|");
    check(event(EVENT_PROXY_CHANGE,
                "group uint8 7|up bool false|reason string no\nanswer\x1b[1m" + std::string(999, 'x')),
          {},
          "health|7|||down|before|proxy-down|no?answer?[1m" + std::string(242, 'x') +
              "|start the proxy; mgmtctl intercept show 7 shows its state|2|");
    check(event(EVENT_RAISE_ALARM, "alarm_type string 196641|param_3 string tunneld|comment string words"),
          {loop}, "alarm||restart-loop|tunneld|raised|before|restart-loop|" + words_of(loop) + "|2|");
    check(
        event(EVENT_CLEAR_ALARM, "alarm_type string 196638|param_3 string eth0:grp:51|comment string words"),
        {silent}, "alarm|51|adjacency|eth0:grp:51|cleared|before||words||2|");
    notify_subject subject;
    notify_state state;
    EXPECT_FALSE(read_notify_event({EVENT_ROLE_CHANGE, {{"group", "string", "256"}}}, &subject, &state));
    EXPECT_FALSE(read_notify_event({EVENT_PROCESS_CRASH, {}}, &subject, &state));
}

struct Commands : testing::Test {
    char directory[32] = "/tmp/notify-test-XXXXXX";
    std::string said;

    void SetUp() override {
        sigset_t set;
        sigemptyset(&set);
        for (const int number : {SIGCHLD, SIGTERM, SIGINT, SIGHUP})
            sigaddset(&set, number);
        sigprocmask(SIG_BLOCK, &set, nullptr);
        ASSERT_TRUE(mkdtemp(directory));
    }
    void TearDown() override { (void)!system(("rm -rf " + std::string(directory)).c_str()); }
    std::string add(const char *name, const std::string &script, mode_t mode = 0755) {
        const std::string path = path_of(name);
        std::ofstream(path) << "#!/bin/sh\ncd " << directory << "\n" << script;
        chmod(path.c_str(), mode);
        return path;
    }
    std::string path_of(const char *name) const { return std::string(directory) + "/" + name; }
    std::string read(const char *name) const { return text_of_file(path_of(name)); }
    notify_run run(int64_t limit_ms) {
        const auto say = [this](const std::string &line) { said += line + "\n"; };
        return {find_notify_commands(directory).paths, {"WCCP_KIND=role"}, limit_ms, 100, say};
    }
};

TEST_F(Commands, RunOneAfterTheOtherWithAllTheirChildren) {
    setenv("WCCP_STALE", "1", 1);
    setenv("OPERATOR", "yes", 1);
    add("10-first", "echo first >>log; (sleep 0.1; echo late >>log) & exit 3\n");
    add("20-second", "echo second $WCCP_KIND $WCCP_STALE $OPERATOR >>log; read x || echo no input >>log; ls "
                     "/proc/self/fd | wc -l >>log\n");
    EXPECT_EQ(run_notify_commands(run(10000)), NOTIFY_FAILED);
    EXPECT_EQ(read("log"), "first\nlate\nsecond role yes\nno input\n4\n"); // 4: that of ls itself
    EXPECT_EQ(said, path_of("10-first: exited with 3\n"));
}

TEST_F(Commands, EndWithTheirWholeGroupWhenTheyTakeTooLong) {
    const auto alive = [&](const char *name) { return kill(std::stoi(read(name)), 0) == 0; };
    add("10-slow", "sleep 100 & echo $! >slow; wait\n");
    add("20-stubborn", "trap '' TERM; sleep 100 & echo $! >stubborn; wait; wait\n");
    add("30-next", "echo next >next\n");
    const int64_t began = lt_monotonic_ms();
    EXPECT_TRUE(run_notify_commands(run(300)) == NOTIFY_TIMED_OUT && lt_monotonic_ms() - began < 8000);
    EXPECT_TRUE(!(alive("slow") || alive("stubborn")) && read("next") == "next\n");
    EXPECT_TRUE(contains(said, "/20-stubborn: not done after 0 s, ended\n"));

    // When the program ends, so does the running command, and no other is started.
    for (const char *name : {"next", "slow"})
        unlink(path_of(name).c_str());
    pid_t pid = 0;
    int pidfd = -1, status = 0;
    ASSERT_TRUE(start_notify_commands(run(60000), &pid, &pidfd));
    while (read("slow").empty())
        usleep(10000);
    kill(pid, SIGTERM);
    pollfd ended = {pidfd, POLLIN, 0};
    ASSERT_TRUE(poll(&ended, 1, 8000) == 1 && waitpid(pid, &status, 0) == pid);
    EXPECT_TRUE(WEXITSTATUS(status) != NOTIFY_DONE && !alive("slow") && read("next") == "");
    close(pidfd);
}

TEST_F(Commands, OnlyFilesThatOnlyRootCanWriteAreRun) {
    const std::string good = add("good", "true\n");
    add("group-writable", "true\n", 0775);
    add("plain", "true\n", 0644);
    add("with.dot", "true\n");
    ASSERT_EQ(symlink("good", path_of("link").c_str()), 0);
    const notify_commands found = find_notify_commands(directory);
    // The group is root's own.
    EXPECT_EQ(found.paths, (strings{good, path_of("group-writable")}));
    EXPECT_EQ(found.refused.size(), 3u);
    EXPECT_TRUE(contains(joined(found.refused, ""), "/link: is not a regular", "/plain: is not executable",
                         "/with.dot: the name"));
    chmod(good.c_str(), 0757);
    EXPECT_EQ(find_notify_commands(directory).paths.size(), 1u);
    if (chown(good.c_str(), 65534, 65534) == 0) {
        chmod(good.c_str(), 0755);
        EXPECT_EQ(find_notify_commands(directory).paths.size(), 1u);
    }
    chmod(directory, 0777);
    EXPECT_TRUE(find_notify_commands(directory).paths.empty());
    EXPECT_TRUE(find_notify_commands("/no/such/directory").refused.empty());
}

} // namespace
