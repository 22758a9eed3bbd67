// tunneld [--json] [--roles] [--slow MS] [--refuse] [--silent] [--index N]

#include <signal.h>

#include <CLI/CLI.hpp>

#include "peers/tunneld/tunneld.h"
#include "runtime/common.h"
#include "runtime/logging.h"
#include "runtime/version.h"

static constexpr uint32_t COMPONENT_TUNNELD = 257u << 16;

// NOLINTNEXTLINE(bugprone-exception-escape): memory that runs out ends this program
int main(int argc, char **argv) {
    tunneld_options options;
    CLI::App app{"The tunnel daemon: takes the commands that wccpd leaves in the mailbox, and prints them."};
    app.set_version_flag("--version", std::string("tunneld ") + wccp_version());
    app.add_flag("--json", options.json, "one JSON object for each command");
    app.add_flag("--roles", options.roles, "print changes of policy group roles as well");
    app.add_option("--slow", options.slow_ms, "take so many milliseconds for each command");
    app.add_flag("--refuse", options.refuse, "answer every command with a failure");
    app.add_flag("--silent", options.silent, "answer no command");
    app.add_option("--index", options.first_index,
                   "index of the first tunnel; 4294967295 gives none, which makes an add fail");
    CLI11_PARSE(app, argc, argv);

    sigset_t set;
    sigemptyset(&set);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP})
        sigaddset(&set, signal);
    sigprocmask(SIG_BLOCK, &set, nullptr);
    signal(SIGPIPE, SIG_IGN);

    lc_init();
    lc_log_init("tunneld", nullptr, 0, COMPONENT_TUNNELD, LC_LOG_DEBUG,
                lc_log_get_facility(nullptr, "tunneld"), 1);
    tunneld daemon;
    const bool started = tunneld_start(&daemon, options, stdout);
    if (started)
        tunneld_run(&daemon);
    lc_log_close();
    return started ? 0 : 1;
}
