// A watch subscribes to all of mgmtd's events, and prints each as a line or as JSON as soon as it arrives.
//
// A change event carries its changes as numbered entries of several bindings each (kind, name, value after
// and before). They arrive sorted by entry, and are printed in that order.
//
// With names, only changes of these nodes are watched. The wait ends once a second to check whether anybody
// still reads the output; otherwise, without an event, that would go unnoticed for a long time.
#include "peers/mgmtctl/watch.h"

#include <cstdio>
#include <ctime>
#include <map>

#include <poll.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/show_model.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/schema.h"

namespace {
constexpr int64_t LOOK_MS = 1000;

struct change_entry {
    std::string kind, name;
    ctl_binding before, after; // an empty type: there is no such value
};
// The name of an event in JSON, and the words of its line.
struct event_row {
    const char *event, *name, *words;
    ctl_json (*json)(const event_row &row, const ctl_event &event);
    std::string (*text)(const event_row &row, const ctl_event &event);
};

std::string value_of(const ctl_event &event, const char *name) {
    for (const ctl_binding &binding : event.bindings)
        if (binding.name == name)
            return binding.value;
    return "";
}

std::vector<change_entry> changes_of(const ctl_event &event) {
    std::map<node_name, change_entry> entries;
    for (const ctl_binding &binding : event.bindings) {
        node_name name;
        // The names are EVENT_CHANGES, which has three parts, the number, and what the binding is.
        if (!parse_node_name(binding.name, &name) || name.parts.size() < 4)
            continue;
        const std::string what = name.parts.size() == 4 ? "" : name.parts[4];
        name.parts.resize(4);
        change_entry &entry = entries[name];
        if (what == "change_type")
            entry.kind = binding.value;
        else if (what == "name")
            entry.name = binding.value;
        else if (what == "new_attribs")
            entry.after = binding;
        else if (what == "prev_attribs")
            entry.before = binding;
    }
    std::vector<change_entry> out;
    for (auto &[number, entry] : entries) {
        entry.before.name = entry.after.name = entry.name; // a secret is recognised by its name
        out.push_back(std::move(entry));
    }
    return out;
}

// --- Reports

ctl_json json_number(const std::string &text) {
    return json_value({"", "int64", text});
}

ctl_json alarm_json(const event_row &row, const ctl_event &event) {
    const std::string type = value_of(event, "alarm_type");
    return {{"event", row.name},
            {"type", json_number(type)},
            {"name", alarm_name(type)},
            {"source", value_of(event, "param_3")},
            {"text", value_of(event, "comment")}};
}
std::string alarm_text(const event_row &row, const ctl_event &event) {
    return std::string(row.words) + value_of(event, "param_3") + " " + value_of(event, "comment");
}

ctl_json role_json(const event_row &row, const ctl_event &event) {
    return {{"event", row.name},
            {"group", json_number(value_of(event, "group"))},
            {"role", role_name(value_of(event, "role"))},
            {"code", json_number(value_of(event, "code"))}};
}
std::string role_text(const event_row &row, const ctl_event &event) {
    return row.words + value_of(event, "group") + ": " + role_name(value_of(event, "role"));
}

ctl_json group_json(const event_row &row, const ctl_event &event) {
    return {{"event", row.name}, {"group", json_number(value_of(event, "group"))}};
}
std::string group_text(const event_row &row, const ctl_event &event) {
    return "group " + value_of(event, "group") + row.words;
}

std::string reason_of(const ctl_event &event) {
    return clean_text(value_of(event, "reason"), 255);
}
std::string with_reason(const char *sign, const std::string &reason) {
    return reason.empty() ? "" : sign + reason;
}

ctl_json leave_json(const event_row &row, const ctl_event &event) {
    ctl_json out = group_json(row, event);
    out["reason"] = reason_of(event);
    return out;
}
std::string leave_text(const event_row &row, const ctl_event &event) {
    return group_text(row, event) + with_reason(": ", reason_of(event));
}

// The event has the reason of the last failed check, even when the proxy is up again.
ctl_json proxy_json(const event_row &row, const ctl_event &event) {
    const bool up = value_of(event, "up") == "true";
    ctl_json out = group_json(row, event);
    out["proxy"] = up ? "up" : "down";
    out["reason"] = up ? ctl_json(nullptr) : ctl_json(reason_of(event));
    return out;
}
std::string proxy_text(const event_row &row, const ctl_event &event) {
    const std::string subject = row.words + value_of(event, "group");
    return value_of(event, "up") == "true" ? subject + ": up"
                                           : subject + ": down" + with_reason(", ", reason_of(event));
}

ctl_json weight_json(const event_row &row, const ctl_event &event) {
    ctl_json out = group_json(row, event);
    out["percent"] = json_number(value_of(event, "percent"));
    return out;
}
std::string weight_text(const event_row &row, const ctl_event &event) {
    return group_text(row, event) + value_of(event, "percent") + " % of its weight";
}

ctl_json drain_json(const event_row &row, const ctl_event &event) {
    const std::string flows = value_of(event, "flows");
    ctl_json out = group_json(row, event);
    out["state"] = clean_text(value_of(event, "state"), 15);
    out["flows"] = flows.empty() ? ctl_json(nullptr) : json_number(flows);
    return out;
}
std::string drain_text(const event_row &row, const ctl_event &event) {
    const std::string flows = value_of(event, "flows");
    return row.words + value_of(event, "group") + ": " + clean_text(value_of(event, "state"), 15) +
           (flows.empty() ? "" : ", " + flows + " flows left");
}

std::string process_of(const ctl_event &event) {
    return event.bindings.empty() ? "" : event.bindings[0].value;
}
ctl_json process_json(const event_row &row, const ctl_event &event) {
    return {{"event", row.name}, {"process", process_of(event)}};
}
std::string process_text(const event_row &row, const ctl_event &event) {
    return "process " + process_of(event) + row.words;
}

ctl_json plain_json(const event_row &row, const ctl_event &) {
    return {{"event", row.name}};
}
std::string plain_text(const event_row &row, const ctl_event &) {
    return row.words;
}

const event_row rows[] = {
    {EVENT_RAISE_ALARM, "alarm_raised", "alarm raised: ", alarm_json, alarm_text},
    {EVENT_CLEAR_ALARM, "alarm_cleared", "alarm cleared: ", alarm_json, alarm_text},
    {EVENT_ROLE_CHANGE, "role", "role of group ", role_json, role_text},
    {EVENT_PROXY_CHANGE, "proxy", "proxy of group ", proxy_json, proxy_text},
    {EVENT_GROUP_LEAVE, "group_leave", " leaves its routers", leave_json, leave_text},
    {EVENT_GROUP_JOIN, "group_join", " joins its routers again", group_json, group_text},
    {EVENT_GROUP_WEIGHT, "weight", " announces ", weight_json, weight_text},
    {EVENT_DRAIN, "drain", "drain of group ", drain_json, drain_text},
    {EVENT_PROCESS_CRASH, "process_crash", " crashed", process_json, process_text},
    {EVENT_PROCESS_EXIT, "process_exit", " ended unexpectedly", process_json, process_text},
    {EVENT_PROCESS_TERMINATE, "process_terminate", " was terminated", process_json, process_text},
    {EVENT_TIME_ZONE, "timezone", "the time zone has changed", plain_json, plain_text},
};

const event_row *find_row(const ctl_event &event) {
    for (const event_row &row : rows)
        if (event.name == row.event)
            return &row;
    return nullptr;
}

// --- Events as JSON and as text

ctl_json json_side(const ctl_binding &side, bool secrets) {
    return side.type.empty() ? ctl_json(nullptr) : json_node(side, secrets)["value"];
}
} // namespace

