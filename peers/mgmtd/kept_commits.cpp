// How the server adds commits to the history, and the nodes that show them:
//
//   /mgmtd/config/state/text                     the text of the configuration file
//   /mgmtd/config/state/commit/N                 its number; below it time, user, cause, changes, what
//   /mgmtd/config/state/commit/N/text            the text of the configuration after it
//   /mgmtd/config/state/commit/N/confirm_by      only while it waits to be confirmed, as returns_to
//
// The texts are made when they are queried by name. Walks leave them out.
//
// Only the last commit can wait to be confirmed, because no other is accepted meanwhile. When its time is
// over, the configuration before it is restored by a new commit. The time is measured by the monotonic clock.
// Across a restart of mgmtd only the wall clock remains; a wall clock that was set back cannot make the time
// longer than was requested.
#include <algorithm>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "peers/nodes/secrets.h"

namespace {

constexpr int64_t RETRY_MS = 60000; // after a commit could not be undone, for example on a full disk

// The commit that waits to be confirmed; null: none.
const history_entry *waiting_commit(const server *self) {
    if (self->kept.entries.empty())
        return nullptr;
    const history_entry &last = self->kept.entries.back();
    // The numbers differ if a later commit could not be kept. The configuration to return from is gone then.
    return last.returns_to != 0 && last.number == self->tree.revision ? &last : nullptr;
}

} // namespace

// --- Nodes

void server_show_commits(server *self) {
    static const node_name root = parsed_name(NODE_COMMITS);
    const auto number = [](uint64_t value) { return node_value{bn_type_uint32, std::to_string(value)}; };
    const auto clock = [](int64_t value) { return node_value{bn_type_uint64, std::to_string(value)}; };
    server_remove_report(self, root);
    for (const history_entry &entry : self->kept.entries) {
        const node_name name = root.below(std::to_string(entry.number));
        self->state[name] = number(entry.number);
        self->state[name.below("time")] = clock(entry.time_s);
        self->state[name.below("user")] = {bn_type_str, entry.user};
        self->state[name.below("cause")] = {bn_type_str, entry.cause};
        self->state[name.below("changes")] = number(entry.changes);
        self->state[name.below("what")] = {bn_type_str, entry.what};
        if (&entry != waiting_commit(self))
            continue;
        self->state[name.below("confirm_by")] = clock(entry.confirm_by_s);
        self->state[name.below("returns_to")] = number(entry.returns_to);
    }
}

namespace {

std::string hidden_text(node_tree tree) {
    hide_secrets(&tree.set);
    return config_format(tree, {});
}

bool kept_text(const server *self, const node_name &name, bool hide, std::string *out) {
    std::string number, reason;
    config_text text;
    if (!canonical_text(bn_type_uint32, name.parts[name.parts.size() - 2], &number) ||
        !history_text(self->kept, static_cast<uint32_t>(std::stoul(number)), out, &reason))
        return false;
    if (!hide)
        return true;
    // Passwords can only be found in the nodes, so that the text is parsed and written again. If that fails,
    // the text is not shown at all.
    const bool good = config_parse_part(*out, "", &text);
    *out = hidden_text(text.tree);
    return good;
}

} // namespace

bool server_config_text(const server *self, const node_name &name, bool hide, node_value *out) {
    static const node_name present = parsed_name(NODE_CONFIG_TEXT),
                           kept = parsed_name(NODE_COMMITS "/*/text");
    *out = {bn_type_str, ""};
    if (matches_pattern(kept, name))
        return kept_text(self, name, hide, &out->text);
    if (!(name == present)) // checked first: every node of every query is looked up here, and the text is
                            // slow to make
        return false;
    out->text = hide ? hidden_text(self->tree) : config_format(self->tree, self->comments);
    return true;
}

// --- Keeping

namespace {

history_entry make_entry(const server *self, uint32_t number, const commit_order &order,
                         commit_extent extent) {
    history_entry entry;
    entry.number = number;
    entry.time_s = self->clock_s();
    entry.user = order.user;
    entry.cause = order.cause;
    entry.changes = static_cast<uint32_t>(extent.changes);
    entry.what = extent.first ? extent.first->text() : "";
    if (order.confirm_minutes) {
        entry.returns_to = self->tree.revision;
        entry.confirm_by_s = entry.time_s + int64_t{order.confirm_minutes} * 60;
    }
    return entry;
}

} // namespace

bool server_keep(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason) {
    const history_entry entry = make_entry(self, next.revision, order, extent);
    // The same two steps as for a commit of mgmtd: if it is killed in between, the next start finishes the
    // second.
    return history_prepare(self->kept, entry, config_format(next, comments), out_reason) &&
           history_finish(&self->kept, entry, out_reason);
}

namespace {

// Adds the present configuration to the history if it is missing there: every commit can be undone.
bool keep_present(server *self, const char *cause, std::string *out_reason) {
    if (self->kept.directory.empty() || history_find(self->kept, self->tree.revision))
        return true;
    return server_keep(self, self->tree, self->comments, {"", "", cause}, {}, out_reason);
}

} // namespace

