// The commands about the configuration as a whole: "apply", "confirm", "export", "history", "diff",
// "rollback".
//
// mgmtd answers with the text of its configuration file and the revision of that text. The changes are
// computed here, and requested for that revision: when somebody else commits in between, mgmtd refuses.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

#include <fcntl.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/config_change.h"
#include "peers/mgmtctl/connection.h"

namespace {
constexpr size_t FILE_MAX_BYTES = 16u << 20;

// --- Configurations of mgmtd

// False when the failure has been printed, and its exit code is in `mgmtd->code`.
bool get_text(connection *mgmtd, const std::string &name, const std::string &missing, ctl_reply *out) {
    if (!mgmtd->session)
        return false;
    if (!mgmtd->ask(ctl_walk::node, name, out))
        mgmtd->code = mgmtd->lost();
    else if (out->code != 0)
        mgmtd->code = tell_failure(mgmtd->options, {exit_of(out->code), "", out->message, "", out->code});
    else if (out->bindings.empty())
        mgmtd->code = tell_failure(mgmtd->options, {CTL_NOT_FOUND, "", missing, "", LC_NOT_FOUND});
    else
        return true;
    return false;
}

bool get_config(connection *mgmtd, const std::string &name, const std::string &missing, config_text *out,
                uint32_t *out_revision) {
    ctl_reply reply;
    if (!get_text(mgmtd, name, missing, &reply))
        return false;
    *out_revision = reply.revision;
    if (config_parse(reply.bindings[0].value, name, out))
        return true;
    mgmtd->code = tell_failure(mgmtd->options,
                               {CTL_REFUSED, "", "mgmtd's answer can't be read: " + out->errors, "", 0});
    return false;
}

bool get_present(connection *mgmtd, config_text *out, uint32_t *out_revision) {
    return get_config(mgmtd, NODE_CONFIG_TEXT, "mgmtd is too old for this", out, out_revision);
}

bool get_commit(connection *mgmtd, uint32_t number, config_text *out) {
    uint32_t ignored = 0;
    return get_config(mgmtd, NODE_COMMITS "/" + std::to_string(number) + "/text",
                      "commit " + std::to_string(number) +
                          " is not kept; \"mgmtctl history\" lists those that are",
                      out, &ignored);
}

// --- Commits

// The changes of one commit.
struct plan {
    std::vector<node_change> changes;
    std::vector<ctl_change_item> items;
    change_notes notes;
};

plan make_plan(const node_tree &before, const node_tree &after) {
    plan out;
    out.changes = config_changes(before, after);
    out.items = items_of(out.changes, after);
    out.notes = config_notes(out.items, before);
    return out;
}

ctl_json json_changes(const std::vector<node_change> &changes, bool secrets) {
    ctl_json out = ctl_json::array();
    for (const node_change &change : changes)
        out.push_back(json_change(change, secrets));
    return out;
}

void put_changes(const ctl_options &options, const std::vector<node_change> &changes) {
    for (const node_change &change : changes)
        write_output(text_change(change, options.secrets) + "\n");
}

// Prints the changes for a person.
void put_plan(const ctl_options &options, const plan &made) {
    if (options.json)
        return;
    put_changes(options, made.changes);
    // The notes go to standard error. Where both end in one file, they must not come before the changes.
    fflush(stdout);
    for (const std::string &note : made.notes.notes)
        fprintf(stderr, "mgmtctl: note: %s\n", note.c_str());
}

int tell_plan(const ctl_options &options, const plan &made, uint32_t commit, bool done,
              uint32_t confirm_minutes, int code) {
    const bool waits = done && confirm_minutes != 0;
    if (options.json) {
        write_output(json_line({{"changes", json_changes(made.changes, options.secrets)},
                                {"done", done},
                                {"commit", commit},
                                {"confirm_minutes", waits ? ctl_json(confirm_minutes) : ctl_json(nullptr)},
                                {"notes", made.notes.notes},
                                {"exit", code}}));
        return code;
    }
    if (made.changes.empty())
        write_output("nothing to change\n");
    else if (done)
        write_output("commit " + std::to_string(commit) + "\n");
    if (waits)
        write_output("it is undone in " + std::to_string(confirm_minutes) +
                     (confirm_minutes == 1 ? " minute" : " minutes") +
                     ", unless \"mgmtctl confirm\" follows\n");
    return code;
}

// Sends the items. False when the failure has been printed, and its exit code is in `mgmtd->code`.
bool send_plan(connection *mgmtd, const plan &made, const ctl_order &order, ctl_reply *out) {
    if (!ctl_set(mgmtd->session.get(), made.items, order, out, &mgmtd->reason)) {
        mgmtd->code = mgmtd->lost();
        return false;
    }
    if (out->code != 0)
        mgmtd->code = tell_failure(mgmtd->options, {exit_of(out->code), "", out->message, "", out->code});
    return out->code == 0;
}

// --- apply

bool read_file(const std::string &file, std::string *out, std::string *out_reason) {
    const int fd = file == "-" ? STDIN_FILENO : open(file.c_str(), O_RDONLY | O_CLOEXEC);
    char bytes[65536];
    ssize_t got = fd < 0 ? -1 : 1;
    // One block beyond the limit is read, to tell a file that is too large from one that just fits.
    while (got > 0 && out->size() <= FILE_MAX_BYTES) {
        got = read(fd, bytes, sizeof bytes);
        if (got < 0 && errno == EINTR && !ctl_stop_signal)
            got = 1;
        else if (got > 0)
            out->append(bytes, static_cast<size_t>(got));
    }
    if (got < 0)
        *out_reason = strerror(errno);
    else if (out->size() > FILE_MAX_BYTES)
        *out_reason = "is larger than 16 MiB";
    if (fd > STDIN_FILENO)
        close(fd);
    return out_reason->empty();
}

bool ask_person() {
    char line[64] = "";
    fputs("mgmtctl: apply this? [y/N] ", stderr);
    const ssize_t got = read(STDIN_FILENO, line, sizeof line - 1); // ended by a signal as well
    return got > 0 && (line[0] == 'y' || line[0] == 'Y');
}

// With --check a failure and a difference have different codes.
int apply_code(const ctl_apply_options &how, int code) {
    return how.check && code != CTL_OK ? int{CTL_USAGE} : code;
}

int apply_plan(connection *mgmtd, const plan &made, const ctl_apply_options &how, uint32_t revision) {
    const ctl_options &options = mgmtd->options;
    ctl_reply reply;
    // Applying the same file again makes no commit.
    if (made.changes.empty())
        return tell_plan(options, made, revision, false, 0, CTL_OK);
    put_plan(options, made);
    if (!how.check && !how.yes && !ask_person())
        return tell_failure(options, {CTL_REFUSED, "", "nothing was changed", "", 0});
    if (!send_plan(mgmtd, made, {options.cause, how.check, false, revision, how.confirm_minutes}, &reply))
        return apply_code(how, mgmtd->code);
    return tell_plan(options, made, reply.revision, !how.check, how.confirm_minutes,
                     how.check ? CTL_WOULD_CHANGE : CTL_OK);
}
} // namespace

