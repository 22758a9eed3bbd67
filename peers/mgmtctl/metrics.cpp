// Tables turn state nodes into metrics: each row maps a node, or a word of a text, to a sample. wccpd reports
// each group as one text, because thousands of routers would be tens of thousands of nodes, and many groups
// are requested at once.
//
// Samples are written as text immediately: a large appliance has 50,000 of them.
#include "peers/mgmtctl/metrics.h"

#include <algorithm>
#include <charconv>
#include <map>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_model.h"

namespace {

constexpr size_t LABEL_MAX = 200, GROUPS_MAX = 256, LINES_MAX = 400; // of a text
constexpr size_t GROUPS_AT_ONCE = 32; // in one request: the answer is at most 400 KB
constexpr size_t WORDS_MAX = 8;       // of a line
constexpr size_t SAMPLE_MAX = 1024;   // of a sample

// Converts the text of a node to the value of a sample; false: the node has no sample.
using metric_value = bool (*)(const std::string &text, std::string *out_value);

struct metric_row {
    const char *node; // each "*" is one of the family's labels, in their order
    size_t family;
    metric_value value;
};

bool is_count(std::string_view text) {
    return !text.empty() && text.size() <= 20 &&
           std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

bool take_count(const std::string &text, std::string *out) {
    *out = text;
    return is_count(text);
}
// With a decimal point before the last `digits` digits.
template <size_t digits>
bool take_fraction(const std::string &text, std::string *out) {
    // By digits instead of floating point: nothing is rounded, and no locale changes the point.
    *out = text.size() > digits ? text : std::string(digits + 1 - text.size(), '0') + text;
    out->insert(out->size() - digits, ".");
    return is_count(text);
}
bool take_flag(const std::string &text, std::string *out) {
    *out = text == "true" ? "1" : "0";
    return text == "true" || text == "false";
}
bool take_up_or_down(const std::string &text, std::string *out) {
    *out = text == "up" ? "1" : "0";
    return text == "up" || text == "down"; // no sample while it is unknown
}

constexpr metric_row rows[] = {
    {NODE_PROCESSES "/*/restarts", metric_place("wccp_process_restarts"), take_count},
    {NODE_PLANE_STATE "/own", metric_place("wccp_own_packets"), take_count},
    {NODE_PLANE_STATE "/clamped", metric_place("wccp_clamped_syn_acks"), take_count},
    {NODE_PLANE_STATE "/refused/*", metric_place("wccp_gre_refused_packets"), take_count},
    {NODE_PLANE_STATE "/refused_source/*", metric_place("wccp_gre_refused_source_packets"), take_count},
    {NODE_TUNNEL_STATE "/*/packets_in", metric_place("wccp_tunnel_received_packets"), take_count},
    {NODE_TUNNEL_STATE "/*/bytes_in", metric_place("wccp_tunnel_received_bytes"), take_count},
    {NODE_TUNNEL_STATE "/*/packets_out", metric_place("wccp_tunnel_returned_packets"), take_count},
    {NODE_TUNNEL_STATE "/*/bytes_out", metric_place("wccp_tunnel_returned_bytes"), take_count},
    {NODE_TUNNEL_STATE "/*/fragments", metric_place("wccp_tunnel_fragments"), take_count},
    {NODE_TUNNEL_STATE "/*/refused/*", metric_place("wccp_tunnel_refused_packets"), take_count},
    {NODE_INTERCEPT_STATE "/*/proxy", metric_place("wccp_proxy_up"), take_up_or_down},
    {NODE_INTERCEPT_STATE "/*/proxy_ms", metric_place("wccp_proxy_state_seconds"), take_fraction<3>},
    {NODE_INTERCEPT_STATE "/*/active", metric_place("wccp_intercept_active"), take_flag},
    {NODE_INTERCEPT_STATE "/*/left", metric_place("wccp_intercept_left"), take_flag},
    {NODE_INTERCEPT_STATE "/*/overloaded", metric_place("wccp_intercept_overloaded"), take_flag},
    {NODE_INTERCEPT_STATE "/*/weight_percent", metric_place("wccp_intercept_weight_ratio"), take_fraction<2>},
    {NODE_INTERCEPT_STATE "/*/flows", metric_place("wccp_intercept_flows"), take_count},
    {NODE_PROTECTION_STATE "/group/*/covered", metric_place("wccp_protection_covered"), take_flag},
};

// Nodes "to_proxy" and, of some, "to_proxy_bytes", by what became of the packets.
constexpr struct {
    const char *node; // the last "*" is the label "way"
    size_t packets, bytes;
} way_rows[] = {
    {NODE_TUNNEL_STATE "/*/*", metric_place("wccp_tunnel_sorted_packets"),
     metric_place("wccp_tunnel_sorted_bytes")},
    {NODE_INTERCEPT_STATE "/*/*", metric_place("wccp_intercept_packets"),
     metric_place("wccp_intercept_bytes")},
    {NODE_PROTECTION_STATE "/member/*/*", metric_place("wccp_protection_packets"), 0},
};

// --- Samples

struct gathering {
    const metric_source &source;
    metric_lines *out;

    void add(size_t family, std::string_view labels, std::string_view value) const {
        const metric_family &about = metric_families[family];
        std::string *lines = &(*out)[family];
        // Grows in large steps: megabytes are seldom copied, and memory is not touched before it is needed.
        if (lines->capacity() - lines->size() < SAMPLE_MAX)
            lines->reserve(std::max(lines->capacity() * 8, 2 * SAMPLE_MAX));
        lines->append(about.name);
        if (about.kind != metric_kind::gauge)
            lines->append(about.kind == metric_kind::counter ? "_total" : "_info");
        if (!labels.empty())
            lines->append("{").append(labels).append("}");
        lines->append(" ").append(value).append("\n");
    }
    // False: neither a daemon nor mgmtd has answered.
    bool ask(ctl_walk walk, const std::vector<std::string> &names, ctl_reply *reply) const {
        *reply = {};
        return source(walk, names, reply);
    }
};

void add_label(std::string *inout, std::string_view name, std::string_view value) {
    inout->append(inout->empty() ? "" : ",").append(name).append("=\"");
    for (const char c : value.substr(0, LABEL_MAX)) {
        // The format's escapes. A newline cannot occur, because control characters are replaced.
        if (c == '"' || c == '\\')
            *inout += '\\';
        *inout += c < 0x20 || c > 0x7e ? '?' : c;
    }
    *inout += '"';
}

std::string make_label(std::string_view name, std::string_view value) {
    std::string out;
    add_label(&out, name, value);
    return out;
}

// Removes the next word from `inout` and returns it; empty at the end.
std::string_view take_word(std::string_view *inout) {
    inout->remove_prefix(std::min(inout->find_first_not_of(' '), inout->size()));
    const std::string_view word = inout->substr(0, inout->find(' '));
    inout->remove_prefix(word.size());
    return word;
}

// The parts of `name` at the places of "*" as labels.
std::string labels_of(const metric_family &family, const node_name &pattern, const node_name &name) {
    std::string_view words = family.labels;
    std::string out;
    for (size_t i = 0; i < pattern.parts.size(); i++)
        if (pattern.parts[i] == "*")
            add_label(&out, take_word(&words), name.parts[i]);
    return out;
}

bool is_way(std::string_view word) {
    static constexpr std::string_view of_members[] = {"passed", "received", "delivered", "returned"};
    return std::ranges::count(of_members, word) != 0 ||
           std::ranges::any_of(sorted_ways(), [&](const sorted_way &way) { return way.word == word; });
}

template <typename Row>
std::vector<node_name> patterns_of(const Row &table) {
    std::vector<node_name> out;
    for (const auto &row : table)
        out.push_back(parsed_name(row.node));
    return out;
}

void add_node_samples(const gathering &work, const std::vector<ctl_binding> &bindings) {
    static const std::vector<node_name> patterns = patterns_of(rows), way_patterns = patterns_of(way_rows);
    for (const ctl_binding &binding : bindings) {
        node_name name = parsed_name(binding.name);
        std::string value;
        for (size_t i = 0; i < std::size(rows); i++)
            if (matches_pattern(patterns[i], name) && rows[i].value(binding.value, &value))
                work.add(rows[i].family, labels_of(metric_families[rows[i].family], patterns[i], name),
                         value);
        for (size_t i = 0; i < std::size(way_rows); i++) {
            if (!matches_pattern(way_patterns[i], name) || !is_count(binding.value))
                continue;
            // The label is taken from the last part of the name, which must not contain the suffix.
            std::string *way = &name.parts.back();
            const bool bytes = way_rows[i].bytes != 0 && way->ends_with("_bytes");
            if (bytes)
                way->resize(way->size() - std::string_view("_bytes").size());
            const size_t family = bytes ? way_rows[i].bytes : way_rows[i].packets;
            if (is_way(*way))
                work.add(family, labels_of(metric_families[family], way_patterns[i], name), binding.value);
        }
    }
}

void add_tunnel_names(const gathering &work, const std::vector<ctl_binding> &bindings) {
    std::map<std::string, std::map<std::string, std::string>> tunnels;
    for (const ctl_binding &binding : bindings)
        if (const std::vector<std::string> parts = parts_below(NODE_TUNNEL_STATE, binding.name);
            parts.size() == 2)
            tunnels[parts[0]][parts[1]] = binding.value;
    for (auto &[id, nodes] : tunnels) {
        std::string labels = make_label("tunnel", id);
        add_label(&labels, "router", nodes["remote"]);
        add_label(&labels, "interface", nodes["interface"]);
        work.add(metric_place("wccp_tunnel"), labels, "1");
    }
}

bool gather_tunneld(const gathering &work) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::subtree,
                  {NODE_PLANE_STATE, NODE_TUNNEL_STATE, NODE_INTERCEPT_STATE, NODE_PROTECTION_STATE}, &reply))
        return false;
    const auto plane = std::ranges::find(reply.bindings, NODE_PLANE_STATE "/name", &ctl_binding::name);
    // A running tunneld always has a data plane.
    const bool running = plane != reply.bindings.end();
    work.add(metric_place("wccp_daemon_up"), make_label("daemon", "tunneld"), running ? "1" : "0");
    if (running)
        work.add(metric_place("wccp_data_plane"), make_label("plane", plane->value), "1");
    add_node_samples(work, reply.bindings);
    add_tunnel_names(work, reply.bindings);
    return true;
}

