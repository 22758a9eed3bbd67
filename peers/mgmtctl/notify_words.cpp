#include "peers/mgmtctl/notify_words.h"

#include <algorithm>
#include <ctime>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/render.h"
#include "peers/nodes/schema.h"

namespace {

constexpr size_t VALUE_MAX = 255, SOURCE_MAX = 127;

using notify_states = std::map<std::string, notify_state>;

std::string find_value(const ctl_event &event, const char *name) {
    for (const ctl_binding &binding : event.bindings)
        if (binding.name == name)
            return clean_text(binding.value, VALUE_MAX);
    return "";
}

// A group's number as the name of a subject, or "".
std::string group_subject(const std::string &text) {
    const int group = number_of(text, -1);
    return group >= 0 && group <= 255 ? std::to_string(group) : "";
}

std::string alarm_subject(const std::string &type, const std::string &source) {
    return std::to_string(number_of<long>(type, 0)) + " " +
           clean_text(source.empty() ? "-" : source, SOURCE_MAX);
}

// --- Walks

notify_states read_roles(const ctl_reply &reply) {
    notify_states out;
    for (const ctl_binding &binding : reply.bindings)
        if (const std::vector<std::string> parts = parts_below(NODE_ROLES, binding.name); parts.size() == 1)
            if (const std::string group = group_subject(parts[0]); !group.empty())
                out[group] = {clean_text(binding.value, STATE_MAX), ""};
    return out;
}

notify_states read_alarms(const ctl_reply &reply) {
    notify_states out;
    for (const ctl_alarm &alarm : alarms_of(reply.bindings))
        out[alarm_subject(alarm.type, alarm.source)] = {"raised", clean_text(alarm.text, VALUE_MAX)};
    return out;
}

notify_states read_health(const ctl_reply &reply) {
    notify_states out;
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(NODE_INTERCEPT_STATE, binding.name);
        const std::string group = parts.size() == 2 ? group_subject(parts[0]) : "";
        if (group.empty())
            continue;
        if (parts[1] == "proxy")
            out[group].state = clean_text(binding.value, STATE_MAX);
        else if (parts[1] == "proxy_reason")
            out[group].detail = clean_text(binding.value, VALUE_MAX);
    }
    // The reason of a proxy whose state is missing.
    std::erase_if(out, [](const auto &each) { return each.second.state.empty(); });
    return out;
}

// --- Reasons

struct change_words {
    std::string code, cause, next;
};

// The group's main reason, or else any reason, even one that is not a fault. Null: none is known.
const reason *first_reason(const std::vector<reason> &reasons, int group) {
    if (const reason *main = main_reason(reasons, group))
        return main;
    const auto found =
        std::find_if(reasons.begin(), reasons.end(), [&](const reason &each) { return each.group == group; });
    return found == reasons.end() ? nullptr : &*found;
}

// Why roles and alarms of groups are not reported; null: they are.
const reason *find_absence(const std::vector<reason> &reasons) {
    const auto found = std::find_if(reasons.begin(), reasons.end(), [](const reason &each) {
        return each.code == "mgmtd-unreachable" || each.code == "wccpd-absent";
    });
    return found == reasons.end() ? nullptr : &*found;
}

change_words words_of(const reason *why, const std::string &otherwise) {
    return why ? change_words{why->code, why->cause, why->next} : change_words{"", otherwise, ""};
}