int ctl_apply(const ctl_options &options, const std::string &file, const ctl_apply_options &how) {
    std::string content, errors;
    if (!how.yes && !how.check && (options.json || file == "-" || !isatty(STDIN_FILENO)))
        return tell_failure(options,
                            {CTL_USAGE, "", "cannot ask for confirmation: add --yes or --check", "", 0});
    if (!read_file(file, &content, &errors))
        return tell_failure(options, {CTL_USAGE, "", file + ": " + errors, "", 0});
    connection mgmtd(options);
    config_text present;
    node_tree wanted;
    uint32_t revision = 0;
    if (!mgmtd.session || !get_present(&mgmtd, &present, &revision))
        return apply_code(how, mgmtd.code);
    if (!read_config(content, file == "-" ? "standard input" : file, present.tree, how.merge, &wanted,
                     &errors)) {
        // Its last newline, which tell_failure() adds.
        errors.pop_back();
        return tell_failure(options, {CTL_USAGE, "", errors, "", 0});
    }
    return apply_plan(&mgmtd, make_plan(present.tree, wanted), how, revision);
}

int ctl_confirm(const ctl_options &options) {
    connection mgmtd(options);
    ctl_reply reply;
    if (!mgmtd.session)
        return mgmtd.code;
    if (!ctl_action(mgmtd.session.get(), ACTION_CONFIRM, {}, &reply, &mgmtd.reason))
        return mgmtd.lost();
    if (reply.code != 0)
        return tell_failure(options, {exit_of(reply.code), "", reply.message, "", reply.code});
    write_output(options.json ? json_line({{"confirmed", reply.message}, {"exit", 0}})
                              : reply.message + " confirmed\n");
    return CTL_OK;
}