ctl_json json_event(const ctl_event &event, bool secrets) {
    if (event.name == EVENT_CONFIG_CHANGE) {
        ctl_json changes = ctl_json::array();
        for (const change_entry &entry : changes_of(event))
            changes.push_back({{"name", entry.name},
                               {"change", entry.kind},
                               {"type", entry.after.type.empty() ? entry.before.type : entry.after.type},
                               {"before", json_side(entry.before, secrets)},
                               {"after", json_side(entry.after, secrets)}});
        return {{"event", "change"}, {"changes", changes}};
    }
    if (const event_row *row = find_row(event))
        return row->json(*row, event);
    ctl_json bindings = ctl_json::array();
    for (const ctl_binding &binding : event.bindings)
        bindings.push_back(json_node(binding, secrets));
    return {{"event", event.name}, {"bindings", bindings}};
}

std::vector<std::string> text_event(const ctl_event &event, bool secrets) {
    if (event.name == EVENT_CONFIG_CHANGE) {
        std::vector<std::string> out;
        for (const change_entry &entry : changes_of(event)) {
            // As wide as "delete" and "modify".
            std::string line = entry.kind + std::string(entry.kind == "add" ? "    " : " ") + entry.name;
            if (!entry.after.type.empty())
                line += " = " + shown_value(entry.after, secrets);
            if (!entry.before.type.empty())
                line += " (was " + shown_value(entry.before, secrets) + ")";
            out.push_back(line);
        }
        return out;
    }
    const event_row *row = find_row(event);
    return {row ? row->text(*row, event) : "event " + event.name};
}

