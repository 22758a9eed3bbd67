// The commands about nodes: "get", "walk", "set", "delete", "alarms", and the shell's completion.
#include <cstdio>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/connection.h"
#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_gather.h"
#include "runtime/common.h"

// --- get and walk

namespace {
ctl_failure describe_missing(connection *mgmtd, const std::string &text) {
    node_name name;
    const schema_row *row = parse_node_name(text, &name) ? find_schema_row(name) : nullptr;
    return {CTL_NOT_FOUND, text, row && !row->instance ? "is not set" : "there is no such node",
            hint_for_missing(mgmtd->asker(), text), LC_NOT_FOUND};
}
} // namespace

int ctl_get(const ctl_options &options, const std::vector<std::string> &names) {
    connection mgmtd(options);
    if (!mgmtd.session)
        return mgmtd.code;
    int code = CTL_OK;
    ctl_json nodes = ctl_json::array();
    for (const std::string &name : names) {
        ctl_reply reply;
        if (!mgmtd.ask(ctl_walk::node, name, &reply))
            return mgmtd.lost();
        if (reply.code == 0 && !reply.bindings.empty()) {
            const ctl_binding &binding = reply.bindings[0];
            nodes.push_back(json_node(binding, options.secrets));
            if (!options.json)
                write_output(names.size() == 1 ? shown_value(binding, options.secrets) + "\n"
                                               : text_node(binding, options.secrets));
            continue;
        }
        const ctl_failure failure =
            reply.code == 0 ? describe_missing(&mgmtd, name)
                            : ctl_failure{exit_of(reply.code), name, reply.message, "", reply.code};
        nodes.push_back(json_failure(failure));
        if (!options.json)
            (void)tell_failure(options, failure);
        // The remaining names are tried all the same; the exit code is that of the first failure.
        code = code == CTL_OK ? failure.exit : code;
    }
    if (options.json)
        write_output(json_line(nodes));
    return code;
}

int ctl_walk_nodes(const ctl_options &options, const std::string &name, ctl_walk how) {
    connection mgmtd(options);
    if (!mgmtd.session)
        return mgmtd.code;
    std::vector<ctl_binding> found;
    // The root of all names is not a node, and mgmtd has no query for a walk of it.
    for (const std::string &root :
         name == "/" ? std::vector<std::string>{"/logging", "/qv"} : std::vector<std::string>{name}) {
        ctl_reply reply;
        node_name parsed;
        if (parse_node_name(root, &parsed) ? !query_walk(mgmtd.asker(), how, parsed, &reply)
                                           : !mgmtd.ask(how, root, &reply))
            return mgmtd.lost();
        if (reply.code != 0)
            return tell_failure(options, {exit_of(reply.code), root, reply.message, "", reply.code});
        if (how != ctl_walk::children && !add_appliances(mgmtd.asker(), root, &reply.bindings))
            return mgmtd.lost();
        found.insert(found.end(), reply.bindings.begin(), reply.bindings.end());
    }
    if (found.empty())
        return tell_failure(
            options, {CTL_NOT_FOUND, name,
                      how == ctl_walk::children ? "no node is directly below" : "there is nothing below",
                      hint_for_missing(mgmtd.asker(), name), LC_NOT_FOUND});
    ctl_json nodes = ctl_json::array();
    for (const ctl_binding &binding : found) {
        if (options.json)
            nodes.push_back(json_node(binding, options.secrets));
        else
            write_output(text_node(binding, options.secrets));
    }
    if (options.json)
        write_output(json_line(nodes));
    return CTL_OK;
}

// --- set and delete

namespace {
int refused_change(const ctl_options &options, connection *mgmtd, const ctl_reply &reply,
                   const std::vector<ctl_change_item> &items) {
    ctl_failure failure = {exit_of(reply.code), "", reply.message, "", reply.code};
    // The text of a refusal begins with the name of the node.
    for (const ctl_change_item &item : items)
        if (reply.message.starts_with(item.binding.name + ": "))
            failure.node = item.binding.name;
    if (!failure.node.empty())
        failure.error.erase(0, failure.node.size() + 2);
    if (reply.code == LC_NOT_FOUND || reply.code == LC_BAD_PATH)
        failure.hint = hint_for_unchangeable(mgmtd->asker(), failure.node);
    return tell_failure(options, failure);
}

// One commit.
int commit_change(const ctl_options &options, const std::vector<ctl_change_item> &items) {
    connection mgmtd(options);
    if (!mgmtd.session)
        return mgmtd.code;
    groups_before before;
    ctl_reply reply;
    // The notes compare with the values before the commit, which cannot be queried afterwards.
    if (!look_before(mgmtd.asker(), items, &before) ||
        !ctl_set(mgmtd.session.get(), items, {options.cause}, &reply, &mgmtd.reason))
        return mgmtd.lost();
    if (reply.code != 0)
        return refused_change(options, &mgmtd, reply, items);
    const change_notes changes = notes_of(items, before);
    if (!options.json) {
        for (const std::string &root : changes.created)
            write_output("created " + root + "\n");
        for (const std::string &note : changes.notes)
            fprintf(stderr, "mgmtctl: note: %s\n", note.c_str());
        return CTL_OK;
    }
    ctl_json changed = ctl_json::array();
    for (const ctl_change_item &item : items)
        changed.push_back(item.binding.name);
    write_output(json_line(
        {{"changed", changed}, {"created", changes.created}, {"notes", changes.notes}, {"exit", 0}}));
    return CTL_OK;
}
} // namespace