int ctl_export(const ctl_options &options) {
    connection mgmtd(options);
    config_text present;
    uint32_t revision = 0;
    if (!get_present(&mgmtd, &present, &revision))
        return mgmtd.code;
    write_output(options.json ? json_text(export_json(present.tree, options.secrets), 2) + "\n"
                              : export_text(present, options.secrets));
    return CTL_OK;
}

// --- history, diff and rollback

namespace {
struct kept_commit {
    std::string number, time, user, cause, changes, what, confirm_by, returns_to;
};

std::vector<kept_commit> commits_of(const std::vector<ctl_binding> &bindings) {
    static const struct {
        const char *name;
        std::string kept_commit::*field;
    } fields[] = {
        {"time", &kept_commit::time},
        {"user", &kept_commit::user},
        {"cause", &kept_commit::cause},
        {"changes", &kept_commit::changes},
        {"what", &kept_commit::what},
        {"confirm_by", &kept_commit::confirm_by},
        {"returns_to", &kept_commit::returns_to},
    };
    static const node_name root = parsed_name(NODE_COMMITS);
    std::vector<kept_commit> out;
    for (const ctl_binding &binding : bindings) {
        const node_name name = parsed_name(binding.name);
        if (!name.is_under(root))
            continue;
        const std::string &number = name.parts[root.parts.size()];
        if (out.empty() || out.back().number != number)
            out.emplace_back().number = number;
        for (const auto &row : fields)
            if (name.parts.back() == row.name)
                out.back().*row.field = binding.value;
    }
    std::ranges::reverse(out); // the latest first
    return out;
}

std::string local_time(const std::string &seconds, const char *format) {
    const time_t at = strtoll(seconds.c_str(), nullptr, 10);
    tm broken{};
    char text[64];
    localtime_r(&at, &broken);
    return {text, strftime(text, sizeof text, format, &broken)};
}

ctl_json json_commit(const kept_commit &commit) {
    const auto number = [](const std::string &text) { return json_value({"", "int64", text}); };
    const auto optional = [](const std::string &text, const ctl_json &value) {
        return text.empty() ? ctl_json(nullptr) : value;
    };
    return {{"commit", number(commit.number)},
            {"time", local_time(commit.time, "%FT%T%z")},
            {"user", optional(commit.user, commit.user)},
            {"cause", commit.cause},
            {"changes", number(commit.changes)},
            {"what", optional(commit.what, commit.what)},
            {"confirm_by", optional(commit.confirm_by, local_time(commit.confirm_by, "%FT%T%z"))},
            {"returns_to", optional(commit.returns_to, number(commit.returns_to))}};
}

std::string text_commit(const kept_commit &commit) {
    std::string out = commit.number +
                      std::string(commit.number.size() < 5 ? 6 - commit.number.size() : 1, ' ') +
                      local_time(commit.time, "%F %T  ") + (commit.user.empty() ? "-" : commit.user) + "  " +
                      commit.cause + "\n";
    if (commit.changes != "0")
        out += "      " + commit.changes + (commit.changes == "1" ? " node: " : " nodes: ") + commit.what +
               (commit.changes == "1" ? "" : " ...") + "\n";
    if (!commit.confirm_by.empty())
        out += "      waits until " + local_time(commit.confirm_by, "%T") + " to be confirmed; commit " +
               commit.returns_to + " returns otherwise\n";
    return out;
}

// False when the failure has been printed.
bool get_history(connection *mgmtd, std::vector<kept_commit> *out) {
    ctl_reply reply;
    if (!mgmtd->session)
        return false;
    if (!mgmtd->ask(ctl_walk::subtree, NODE_COMMITS, &reply))
        mgmtd->code = mgmtd->lost();
    else if (reply.code != 0)
        mgmtd->code = tell_failure(mgmtd->options, {exit_of(reply.code), "", reply.message, "", reply.code});
    *out = commits_of(reply.bindings);
    return mgmtd->code == CTL_OK;
}
} // namespace

