// Changes of the configuration: set requests of sessions, and the configuration file when it is read again. A
// commit is checked, then saved, then put into force, and then reported by events: no change is reported that
// a crash could lose.
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <span>
#include <sstream>
#include <utility>

#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/change_plan.h"
#include "peers/mgmtd/file_replace.h"
#include "peers/mgmtd/server.h"
#include "peers/nodes/secrets.h"

// --- Change events

namespace {

bool is_wanted(const peer &who, const node_name &name) {
    for (const interest &wish : who.interests) {
        if (wish.event != EVENT_CONFIG_CHANGE)
            continue;
        if (wish.patterns.empty() ||
            std::any_of(wish.patterns.begin(), wish.patterns.end(),
                        [&](const std::string &pattern) { return interest_matches(pattern, name); }))
            return true;
    }
    return false;
}

using event_changes = std::vector<const node_change *>;

std::vector<event_changes> select_events(const peer &who, std::span<const change_list> lists) {
    std::vector<event_changes> out;
    for (const change_list &changes : lists) {
        event_changes wanted;
        for (const node_change &change : changes)
            if (is_wanted(who, change.name))
                wanted.push_back(&change);
        std::ranges::move(cut_into_events(wanted), std::back_inserter(out));
    }
    return out;
}

// With passwords hidden from viewers.
bn_request_msg *make_event_for(const server *self, uint32_t peer_id, const event_changes &event) {
    const auto who = self->peers.find(peer_id);
    if (who == self->peers.end() || who->second.owner.may_change)
        return make_change_event(event);
    change_list hidden;
    event_changes shown;
    // `shown` points into `hidden`, which must therefore not be reallocated.
    hidden.reserve(event.size());
    for (const node_change *change : event) {
        hidden.push_back(*change);
        for (std::optional<node_value> *value : {&hidden.back().before, &hidden.back().after})
            if (*value)
                (*value)->text = hidden_value(change->name.text(), (*value)->text);
        shown.push_back(&hidden.back());
    }
    return make_change_event(shown);
}

void send_change_events(server *self, const node_tree &before, const commit_result &commit) {
    wccpd_plan plan = plan_for_wccpd(before, self->tree, commit);
    // After the plan: which groups are recreated depends on the configured values, not on those of an
    // overlay.
    for (change_list &changes : plan.events)
        server_adapt_for_wccpd(self, &changes);
    // The events point to changes in `plan` and `commit`, which outlive them.
    std::vector<std::pair<uint32_t, event_changes>> events;
    bool recreates = false;
    for (const auto &[id, who] : self->peers) {
        const bool runs_groups = server_runs_groups(who);
        for (event_changes &event :
             select_events(who, runs_groups ? std::span(plan.events) : std::span(&commit.changes, 1))) {
            events.emplace_back(id, std::move(event));
            recreates = recreates || runs_groups;
        }
    }
    if (recreates)
        for (const node_name &root : plan.recreated)
            // Logged only if a wccpd is connected: the group loses its routers for a moment.
            self->say("service group " + root.parts.back() + " is deleted and created again in wccpd");
    for (const auto &[id, event] : events) {
        const owned_request msg(make_event_for(self, id, event));
        (void)server_send_request(self, id, msg.pointer);
    }
}

} // namespace

void server_send_to_wccpd(server *self, const change_list &changes) {
    std::vector<std::pair<uint32_t, event_changes>> events;
    for (const auto &[id, who] : self->peers)
        if (server_runs_groups(who))
            for (event_changes &event : select_events(who, std::span(&changes, 1)))
                events.emplace_back(id, std::move(event));
    for (const auto &[id, event] : events) {
        const owned_request msg(make_change_event(event));
        (void)server_send_request(self, id, msg.pointer);
    }
}

// --- The log facility

namespace {

std::string read_facility(const node_tree &tree) {
    static const node_name facility = parsed_name(NODE_SYSTEM_FACILITY);
    const auto found = tree.nodes.find(facility);
    return found == tree.nodes.end() ? "" : found->second.text;
}

// Programs read the file at their start, before they have a session. Lines that mgmtd does not know stay as
// they are.
void write_facility(const server *self) {
    if (self->facility_file.empty())
        return;
    std::optional<std::string> before;
    std::string reason, content = "system " + read_facility(self->tree) + "\n";
    bool good = read_whole_file(self->facility_file, &before, &reason);
    std::istringstream lines(before.value_or(""));
    // All other lines are kept, and several "system" lines become one.
    for (std::string line; std::getline(lines, line);)
        if (!line.starts_with("system "))
            content += line + "\n";
    if (good && content != before) {
        std::error_code ignored; // if this fails, the write fails as well and gives the reason
        std::filesystem::create_directories(std::filesystem::path(self->facility_file).parent_path(),
                                            ignored);
        // Unlike the configuration, this file is read by programs of other users.
        good = replace_file(self->facility_file, content, 0644, nullptr, &reason);
    }
    if (!good)
        self->say("the log facility of starting programs could not be written: " + self->facility_file +
                  ": " + reason);
}

} // namespace

