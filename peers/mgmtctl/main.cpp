// mgmtctl: queries mgmtd, changes the configuration, watches. The commands and exit codes are in
// docs/mgmtctl.md.
//
// The handlers of SIGINT, SIGTERM and SIGHUP only note the signal, because the session has to be closed
// first. Then the program ends by the same signal, which the shell sees. SIGPIPE is ignored, because a lost
// session is reported as an error; a pipe on standard output that nobody reads any more is detected at the
// end, and ends the program as SIGPIPE would have.
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

namespace {
void note_signal(int number) {
    ctl_stop_signal = number;
}

void take_signals() {
    struct sigaction action = {};
    action.sa_handler = note_signal; // without SA_RESTART: it ends a wait
    for (const int number : {SIGINT, SIGTERM, SIGHUP})
        sigaction(number, &action, nullptr);
    signal(SIGPIPE, SIG_IGN);
}

void end_by_signal(int number) {
    signal(number, SIG_DFL);
    raise(number);
}

int finish_output(int code) {
    errno = 0;
    const bool written = fflush(stdout) == 0 && !ferror(stdout);
    const int error = errno;
    // A watch that is ended by a signal has succeeded. Any other command was interrupted, and the shell has
    // to see that.
    if (ctl_stop_signal && code != CTL_OK)
        end_by_signal(ctl_stop_signal);
    if (written || ctl_stop_signal)
        return code;
    pollfd out = {STDOUT_FILENO, 0, 0};
    // The failed write may have been an earlier one, whose errno is lost. poll reports a pipe without readers
    // even if no event is requested.
    if (error == EPIPE || (poll(&out, 1, 0) == 1 && (out.revents & POLLERR)))
        end_by_signal(SIGPIPE);
    fprintf(stderr, "mgmtctl: standard output: %s\n", error ? strerror(error) : "not all of it was written");
    return code == CTL_OK ? CTL_OUTPUT : code;
}

// --- The command line

// Words that look like options or lists but are not (after "--", or in brackets) are marked, because the
// parser would take them apart.
constexpr char SHIELD = '\1';

std::vector<std::string> shield_words(int argc, char **argv) {
    std::vector<std::string> out;
    bool plain = false;
    for (int i = argc - 1; i > 0; i--) // the parser expects them in reverse order
        out.emplace_back(argv[i]);
    for (auto word = out.rbegin(); word != out.rend(); ++word) {
        if (plain || word->starts_with('['))
            word->insert(0, 1, SHIELD);
        plain = plain || *word == "--";
    }
    // Only the first "--" is unmarked; a later one is a word.
    std::erase(out, "--");
    return out;
}

int usage_error(const CLI::App &app, const std::vector<std::string> &arguments, std::string error) {
    // No command was recognised: the first word is the wrong one.
    if (app.get_subcommands().empty()) {
        error = "a word is missing";
        bool is_value = false; // of the option before it
        for (auto word = arguments.rbegin(); word != arguments.rend(); ++word) {
            if (!word->starts_with('-') && !is_value) {
                error = "unknown word \"" + *word + "\"";
                break;
            }
            const CLI::Option *option = app.get_option_no_throw(*word);
            is_value = option && option->get_items_expected_max() > 0;
        }
        error += "; known are";
        for (const CLI::App *command : app.get_subcommands([](const CLI::App *) { return true; }))
            if (!command->get_group().empty())
                error += " " + command->get_name();
    }
    for (const std::string &word : app.remaining(true))
        if (word.starts_with('-'))
            error = "unknown option " + word;
    fprintf(stderr, "mgmtctl: %s\nmgmtctl: \"mgmtctl --help\" lists the commands\n", error.c_str());
    return CTL_USAGE;
}

// --- Commands

struct command_line {
    CLI::App app{"Shows the state of the appliance, changes its configuration and watches it.", "mgmtctl"};
    ctl_options options;
    double seconds = 10; // of --timeout
    std::function<int()> run;
    std::vector<std::string> words;
    std::string name = "/";
    bool children = false, leaves = false, existing = false, check = false, list = false, text = false,
         http = false;
    int group = -1;
    uint64_t count = 0;
    ctl_apply_options apply;
    uint32_t from = 0, to = 0; // commits
    ctl_notify_options notify;
};

CLI::App *add_command(command_line *line, const char *word, const char *about,
                      std::function<int()> function) {
    CLI::App *command = line->app.add_subcommand(word, about);
    // Only noted here: it must run after the marks of the words have been removed.
    command->callback([line, function = std::move(function)] { line->run = function; });
    return command;
}

void add_options(command_line *line) {
    line->app.set_version_flag("--version", std::string("mgmtctl ") + wccp_version());
    line->app.require_subcommand(1);
    line->app.fallthrough();
    line->app.add_flag("--json", line->options.json, "JSON instead of text");
    line->app.add_flag("--secrets", line->options.secrets, "show passwords");
    line->app.add_option("--timeout", line->seconds, "seconds to wait for an answer")
        ->check(CLI::Range(0.001, 86400.0))
        ->capture_default_str();
}

void add_node_commands(command_line *line) {
    add_command(line, "get", "values of nodes", [line] { return ctl_get(line->options, line->words); })
        ->add_option("NAME", line->words)
        ->required();
    CLI::App *command = add_command(line, "walk", "a node and all below it", [line] {
        return ctl_walk_nodes(line->options, line->name,
                              line->children ? ctl_walk::children
                              : line->leaves ? ctl_walk::leaves
                                             : ctl_walk::subtree);
    });
    command->add_option("NAME", line->name)->capture_default_str();
    CLI::Option *only_children =
        command->add_flag("--children", line->children, "only the nodes directly below it");
    command->add_flag("--leaves", line->leaves, "only nodes with nothing below them")
        ->excludes(only_children);
    command = add_command(line, "set", "set nodes: one commit",
                          [line] { return ctl_change_nodes(line->options, line->words, line->existing); });
    command->add_option("NAME=VALUE", line->words, "or NAME VALUE")->required();
    command->add_flag("--existing", line->existing, "don't create a group, policy group or router");
    add_command(line, "delete", "delete nodes with all below them: one commit",
                [line] { return ctl_delete(line->options, line->words); })
        ->add_option("NAME", line->words)
        ->required();
}

void add_watch_commands(command_line *line) {
    CLI::App *command = add_command(line, "watch", "changes, alarms, roles and processes, as they happen",
                                    [line] { return ctl_watch(line->options, line->words, line->count); });
    command->add_option("NAME", line->words,
                        "only changes of this node and those below it; * is one part of a name");
    command->add_option("--count", line->count, "end after this many events");
    add_command(line, "alarms", "the active alarms", [line] {
        return ctl_alarms(line->options, line->check);
    })->add_flag("--check", line->check, "exit with 6 if there are any");
}

void add_group_commands(command_line *line) {
    add_command(line, "group", "service groups: add, set, restart, delete, list, words", [line] {
        return ctl_group(line->options, line->words);
    })->add_option("WORD", line->words);
    add_command(line, "policy", "policy groups: add, delete, list", [line] {
        return ctl_policy(line->options, line->words);
    })->add_option("WORD", line->words);
}

void add_traffic_commands(command_line *line) {
    add_command(line, "intercept", "redirected packets to a proxy: add, set, delete, show, words", [line] {
        return ctl_intercept(line->options, line->words);
    })->add_option("WORD", line->words);
    add_command(line, "bypass", "clients and servers whose packets are returned: add, delete, show", [line] {
        return ctl_bypass(line->options, line->words);
    })->add_option("WORD", line->words);
    add_command(line, "tunnel", "tunnels and their accepted sources: accept, refuse, show", [line] {
        return ctl_tunnel(line->options, line->words);
    })->add_option("WORD", line->words);
    add_command(line, "protection", "flows whose buckets have moved: [time SECONDS]", [line] {
        return ctl_protection(line->options, line->words);
    })->add_option("WORD", line->words);
}

void add_config_commands(command_line *line) {
    const CLI::Range commits(1u, UINT32_MAX);
    CLI::App *apply = add_command(line, "apply", "make FILE the configuration: one commit",
                                  [line] { return ctl_apply(line->options, line->name, line->apply); });
    apply
        ->add_option("FILE", line->name,
                     "a configuration, in the format of mgmtd's file or as JSON; - for standard input")
        ->required();
    CLI::Option *check =
        apply->add_flag("--check", line->apply.check,
                        "change nothing; exit with 1 if something would change, 0 if not, 2 for errors");
    apply->add_flag("--yes", line->apply.yes, "don't ask");
    apply->add_flag("--merge", line->apply.merge, "keep the nodes that FILE doesn't name");
    apply
        ->add_option("--confirm", line->apply.confirm_minutes,
                     "undo it after this many minutes, unless \"mgmtctl confirm\" follows")
        ->check(CLI::Range(1u, CTL_CONFIRM_MAX_MINUTES))
        ->excludes(check);
    add_command(line, "confirm", "keep the commit that was applied with --confirm",
                [line] { return ctl_confirm(line->options); });
    add_command(line, "export", "the configuration in the format of apply",
                [line] { return ctl_export(line->options); });
    add_command(line, "history", "the last commits", [line] { return ctl_history(line->options); });
    CLI::App *diff = add_command(line, "diff", "what the last commit changed, or all since commit FROM",
                                 [line] { return ctl_diff(line->options, line->from, line->to); });
    diff->add_option("FROM", line->from, "the number of a commit")->check(commits);
    diff->add_option("TO", line->to, "the number of another one; default: the present configuration")
        ->check(commits);
    add_command(line, "rollback", "return to a commit, by a new commit",
                [line] { return ctl_rollback(line->options, line->from); })
        ->add_option("COMMIT", line->from, "its number")
        ->check(commits)
        ->required();
}

// The cause of a commit: the command, with its verb where it has one.
std::string cause_of(const command_line &line) {
    std::string word = line.app.get_subcommands().front()->get_name();
    for (const char *begins : {"group", "policy", "intercept", "bypass", "tunnel"})
        if (word == begins && !line.words.empty())
            return word + " " + line.words.front();
    return word;
}

void add_drain_command(command_line *line) {
    add_command(line, "drain", "empty groups before they leave: [GROUP] [for S] [wait], cancel, show",
                [line] { return ctl_drain(line->options, line->words); })
        ->add_option("WORD", line->words);
}

void add_show_command(command_line *line) {
    ctl_options *options = &line->options;
    CLI::App *command = add_command(line, "show", "the whole appliance in one screen",
                                    [options] { return ctl_show(*options); });
    CLI::Option *stay = command->add_flag("--watch", options->watch, "keep running, and follow changes");
    command->add_option("--html", options->html, "write it as a page to FILE; - is standard output")
        ->type_name("FILE")
        ->check([](const std::string &file) { return file.empty() ? "the name of a file is empty" : ""; })
        ->excludes(stay)
        ->excludes(line->app.get_option("--json"));
    command->add_option("--below", options->below, "leave this many rows at the top of the terminal alone")
        ->check(CLI::Range(0, 1000))
        ->needs(stay);
    command->add_flag_callback(
        "--colour", [options] { options->colour = 1; }, "in colour, also if the output is not a terminal");
    command->add_flag_callback(
        "--no-colour", [options] { options->colour = 0; }, "without colour");
}

void add_explain_command(command_line *line) {
    CLI::App *command = add_command(line, "explain", "why a group does not work, and what to do", [line] {
        return line->list ? ctl_list_reasons(line->options) : ctl_explain(line->options, line->group);
    });
    command->add_option("GROUP", line->group, "only this group")->check(CLI::Range(0, 255));
    command->add_flag("--list", line->list, "all possible reasons, as a table");
}

void add_check_command(command_line *line) {
    add_command(line, "check", "problems of this host, and how to fix them",
                [line] { return ctl_check(line->options); });
}

void add_metrics_command(command_line *line) {
    CLI::App *command = add_command(line, "metrics", "counters and states for a monitoring system",
                                    [line] { return ctl_metrics(line->options, line->text, line->http); });
    command->add_flag("--text", line->text, "in the older text format, for a textfile collector");
    command->add_flag("--http", line->http, "answer the HTTP request on standard input");
}

void add_notify_command(command_line *line) {
    CLI::App *command =
        add_command(line, "notify", "commands at changes of roles, alarms and proxies: run, list",
                    [line] { return ctl_notify(line->options, line->name, line->notify); });
    command->add_option("WORD", line->name)->required();
    command->add_option("--directory", line->notify.directory, "directory of the commands")
        ->capture_default_str();
    command->add_option("--state", line->notify.state_file, "file of the states that were reported")
        ->capture_default_str();
    command->add_option("--user", line->notify.user, "user to run as, if root starts it");
    command->add_option("--limit", line->notify.limit_s, "seconds that a command may take")
        ->check(CLI::Range(1u, 3600u))
        ->capture_default_str();
}

void add_shell_command(command_line *line) {
    CLI::App *command = add_command(
        line, "complete", "", [line] { return ctl_complete(line->words.empty() ? "" : line->words[0]); });
    command->add_option("WORD", line->words);
    command->group(""); // not in the list of commands
}

void unshield_word(std::string *word) {
    if (word->starts_with(SHIELD))
        word->erase(0, 1);
}
} // namespace

// NOLINTNEXTLINE(bugprone-exception-escape): memory that runs out ends this program
int main(int argc, char **argv) {
    command_line line;
    add_options(&line);
    add_node_commands(&line);
    add_watch_commands(&line);
    add_group_commands(&line);
    add_traffic_commands(&line);
    add_config_commands(&line);
    add_drain_command(&line);
    add_show_command(&line);
    add_explain_command(&line);
    add_check_command(&line);
    add_metrics_command(&line);
    add_notify_command(&line);
    add_shell_command(&line);

    take_signals();
    const std::vector<std::string> arguments = shield_words(argc, argv);
    try {
        std::vector<std::string> taken = arguments;
        line.app.parse(taken);
    } catch (const CLI::ParseError &error) {
        if (error.get_exit_code() == 0)
            return line.app.exit(error) == 0 ? finish_output(CTL_OK) : CTL_USAGE; // --help
        return usage_error(line.app, arguments, error.what());
    }
    for (std::string &word : line.words)
        unshield_word(&word);
    unshield_word(&line.name);
    line.options.timeout_ms = static_cast<int64_t>(std::max(1.0, line.seconds * 1000)); // 1 also for "nan"
    line.options.cause = cause_of(line);
    return finish_output(line.run());
}