// --- wccpd

// A line of a text: its first word, then its labels, then a value for each family.
struct line_row {
    std::string_view word;
    size_t labels; // number of words, named like the families' labels after "group"
    std::vector<size_t> families;
};
const std::vector<line_row> &text_lines() {
    static const std::vector<line_row> lines = {
        {"router",
         2,
         {metric_place("wccp_router_two_way"), metric_place("wccp_router_heard_seconds"),
          metric_place("wccp_router_connected_seconds"), metric_place("wccp_router_own_buckets"),
          metric_place("wccp_router_buckets")}},
        {"appliance", 1, {metric_place("wccp_appliance_weight")}},
        {"reason", 2, {metric_place("wccp_reason_occurrences"), metric_place("wccp_reason_last_seconds")}},
        {"interface",
         1,
         {metric_place("wccp_interface_ready"), metric_place("wccp_interface_starts"),
          metric_place("wccp_interface_stops"), metric_place("wccp_interface_link_downs"),
          metric_place("wccp_interface_address_changes")}},
    };
    return lines;
}

// A line "gauge WORD VALUE" or "counter WORD VALUE".
void add_named_number(const gathering &work, const std::string &labels, std::string_view word,
                      std::string_view value) {
    static const std::map<std::string_view, size_t> places = [] {
        std::map<std::string_view, size_t> out;
        for (size_t i = 0; i < std::size(metric_families); i++)
            out[metric_families[i].name] = i;
        return out;
    }();
    const std::string name = std::string(labels.empty() ? "wccp_" : "wccp_group_").append(word);
    if (const auto found = places.find(name); found != places.end() && is_count(value))
        work.add(found->second, labels, value);
}

