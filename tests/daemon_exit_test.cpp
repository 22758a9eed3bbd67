// The exit that begins while the daemon waits for mgmtd: by a signal, by the loss of the session, by the word
// that tunneld has gone, at each request of the start and once the daemon is ready. The daemon runs in a
// process of its own; the provider is this test, which answers so many requests and no more.
#include <atomic>
#include <csignal>
#include <ctime>
#include <thread>

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include "daemon/wccpd_main.h"
#include "mgmt/owners.h"
#include "tests/support/gcl_provider.h"
#include "tests/support/log_daemon.h"

namespace {

constexpr double EXIT_SECONDS = 3;
constexpr double CPU_SECONDS = 1;
constexpr int QUIET_MS = 1000; // a daemon that asks nothing for so long is ready

enum class cause { signal, lost_session, tunneld, lost_working_session };
const char *const cause_names[] = {"SIGTERM", "the session lost", "tunneld gone",
                                   "only the working session lost"};

double now_seconds() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}
double seconds_of(const timeval &time) {
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}
wire frame_of(uint16_t mtype, const tbuffer *bytes) {
    const wire whole(reinterpret_cast<const char *>(tb_buf(bytes)), static_cast<size_t>(tb_length(bytes)));
    return frame_bytes(BN_PROTO, mtype, whole.substr(BN_FRAME_HEADER_BYTES));
}

struct scripted_run {
    gcl_provider working, alarms;
    pid_t daemon = 0;
    wire unanswered;
    std::vector<wire> responses;

    scripted_run() {
        // The platform's numbers, without which there is no mailbox.
        EXPECT_EQ(system("cp " WCCP_SOURCE_DIR "/packaging/*.conf /etc/opt/rvl/"), 0);
        EXPECT_TRUE(working.listen_as("mgmtd"));
        daemon = fork();
        if (daemon == 0)
            _exit(wccpd_main()); // ends by itself
    }
    ~scripted_run() {
        if (daemon > 0) {
            kill(daemon, SIGKILL);
            waitpid(daemon, nullptr, 0);
        }
    }
    scripted_run(const scripted_run &) = delete;
    scripted_run &operator=(const scripted_run &) = delete;

