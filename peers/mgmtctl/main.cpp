// mgmtctl: asks mgmtd, changes the configuration, watches. Its words and exit codes are told in
// docs/mgmtctl.md.
//
// The signals that end a program only note that they came, so that the session is closed and its socket goes
// away; then the program ends by the signal after all, for the shell to see. SIGPIPE is not taken, since a
// session that is lost must be told; a pipe behind standard output that nobody reads any more is found out at
// the end and ends the program as it would have.
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <functional>

#include <CLI/CLI.hpp>
#include <poll.h>
#include <unistd.h>

#include "peers/mgmtctl/commands.h"
#include "runtime/version.h"

// --- The end

static void note_signal(int number) {
    ctl_stop_signal = number;
}

static void take_signals() {
    struct sigaction action = {};
    action.sa_handler = note_signal; // without SA_RESTART: it ends a wait
    for (const int number : {SIGINT, SIGTERM, SIGHUP})
        sigaction(number, &action, nullptr);
    signal(SIGPIPE, SIG_IGN);
}

static void end_by(int number) {
    signal(number, SIG_DFL);
    raise(number);
}

static int finish(int code) {
    errno = 0;
    const bool written = fflush(stdout) == 0 && !ferror(stdout);
    const int error = errno;
    if (ctl_stop_signal && code != CTL_OK)
        end_by(ctl_stop_signal);
    if (written || ctl_stop_signal)
        return code;
    pollfd out = {STDOUT_FILENO, 0, 0};
    if (error == EPIPE || (poll(&out, 1, 0) == 1 && (out.revents & POLLERR)))
        end_by(SIGPIPE);
    fprintf(stderr, "mgmtctl: standard output: %s\n", error ? strerror(error) : "not all of it was written");
    return code == CTL_OK ? CTL_OUTPUT : code;
}

// --- The command line

// Words that may look like options or lists (behind "--", or in brackets) are shielded from the parser, which
// would take them apart.
static constexpr char SHIELD = '\1';

static std::vector<std::string> shielded(int argc, char **argv) {
    std::vector<std::string> out;
    bool plain = false;
    for (int i = argc - 1; i > 0; i--) // the parser takes them from the back
        out.emplace_back(argv[i]);
    for (auto word = out.rbegin(); word != out.rend(); ++word) {
        if (plain || word->starts_with('['))
            word->insert(0, 1, SHIELD);
        plain = plain || *word == "--";
    }
    std::erase(out, "--");
    return out;
}

static int usage_error(const CLI::App &app, const std::vector<std::string> &arguments, std::string error) {
    if (app.get_subcommands().empty()) {
        error = "a word is missing";
        for (auto word = arguments.rbegin(); word != arguments.rend(); ++word)
            if (!word->starts_with('-')) {
                error = "unknown word \"" + *word + "\"";
                break;
            }
        error += "; known are";
        for (const CLI::App *command : app.get_subcommands([](const CLI::App *) { return true; }))
            if (!command->get_group().empty())
                error += " " + command->get_name();
    }
    for (const std::string &word : app.remaining(true))
        if (word.starts_with('-'))
            error = "unknown option " + word;
    fprintf(stderr, "mgmtctl: %s\nmgmtctl: \"mgmtctl --help\" tells what there is\n", error.c_str());
    return CTL_USAGE;
}

// NOLINTNEXTLINE(bugprone-exception-escape): memory that runs out ends this program
int main(int argc, char **argv) {
    ctl_options options;
    double seconds = 10;
    CLI::App app{"Asks mgmtd for the state of the appliance, changes its configuration, watches it.",
                 "mgmtctl"};
    app.set_version_flag("--version", std::string("mgmtctl ") + wccp_version());
    app.require_subcommand(1);
    app.fallthrough();
    app.add_flag("--json", options.json, "JSON in the place of text");
    app.add_flag("--secrets", options.secrets, "show passwords");
    app.add_option("--timeout", seconds, "seconds to wait for an answer")
        ->check(CLI::Range(0.001, 86400.0))
        ->capture_default_str();
    std::function<int()> run;
    std::vector<std::string> words;
    std::string name = "/";
    bool children = false, leaves = false, existing = false, check = false;
    uint64_t count = 0;

    const auto add = [&](const char *word, const char *about, std::function<int()> function) {
        CLI::App *command = app.add_subcommand(word, about);
        command->callback([&run, function = std::move(function)] { run = function; });
        return command;
    };
    CLI::App *command = add("get", "values of nodes", [&] { return ctl_get(options, words); });
    command->add_option("NAME", words)->required();
    command = add("walk", "a node and all below it", [&] {
        return ctl_walk_nodes(options, name,
                              children ? ctl_walk::children
                              : leaves ? ctl_walk::leaves
                                       : ctl_walk::subtree);
    });
    command->add_option("NAME", name)->capture_default_str();
    CLI::Option *only_children = command->add_flag("--children", children, "what is directly below it only");
    command->add_flag("--leaves", leaves, "only nodes with nothing below them")->excludes(only_children);
    command = add("set", "set nodes: one commit", [&] { return ctl_change_nodes(options, words, existing); });
    command->add_option("NAME=VALUE", words, "or NAME VALUE")->required();
    command->add_flag("--existing", existing, "make no new group, policy group or router");
    command = add("delete", "delete nodes with all below them: one commit",
                  [&] { return ctl_delete(options, words); });
    command->add_option("NAME", words)->required();
    command = add("watch", "changes, alarms, roles and processes, as they come",
                  [&] { return ctl_watch(options, words, count); });
    command->add_option("NAME", words, "changes of this and below it only; * is one part of a name");
    command->add_option("--count", count, "end after so many events");
    command = add("alarms", "the alarms that stand", [&] { return ctl_alarms(options, check); });
    command->add_flag("--check", check, "exit with 6 when there are any");
    command = add("group", "service groups: add, set, restart, delete, list, words",
                  [&] { return ctl_group(options, words); });
    command->add_option("WORD", words);
    command = add("policy", "policy groups: add, delete, list", [&] { return ctl_policy(options, words); });
    command->add_option("WORD", words);
    command = add("show", "the whole appliance in one screen", [&] { return ctl_show(options); });
    CLI::Option *stay = command->add_flag("--watch", options.watch, "stay, and follow what changes");
    command->add_option("--below", options.below, "leave so many rows at the top of the terminal alone")
        ->check(CLI::Range(0, 1000))
        ->needs(stay);
    command->add_flag_callback(
        "--colour", [&] { options.colour = 1; }, "in colour, whatever the output is");
    command->add_flag_callback(
        "--no-colour", [&] { options.colour = 0; }, "without colour");
    command = add("complete", "", [&] { return ctl_complete(words.empty() ? "" : words[0]); });
    command->add_option("WORD", words);
    command->group(""); // for the shell

    take_signals();
    const std::vector<std::string> arguments = shielded(argc, argv);
    try {
        std::vector<std::string> taken = arguments;
        app.parse(taken);
    } catch (const CLI::ParseError &error) {
        if (error.get_exit_code() == 0)
            return app.exit(error) == 0 ? finish(CTL_OK) : CTL_USAGE; // --help
        return usage_error(app, arguments, error.what());
    }
    words.push_back(name);
    for (std::string &word : words)
        if (word.starts_with(SHIELD))
            word.erase(0, 1);
    name = words.back();
    words.pop_back();
    options.timeout_ms = static_cast<int64_t>(std::max(1.0, seconds * 1000)); // 1 also for "nan"
    return finish(run());
}