void add_text_line(const gathering &work, const std::string &group_labels, std::string_view line) {
    std::string_view words[WORDS_MAX];
    size_t count = 0;
    for (std::string_view word = take_word(&line); !word.empty(); word = take_word(&line)) {
        if (count == WORDS_MAX)
            return;
        words[count++] = word;
    }
    if (count == 3 && (words[0] == "gauge" || words[0] == "counter"))
        return add_named_number(work, group_labels, words[1], words[2]);
    for (const line_row &row : text_lines()) {
        // A line of another length comes from another version of wccpd.
        if (count != 1 + row.labels + row.families.size() || words[0] != row.word)
            continue;
        std::string labels = group_labels;
        std::string_view names = metric_families[row.families[0]].labels;
        // The label "group" is in `group_labels` already, or left out for wccpd as a whole.
        if (names.starts_with("group "))
            (void)take_word(&names);
        for (size_t i = 0; i < row.labels; i++)
            add_label(&labels, take_word(&names), words[1 + i]);
        for (size_t i = 0; i < row.families.size(); i++)
            if (const std::string_view value = words[1 + row.labels + i]; is_count(value))
                work.add(row.families[i], labels, value);
    }
}

void add_text(const gathering &work, const std::string &group_labels, std::string_view text) {
    for (size_t count = 0; count < LINES_MAX && !text.empty(); count++) {
        const std::string_view line = text.substr(0, text.find('\n'));
        add_text_line(work, group_labels, line);
        text.remove_prefix(std::min(line.size() + 1, text.size()));
    }
}

