// mgmtd [--config FILE] [--check] [--supervise [--wccpd COMMAND] [--tunneld COMMAND]]
#include <algorithm>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstring>

#include <poll.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <CLI/CLI.hpp>

#include "peers/mgmtd/supervise.h"
#include "peers/mgmtd/transport.h"
#include "runtime/common.h"
#include "runtime/logging.h"
#include "runtime/service_notify.h"
#include "runtime/ttime.h"
#include "runtime/version.h"

namespace {

constexpr uint32_t COMPONENT_MGMTD = 5u << 16;

// Never blocks: if nobody reads the pipe, or the terminal is stopped, lines are lost. After POLLOUT there is
// room for PIPE_BUF bytes.
void print_line(const std::string &line) {
    static uint64_t lost;
    std::string text = lost ? "(" + std::to_string(lost) + " lines lost)\n" + line : line;
    text.resize(std::min<size_t>(text.size(), PIPE_BUF - 1));
    text += '\n';
    pollfd out = {STDOUT_FILENO, POLLOUT, 0};
    if (poll(&out, 1, 0) == 1 && (out.revents & POLLOUT) &&
        write(STDOUT_FILENO, text.data(), text.size()) > 0)
        lost = 0;
    else
        lost++;
}

int block_signals() {
    sigset_t set;
    sigemptyset(&set);
    for (const int number : {SIGTERM, SIGINT, SIGHUP})
        sigaddset(&set, number);
    sigprocmask(SIG_BLOCK, &set, nullptr);
    // For standard output. Sessions are written with MSG_NOSIGNAL.
    signal(SIGPIPE, SIG_IGN);
    return signalfd(-1, &set, SFD_NONBLOCK | SFD_CLOEXEC);
}

void take_signals(int fd, server *daemon, supervisor *processes) {
    signalfd_siginfo info;
    while (read(fd, &info, sizeof info) == sizeof info) {
        if (info.ssi_signo == SIGHUP)
            server_reload(daemon);
        else
            processes->ending = true;
    }
}

int64_t find_time_left(int64_t now, std::initializer_list<int64_t> due) {
    int64_t left = -1;
    // -1 stands for nothing due, and as a result for no limit. What is overdue gives 0.
    for (const int64_t at : due)
        if (at >= 0 && (left < 0 || at - now < left))
            left = std::max<int64_t>(at - now, 0);
    return left;
}

// Reports to the service manager that mgmtd is alive, when that is due. Returns when to call it again, or -1.
int64_t report_alive(int64_t *inout_at_ms) {
    if (service_watchdog_ms() < 0)
        return -1;
    const int64_t now = lt_monotonic_ms();
    if (now >= *inout_at_ms) {
        service_report("WATCHDOG=1");
        // Several reports in each period, because a round may take long and reports may be lost.
        *inout_at_ms = now + service_watchdog_ms() / 4;
    }
    return *inout_at_ms;
}

} // namespace

// NOLINTNEXTLINE(bugprone-exception-escape): memory that runs out ends this program
int main(int argc, char **argv) {
    std::string config = "/etc/wccpd/mgmtd.conf", wccpd = "wccpd", tunneld = "tunneld";
    bool check = false, supervise = false;
    CLI::App app{"The management daemon: keeps the configuration, reports changes, queries states."};
    app.set_version_flag("--version", std::string("mgmtd ") + wccp_version());
    app.add_option("--config", config, "the configuration file, rewritten at each change")
        ->capture_default_str();
    app.add_flag("--check", check, "read the configuration file, report its errors, and exit");
    app.add_flag("--supervise", supervise, "start tunneld and wccpd, and restart them when they exit");
    const auto has_word = [](const std::string &line) {
        return command_words(line).empty() ? std::string("no program is given") : std::string();
    };
    for (std::string *command : {&wccpd, &tunneld})
        app.add_option(command == &wccpd ? "--wccpd" : "--tunneld", *command,
                       "with --supervise: the program and its options, separated by blanks")
            ->check(CLI::Validator(has_word, "COMMAND"))
            ->capture_default_str();
    CLI11_PARSE(app, argc, argv);

    service_open();
    lc_init();
    lc_log_init("mgmtd", nullptr, 0, COMPONENT_MGMTD, LC_LOG_NOTICE, lc_log_get_facility(nullptr, "mgmtd"),
                1);
    server daemon;
    std::string errors, warnings;
    daemon.file.path = config;
    // Before the lock is taken, so that --check works while mgmtd runs. The file is only read here.
    const bool good = server_load(&daemon, &errors, &warnings);
    fputs((errors + warnings).c_str(), stderr);
    if (check || !good)
        return good ? 0 : 1;
    daemon.facility_file = LC_LOG_FACILITY_FILE;
    daemon.now_ms = lt_monotonic_ms;
    daemon.say = print_line;
    daemon.supervises = supervise;

    // Blocked before any child exists; a signal that arrives earlier ends the program.
    const int signals = block_signals();
    transport sockets;
    if (!transport_listen(&sockets, &daemon, &errors)) {
        fprintf(stderr, "mgmtd: %s\n", errors.c_str());
        transport_close(&sockets);
        return 1;
    }
    // Files may be changed only while the lock is held.
    server_begin(&daemon);
    service_report("READY=1");
    print_line("mgmtd ready, " + std::to_string(daemon.tree.nodes.size()) + " nodes");

    supervisor processes;
    processes.now_ms = lt_monotonic_ms;
    processes.say = print_line;
    processes.report = [&](const std::string &event, const std::string &process) {
        server_process_event(&daemon, event, process);
    };
    processes.restarted = [&](const std::string &process, const std::string &last_end) {
        server_note_restart(&daemon, process, last_end);
    };
    // tunneld first: wccpd orders tunnels as soon as it runs. Without --supervise the commands are empty, and
    // the children are known by their sessions.
    processes.children = {{"tunneld", command_words(supervise ? tunneld : "")},
                          {"wccpd", command_words(supervise ? wccpd : "")}};
    processes.children.front().takes_over = true;
    for (child &process : processes.children)
        // The path doesn't depend on the options, because the earlier run may have had others.
        process.lock_file = "/var/run/mgmtd." + process.name + ".lock";
    daemon.opened = [&](const std::string &name) { supervisor_session_opened(&processes, name); };
    daemon.closed = [&](const std::string &name) { supervisor_session_closed(&processes, name); };
    daemon.is_news = [&](const std::string &name) { return supervisor_take_report(&processes, name); };
    int64_t alive_at_ms = 0;
    for (;;) {
        const int64_t child_due = supervisor_tick(&processes);
        if (processes.ending && supervisor_is_done(processes))
            break;
        const int64_t query_due = server_tick(&daemon), alive_due = report_alive(&alive_at_ms);
        // Built for each round: a child that was started has a new descriptor.
        std::vector<pollfd> others = {{signals, POLLIN, 0}};
        supervisor_watch(processes, &others);
        transport_round(&sockets, &others,
                        find_time_left(lt_monotonic_ms(), {child_due, query_due, alive_due}));
        if (others[0].revents & POLLIN)
            take_signals(signals, &daemon, &processes);
        // Asks the kernel about each child; the result of poll only ends the wait.
        supervisor_reap(&processes);
    }
    service_report("STOPPING=1");
    transport_close(&sockets);
    print_line("mgmtd ended");
    lc_log_close();
    return 0;
}