    // The next frame on the working session; the alarm session opens in between. Empty when none comes.
    wire next_frame() {
        for (;;) {
            pollfd watched[] = {{working.client, POLLIN, 0},
                                {alarms.client < 0 ? working.listener : -1, POLLIN, 0}};
            if (working.unread.empty() && poll(watched, 2, QUIET_MS) <= 0)
                return {};
            if (!watched[1].revents)
                return working.take_frame();
            alarms.listener = working.listener;
            EXPECT_TRUE(alarms.open_session());
            alarms.listener = -1;
        }
    }
    // Every query finds nothing, but for the system mode.
    void answer(const wire &frame) {
        owned_tbuffer bytes, out;
        owned_request request;
        owned_response response;
        ASSERT_EQ(tb_new_buf(&bytes.pointer, frame.data(), static_cast<int32_t>(frame.size())), LC_OK);
        ASSERT_EQ(bn_request_msg_deserialize(bytes.pointer, BN_FRAME_HEADER_BYTES, &request.pointer), LC_OK);
        const uint16_t type = bn_request_msg_response_msg_type(request.pointer->msg_type);
        ASSERT_EQ(bn_response_msg_create(&response.pointer, type, request.pointer->msg_id, 0, ""), LC_OK);
        const bn_request_node *node = bn_request_per_node_array_get_quick(request.pointer->nodes, 0);
        const char *mode = "/qv/tunneld/system/config/mode";
        if (type == bn_msg_query_response && node &&
            strcmp(bn_binding_get_name_quick(node->binding), mode) == 0) {
            owned_binding binding;
            ASSERT_EQ(bn_binding_new_str(&binding.pointer, mode, bn_attrib_value, bn_type_str, 0, "router"),
                      LC_OK);
            ASSERT_EQ(bn_query_response_msg_append_binding_takeover(response.pointer, &binding.pointer,
                                                                    node->node_id),
                      LC_OK);
        }
        response.pointer->service_id = 2;
        response.pointer->msg_id = 1;
        ASSERT_EQ(bn_response_msg_serialize(response.pointer, BN_FRAME_HEADER_BYTES, &out.pointer), LC_OK);
        ASSERT_TRUE(working.put(frame_of(type, out.pointer)));
    }
    // Answers the one that waits and `count` more, and reads another without answering it. The number read.
    int serve(int count) {
        if (working.client < 0) {
            EXPECT_TRUE(working.open_session());
        }
        if (!unanswered.empty())
            answer(unanswered);
        unanswered.clear();
        for (int read = 0;; read++) {
            const wire frame = next_frame();
            if (frame.empty())
                return read;
            if (number_at(frame, 26, 2) % 2 == 0) {
                responses.push_back(frame);
                read--;
                continue;
            }
            if (read == count) {
                unanswered = frame;
                return read + 1;
            }
            answer(frame);
        }
    }
    void ask(const char *node) {
        owned_request query;
        ASSERT_EQ(bn_query_request_msg_create(&query.pointer, 0, nullptr), LC_OK);
        ASSERT_EQ(bn_query_request_msg_append_str(query.pointer, bn_query_get, 0, node, nullptr), LC_OK);
        put_request(query.pointer);
    }
    void put_request(bn_request_msg *request) {
        owned_tbuffer out;
        request->service_id = 2;
        request->msg_id = 1;
        request->transaction_id = 2;
        ASSERT_EQ(bn_request_msg_serialize(request, BN_FRAME_HEADER_BYTES, &out.pointer), LC_OK);
        ASSERT_TRUE(working.put(frame_of(request->msg_type, out.pointer)));
    }
    void bring(cause what) {
        if (what == cause::signal)
            kill(daemon, SIGTERM);
        if (what == cause::lost_session || what == cause::lost_working_session)
            working.close_client();
        if (what == cause::lost_session)
            alarms.close_client();
        if (what == cause::tunneld)
            put_event("/pm/events/failure/crash", "tunneld");
    }
    void put_event(const char *name, const char *process) {
        owned_request event;
        ASSERT_EQ(bn_event_request_msg_create(&event.pointer, name), LC_OK);
        if (process) {
            ASSERT_EQ(bn_event_request_msg_append_new_binding(event.pointer, 0, "process_name", bn_type_str,
                                                              process, nullptr),
                      LC_OK);
        }
        put_request(event.pointer);
    }
    void expect_exit() {
        const double start = now_seconds();
        int status = -1;
        rusage used = {};
        while (wait4(daemon, &status, WNOHANG, &used) != daemon) {
            ASSERT_LT(now_seconds() - start, EXIT_SECONDS) << "the daemon does not end";
            usleep(2000);
        }
        daemon = 0;
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
        EXPECT_LT(seconds_of(used.ru_utime) + seconds_of(used.ru_stime), CPU_SECONDS);
    }
};

} // namespace

TEST(DaemonExit, AtEachRequestOfTheStart) {
    int requests = 0;
    {
        scripted_run whole;
        requests = whole.serve(1000);
        EXPECT_GE(requests, 15);
        whole.bring(cause::signal);
        whole.expect_exit();
    }
    for (const cause what : {cause::signal, cause::lost_session, cause::tunneld})
        for (int answered = 0; answered < requests; answered++) {
            SCOPED_TRACE(std::string(cause_names[static_cast<int>(what)]) + " at request " +
                         std::to_string(answered + 1));
            scripted_run run;
            ASSERT_EQ(run.serve(answered), answered + 1);
            run.bring(what);
            run.expect_exit();
            if (HasFatalFailure())
                return;
        }
}