int ctl_change_nodes(const ctl_options &options, const std::vector<std::string> &words, bool existing) {
    std::vector<ctl_change_item> items;
    const std::string wrong =
        parse_assignments(words, existing ? ctl_change::modify : ctl_change::create, &items);
    if (!wrong.empty())
        return tell_failure(options, {CTL_USAGE, "", wrong, "", 0});
    return commit_change(options, items);
}

int ctl_delete(const ctl_options &options, const std::vector<std::string> &names) {
    std::vector<ctl_change_item> items;
    items.reserve(names.size());
    for (const std::string &name : names)
        items.push_back({ctl_change::remove, {name, "", ""}});
    return commit_change(options, items);
}

// --- alarms and completion

namespace {
// Since when wccpd has been gone; empty: unknown.
std::string absence_of(const snapshot &shown) {
    const auto known = shown.processes.find("wccpd");
    return known == shown.processes.end() || known->second.running ? "" : known->second.since;
}

// Adds the causes of the alarms of groups. A wccpd that is gone or hangs raises no alarms; this adds one for
// it.
bool explain_alarms(connection *mgmtd, std::vector<ctl_alarm> *inout, bool *out_known) {
    snapshot_limits limits;
    if (inout->empty())
        limits.queries = 0; // of groups
    const snapshot shown = gather_snapshot(
        [mgmtd](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason) {
            const bool answered = mgmtd->ask(walk, name, out);
            *out_reason = mgmtd->reason;
            return answered;
        },
        limits);
    const std::vector<reason> reasons = reasons_of(shown);
    for (ctl_alarm &alarm : *inout)
        for (const snapshot_alarm &each : shown.alarms) {
            const reason *cause = alarm_reason(reasons, each.group, each.name, each.source);
            if (cause && alarm.source == each.source && alarm.name == each.name) {
                alarm.reason = cause->code;
                alarm.cause =
                    (each.group < 0 ? "" : "group " + std::to_string(each.group) + ": ") + cause->cause;
            }
        }
    *out_known = shown.wccpd == wccpd_condition::running;
    for (const reason &each : reasons)
        if (each.code.starts_with("wccpd-"))
            inout->push_back(
                {"0", "wccpd", each.code, each.cause, absence_of(shown), "", each.code, each.cause});
    return shown.unreachable.empty();
}
} // namespace

int ctl_alarms(const ctl_options &options, bool check) {
    connection mgmtd(options);
    if (!mgmtd.session)
        return mgmtd.code;
    ctl_reply reply;
    if (!mgmtd.ask(ctl_walk::subtree, NODE_ALARMS_RAISED, &reply))
        return mgmtd.lost();
    if (reply.code != 0)
        return tell_failure(options, {exit_of(reply.code), "", reply.message, "", reply.code});
    std::vector<ctl_alarm> active_alarms = alarms_of(reply.bindings);
    bool known = false;
    if (!explain_alarms(&mgmtd, &active_alarms, &known))
        return mgmtd.lost();
    write_output(options.json ? json_line(json_alarms(active_alarms)) : text_alarms(active_alarms));
    if (!known)
        return CTL_UNREACHABLE;
    return check && !active_alarms.empty() ? CTL_ALARM : CTL_OK;
}

// Prints nothing but completions, even on failure: the shell calls it while somebody types.
int ctl_complete(const std::string &word) {
    std::string reason;
    // Without a session the names of the schema are completed all the same.
    const ctl_held_session session(ctl_open(1000, &reason));
    const ctl_ask ask = [&](ctl_walk walk, const std::string &name, ctl_reply *out) {
        return session && ctl_query(session.get(), walk, name, out, &reason);
    };
    for (const std::string &candidate : complete_node_name(ask, word))
        write_output(candidate + "\n");
    return CTL_OK;
}