// --- Commits

void server_take_over(server *self, node_tree next, const commit_result &commit) {
    const node_tree before = std::exchange(self->tree, std::move(next));
    if (read_facility(before) != read_facility(self->tree))
        write_facility(self);
    server_show_commits(self);
    send_change_events(self, before, commit);
    server_forget_deleted_groups(self);
    server_forget_deleted_drains(self);
    self->expire_at_ms = 0; // bypasses may have been added
}

namespace {

// Checks that need more than the tree: the present configuration and the addresses of this machine.
bool check_commit(const server *self, const node_tree &next, std::string *out_reason) {
    const std::vector<std::string> bad = find_bad_routers(next, &self->tree, self->local_addresses());
    if (!bad.empty())
        *out_reason = bad.front();
    return bad.empty() && tree_check_change(self->tree, next, out_reason);
}

commit_result refuse_commit(uint32_t code, const std::string &reason) {
    return {code, reason, {}, {}};
}

commit_result prepare_commit(server *self, const std::vector<set_step> &steps, const commit_order &order,
                             node_tree *out_next) {
    // Checked first: with another base, the other errors would be about a configuration that the client has
    // not seen.
    if (order.revision && order.revision != self->tree.revision)
        return refuse_commit(LC_ASSERTION, "The configuration has changed meanwhile (commit " +
                                               std::to_string(self->tree.revision) + "): read it again");
    commit_result result = tree_prepare(self->tree, steps, out_next);
    std::string reason;
    if (result.code != 0)
        return result;
    if (!check_commit(self, *out_next, &reason))
        return refuse_commit(LC_ASSERTION, reason);
    // A commit without changes succeeds even while another one waits, and gets no revision and no file.
    if (out_next->set == self->tree.set && result.renewed.empty()) {
        out_next->revision = self->tree.revision;
        return result;
    }
    // A check-only commit is refused as well: its answer has to be that of the commit.
    if (reason = server_wait_for_confirmation(self); !reason.empty() && !order.ends_wait)
        return refuse_commit(LC_ASSERTION, reason);
    // A commit may have no changes here: setting a node to its default writes it to the file and changes no
    // value.
    const commit_extent extent = {result.changes.size(),
                                  result.changes.empty() ? result.renewed.data() : &result.changes[0].name};
    if (!order.check_only && !server_save(self, *out_next, self->comments, order, extent, &reason))
        return refuse_commit(LC_IO_ERROR, "The configuration could not be saved: " + reason);
    return result;
}

std::string describe_node_count(size_t changes) {
    return std::to_string(changes) + (changes == 1 ? " node" : " nodes");
}

} // namespace

commit_result server_commit(server *self, const std::vector<set_step> &steps, const commit_order &order) {
    node_tree next;
    commit_result result = prepare_commit(self, steps, order, &next);
    if (order.check_only) {
        if (result.code == 0)
            result.message = describe_node_count(result.changes.size()) + " would change";
        return result;
    }
    if (result.code != 0) {
        self->say("commit of " + order.who + " refused: " + result.message);
        return result;
    }
    self->say("commit " + std::to_string(next.revision) + " of " + order.who + ": " +
              std::to_string(result.changes.size()) + " nodes changed");
    server_take_over(self, std::move(next), result);
    return result;
}

// --- Bypasses with a time

namespace {

// While there is a bypass with a time, the clock is read at least this often, because it may be set.
constexpr int64_t CLOCK_LOOK_MS = 60000;

} // namespace

int64_t server_expire_bypasses(server *self) {
    static const node_name pattern = parsed_name(NODE_BYPASS_CONFIG "/*/until");
    static const node_name root = parsed_name(NODE_BYPASS_CONFIG);
    const int64_t now = self->now_ms();
    // The walk below is only made when it can find something.
    if (self->expire_at_ms < 0 || now < self->expire_at_ms)
        return self->expire_at_ms;
    const int64_t clock = self->clock_s();
    std::vector<set_step> over;
    int64_t wait_ms = -1;
    for (auto at = self->tree.nodes.upper_bound(root);
         at != self->tree.nodes.end() && at->first.is_under(root); ++at) {
        // 0 stands for a node that is not a time as well as for a bypass without an end.
        const int64_t until = matches_pattern(pattern, at->first) ? std::stoll(at->second.text) : 0;
        if (until != 0 && until <= clock)
            // The whole bypass is removed, not only its `until`: without that it would last forever.
            over.push_back(
                {set_kind::remove, root.below(at->first.parts[root.parts.size()]).text(), bn_type_none, ""});
        else if (until != 0)
            wait_ms = std::min(wait_ms < 0 ? CLOCK_LOOK_MS : wait_ms, (until - clock) * 1000);
    }
    if (!over.empty() &&
        server_commit(self, over,
                      {"mgmtd (bypasses whose time is over)", "mgmtd", "bypasses whose time is over"})
                .code != 0)
        wait_ms = CLOCK_LOOK_MS; // refused, perhaps because the disk is full: try again later
    // A successful commit has set the time to 0 meanwhile. All remaining bypasses have been examined already.
    return self->expire_at_ms = wait_ms < 0 ? -1 : now + wait_ms;
}

