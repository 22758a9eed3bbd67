// Metrics are made of state nodes by a table: each row says which node becomes which sample. What wccpd has
// of a group comes in one text for each group, since thousands of routers would be tens of thousands of
// nodes.
#include "peers/mgmtctl/metrics.h"

#include <algorithm>
#include <cstring>
#include <map>
#include <sstream>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_model.h"
#include "runtime/common.h"

namespace {

constexpr size_t LABEL_MAX = 200, GROUPS_MAX = 256, LINES_MAX = 400; // of a group's text

// The value of a sample by the text of its node; false: the node gives none.
using metric_value = bool (*)(const std::string &text, std::string *out_value);

struct metric_row {
    const char *node; // "*" are the labels, in the order of `labels`
    const char *labels;
    metric_kind kind;
    const char *family;
    const char *help;
    metric_value value;
};

bool is_count(const std::string &text) {
    return !text.empty() && text.size() <= 20 &&
           std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

bool take_count(const std::string &text, std::string *out) {
    *out = text;
    return is_count(text);
}
bool take_milliseconds(const std::string &text, std::string *out) {
    if (!is_count(text))
        return false;
    const uint64_t ms = number_of<uint64_t>(text, 0);
    char value[40];
    snprintf(value, sizeof value, "%llu.%03u", static_cast<unsigned long long>(ms / 1000),
             static_cast<unsigned>(ms % 1000));
    *out = value;
    return true;
}
bool take_flag(const std::string &text, std::string *out) {
    *out = text == "true" ? "1" : "0";
    return text == "true" || text == "false";
}
bool take_up_or_down(const std::string &text, std::string *out) {
    *out = text == "up" ? "1" : "0";
    return text == "up" || text == "down"; // unknown as yet: no sample
}

constexpr metric_row rows[] = {
    {NODE_PLANE_STATE "/own", "", metric_kind::counter, "wccp_own_packets",
     "Redirected packets of the appliance itself, given back.", take_count},
    {NODE_PLANE_STATE "/clamped", "", metric_kind::counter, "wccp_clamped_syn_acks",
     "SYN-ACKs whose segment size was lowered to fit the tunnel.", take_count},
    {NODE_PLANE_STATE "/refused/*", "reason", metric_kind::counter, "wccp_gre_refused_packets",
     "GRE packets that belong to no tunnel, by the reason of their refusal.", take_count},
    {NODE_PLANE_STATE "/refused_source/*", "source", metric_kind::counter, "wccp_gre_refused_source_packets",
     "GRE packets from addresses that are no routers of ours.", take_count},
    {NODE_TUNNEL_STATE "/*/packets_in", "tunnel", metric_kind::counter, "wccp_tunnel_received_packets",
     "Packets that routers have redirected through the tunnel.", take_count},
    {NODE_TUNNEL_STATE "/*/bytes_in", "tunnel", metric_kind::counter, "wccp_tunnel_received_bytes",
     "Bytes that routers have redirected through the tunnel.", take_count},
    {NODE_TUNNEL_STATE "/*/packets_out", "tunnel", metric_kind::counter, "wccp_tunnel_returned_packets",
     "Packets given back through the tunnel.", take_count},
    {NODE_TUNNEL_STATE "/*/bytes_out", "tunnel", metric_kind::counter, "wccp_tunnel_returned_bytes",
     "Bytes given back through the tunnel.", take_count},
    {NODE_TUNNEL_STATE "/*/fragments", "tunnel", metric_kind::counter, "wccp_tunnel_fragments",
     "Fragments of GRE packets that came in.", take_count},
    {NODE_TUNNEL_STATE "/*/refused/*", "tunnel reason", metric_kind::counter, "wccp_tunnel_refused_packets",
     "GRE packets of the tunnel's router that were refused, by reason.", take_count},
    {NODE_INTERCEPT_STATE "/*/proxy", "group", metric_kind::gauge, "wccp_proxy_up",
     "Whether the proxy of the group's intercept answers its health check.", take_up_or_down},
    {NODE_INTERCEPT_STATE "/*/proxy_ms", "group", metric_kind::gauge, "wccp_proxy_state_seconds",
     "How long the proxy has been in its state.", take_milliseconds},
    {NODE_INTERCEPT_STATE "/*/active", "group", metric_kind::gauge, "wccp_intercept_active",
     "Whether the group's role lets new flows go to the proxy.", take_flag},
    {NODE_INTERCEPT_STATE "/*/left", "group", metric_kind::gauge, "wccp_intercept_left",
     "Whether the group is out of its routers because of its proxy.", take_flag},
    {NODE_INTERCEPT_STATE "/*/flows", "group", metric_kind::gauge, "wccp_intercept_flows",
     "Connections that the proxy serves for the group.", take_count},
};

// --- Samples

struct gathering {
    const ctl_ask &ask;
    std::vector<metric_sample> *out;

    void add(metric_kind kind, const std::string &family, const std::string &help, const std::string &labels,
             const std::string &value) const {
        out->push_back({family, kind, help, labels, value});
    }
    // False: nobody has answered, neither the daemon nor mgmtd.
    bool walk(ctl_walk how, const std::string &root, ctl_reply *reply) const {
        *reply = {};
        node_name name;
        return parse_node_name(root, &name) && query_walk(ask, how, name, reply);
    }
};

void add_label(std::string *inout, const std::string &name, const std::string &value) {
    *inout += (inout->empty() ? "" : ",") + name + "=\"";
    for (const char c : clean_text(value, LABEL_MAX)) {
        if (c == '"' || c == '\\')
            *inout += '\\';
        *inout += c;
    }
    *inout += '"';
}

std::string label(const std::string &name, const std::string &value) {
    std::string out;
    add_label(&out, name, value);
    return out;
}

// The parts of `name` at the places of "*" as labels.
std::string labels_of(const metric_row &row, const node_name &pattern, const node_name &name) {
    std::istringstream words(row.labels);
    std::string out, word;
    for (size_t i = 0; i < pattern.parts.size(); i++)
        if (pattern.parts[i] == "*" && words >> word)
            add_label(&out, word, name.parts[i]);
    return out;
}

// "to_proxy" and "to_proxy_bytes" below `root`, by way.
void add_sorted_sample(const gathering &work, const char *root, const char *about, const char *subject,
                       const node_name &name, const std::string &value) {
    if (name.parts.size() != parsed_name(root).parts.size() + 2 || !is_count(value))
        return;
    std::string way = name.parts.back();
    const bool bytes = way.ends_with("_bytes");
    if (bytes)
        way.resize(way.size() - strlen("_bytes"));
    for (const sorted_way &known : sorted_ways()) {
        if (way != known.word)
            continue;
        std::string labels = label(about, name.parts[name.parts.size() - 2]);
        add_label(&labels, "way", way);
        work.add(metric_kind::counter, std::string("wccp_") + subject + (bytes ? "_bytes" : "_packets"),
                 "What became of redirected packets; the way \"in\" is their sum.", labels, value);
    }
}

void add_node_samples(const gathering &work, const std::vector<ctl_binding> &bindings) {
    static const std::vector<node_name> patterns = [] {
        std::vector<node_name> out;
        for (const metric_row &row : rows)
            out.push_back(parsed_name(row.node));
        return out;
    }();
    for (const ctl_binding &binding : bindings) {
        const node_name name = parsed_name(binding.name);
        std::string value;
        for (size_t i = 0; i < std::size(rows); i++)
            if (matches(patterns[i], name) && rows[i].value(binding.value, &value))
                work.add(rows[i].kind, rows[i].family, rows[i].help, labels_of(rows[i], patterns[i], name),
                         value);
        if (name.is_under(parsed_name(NODE_TUNNEL_STATE)))
            add_sorted_sample(work, NODE_TUNNEL_STATE, "tunnel", "tunnel_sorted", name, binding.value);
        else if (name.is_under(parsed_name(NODE_INTERCEPT_STATE)))
            add_sorted_sample(work, NODE_INTERCEPT_STATE, "group", "intercept", name, binding.value);
    }
}

// What belongs to a tunnel's number: it means something on this appliance only.
void add_tunnel_names(const gathering &work, const std::vector<ctl_binding> &bindings) {
    std::map<std::string, std::map<std::string, std::string>> tunnels;
    for (const ctl_binding &binding : bindings)
        if (const std::vector<std::string> parts = parts_below(NODE_TUNNEL_STATE, binding.name);
            parts.size() == 2)
            tunnels[parts[0]][parts[1]] = binding.value;
    for (auto &[id, nodes] : tunnels) {
        std::string labels = label("tunnel", id);
        add_label(&labels, "router", nodes["remote"]);
        add_label(&labels, "interface", nodes["interface"]);
        work.add(metric_kind::info, "wccp_tunnel", "The ends of a tunnel.", labels, "1");
    }
}

bool gather_tunneld(const gathering &work) {
    std::vector<ctl_binding> all;
    bool running = false;
    for (const char *root : {NODE_PLANE_STATE, NODE_TUNNEL_STATE, NODE_INTERCEPT_STATE}) {
        ctl_reply reply;
        if (!work.walk(ctl_walk::subtree, root, &reply))
            return false;
        running |= reply.code == 0 && root == std::string(NODE_PLANE_STATE) && !reply.bindings.empty();
        if (!running)
            break;
        all.insert(all.end(), reply.bindings.begin(), reply.bindings.end());
    }
    work.add(metric_kind::gauge, "wccp_daemon_up", "Whether the daemon answers.", label("daemon", "tunneld"),
             running ? "1" : "0");
    for (const ctl_binding &binding : all)
        if (binding.name == NODE_PLANE_STATE "/name")
            work.add(metric_kind::info, "wccp_data_plane", "How redirected packets are carried.",
                     label("plane", binding.value), "1");
    add_node_samples(work, all);
    add_tunnel_names(work, all);
    return true;
}

// --- wccpd

// One line of a group's text: the word it begins with, and what becomes of the words after it. "-" is no
// sample, "=NAME" a label, anything else a gauge of that name.
struct line_row {
    const char *word;
    std::vector<const char *> columns;
};
const std::map<std::string, const char *> &group_gauges() {
    static const std::map<std::string, const char *> help = {
        {"wccp_group_active", "Whether the group's role is ACTIVE."},
        {"wccp_group_designated", "Whether this is the designated appliance of the group."},
        {"wccp_group_uptime_seconds", "How long the group has been ACTIVE or BACKUP."},
        {"wccp_group_routers", "Routers that have answered."},
        {"wccp_group_appliances", "Appliances in the view of the routers."},
        {"wccp_group_pending_acks", "Routers that have not acknowledged the table sent last."},
        {"wccp_router_two_way", "Whether the router reports this appliance."},
        {"wccp_router_heard_seconds", "Time since the last I-See-You of the router."},
        {"wccp_router_connected_seconds", "How long the router has been in its state."},
        {"wccp_router_own_buckets", "Buckets or mask values that the router gives this appliance."},
        {"wccp_router_buckets", "Buckets or mask values that the router gives anybody."},
        {"wccp_appliance_weight", "The weight of an appliance as the routers report it."},
        {"wccp_reason_occurrences", "What keeps the group from working, by its code, and how often."},
        {"wccp_reason_last_seconds", "Time since the reason's last occurrence."},
    };
    return help;
}
const std::vector<line_row> &group_lines() {
    static const std::vector<line_row> lines = {
        {"group",
         {"wccp_group_active", "wccp_group_designated", "wccp_group_uptime_seconds", "wccp_group_routers",
          "wccp_group_appliances", "wccp_group_pending_acks"}},
        {"router",
         {"=router", "=address", "wccp_router_two_way", "wccp_router_heard_seconds",
          "wccp_router_connected_seconds", "wccp_router_own_buckets", "wccp_router_buckets"}},
        {"appliance", {"=appliance", "wccp_appliance_weight"}},
        {"reason", {"=reason", "=sender", "wccp_reason_occurrences", "wccp_reason_last_seconds"}},
    };
    return lines;
}

void add_counter_line(const gathering &work, const std::string &group, std::istream &words) {
    std::string name, value;
    if (words >> name >> value && is_count(value) &&
        std::all_of(name.begin(), name.end(), [](char c) { return c == '_' || (c >= 'a' && c <= 'z'); }))
        work.add(metric_kind::counter, "wccp_group_" + name,
                 "The counter " + name + " of the group, as its dump has it.", label("group", group), value);
}

void add_group_line(const gathering &work, const std::string &group, const std::string &line) {
    std::istringstream words(line);
    std::string word;
    if (!(words >> word))
        return;
    if (word == "counter")
        return add_counter_line(work, group, words);
    for (const line_row &row : group_lines()) {
        if (word != row.word)
            continue;
        std::string labels = group.empty() ? "" : label("group", group), value;
        for (const char *column : row.columns) {
            if (!(words >> value))
                return;
            if (column[0] == '=')
                add_label(&labels, column + 1, value);
            else if (is_count(value))
                work.add(metric_kind::gauge, column, group_gauges().at(column), labels, value);
        }
    }
}

bool gather_group(const gathering &work, const std::string &group) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::node, std::string(NODE_GROUP_STATE "/") + group + "/metric/all", &reply))
        return false;
    if (reply.code != 0 || reply.bindings.empty())
        return true; // gone in the meantime
    std::istringstream lines(reply.bindings[0].value);
    std::string line;
    for (size_t count = 0; count < LINES_MAX && std::getline(lines, line); count++)
        add_group_line(work, group, line);
    return true;
}