// --- The command

namespace {
std::vector<std::string> watched_events() {
    std::vector<std::string> out = {EVENT_CONFIG_CHANGE};
    for (const event_row &row : rows)
        out.emplace_back(row.event);
    return out;
}

// A name without a wildcard means the node and all below it.
std::string watch_pattern(const std::string &name) {
    if (name == "/")
        return "/**";
    return name.find('*') != std::string::npos ? name : name + "/**";
}

std::string time_text(const char *format) {
    const time_t now = time(nullptr);
    tm broken{};
    char text[64];
    localtime_r(&now, &broken);
    return {text, strftime(text, sizeof text, format, &broken)};
}

void print_event(const ctl_options &options, const ctl_event &event) {
    if (options.json) {
        ctl_json out = {{"time", time_text("%FT%T%z")}};
        out.update(json_event(event, options.secrets));
        write_output(json_line(out));
    } else {
        const std::string now = time_text("%T ");
        for (const std::string &line : text_event(event, options.secrets))
            write_output(now + line + "\n");
    }
}

bool anybody_reads() {
    pollfd out = {STDOUT_FILENO, 0, 0};
    return fflush(stdout) == 0 && !(poll(&out, 1, 0) == 1 && (out.revents & POLLERR));
}

int follow_events(const ctl_options &options, ctl_session *session, const std::vector<std::string> &names,
                  uint64_t count) {
    std::vector<std::string> patterns;
    for (const std::string &name : names)
        patterns.push_back(watch_pattern(name));
    std::string reason;
    for (const std::string &event : watched_events()) {
        // The first event is the only one that has names.
        if (event != EVENT_CONFIG_CHANGE && !names.empty())
            break;
        if (!ctl_add_interest(session, event, patterns, &reason))
            return tell_failure(options, {CTL_UNREACHABLE, "", reason, "", 0});
    }
    for (uint64_t seen = 0; (count == 0 || seen < count) && !ctl_stop_signal && anybody_reads();) {
        ctl_event event;
        const int got = ctl_next_event(session, LOOK_MS, &event, &reason);
        if (got < 0)
            return tell_failure(options, {CTL_UNREACHABLE, "", reason, "", 0});
        if (got == 0)
            continue;
        print_event(options, event);
        seen++;
    }
    return CTL_OK;
}
} // namespace

int ctl_watch(const ctl_options &options, const std::vector<std::string> &names, uint64_t count) {
    std::string reason;
    for (const std::string &name : names)
        if (node_name parsed; !parse_node_name(watch_pattern(name), &parsed))
            return tell_failure(options, {CTL_USAGE, name, "is not the name of a node", "", 0});
    ctl_session *session = ctl_open(options.timeout_ms, &reason);
    if (!session)
        return tell_failure(options, {CTL_UNREACHABLE, "", reason, "", 0});
    const int code = follow_events(options, session, names, count);
    ctl_close(session);
    return code;
}