change_words explain_change(const notify_change &change, const std::vector<reason> &reasons,
                            const std::string &alarm, const std::string &source) {
    const int group = notify_group(change.subject);
    switch (change.subject.kind) {
    case notify_kind::role:
        // What works needs no reason.
        if (change.state == "ACTIVE")
            return {};
        // Roles also become UNKNOWN when wccpd or mgmtd is gone, which is not the fault of a group.
        return words_of(find_absence(reasons) ? find_absence(reasons) : first_reason(reasons, group), "");
    case notify_kind::alarm:
        // An alarm may have been cleared only because the daemon that raised it is gone.
        return words_of(change.state == "raised" ? alarm_reason(reasons, group, alarm, source)
                                                 : find_absence(reasons),
                        change.detail);
    case notify_kind::health:
        break;
    }
    if (change.state == "up")
        return {};
    // Made from the change itself: the proxy's present state may be newer.
    reason down;
    down.code = "proxy-down";
    down.group = group;
    down.cause = change.detail;
    fill_reason(reason_texts(), &down);
    return words_of(&down, "");
}

} // namespace

bool read_notify_event(const ctl_event &event, notify_subject *out_subject, notify_state *out_state) {
    const std::string group = group_subject(find_value(event, "group"));
    const bool raised = event.name == EVENT_RAISE_ALARM;
    if (event.name == EVENT_ROLE_CHANGE && !group.empty()) {
        *out_subject = {notify_kind::role, group};
        *out_state = {role_name(find_value(event, "role")), ""};
        return true;
    }
    if (event.name == EVENT_PROXY_CHANGE && !group.empty()) {
        *out_subject = {notify_kind::health, group};
        *out_state = {find_value(event, "up") == "true" ? "up" : "down", find_value(event, "reason")};
        return true;
    }
    if (!raised && event.name != EVENT_CLEAR_ALARM)
        return false;
    *out_subject = {notify_kind::alarm,
                    alarm_subject(find_value(event, "alarm_type"), find_value(event, "param_3"))};
    *out_state = {raised ? "raised" : "cleared", find_value(event, "comment")};
    return true;
}

const char *notify_node(notify_kind kind) {
    return kind == notify_kind::role    ? NODE_ROLES
           : kind == notify_kind::alarm ? NODE_ALARMS_RAISED
                                        : NODE_INTERCEPT_STATE;
}

notify_states read_notify_states(notify_kind kind, const ctl_reply &reply) {
    return kind == notify_kind::role    ? read_roles(reply)
           : kind == notify_kind::alarm ? read_alarms(reply)
                                        : read_health(reply);
}

int notify_group(const notify_subject &subject) {
    if (subject.kind != notify_kind::alarm)
        return number_of(subject.name, -1);
    const size_t at = subject.name.rfind(":grp:");
    return at == std::string::npos ? -1 : number_of(subject.name.substr(at + 5), -1);
}

std::vector<std::string> notify_environment(const notify_change &change, const std::vector<reason> &reasons) {
    std::string alarm, source;
    if (change.subject.kind == notify_kind::alarm) {
        const size_t blank = change.subject.name.find(' ');
        alarm = alarm_name(change.subject.name.substr(0, blank));
        source = blank == std::string::npos ? "" : change.subject.name.substr(blank + 1);
    }
    const int group = notify_group(change.subject);
    const change_words words = explain_change(change, reasons, alarm, source);
    char time_text[64] = "";
    const auto at = static_cast<time_t>(change.time);
    if (tm broken{}; localtime_r(&at, &broken))
        (void)!strftime(time_text, sizeof time_text, "%FT%T%z", &broken);
    const std::pair<const char *, std::string> variables[] = {
        {"WCCP_KIND", notify_kind_word(change.subject.kind)},
        {"WCCP_GROUP", group < 0 ? "" : std::to_string(group)},
        {"WCCP_ALARM", alarm},
        {"WCCP_SOURCE", source},
        {"WCCP_STATE", change.state},
        {"WCCP_PREVIOUS", change.previous},
        {"WCCP_REASON", words.code},
        {"WCCP_CAUSE", words.cause},
        {"WCCP_NEXT", words.next},
        {"WCCP_TIME", time_text},
        {"WCCP_MERGED", std::to_string(change.merged)},
    };
    std::vector<std::string> out;
    for (const auto &[name, value] : variables)
        out.push_back(std::string(name) + "=" + clean_text(value, VALUE_MAX));
    return out;
}