bool gather_wccpd(const gathering &work) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::node, NODE_WCCPD_VERSION, &reply))
        return false;
    const bool running = reply.code == 0 && !reply.bindings.empty();
    work.add(metric_kind::gauge, "wccp_daemon_up", "Whether the daemon answers.", label("daemon", "wccpd"),
             running ? "1" : "0");
    if (!running)
        return true;
    work.add(metric_kind::info, "wccp_build", "The version of wccpd.",
             label("version", reply.bindings[0].value), "1");
    if (!work.walk(ctl_walk::children, NODE_GROUP_STATE, &reply))
        return false;
    size_t groups = 0;
    for (const ctl_binding &binding : reply.bindings)
        if (const std::vector<std::string> parts = parts_below(NODE_GROUP_STATE, binding.name);
            parts.size() == 1 && groups++ < GROUPS_MAX && !gather_group(work, parts[0]))
            return false;
    return true;
}

// --- mgmtd

bool gather_mgmtd(const gathering &work) {
    ctl_reply reply;
    if (!work.walk(ctl_walk::subtree, NODE_ALARMS_RAISED, &reply))
        return false;
    const std::vector<ctl_alarm> active = alarms_of(reply.bindings);
    work.add(metric_kind::gauge, "wccp_alarms", "Alarms that are active.", "", std::to_string(active.size()));
    for (const ctl_alarm &alarm : active) {
        std::string labels = label("alarm", alarm.name);
        add_label(&labels, "source", alarm.source);
        work.add(metric_kind::gauge, "wccp_alarm_active", "An alarm that is active.", labels, "1");
    }
    if (!work.walk(ctl_walk::subtree, NODE_PROCESSES, &reply))
        return false;
    for (const ctl_binding &binding : reply.bindings)
        if (const std::vector<std::string> parts = parts_below(NODE_PROCESSES, binding.name);
            parts.size() == 2 && parts[1] == "restarts" && is_count(binding.value))
            work.add(metric_kind::counter, "wccp_process_restarts",
                     "How often mgmtd has started the program again.", label("process", parts[0]),
                     binding.value);
    return true;
}

} // namespace

