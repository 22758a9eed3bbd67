// The format of a line, the levels that decide whether it is written, and the files that the log checks.
#include <gtest/gtest.h>

#include <filesystem>
#include <regex>

#include <syslog.h>

#include "runtime/logging_levels.h"
#include "tests/support/log_daemon.h"
#include "tests/support/texts.h"

namespace {

constexpr const char *LINK = "/var/opt/rvl/output/sysloglevel", *ZONE = "/var/opt/rvl/output/localtime";

void set_link(const char *target) {
    unlink(LINK);
    ASSERT_EQ(symlink(target, LINK), 0);
}

// The text after the syslog head and the thread mark.
std::string body_of(const std::string &line) {
    const size_t mark = line.find("TID ");
    return mark == std::string::npos ? line : line.substr(line.find(": ", mark) + 2);
}
testing::AssertionResult matches_regex(const std::string &text, const char *pattern) {
    return testing::AssertionResult(std::regex_match(text, std::regex(pattern))) << text;
}

struct Log : testing::Test {
    log_daemon daemon;
    // The highest level that reaches the log daemon through the socket's mask.
    int32_t level_of_mask() {
        syslog_socket direct = {};
        syslog_socket_open(&direct, "direct", false, LOG_USER);
        for (int32_t level = LC_LOG_DEBUG; level >= LC_LOG_EMERG; level--)
            EXPECT_EQ(syslog_socket_send(&direct, level, "masked"), 0);
        syslog_socket_close(&direct);
        return static_cast<int32_t>(daemon.take().size()) - 1;
    }
    lc_status init(const char *name = "wccpd", uint32_t flags = 0, const char *prefix = nullptr,
                   uint8_t destinations = 1) {
        return lc_log_init(name, prefix, flags, 0x1060000, 7, 136, destinations);
    }
    void SetUp() override { ASSERT_EQ(init(), LC_OK); }
    void TearDown() override {
        unlink(LINK);
        (void)lc_log_close();
    }
};

// The first test: nothing in this process has logged yet.
TEST(UnopenedLog, IsSetUpByTheFirstLine) {
    log_daemon daemon;
    ASSERT_EQ(G_log_state_lock, nullptr);
    LC_LOG(LC_LOG_NOTICE, "early");
    EXPECT_TRUE(matches_regex(daemon.one(), "<13>.*runtime_logging_test-UNINIT\\[\\d+\\]: TID \\d+: "
                                            "\\[unk\\.NOTICE\\]: unk: early\n"));
}

TEST_F(Log, ALineHasTheBytesOfVsyslog) {
    for (const size_t length : {5u, 1000u, 9000u}) {
        const std::string text(length, 'x');
        std::string theirs, ours;
        for (int attempt = 0; attempt < 3 && (ours.empty() || ours != theirs); attempt++) { // in one second
            (void)lc_log_internal(nullptr, nullptr, 0, LC_LOG_FLAG_NO_THREAD, 0, LC_LOG_WARNING, "%s",
                                  text.c_str());
            ours = daemon.one();
            syslog(LOG_WARNING, "[wccpd.WARNING]: %s\n", text.c_str());
            theirs = daemon.one();
        }
        EXPECT_EQ(ours, theirs);
        EXPECT_GT(ours.size(), length);
    }
    EXPECT_EQ(lc_log_init("wccpd", nullptr, LC_LOG_FLAG_NO_PID, 0x1060000, 7, 24, 1), LC_OK);
    QV_LOG(LC_LOG_ERR, "x");
    EXPECT_TRUE(matches_regex(daemon.one(), "<27>[A-Z][a-z]{2} [ 1-3][0-9] [0-9:]{8} wccpd: TID \\d+: .*\n"));
    closelog();
}

TEST_F(Log, TheBodyOfALine) {
    QV_LOG(LC_LOG_NOTICE, "100%% of %s", "%s");
    EXPECT_EQ(body_of(daemon.one()), "[wccpd.NOTICE]: 100% of %s\n");
    util_log(LC_LOG_ERR, "pre: ", "%d%%", 5);
    EXPECT_EQ(body_of(daemon.one()), "[wccpd.ERR]: pre: 5%\n");
    errno = ENOENT;
    (void)lc_log_internal(nullptr, nullptr, 0, 0, 0x3f00000, LC_LOG_ERR, "%m");
    EXPECT_TRUE(errno == ENOENT &&
                body_of(daemon.one()) == "[UNKNOWN_COMP.ERR]: No such file or directory\n");
    ASSERT_EQ(init("wccpd", LC_LOG_FLAG_STAMP_USEC | LC_LOG_FLAG_RELATIVE, "prefix"), LC_OK);
    LC_LOG(LC_LOG_ERR, "text");
    EXPECT_TRUE(matches_regex(body_of(daemon.one()), "\\[0\\.0\\d{5}\\] \\[wccpd\\.ERR\\]: prefix: text\n"));
    LC_LOG(LC_LOG_ERR, "x");
    EXPECT_NE(daemon.one().find(": TID " + std::to_string(gettid()) + ": ["), std::string::npos);
}

TEST_F(Log, WhatDoesNotFitIsCut) {
    QV_LOG(LC_LOG_ERR, "%s", std::string(2000, 'y').c_str());
    EXPECT_EQ(body_of(daemon.one()), "[wccpd.ERR]: " + std::string(1023, 'y') + "\n");
    // Cuts the format at each position around its conversion.
    for (int length = 960; length < 1020; length++) {
        const std::string format =
            std::string(static_cast<size_t>(length), 'z') + "%08ld" + std::string(99, 'z');
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
        (void)lc_log_internal(nullptr, nullptr, 0, 0, 0, LC_LOG_ERR, format.c_str(), 5L);
#pragma GCC diagnostic pop
        const std::string text = daemon.one();
        EXPECT_NE(text.find(std::string(900, 'z')), std::string::npos) << length;
        EXPECT_EQ(text.find('%'), std::string::npos) << length;
    }
}

TEST_F(Log, LevelsAndTheirOrder) {
    EXPECT_EQ(lc_log_set_max_log_level("debug"), LC_OK);
    for (const auto &[own, passes] : {std::pair{3, 3}, {0, 0}, {-1, 7}}) {
        EXPECT_EQ(lc_log_set_daemon_log_level(own), LC_OK);
        EXPECT_TRUE(lc_log_check_level(passes) && !lc_log_check_level(passes + 1)) << own;
        EXPECT_EQ(level_of_mask(), passes);
    }
    EXPECT_TRUE(lc_log_set_max_log_level("Err") == LC_BAD_TYPE &&
                lc_log_set_max_log_level("warning") == LC_OK);
    int evaluated = 0;
    QV_LOG(LC_LOG_NOTICE, "%d", ++evaluated);
    EXPECT_EQ(evaluated, 0);
    (void)lc_log_internal(nullptr, nullptr, 0, 0, 0, LC_LOG_NOTICE, "x");
    G_logging_suspended = 1;
    (void)lc_log_internal(nullptr, nullptr, 0, 0, 0, LC_LOG_ERR, "x");
    G_logging_suspended = 0;
    EXPECT_EQ(daemon.take().size(), 0u);

    // A line above the initial maximum is written only if the process has a level of its own.
    ASSERT_EQ(lc_log_init("wccpd", nullptr, 0, 0x1060000, LC_LOG_ERR, 136, 1), LC_OK);
    QV_LOG(LC_LOG_NOTICE, "dropped");
    EXPECT_EQ(lc_log_set_daemon_log_level(5), LC_OK);
    QV_LOG(LC_LOG_NOTICE, "kept");
    EXPECT_EQ(body_of(daemon.one()), "[wccpd.NOTICE]: kept\n");
}

TEST_F(Log, TheOverrideAppliesWhileBothSwitchesAreOn) {
    const auto expect = [](lc_status status, int32_t level) {
        EXPECT_TRUE(status == LC_OK && G_log_level == level);
    };
    expect(lc_log_set_override_log_level("debug"), 5);
    expect(lc_log_enable_override_log_level(1, 1), 5);
    expect(lc_log_enable_override_log_level(0, 1), 7);
    expect(lc_log_set_max_log_level("err"), 7); // applies after the override
    expect(lc_log_set_override_log_level("info"), 6);
    expect(lc_log_set_override_log_level("nonsense"), 3); // ends the override
    expect(lc_log_enable_override_log_level(0, 1), 3);
    expect(lc_log_set_override_log_level("debug"), 7);
    expect(lc_log_set_daemon_log_level(1), 7);
    expect(lc_log_enable_override_log_level(1, 0), 3);
    EXPECT_EQ(level_of_mask(), 1);                     // that of the process
    expect(lc_log_enable_override_log_level(0, 0), 3); // the current level becomes the override level
    expect(lc_log_enable_override_log_level(0, 1), 3);
    expect(lc_log_enable_override_log_level(1, 1), 3);
}

TEST_F(Log, TheLevelLink) {
    static const std::pair<const char *, int32_t> links[] = {
        {"7", 7}, {"0", 0}, {"99", 5}, {"-3", 5}, {"x", 5}, {"3x", 5}, {"77777777777777777777777", 5}};
    for (const auto &[target, level] : links) {
        set_link(target);
        ASSERT_EQ(init(), LC_OK);
        EXPECT_TRUE(G_log_level == level && level_of_mask() == level) << target;
    }
}

TEST_F(Log, UnmanagedProcessesFollowTheFiles) {
    for (const bool polls : {true, false}) {
        set_link("4");
        std::ofstream(ZONE) << "one";
        setenv("TZ", "XXX-5", 1);
        ASSERT_EQ(init(polls ? "poller" : "wccpd"), LC_OK);
        LC_LOG(LC_LOG_ERR, "one");
        set_link("6");
        const timespec later[2] = {{1000000000, 0}, {1000000000, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, ZONE, later, 0), 0);
        usleep(1100000); // the files are checked once a second
        LC_LOG(LC_LOG_ERR, "two");
        EXPECT_TRUE(G_log_level == polls ? 6 : 4 && !getenv("TZ") == polls);
    }
    unsetenv("TZ");
    unlink(ZONE);
}

TEST_F(Log, AConsoleGetsAHeaderAndKeepsItsLevel) {
    ASSERT_TRUE(init("tool", 0, nullptr, LOG_TO_STDERR) == LC_OK &&
                lc_log_set_max_log_level("emerg") == LC_OK);
    testing::internal::CaptureStderr();
    LC_LOG(LC_LOG_ERR, "seen %d", 1);
    EXPECT_TRUE(matches_regex(testing::internal::GetCapturedStderr(),
                              "[A-Z][a-z]{2} [ 1-3][0-9] [0-9:]{8} [^ .]+ tool\\[\\d+\\]: TID \\d+: "
                              "\\[wccpd\\.ERR\\]: seen 1\n"));
    EXPECT_EQ(daemon.take().size(), 0u);
}

TEST_F(Log, AfterTheCloseLinesAreDropped) {
    EXPECT_TRUE(lc_log_close() == LC_OK && lc_log_close() == LC_NULL);
    EXPECT_EQ(lc_log_internal(nullptr, nullptr, 0, 0, 0, LC_LOG_ERR, "x"), LC_GENERIC);
    EXPECT_EQ(lc_log_set_max_log_level("err"), LC_NULL); // its failure is not logged, and does not deadlock
    EXPECT_EQ(daemon.take().size(), 0u);
}

TEST(Files, TheFacilityAndTheDebugLog) {
    static constexpr const char *FACILITY = "/var/opt/rvl/syslog_fac.conf", *DEBUG = "/var/log/debug_log";
    EXPECT_EQ(lc_log_get_facility(nullptr, "wccpd"), 136);
    std::ofstream(FACILITY) << "# system 8\nflow 144\nsystem\n\nsystem 160\nsystem 176\n";
    EXPECT_TRUE(lc_log_get_facility(nullptr, "wccpd") == 160 &&
                lc_log_get_facility(nullptr, "mgmtctl") == 136);
    EXPECT_TRUE(matches_regex(text_of_file(DEBUG), "\\d{6} \\d{6} Skipping facility type: flow for wccpd\n"));
    unlink(FACILITY);
    std::ofstream(DEBUG) << std::string(1999999, 'x') << "\n";
    EXPECT_TRUE(lc_log_file(nullptr, "%d", 1) == 0 && std::filesystem::file_size(DEBUG) > 2000000);
    EXPECT_EQ(lc_log_file(nullptr, "%d", 2), 0); // too large to append to
    EXPECT_TRUE(matches_regex(text_of_file(DEBUG), "\\d{6} \\d{6} 2\n"));
    EXPECT_EQ(lc_log_file("/no/such/directory", "x"), 1);
    unlink(DEBUG);
}

} // namespace