TEST(DaemonExit, WhileTheServiceIsNotOpen) {
    scripted_run run;
    ASSERT_TRUE(run.working.accept_client());
    run.bring(cause::signal);
    run.expect_exit();
}

// What the daemon logs from here on, read all the time.
struct log_reader {
    log_daemon log;
    std::atomic<bool> over{false};
    std::string text;
    std::thread thread;

    log_reader() { (void)!symlink("7", "/var/opt/rvl/output/sysloglevel"); }
    void start() {
        thread = std::thread([this] {
            for (bool last = false; !last;) {
                last = over;
                for (const std::string &line : log.take(20))
                    text += line;
            }
        });
    }
    void expect_in_order(std::initializer_list<const char *> lines) {
        end();
        size_t place = 0;
        for (const char *line : lines) {
            const size_t found = text.find(line, place);
            EXPECT_NE(found, std::string::npos) << line << " is missing or out of its place in\n" << text;
            place = found == std::string::npos ? place : found;
        }
    }
    void end() {
        over = true;
        if (thread.joinable())
            thread.join();
    }
    ~log_reader() { end(); }
};

// The start waits for the alarm thread then, which waits for the provider.
TEST(DaemonExit, WhileTheAlarmSessionIsNotOpen) {
    for (const cause what :
         {cause::signal, cause::lost_session, cause::tunneld, cause::lost_working_session}) {
        SCOPED_TRACE(cause_names[static_cast<int>(what)]);
        log_reader log;
        scripted_run run;
        log.start();
        ASSERT_EQ(run.serve(4), 5); // the interests
        run.answer(run.unanswered);
        run.alarms.listener = run.working.listener;
        ASSERT_TRUE(run.alarms.accept_client());
        run.alarms.listener = -1;
        run.put_event("/mgmtd/notify/dbchange", nullptr); // the engine's records aren't there yet
        run.bring(what);
        run.expect_exit();
        const char *told = what == cause::signal    ? "Received SIGTERM"
                           : what == cause::tunneld ? "WCCP: Detected that tunneld has exited"
                                                    : "Lost connection to mgmtd; exiting";
        log.expect_in_order({told, "WCCP: alarms: clearing all alarms.",
                             "qv_alm_mgmt_shutdown: cancel alm thread",
                             "qv_alm_mgmt_shutdown: alm thread exited", "WCCP: wccp manager is exiting",
                             "WCCP daemon exiting with code 0"});
        log.expect_in_order({"qv_alm_thread: failed to initialize alarm session",
                             "qv_alm_mgmt_shutdown: alm thread exited", "WCCP: wccp manager"});
        if (what != cause::signal) // which comes at any moment
            log.expect_in_order({"change before the engine's start: left to the start", told});
    }
}

// Queries find the daemon deaf until it is ready.
TEST(DaemonExit, AQueryThatComesTooEarlyStaysUnanswered) {
    scripted_run run;
    ASSERT_EQ(run.serve(7), 8);
    run.ask("/qv/wccpd/system/state/is_alive");
    ASSERT_GE(run.serve(1000), 5);
    EXPECT_EQ(run.responses.size(), 0u);
    run.ask("/qv/wccpd/system/state/is_alive");
    ASSERT_EQ(run.serve(1000), 0);
    ASSERT_EQ(run.responses.size(), 1u);
    EXPECT_EQ(number_at(run.responses[0], 26, 2), bn_msg_query_response);
    EXPECT_NE(run.responses[0].find("Ready"), wire::npos);
    run.bring(cause::signal);
    run.expect_exit();
}

TEST(DaemonExit, OnceReadyByASessionOrTunneld) {
    for (const cause what : {cause::lost_session, cause::tunneld}) {
        SCOPED_TRACE(cause_names[static_cast<int>(what)]);
        scripted_run run;
        ASSERT_GE(run.serve(1000), 15);
        run.bring(what);
        run.expect_exit();
    }
}
