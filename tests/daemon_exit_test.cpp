// Events while the daemon waits for mgmtd. A signal, a lost session and the end of tunneld begin the exit, at
// each request of the start and once the daemon is ready; queries and changes can come too early. The daemon
// runs in a process of its own. This test is its mgmtd, and answers a given number of requests.
#include <csignal>
#include <thread>

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/shm.h>
#include <syslog.h>

#include "daemon/wccpd_main.h"
#include "mgmt/owners.h"
#include "tests/support/gcl_provider.h"
#include "tests/support/log_daemon.h"

namespace {

constexpr int QUIET_MS = 1000; // a daemon that sends no request for so long is ready

enum class cause { signal, lost_session, tunneld, lost_working_session };

struct scripted_run {
    log_daemon log;
    std::atomic<bool> over{false};
    std::string text; // that the daemon has logged
    std::thread reader;
    gcl_provider working, alarms;
    pid_t daemon = 0;
    wire unanswered;
    std::vector<wire> responses;

    explicit scripted_run(bool has_mailbox = true) {
        (void)!symlink("7", "/var/opt/rvl/output/sysloglevel");
        // Without mem.conf there is no mailbox, and the start fails. The registry keeps what it has read.
        for (const uint32_t key : {0xbeeffeedu, 0x5743434du})
            shmctl(shmget(static_cast<key_t>(key), 0, 0), IPC_RMID, nullptr);
        EXPECT_EQ(system("cp " WCCP_SOURCE_DIR "/packaging/*.conf /etc/opt/rvl/"), 0);
        if (!has_mailbox)
            unlink("/etc/opt/rvl/mem.conf");
        EXPECT_TRUE(working.listen_as("mgmtd"));
        daemon = fork();
        if (daemon == 0)
            _exit(wccpd_main()); // ends by itself
        reader = std::thread([this] {
            for (bool last = false; !last;) {
                last = over;
                for (const std::string &line : log.take(20))
                    text += line;
            }
        });
    }
    ~scripted_run() {
        if (daemon > 0) {
            kill(daemon, SIGKILL);
            waitpid(daemon, nullptr, 0);
        }
        read_rest();
    }
    void read_rest() {
        over = true;
        if (reader.joinable())
            reader.join();
    }
    void expect_in_order(std::initializer_list<const char *> lines) {
        size_t place = 0;
        for (const char *line : lines) {
            const size_t found = text.find(line, place);
            EXPECT_NE(found, std::string::npos) << line << " is missing or out of its place in\n" << text;
            place = found == std::string::npos ? place : found + strlen(line);
        }
    }
    void expect_no_error() {
        std::istringstream lines(text);
        for (std::string line; std::getline(lines, line);)
            EXPECT_TRUE(line[0] != '<' || atoi(&line[1]) % 8 > LOG_ERR) << line;
    }

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
    // Every query has an empty answer, except that for the system mode.
    void answer(const wire &frame) {
        owned_tbuffer bytes;
        owned_request request;
        owned_response msg;
        ASSERT_EQ(tb_new_buf(&bytes.pointer, frame.data(), static_cast<int32_t>(frame.size())), LC_OK);
        ASSERT_EQ(bn_request_msg_deserialize(bytes.pointer, BN_FRAME_HEADER_BYTES, &request.pointer), LC_OK);
        const uint16_t type = bn_request_msg_response_msg_type(request.pointer->msg_type);
        ASSERT_EQ(bn_response_msg_create(&msg.pointer, type, request.pointer->msg_id, 0, ""), LC_OK);
        const bn_request_node *node = bn_request_per_node_array_get_quick(request.pointer->nodes, 0);
        const char *mode = "/qv/tunneld/system/config/mode";
        if (type == bn_msg_query_response && node &&
            strcmp(bn_binding_get_name_quick(node->binding), mode) == 0) {
            owned_binding binding;
            ASSERT_EQ(bn_binding_new_str(&binding.pointer, mode, bn_attrib_value, bn_type_str, 0, "router"),
                      LC_OK);
            ASSERT_EQ(
                bn_query_response_msg_append_binding_takeover(msg.pointer, &binding.pointer, node->node_id),
                LC_OK);
        }
        put_message<bn_response_msg_serialize>(msg.pointer);
    }
    template <auto Serialize, typename Message>
    void put_message(Message *msg) {
        owned_tbuffer out;
        msg->service_id = 2;
        msg->msg_id = 1;
        msg->transaction_id = 2;
        ASSERT_EQ(Serialize(msg, 0, &out.pointer), LC_OK);
        const auto *bytes = reinterpret_cast<const char *>(tb_buf(out.pointer));
        ASSERT_TRUE(working.put(
            frame_bytes(BN_PROTO, msg->msg_type, {bytes, static_cast<size_t>(tb_length(out.pointer))})));
    }
    // Answers the request that is waiting and `count` more, and reads one more without answering it. Returns
    // the number of requests read.
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
            } else if (read == count) {
                unanswered = frame;
                return read + 1;
            } else {
                answer(frame);
            }
        }
    }
    void ask_is_alive() {
        owned_request query;
        const char *const name = "/qv/wccpd/system/state/is_alive";
        ASSERT_EQ(bn_query_request_msg_create(&query.pointer, 0, nullptr), LC_OK);
        ASSERT_EQ(bn_query_request_msg_append_str(query.pointer, bn_query_get, 0, name, nullptr), LC_OK);
        put_message<bn_request_msg_serialize>(query.pointer);
    }
    void bring(cause what) {
        if (what == cause::signal)
            kill(daemon, SIGTERM);
        if (what == cause::lost_session || what == cause::lost_working_session)
            working.close_client();
        if (what == cause::lost_session)
            alarms.close_client();
        if (what == cause::tunneld)
            put_event("/pm/events/failure/crash", {{"process_name", bn_type_str, "tunneld"}});
    }
    using event_binding = std::tuple<std::string, uint32_t, std::string>; // name, type and value
    void put_event(const char *name, const std::vector<event_binding> &bindings) {
        owned_request event;
        ASSERT_EQ(bn_event_request_msg_create(&event.pointer, name), LC_OK);
        for (const auto &[node, type, value] : bindings)
            ASSERT_EQ(bn_event_request_msg_append_new_binding(event.pointer, 0, node.c_str(), type,
                                                              value.c_str(), nullptr),
                      LC_OK);
        put_message<bn_request_msg_serialize>(event.pointer);
    }
    // A commit that adds nodes below the groups' root.
    void put_added(const std::vector<event_binding> &nodes) {
        std::vector<event_binding> list;
        for (const auto &[node, type, value] : nodes) {
            const std::string entry = "/mgmtd/notification/dbchange/" + std::to_string(list.size() / 4 + 1);
            list.insert(list.end(), {{entry, bn_type_uint32, "1"},
                                     {entry + "/change_type", bn_type_str, "add"},
                                     {entry + "/name", bn_type_name, "/qv/wccpd/wccp/srv_grp/config/" + node},
                                     {entry + "/new_attribs/value", type, value}});
        }
        put_event("/mgmtd/notify/dbchange", list);
    }
    void expect_exit() {
        int status = -1;
        rusage used = {};
        for (int waited_ms = 0; wait4(daemon, &status, WNOHANG, &used) != daemon; waited_ms += 2) {
            ASSERT_LT(waited_ms, 3000) << "the daemon does not end";
            usleep(2000);
        }
        daemon = 0;
        read_rest();
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
        timeval cpu;
        timeradd(&used.ru_utime, &used.ru_stime, &cpu);
        EXPECT_EQ(cpu.tv_sec, 0);
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
        for (int answered = 0; answered <= requests; answered++) { // with all of them answered it is ready
            SCOPED_TRACE(static_cast<int>(what) * 100 + answered);
            scripted_run run;
            ASSERT_EQ(run.serve(answered), std::min(answered + 1, requests));
            run.bring(what);
            run.expect_exit();
            if (what != cause::lost_session)
                run.expect_no_error();
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

// The start is waiting for the alarm thread, and that for mgmtd.
TEST(DaemonExit, WhileTheAlarmSessionIsNotOpen) {
    for (const cause what :
         {cause::signal, cause::lost_session, cause::tunneld, cause::lost_working_session}) {
        SCOPED_TRACE(static_cast<int>(what));
        scripted_run run;
        ASSERT_EQ(run.serve(4), 5); // the interests
        run.answer(run.unanswered);
        run.alarms.listener = run.working.listener;
        ASSERT_TRUE(run.alarms.accept_client());
        run.alarms.listener = -1;
        run.bring(what);
        run.expect_exit();
        const char *line = what == cause::signal    ? "Received SIGTERM"
                           : what == cause::tunneld ? "WCCP: Detected that tunneld has exited"
                                                    : "Lost connection to mgmtd; exiting";
        run.expect_in_order({line, "WCCP: alarms: clearing all alarms.",
                             "qv_alm_mgmt_shutdown: cancel alm thread",
                             "qv_alm_mgmt_shutdown: alm thread exited", "WCCP: wccp manager is exiting",
                             "WCCP daemon exiting with code 0"});
        if (what == cause::signal || what == cause::tunneld)
            run.expect_no_error();
    }
}

// Queries are dropped until the daemon is ready; changes are kept until the configuration has been read.
TEST(DaemonExit, EarlyQueriesAndChanges) {
    scripted_run run;
    ASSERT_EQ(run.serve(7), 8);
    run.ask_is_alive();
    run.put_added({{"51", bn_type_uint8, "51"}, {"51/interface", bn_type_str, "lo"}});
    ASSERT_EQ(run.serve(5), 6);
    run.put_added({{"51/weight", bn_type_uint32, "7"}});
    ASSERT_TRUE(run.serve(1000) >= 0 && run.responses.empty());
    run.ask_is_alive();
    ASSERT_TRUE(run.serve(1000) == 0 && run.responses.size() == 1);
    EXPECT_EQ(number_at(run.responses[0], 26, 2), bn_msg_query_response);
    EXPECT_NE(run.responses[0].find("Ready"), wire::npos);
    run.put_added({{"51/weight", bn_type_uint32, "8"}});
    run.bring(cause::signal);
    run.expect_exit();
    run.expect_in_order({"Received event: /mgmtd/notify/dbchange", "Received event: /mgmtd/notify/dbchange",
                         "Created WCCP group 51", "set weight to 7", "encap entries"});
}

TEST(DaemonExit, AChangeAfterAStartThatHasFailed) {
    scripted_run run(false);
    run.serve(5);
    run.put_added({{"51", bn_type_uint8, "51"}, {"51/interface", bn_type_str, "lo"}});
    run.serve(1000);
    run.put_added({{"52", bn_type_uint8, "52"}, {"52/interface", bn_type_str, "lo"}});
    EXPECT_EQ(run.serve(1000), 0);
    run.bring(cause::signal);
    run.expect_exit();
    run.expect_in_order({"WCCP: Cannot init shared memory",
                         "Configuration change ignored: the start has failed", "Received SIGTERM"});
    EXPECT_EQ(run.text.find("WCCP group 5"), std::string::npos);
}