bool gather_groups(const gathering &work) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::children, {NODE_GROUP_STATE}, &reply))
        return false;
    std::vector<std::string> names;
    for (const ctl_binding &binding : reply.bindings)
        if (parts_below(NODE_GROUP_STATE, binding.name).size() == 1 && names.size() < GROUPS_MAX)
            // One text for all metrics of a group.
            names.push_back(binding.name + "/metric/all");
    for (size_t first = 0; first < names.size(); first += GROUPS_AT_ONCE) {
        const auto from = names.begin() + static_cast<std::ptrdiff_t>(first);
        const size_t some = std::min(GROUPS_AT_ONCE, names.size() - first);
        if (!work.ask(ctl_walk::node, {from, from + static_cast<std::ptrdiff_t>(some)}, &reply))
            return false;
        for (const ctl_binding &binding : reply.bindings)
            if (const std::vector<std::string> parts = parts_below(NODE_GROUP_STATE, binding.name);
                parts.size() == 3)
                add_text(work, make_label("group", parts[0]), binding.value);
    }
    return true;
}

bool gather_wccpd(const gathering &work) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::node, {NODE_WCCPD_VERSION, NODE_WCCPD_STATE "/metric/all"}, &reply))
        return false;
    const bool running = reply.code == 0 && !reply.bindings.empty();
    work.add(metric_place("wccp_daemon_up"), make_label("daemon", "wccpd"), running ? "1" : "0");
    for (const ctl_binding &binding : reply.bindings)
        if (binding.name == NODE_WCCPD_VERSION)
            work.add(metric_place("wccp_build"), make_label("version", binding.value), "1");
        else
            add_text(work, "", binding.value);
    return !running || gather_groups(work);
}

// --- mgmtd

bool gather_mgmtd(const gathering &work) {
    ctl_reply reply;
    if (!work.ask(ctl_walk::subtree, {NODE_ALARMS_RAISED, NODE_PROCESSES}, &reply))
        return false;
    work.add(metric_place("wccp_daemon_up"), make_label("daemon", "mgmtd"), "1");
    add_node_samples(work, reply.bindings);
    // The answer also has the processes, which are not alarms.
    std::erase_if(reply.bindings, [](const ctl_binding &binding) {
        return parts_below(NODE_ALARMS_RAISED, binding.name).empty();
    });
    const std::vector<ctl_alarm> active = alarms_of(reply.bindings);
    work.add(metric_place("wccp_alarms"), "", std::to_string(active.size()));
    for (const ctl_alarm &alarm : active) {
        std::string labels = make_label("alarm", alarm.name);
        add_label(&labels, "source", alarm.source);
        work.add(metric_place("wccp_alarm_active"), labels, "1");
    }
    return true;
}

} // namespace

bool gather_metrics(const metric_source &source, metric_lines *out) {
    const gathering work{source, out};
    if (gather_mgmtd(work) && gather_wccpd(work) && gather_tunneld(work))
        return true;
    // A part of the samples would look like groups that are gone. One sample reports the failure instead.
    *out = {};
    work.add(metric_place("wccp_daemon_up"), make_label("daemon", "mgmtd"), "0");
    return false;
}

std::vector<std::string> metrics_text(metric_lines samples, metric_format format) {
    const bool modern = format == metric_format::openmetrics;
    std::vector<std::string> out;
    for (size_t i = 0; i < samples.size(); i++) {
        if (samples[i].empty())
            continue;
        const metric_family &family = metric_families[i];
        // In the older format a metric has its whole name, and there is no type "info".
        std::string name(family.name);
        if (!modern && family.kind == metric_kind::counter)
            name += "_total";
        if (!modern && family.kind == metric_kind::info)
            name += "_info";
        std::string about = "# TYPE " + name;
        about += family.kind == metric_kind::counter          ? " counter\n"
                 : modern && family.kind == metric_kind::info ? " info\n"
                                                              : " gauge\n";
        for (const char *unit : {"seconds", "bytes"})
            if (modern && family.name.ends_with(std::string("_") + unit))
                about.append("# UNIT ").append(name).append(" ").append(unit).append("\n");
        about.append("# HELP ").append(name).append(" ").append(family.help).append("\n");
        out.push_back(std::move(about));
        out.push_back(std::move(samples[i]));
    }
    if (modern)
        out.push_back("# EOF\n");
    return out;
}

const char *metrics_content_type(metric_format format) {
    return format == metric_format::openmetrics ? "application/openmetrics-text; version=1.0.0; charset=utf-8"
                                                : "text/plain; version=0.0.4; charset=utf-8";
}
