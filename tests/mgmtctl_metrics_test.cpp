// Metrics: the samples of states, in both formats, and the names that documents, alert rules, the dashboard
// and the engine share with the table of metrics.
#include <algorithm>
#include <regex>

#include <gtest/gtest.h>

#include "peers/mgmtctl/metrics.h"
#include "peers/nodes/schema.h"
#include "tests/support/canned_nodes.h"
#include "tests/support/texts.h"

static metric_source answered_by(const std::vector<ctl_binding> &nodes) {
    return [known = canned_nodes{nodes}](ctl_walk walk, const strings &names, ctl_reply *out) mutable {
        return std::ranges::all_of(names, [&](const auto &name) { return known(walk, name, out); });
    };
}

// The text of what is gathered; gathering has to end like this.
static std::string metrics_of(const metric_source &source, bool complete = true,
                              metric_format format = metric_format::text) {
    metric_lines samples;
    EXPECT_EQ(gather_metrics(source, &samples), complete);
    return joined(metrics_text(samples, format), "");
}

// Only numbers become values, texts cannot leave their labels, and a daemon that is gone is reported as down.
TEST(Metrics, AreMadeOfStatesAndReadInBothFormats) {
    const std::vector<ctl_binding> known = bindings_of(
        "/qv",
        "%/wccpd/system/state/version string 1.0.0|"
        "%/wccpd/system/state/metric/all string counter rx_failures 9\ninterface eth0 1 2 3 4 5\n"
        "interface a b 1 2 3 4 5\nreason group-unknown 10.0.0.7 1 2\n|"
        "%/wccpd/wccp/srv_grp/state/51 string 51|"
        "%/wccpd/wccp/srv_grp/state/51/metric/all string gauge active 1\ngauge pending_acks x\n"
        "counter rx_icus 5\ncounter Bad{} 5\nrouter 10.0.0.1 10.0.0.9 1 3 40 128 256\nrouter 10.0.0.2\n"
        "nothing 1\nreason password-mismatch 10.0.0.1 7 2|"
        "%/tunneld/plane/state/name string user|%/tunneld/plane/state/refused/source uint64 4|"
        "%/tunneld/tunnel/state/232 uint16 232|%/tunneld/tunnel/state/232/remote ipv4addr 10.0.0.1|"
        "%/tunneld/tunnel/state/232/to_proxy_bytes uint64 99|%/tunneld/intercept/state/51 uint8 51|"
        "%/tunneld/intercept/state/51/proxy string unknown|%/tunneld/intercept/state/51/proxy_ms uint64 1500|"
        "%/tunneld/intercept/state/51/weight_percent uint32 5|"
        "%/tunneld/protection/state/member/10.0.0.102/passed uint64 3|"
        "%/alarms/state/raised/196638/a\"b\\\\c string text|"
        "%/alarms/state/process/wccpd string running|%/alarms/state/process/wccpd/restarts uint32 2|");
    const std::string modern = "\n" + metrics_of(answered_by(known), true, metric_format::openmetrics);
    for (const char *line :
         {"wccp_build_info{version=\"1.0.0\"} 1", "# TYPE wccp_build info", "wccp_rx_failures_total 9",
          "wccp_interface_link_downs_total{interface=\"eth0\"} 4",
          "wccp_reason_occurrences{reason=\"group-unknown\",sender=\"10.0.0.7\"} 1",
          "wccp_group_active{group=\"51\"} 1", "wccp_group_rx_icus_total{group=\"51\"} 5",
          "# TYPE wccp_group_rx_icus counter", "# UNIT wccp_router_heard_seconds seconds",
          "wccp_router_own_buckets{group=\"51\",router=\"10.0.0.1\",address=\"10.0.0.9\"} 128",
          "wccp_reason_occurrences{group=\"51\",reason=\"password-mismatch\",sender=\"10.0.0.1\"} 7",
          "wccp_gre_refused_packets_total{reason=\"source\"} 4",
          "wccp_tunnel_info{tunnel=\"232\",router=\"10.0.0.1\",interface=\"\"} 1",
          "wccp_tunnel_sorted_bytes_total{tunnel=\"232\",way=\"to_proxy\"} 99",
          "wccp_proxy_state_seconds{group=\"51\"} 1.500", "wccp_intercept_weight_ratio{group=\"51\"} 0.05",
          "wccp_protection_packets_total{appliance=\"10.0.0.102\",way=\"passed\"} 3",
          "wccp_process_restarts_total{process=\"wccpd\"} 2", "wccp_daemon_up{daemon=\"tunneld\"} 1"})
        EXPECT_TRUE(contains(modern, "\n" + std::string(line) + "\n"));
    EXPECT_TRUE(lacks(modern, "pending_acks{", "Bad", "nothing", "wccp_proxy_up{", "router=\"10.0.0.2\"",
                      "interface=\"a\""));
    EXPECT_TRUE(contains(modern, "source=\"a\\\"b") && modern.ends_with("\n# EOF\n"));
    EXPECT_TRUE(contains(metrics_of(answered_by(known)), "# TYPE wccp_group_rx_icus_total counter\n"));
    EXPECT_TRUE(contains(metrics_of(answered_by({})), "wccp_daemon_up{daemon=\"wccpd\"} 0\n"));
    const auto silent = [](ctl_walk, const std::vector<std::string> &, ctl_reply *) { return false; };
    EXPECT_TRUE(metrics_of(silent, false).ends_with("\nwccp_daemon_up{daemon=\"mgmtd\"} 0\n"));
}

