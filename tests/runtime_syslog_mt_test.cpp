// The log with a syslog daemon that reads, is stopped, ends and is started again, or does not exist; threads
// that are cancelled while they log, and a process that forks meanwhile.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "runtime/logging.h"
#include "runtime/ttime.h"
#include "tests/support/log_daemon.h"
#include "tests/support/test_host.h"

namespace {

void log_numbered(int from, int to) {
    for (int i = from; i < to; i++) {
        QV_LOG(LC_LOG_DEBUG, "line %d.", i);
    }
}
// The number after `words`, -1 without them.
int number_in(const std::string &line, const char *words) {
    const size_t at = line.find(words);
    return at == std::string::npos ? -1 : atoi(line.c_str() + at + strlen(words));
}
void expect_lines(const std::vector<std::string> &lines, size_t begin, int from, int to) {
    ASSERT_EQ(lines.size() - begin, static_cast<size_t>(to - from));
    for (int i = from; i < to; i++)
        ASSERT_EQ(number_in(lines[begin + static_cast<size_t>(i - from)], "line "), i);
}
// More than the queue and the send buffer of a socket hold.
constexpr int FLOOD = 1000;
// The delay that a stopped daemon may cause in all. The patience is 30 ms; the rest is for a busy machine.
constexpr int64_t COST_MS = 500;

struct Syslog : testing::TestWithParam<int> {
    log_daemon daemon{GetParam()};
    void SetUp() override {
        ASSERT_EQ(lc_log_init("wccpd", nullptr, 0, 0x1060000, 7, 136, 1), LC_OK);
        ASSERT_EQ(lc_log_set_daemon_log_level(7), LC_OK);
        settle();
    }
    void settle() { // no line is lost or unread
        (void)daemon.take();
        log_numbered(-1, 0);
        (void)daemon.take();
    }
    void TearDown() override { (void)lc_log_close(); }
    // Logs 500 lines while another thread reads, with a pause after each line. On a busy machine the reader
    // may be held up as well, so there are three attempts.
    void expect_burst(useconds_t rest_us) {
        std::vector<std::string> lines;
        for (int attempt = 0; attempt < 3 && lines.size() != 500; attempt++) {
            settle();
            lines.clear();
            std::thread reader([&] {
                while (lines.size() < 500) {
                    const std::vector<std::string> more = daemon.take(500, 1);
                    if (more.empty())
                        return;
                    lines.insert(lines.end(), more.begin(), more.end()); // a stream returns several at once
                    usleep(lines.size() % 100 ? rest_us : rest_us * 50);
                }
            });
            log_numbered(0, 500);
            reader.join();
        }
        expect_lines(lines, 0, 0, 500);
    }
};
INSTANTIATE_TEST_SUITE_P(Sockets, Syslog, testing::Values(SOCK_DGRAM, SOCK_STREAM));

TEST_P(Syslog, ABurstArrivesWholeAndInOrder) {
    expect_burst(0);
    expect_burst(100);
}

TEST_P(Syslog, AStoppedReaderCostsMillisecondsAndIsReported) {
    const int64_t began = lt_monotonic_ms();
    errno = EAGAIN; // as after a read from an empty socket
    log_numbered(0, FLOOD);
    EXPECT_LT(lt_monotonic_ms() - began, COST_MS);
    std::vector<std::string> lines = daemon.take();
    const int got = static_cast<int>(lines.size());
    ASSERT_LT(got, FLOOD);
    expect_lines(lines, 0, 0, got);

    log_numbered(FLOOD, FLOOD + 1);
    lines = daemon.take();
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(number_in(lines[0], "messages lost due to non-blocking syslog (count="), FLOOD - got);
    EXPECT_TRUE(lines[0].starts_with("<139>") && lines[0].ends_with(')')); // no newline
    EXPECT_EQ(lines[0].find("TID"), std::string::npos);
    expect_lines(lines, 1, FLOOD, FLOOD + 1);
    expect_burst(0); // reported once; the patience has been restored
}

TEST_P(Syslog, ThreadsShareOnePatience) {
    const int64_t began = lt_monotonic_ms();
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++)
        threads.emplace_back([] { log_numbered(0, FLOOD / 4); });
    for (std::thread &thread : threads)
        thread.join();
    EXPECT_LT(lt_monotonic_ms() - began, COST_MS);
    int sum = 0;
    for (int round = 0; round < 2; round++) {
        for (const std::string &line : daemon.take())
            sum += std::max(number_in(line, "(count="), 0) + (number_in(line, "line ") >= 0);
        QV_LOG(LC_LOG_NOTICE, "the last");
    }
    EXPECT_EQ(sum, FLOOD);
}

TEST_P(Syslog, ADaemonThatIsRestartedIsFound) {
    daemon.stop();
    const int64_t began = lt_monotonic_ms();
    log_numbered(0, 5000); // lost silently and cheaply
    EXPECT_LT(lt_monotonic_ms() - began, 2000);
    daemon.start();
    log_numbered(6, 9);
    expect_lines(daemon.take(), 0, 6, 9);
    daemon.stop();
    daemon.start(); // between two lines
    log_numbered(9, 12);
    expect_lines(daemon.take(), 0, 9, 12);

    log_numbered(0, FLOOD);
    log_daemon successor; // the old one is stopped and still has its socket
    log_numbered(0, 3);
    const std::vector<std::string> lines = successor.take();
    ASSERT_TRUE(lines.size() == 4 && number_in(lines[0], "(count=") > 0);
    expect_lines(lines, 1, 0, 3);
}

// The queue of datagrams holds a few lines; a thread that waits for room is not cancelled there.
TEST_P(Syslog, ACancelledThreadFinishesItsLines) {
    std::atomic<int> finished{0};
    for (int round = 0; round < 50; round++) {
        std::thread([&, round] {
            pthread_cancel(pthread_self());
            log_numbered(round, round + 1);
            finished++;
            pthread_testcancel();
        }).join();
    }
    EXPECT_EQ(finished, 50);
    std::vector<std::string> lines = daemon.take();
    ASSERT_FALSE(lines.empty());
    expect_lines(lines, 0, 0, GetParam() == SOCK_STREAM ? 50 : static_cast<int>(lines.size()));
}

TEST_P(Syslog, AForkedChildCanLog) {
    std::atomic<bool> stop{false};
    std::atomic<int> from_children{0};
    std::thread writer([&] {
        while (!stop)
            log_numbered(0, 1);
    });
    std::thread reader([&] {
        while (!stop)
            for (const std::string &line : daemon.take(5, 50))
                from_children += line.find("a child") != std::string::npos;
    });
    for (int round = 0; round < 30; round++) {
        const pid_t child = start_child([] {
            alarm(5);
            QV_LOG(LC_LOG_NOTICE, "a child");
            return 0;
        });
        EXPECT_EQ(wait_for_child(child), 0); // and not the alarm
    }
    for (int i = 0; i < 100 && from_children < 30; i++)
        usleep(10000);
    stop = true;
    writer.join();
    reader.join();
    EXPECT_GE(from_children, 15); // all of them, unless the reader is held up on a busy machine
}

} // namespace