bool server_save(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason) {
    if (self->file.path.empty())
        return true;
    const history_entry entry = make_entry(self, next.revision, order, extent);
    // The history may lack the present configuration, for example because the disk was full at startup.
    if (!keep_present(self, "found", out_reason) ||
        !history_prepare(self->kept, entry, config_format(next, comments), out_reason))
        return false;
    if (!config_save(&self->file, next, comments, out_reason)) {
        history_abandon(self->kept);
        return false;
    }
    // The configuration file has been replaced. Whatever fails from here on, the commit is made.
    if (std::string reason; !history_finish(&self->kept, entry, &reason))
        self->say("commit " + std::to_string(entry.number) + " is not kept: " + reason);
    // This commit may wait itself, with another time.
    self->return_at_ms = -1;
    return true;
}

// If the configuration at the start is not that of the last commit, it becomes a commit.
void server_open_history(server *self) {
    if (self->file.path.empty())
        return;
    self->kept.directory = self->file.path + ".history";
    history_open(&self->kept, self->file.seen.value_or(""), self->say);
    std::string text, reason;
    config_text last;
    if (!self->kept.entries.empty()) {
        // The numbers continue. If the file was edited while mgmtd did not run, the edit is the next commit.
        self->tree.revision = self->kept.entries.back().number;
        if (!history_text(self->kept, self->tree.revision, &text, &reason) ||
            !config_parse(text, "", &last) || last.tree.set != self->tree.set)
            self->tree.revision++;
    }
    if (!keep_present(self, "found at the start", &reason))
        self->say("the configuration is not kept in the history: " + reason);
    server_show_commits(self);
}

// --- Confirmation

namespace {

std::string clock_text(int64_t time_s) {
    char text[32];
    const time_t at = time_s;
    tm broken{};
    localtime_r(&at, &broken);
    return {text, strftime(text, sizeof text, "%F %T", &broken)};
}

} // namespace

std::string server_wait_for_confirmation(const server *self) {
    const history_entry *entry = waiting_commit(self);
    return entry ? "commit " + std::to_string(entry->number) + " waits until " +
                       clock_text(entry->confirm_by_s) +
                       " to be confirmed; \"mgmtctl confirm\" keeps it, \"mgmtctl rollback " +
                       std::to_string(entry->returns_to) + "\" undoes it"
                 : "";
}

commit_result server_confirm(server *self, const std::string &who) {
    const history_entry *entry = waiting_commit(self);
    std::string reason;
    if (!entry)
        return {LC_NOT_FOUND, "No commit waits to be confirmed", {}, {}};
    const std::string number = std::to_string(entry->number);
    if (!history_confirm(&self->kept, &reason)) {
        self->say("commit " + number + " is not confirmed: " + reason);
        return {LC_IO_ERROR, "The confirmation could not be saved: " + reason, {}, {}};
    }
    self->say("commit " + number + " confirmed by " + who);
    server_show_commits(self);
    return {0, "commit " + number, {}, {}};
}

namespace {

// Restores the configuration before the commit. It has been in force and is not checked again as a change:
// the present state of the machine must not prevent the return.
bool return_to(server *self, const history_entry &entry, std::string *out_reason) {
    const commit_order order = {"mgmtd", "mgmtd",
                                "return to commit " + std::to_string(entry.returns_to) + ": commit " +
                                    std::to_string(entry.number) + " was not confirmed"};
    std::string content;
    config_text text;
    if (!history_text(self->kept, entry.returns_to, &content, out_reason))
        return false;
    if (!config_parse(content, "commit " + std::to_string(entry.returns_to), &text)) {
        *out_reason = text.errors;
        return false;
    }
    const commit_result commit = {0, "", tree_difference(self->tree.nodes, text.tree.nodes), {}};
    text.tree.revision = self->tree.revision + 1;
    if (!server_save(self, text.tree, text.comments, order,
                     {commit.changes.size(), commit.changes.empty() ? nullptr : &commit.changes[0].name},
                     out_reason))
        return false;
    self->say(order.cause);
    self->comments = std::move(text.comments);
    server_take_over(self, std::move(text.tree), commit);
    return true;
}

} // namespace

int64_t server_return_unconfirmed(server *self) {
    const history_entry *waiting = waiting_commit(self);
    if (!waiting)
        return self->return_at_ms = -1;
    // A copy: the commit that undoes it is appended to the vector that `waiting` points into.
    const history_entry entry = *waiting;
    const int64_t now = self->now_ms();
    if (self->return_at_ms < 0) {
        // Computed once after the commit or a restart. From then on changes of the wall clock have no effect.
        const int64_t left = entry.confirm_by_s - self->clock_s(), most = entry.confirm_by_s - entry.time_s;
        self->return_at_ms = now + std::clamp<int64_t>(left, 0, std::max<int64_t>(most, 0)) * 1000;
    }
    if (now < self->return_at_ms)
        return self->return_at_ms;
    std::string reason;
    if (return_to(self, entry, &reason))
        return -1;
    self->say("commit " + std::to_string(entry.number) +
              " was not confirmed, and can't be undone yet: " + reason);
    return self->return_at_ms = now + RETRY_MS;
}