// All that the pattern's group of this number matches in a file; at least so many.
static strings found_in(const std::string &name, const char *pattern, int group, size_t least) {
    const std::string text = text_of_file(WCCP_SOURCE_DIR "/" + name);
    const std::regex expression(pattern);
    const strings found(std::sregex_token_iterator(text.begin(), text.end(), expression, group), {});
    EXPECT_GE(found.size(), least) << name;
    return found;
}

// The documents, the dashboard and the alert rules name metrics that exist, and each number of the engine has
// one.
TEST(Metrics, AreTheOnesThatOthersName) {
    const std::string document = text_of_file(WCCP_SOURCE_DIR "/docs/metrics.md");
    std::set<std::string> names;
    for (const metric_family &family : metric_families) {
        const char *const kinds[] = {"gauge", "counter", "info"}, *const suffixes[] = {"", "_total", "_info"};
        const auto kind = static_cast<size_t>(family.kind);
        const std::string name = std::string(family.name) + suffixes[kind];
        names.insert(name);
        const std::string row = "| `" + name + "` | " + kinds[kind] + " | " + std::string(family.labels) +
                                (family.labels.empty() ? "| " : " | ") + std::string(family.help) + " |\n";
        EXPECT_TRUE(contains(document, row));
    }
    for (const char *file : {"docs/metrics.md", "packaging/prometheus/wccp.rules.yml",
                             "packaging/prometheus/wccp.dashboard.json"})
        for (const std::string &name : found_in(file, "\\bwccp_[a-z_]+\\b", 0, 9))
            EXPECT_TRUE(names.contains(name)) << name << " in " << file;
    for (const char *file : {"engine/wccp_query.cpp", "engine/wccp_metrics.cpp"})
        for (const std::string &row : found_in(file, "\n    \\{\"([a-z_]+)\",", 1, 9))
            EXPECT_TRUE(names.contains("wccp_group_" + row) || names.contains("wccp_group_" + row + "_total"))
                << row << " of " << file;
}

// --- Nodes

// The documents list exactly the nodes that exist.
TEST(Nodes, AreInTheDocuments) {
    const std::regex way(
        "^((?!.*/member/).*/\\*)/"
        "(in|to_proxy|bypassed|returned|down|own|forwarded|dropped|passed|overload)(_bytes)?$");
    const strings rows = found_in("docs/states.md", "\n\\| (/qv/(wccpd|tunneld)/[^ ]+) \\|", 1, 9);
    const std::set<std::string> documented(rows.begin(), rows.end());
    std::set<std::string> wanted;
    for (const auto *list : {&wccpd_state_nodes(), &tunneld_state_nodes()})
        for (const std::string node : *list) {
            const auto is_below = [&](const std::string &other) { return other.starts_with(node + "/"); };
            // A node that only has others below it needs no row.
            if (!node.ends_with("*") || documented.contains(node) || std::ranges::none_of(*list, is_below))
                wanted.insert(std::regex_replace(node, way, "$1/WAY"));
        }
    EXPECT_EQ(documented, wanted);

    const std::string configured = text_of_file(WCCP_SOURCE_DIR "/docs/mgmtd.md");
    for (const schema_row &one : schema_rows()) {
        const std::string last = one.parts.parts.back();
        EXPECT_TRUE(last == "*" || std::regex_search(configured, std::regex("/" + last + "[ ,]")))
            << one.pattern;
    }
}