// --- The configuration file

namespace {

void append_complaints(const server *self, const config_text &text, const std::vector<std::string> &reasons,
                       std::string *out) {
    for (const std::string &reason : reasons)
        *out += config_complaint(self->file.path, text.lines, reason);
}

} // namespace

bool server_load(server *self, std::string *out_errors, std::string *out_warnings) {
    config_text text;
    const bool good = config_load(&self->file, &text);
    *out_errors = text.errors;
    if (good)
        // At startup these are only warnings: the address of an interface may have changed since the commit,
        // and mgmtd has to start all the same.
        append_complaints(self, text, find_bad_routers(text.tree, nullptr, self->local_addresses()),
                          out_warnings);
    // Taken over in spite of errors: the caller ends the program then.
    self->tree = std::move(text.tree);
    self->comments = std::move(text.comments);
    return good;
}

void server_begin(server *self) {
    if (!self->file.path.empty() && remove_unfinished_file(self->file.path))
        self->say("removed the leftover of an interrupted commit beside " + self->file.path);
    // The mode matters even before the first commit, because the file may contain passwords.
    if (const std::string open = config_protect(self->file.path); !open.empty())
        self->say(open);
    write_facility(self);
    server_open_history(self);
}

namespace {

bool read_file_again(server *self, config_text *out, std::string *out_warnings) {
    // config_load takes a missing file for an empty one. Here it may be missing for a moment only, while an
    // editor replaces it, and must not delete everything.
    if (access(self->file.path.c_str(), R_OK) != 0) {
        out->errors = self->file.path + ": " + strerror(errno) + "\n";
        return false;
    }
    // A copy: if the new content is refused, `seen` keeps the old one, and no commit can overwrite the edit.
    config_file file = self->file;
    if (!config_load(&file, out))
        return false;
    const std::vector<local_address> local = self->local_addresses();
    std::string reason;
    // Bad routers are errors where the edit changes a group, and warnings in the others.
    append_complaints(self, *out, find_bad_routers(out->tree, &self->tree, local), &out->errors);
    if (!tree_check_change(self->tree, out->tree, &reason))
        out->errors += config_complaint(file.path, out->lines, reason);
    if (!out->errors.empty())
        return false;
    append_complaints(self, *out, find_bad_routers(out->tree, nullptr, local), out_warnings);
    self->file = std::move(file);
    return true;
}

// Adds the changes to the history as one commit. False with the reason.
bool keep_reload(server *self, const config_text &read, const std::vector<node_change> &changes,
                 std::string *out_reason) {
    if (changes.empty())
        return true;
    if (*out_reason = server_wait_for_confirmation(self); !out_reason->empty())
        return false;
    return server_keep(self, read.tree, read.comments, {"", "", "the configuration file was read again"},
                       {changes.size(), &changes[0].name}, out_reason);
}

} // namespace

void server_reload(server *self) {
    config_text text;
    std::string warnings, reason;
    // Restored if the history refuses the edit, which then counts as unread.
    const config_file before = self->file;
    if (!read_file_again(self, &text, &warnings)) {
        self->say("configuration not read again:\n" + text.errors);
        return;
    }
    const commit_result commit = {0, "", tree_difference(self->tree.nodes, text.tree.nodes), {}};
    // An edit of comments or of the layout is not a commit.
    text.tree.revision = self->tree.revision + (commit.changes.empty() ? 0 : 1);
    if (!keep_reload(self, text, commit.changes, &reason)) {
        self->file = before;
        self->say("configuration not read again: " + reason);
        return;
    }
    self->comments = std::move(text.comments);
    self->say("configuration read again: " + std::to_string(commit.changes.size()) + " nodes changed");
    if (const std::string open = config_protect(self->file.path); !open.empty())
        self->say(open);
    if (!warnings.empty())
        self->say(warnings);
    server_take_over(self, std::move(text.tree), commit);
}