bool gather_metrics(const ctl_ask &ask, std::vector<metric_sample> *out) {
    const gathering work{ask, out};
    const auto say_up = [&](const char *value) {
        work.add(metric_kind::gauge, "wccp_daemon_up", "Whether the daemon answers.",
                 label("daemon", "mgmtd"), value);
    };
    if (gather_mgmtd(work) && gather_wccpd(work) && gather_tunneld(work)) {
        say_up("1");
        return true;
    }
    out->clear();
    say_up("0");
    return false;
}

std::string metrics_text(const std::vector<metric_sample> &samples, metric_format format) {
    const auto suffix = [](metric_kind kind) {
        return kind == metric_kind::counter ? "_total" : kind == metric_kind::info ? "_info" : "";
    };
    std::vector<const metric_sample *> families; // the first of each
    std::map<std::string, std::string> lines;    // of its samples
    for (const metric_sample &sample : samples) {
        const auto [at, is_new] = lines.try_emplace(sample.family);
        if (is_new)
            families.push_back(&sample);
        at->second += sample.family + suffix(sample.kind) +
                      (sample.labels.empty() ? "" : "{" + sample.labels + "}") + " " + sample.value + "\n";
    }
    const bool modern = format == metric_format::openmetrics;
    std::string out;
    for (const metric_sample *first : families) {
        // "info" is a type that readers of the older format refuse.
        const bool bare = modern && first->kind == metric_kind::counter;
        const std::string name = first->family + (bare ? "" : suffix(first->kind));
        const char *kind = first->kind == metric_kind::counter ? "counter" : "gauge";
        out += "# TYPE " + name + " " + kind + "\n";
        for (const char *unit : {"seconds", "bytes"})
            if (modern && first->family.ends_with(std::string("_") + unit))
                out += "# UNIT " + name + " " + unit + "\n";
        out += "# HELP " + name + " " + first->help + "\n" + lines.at(first->family);
    }
    return out + (modern ? "# EOF\n" : "");
}

const char *metrics_content_type(metric_format format) {
    return format == metric_format::openmetrics ? "application/openmetrics-text; version=1.0.0; charset=utf-8"
                                                : "text/plain; version=0.0.4; charset=utf-8";
}