int ctl_history(const ctl_options &options) {
    connection mgmtd(options);
    std::vector<kept_commit> commits;
    if (!get_history(&mgmtd, &commits))
        return mgmtd.code;
    ctl_json all = ctl_json::array();
    for (const kept_commit &commit : commits) {
        all.push_back(json_commit(commit));
        if (!options.json)
            write_output(text_commit(commit));
    }
    if (options.json)
        write_output(json_line(all));
    return CTL_OK;
}

namespace {
// Without a number, the comparison begins at the commit before the last one.
bool choose_commits(connection *mgmtd, uint32_t *inout_from) {
    std::vector<kept_commit> commits;
    if (*inout_from != 0)
        return true;
    if (!get_history(mgmtd, &commits))
        return false;
    if (commits.size() < 2)
        mgmtd->code = tell_failure(
            mgmtd->options, {CTL_NOT_FOUND, "", "there is no commit before the last one", "", LC_NOT_FOUND});
    else
        // The latest is first: the second one is the commit before it.
        *inout_from = static_cast<uint32_t>(std::strtoul(commits[1].number.c_str(), nullptr, 10));
    return *inout_from != 0;
}
} // namespace

int ctl_diff(const ctl_options &options, uint32_t from, uint32_t to) {
    connection mgmtd(options);
    config_text before, after;
    uint32_t revision = to;
    if (!mgmtd.session || !choose_commits(&mgmtd, &from) || !get_commit(&mgmtd, from, &before) ||
        !(to ? get_commit(&mgmtd, to, &after) : get_present(&mgmtd, &after, &revision)))
        return mgmtd.code;
    const std::vector<node_change> changes = config_changes(before.tree, after.tree);
    if (options.json)
        write_output(json_line(
            {{"from", from}, {"to", revision}, {"changes", json_changes(changes, options.secrets)}}));
    else
        put_changes(options, changes);
    return CTL_OK;
}

// A new commit, which is allowed while another one waits to be confirmed, and ends that wait.
int ctl_rollback(const ctl_options &options, uint32_t number) {
    connection mgmtd(options);
    config_text wanted, present;
    uint32_t revision = 0;
    ctl_reply reply;
    if (!mgmtd.session || !get_commit(&mgmtd, number, &wanted) || !get_present(&mgmtd, &present, &revision))
        return mgmtd.code;
    const plan made = make_plan(present.tree, wanted.tree);
    if (made.changes.empty())
        return tell_plan(options, made, revision, false, 0, CTL_OK);
    if (!send_plan(&mgmtd, made, {"rollback to " + std::to_string(number), false, true, revision}, &reply))
        return mgmtd.code;
    put_plan(options, made);
    return tell_plan(options, made, reply.revision, true, 0, CTL_OK);
}
