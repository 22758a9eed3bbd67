// What mgmtctl prints.
//
// For people a node is a line "NAME = VALUE", and a query for a single node prints its value only. For
// scripts all output is JSON, in which numbers are numbers. The keys are documented in docs/mgmtctl.md and
// don't change.
//
// Nothing here ends the program: main detects at the end that nobody reads standard output any more.
#include "peers/mgmtctl/render.h"

#include <algorithm>
#include <cstdio>

#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/schema.h"
#include "peers/nodes/secrets.h"
#include "runtime/common.h"

namespace {
// Values come from other machines: on a terminal they must not act as control sequences.
std::string without_controls(std::string text) {
    for (char &c : text)
        if ((static_cast<unsigned char>(c) < 0x20 && c != '\n' && c != '\t') || c == 0x7f)
            c = '?';
    return text;
}
} // namespace

void write_output(const std::string &text) {
    static const bool terminal = isatty(STDOUT_FILENO);
    const std::string &shown = terminal ? without_controls(text) : text;
    (void)fwrite(shown.data(), 1, shown.size(), stdout);
}

std::string json_line(const ctl_json &value) {
    return json_text(value) + "\n";
}

// --- Nodes

std::string shown_value(const ctl_binding &binding, bool secrets) {
    return secrets ? binding.value : hidden_value(binding.name, binding.value);
}

ctl_json json_value(const ctl_binding &binding) {
    uint32_t type = bn_type_str;
    const std::string &text = binding.value;
    (void)type_named(binding.type, &type);
    switch (type) {
    case bn_type_none:
        return nullptr;
    case bn_type_bool:
        return text == "true" ? ctl_json(true) : text == "false" ? ctl_json(false) : ctl_json(text);
    default:
        break;
    }
    if (!bn_type_numeric(type))
        return text;
    ctl_json number;
    return parse_json(text, &number) && number.is_number() ? number : ctl_json(text);
}

ctl_json json_node(const ctl_binding &binding, bool secrets) {
    ctl_binding shown = binding;
    shown.value = shown_value(binding, secrets);
    return {{"name", binding.name}, {"type", binding.type}, {"value", json_value(shown)}};
}

std::string text_node(const ctl_binding &binding, bool secrets) {
    std::string value = shown_value(binding, secrets);
    while (value.ends_with('\n'))
        value.pop_back();
    std::string out = binding.name + " =";
    if (value.find('\n') == std::string::npos)
        return out + (value.empty() ? "" : " " + value) + "\n";
    out += "\n    ";
    for (const char c : value)
        out += c == '\n' ? std::string("\n    ") : std::string(1, c);
    return out + "\n";
}

// --- Failures

int exit_of(uint32_t code) {
    switch (code) {
    case LC_OK:
        return CTL_OK;
    case LC_NOT_FOUND:
        return CTL_NOT_FOUND;
    case LC_IO_CLOSED: // wccpd has no session, or has not answered in time
    case LC_IO_TIMED_OUT:
        return CTL_UNREACHABLE;
    default:
        return CTL_REFUSED;
    }
}

ctl_json json_failure(const ctl_failure &failure) {
    ctl_json out;
    if (!failure.node.empty())
        out["name"] = failure.node;
    out["error"] = failure.error;
    if (!failure.hint.empty())
        out["hint"] = failure.hint;
    out["code"] = failure.code;
    out["exit"] = failure.exit;
    return out;
}

namespace {
std::string text_failure(const ctl_failure &failure) {
    std::string out = "mgmtctl: ";
    // Many refusals of mgmtd name the node themselves.
    if (!failure.node.empty() && !failure.error.starts_with(failure.node))
        out += failure.node + ": ";
    out += failure.error + "\n";
    if (!failure.hint.empty())
        out += "mgmtctl: " + failure.hint + "\n";
    return out;
}
} // namespace

int tell_failure(const ctl_options &options, const ctl_failure &failure) {
    if (ctl_stop_signal)
        return failure.exit;
    if (options.json)
        write_output(json_line(json_failure(failure)));
    else
        fputs(text_failure(failure).c_str(), stderr);
    return failure.exit;
}

// --- Alarms

std::vector<ctl_alarm> alarms_of(const std::vector<ctl_binding> &bindings) {
    node_name root;
    (void)parse_node_name(NODE_ALARMS_RAISED, &root);
    std::vector<ctl_alarm> out;
    for (const ctl_binding &binding : bindings) {
        node_name name;
        if (!parse_node_name(binding.name, &name) || !name.is_under(root))
            continue;
        const size_t depth = name.parts.size() - root.parts.size();
        // TYPE/SOURCE, and below it what else is known of the alarm.
        if (depth < 2)
            continue;
        const std::string &type = name.parts[root.parts.size()];
        const std::string &source = name.parts[root.parts.size() + 1];
        auto at = std::find_if(out.begin(), out.end(), [&](const ctl_alarm &alarm) {
            return alarm.type == type && alarm.source == source;
        });
        if (at == out.end())
            at = out.insert(at, {type, source, "", "", "", "", "", ""});
        const std::string what = depth == 2 ? "" : name.parts.back();
        if (what.empty())
            at->text = binding.value;
        else if (what == "name")
            at->name = binding.value;
        else if (what == "since")
            at->since = binding.value;
        else if (what == "reporter")
            at->reporter = binding.value;
    }
    return out;
}

ctl_json json_alarms(const std::vector<ctl_alarm> &alarms) {
    ctl_json out = ctl_json::array();
    for (const ctl_alarm &alarm : alarms)
        out.push_back({{"type", json_value({"", "uint32", alarm.type})},
                       {"name", alarm.name},
                       {"source", alarm.source},
                       {"text", alarm.text},
                       {"since", alarm.since},
                       {"reporter", alarm.reporter},
                       {"reason", alarm.reason.empty() ? ctl_json(nullptr) : ctl_json(alarm.reason)},
                       {"cause", alarm.cause.empty() ? ctl_json(nullptr) : ctl_json(alarm.cause)}});
    return out;
}

std::string text_alarms(const std::vector<ctl_alarm> &alarms) {
    if (alarms.empty())
        return "no alarm is active\n";
    size_t times = 0, names = 0, sources = 0;
    for (const ctl_alarm &alarm : alarms) {
        times = std::max(times, alarm.since.size());
        names = std::max(names, alarm.name.size());
        sources = std::max(sources, alarm.source.size());
    }
    std::string out;
    for (const ctl_alarm &alarm : alarms)
        out += alarm.since + std::string(times - alarm.since.size() + 2, ' ') + alarm.name +
               std::string(names - alarm.name.size() + 2, ' ') + alarm.source +
               std::string(sources - alarm.source.size() + 2, ' ') +
               (alarm.cause.empty() ? alarm.text : alarm.cause) + "\n";
    return out;
}
