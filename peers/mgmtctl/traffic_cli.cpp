// "mgmtctl intercept", "bypass" and "tunnel": their output for people and scripts.
#include <cstdlib>
#include <ctime>
#include <map>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/intercept_words.h"
#include "peers/mgmtctl/intercepts.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_model.h"
#include "peers/mgmtctl/traffic_json.h"
#include "peers/nodes/value_lists.h"

// --- Changes

namespace {
ctl_json result_json(const traffic_result &result) {
    ctl_json subject = nullptr;
    if (!result.subject.empty())
        subject = std::string(result.kind) == "intercept" ? ctl_json(std::atol(result.subject.c_str()))
                                                          : ctl_json(result.subject);
    ctl_json out = {{result.kind, subject}, {"done", result.done.empty() ? "nothing" : result.done}};
    if (!result.tunneld.empty())
        out["tunneld"] = result.tunneld;
    if (!result.note.empty())
        out["note"] = result.note;
    if (result.exit == CTL_OK)
        return out;
    out["error"] = result.error;
    out["code"] = result.code;
    out["exit"] = result.exit;
    return out;
}

int tell_result(const ctl_options &options, const traffic_result &result) {
    const std::string subject = std::string(result.kind) + " " + result.subject;
    if (options.json) {
        write_output(json_line(result_json(result)));
        return result.exit;
    }
    if (result.exit != CTL_OK)
        return tell_failure(
            options, {result.exit, result.subject.empty() ? "" : subject, result.error, "", result.code});
    write_output(subject + " " + (result.done == "unchanged" ? "is as asked" : result.done) +
                 (result.note.empty() ? "" : " (" + result.note + ")") +
                 (result.tunneld == "absent"   ? "; tunneld has no session"
                  : result.tunneld == "silent" ? "; tunneld does not answer"
                                               : "") +
                 "\n");
    return result.exit;
}

// --- Reading

// Instances by their names, each with the nodes below it by theirs.
using instance_list = std::vector<std::pair<std::string, std::map<std::string, std::string>>>;

// The queries of one command, which ends with the first failure.
struct traffic_queries {
    ctl_link link;
    ctl_failure failure = {CTL_OK, "", "", "", 0};

    bool ask(ctl_walk walk, const std::string &name, ctl_reply *out) {
        *out = {};
        if (!link.query(walk, name, out, &failure.error))
            failure.exit = CTL_UNREACHABLE;
        return failure.exit == CTL_OK;
    }
    bool ask_traffic(traffic_state *out) {
        return gather_traffic([this](ctl_walk walk, const std::string &name,
                                     ctl_reply *reply) { return ask(walk, name, reply); },
                              out);
    }
    // The configuration below `root`.
    bool ask_configuration(const char *root, instance_list *out) {
        ctl_reply reply;
        if (!ask(ctl_walk::subtree, root, &reply))
            return false;
        if (reply.code != 0)
            failure = {exit_of(reply.code), root, reply.message, "", reply.code};
        for (const ctl_binding &binding : reply.bindings) {
            const std::vector<std::string> parts = parts_below(root, binding.name);
            if (parts.empty() || parts.size() > 2)
                continue;
            // Nodes of one instance follow one another.
            if (out->empty() || out->back().first != parts[0])
                out->push_back({parts[0], {}});
            if (parts.size() == 2)
                out->back().second[parts[1]] = binding.value;
        }
        return failure.exit == CTL_OK;
    }
};

void put_absence(tunneld_condition condition) {
    if (condition != tunneld_condition::running)
        write_output(condition == tunneld_condition::absent ? "tunneld has no session\n"
                                                            : "tunneld does not answer\n");
}

void put_reasons(const std::vector<traffic_reason> &reasons, int group) {
    for (const traffic_reason &reason : reasons)
        if (reason.group == group && reason.word != "proxy-down") // printed with the proxy already
            write_output((group < 0 ? "" : "  ") + reason.text + "\n");
}

// --- Intercepts

ctl_json intercept_json(const std::string &number, const std::map<std::string, std::string> &nodes,
                        const traffic_intercept *state, const traffic_state &traffic) {
    ctl_json out = {{"group", std::atol(number.c_str())}};
    for (const intercept_word &word : intercept_words()) {
        const auto found = nodes.find(word.node);
        const schema_row *row =
            find_schema_row(parsed_name(NODE_INTERCEPT_CONFIG "/0/" + std::string(word.node)));
        if (found != nodes.end() && row)
            out[word.node] = bn_type_numeric(row->type) ? ctl_json(std::atol(found->second.c_str()))
                                                        : ctl_json(found->second);
        else
            out[word.node] = nullptr;
    }
    const auto argument = nodes.find("check_argument");
    out["check_argument"] = argument == nodes.end() ? "" : argument->second;
    out.update(intercept_state_json(state));
    const auto left = traffic.left.find(std::atoi(number.c_str()));
    out["left_reason"] = left == traffic.left.end() ? ctl_json(nullptr) : ctl_json(left->second);
    return out;
}
} // namespace

int tell_intercepts(const ctl_options &options, const ctl_link &link, const std::string &only) {
    traffic_queries mgmtd = {link};
    instance_list intercepts;
    traffic_state traffic;
    if (!mgmtd.ask_configuration(NODE_INTERCEPT_CONFIG, &intercepts) || !mgmtd.ask_traffic(&traffic))
        return tell_failure(options, mgmtd.failure);
    std::erase_if(intercepts, [&](const auto &each) { return !only.empty() && each.first != only; });
    if (!only.empty() && intercepts.empty())
        return tell_failure(options, {CTL_NOT_FOUND, "", "there is no intercept for group " + only, "", 0});
    const std::vector<traffic_reason> reasons = traffic_reasons(traffic);
    ctl_json all = ctl_json::array();
    for (const auto &[number, nodes] : intercepts) {
        const traffic_intercept *state = nullptr;
        for (const traffic_intercept &each : traffic.intercepts)
            if (std::to_string(each.group) == number)
                state = &each;
        all.push_back(intercept_json(number, nodes, state, traffic));
        if (options.json)
            continue;
        write_output(number + " " + intercept_clauses(nodes) + "\n");
        if (state)
            write_output(
                "  " + proxy_text(*state) +
                (state->proxy == "up" || state->proxy_reason.empty() ? "" : ": " + state->proxy_reason) +
                "\n  " + sorted_text(state->sorted) + "\n");
        put_reasons(reasons, std::atoi(number.c_str()));
    }
    if (options.json)
        write_output(json_line({{"tunneld", tunneld_word(traffic.tunneld)}, {"intercepts", all}}));
    else
        put_absence(traffic.tunneld);
    return CTL_OK;
}

namespace {
int list_clauses(const ctl_options &options) {
    ctl_json all = ctl_json::array();
    for (const intercept_word &word : intercept_words()) {
        const char *fallback = intercept_word_fallback(word);
        if (!options.json)
            write_output(word.word + std::string(12 - std::string(word.word).size(), ' ') + word.values +
                         (fallback && *fallback ? std::string("; default ") + fallback : "") + "\n");
        all.push_back({{"word", word.word},
                       {"node", word.node},
                       {"values", word.values},
                       {"default", fallback ? ctl_json(fallback) : ctl_json(nullptr)}});
    }
    if (options.json)
        write_output(json_line(all));
    return CTL_OK;
}
} // namespace

int ctl_intercept(const ctl_options &options, const std::vector<std::string> &words) {
    std::string only;
    if (!words.empty() && words[0] == "show" &&
        (words.size() == 1 || (words.size() == 2 && parse_group_number(words[1], &only))))
        return tell_intercepts(options, link_to_mgmtd(options), only);
    if (words.size() == 1 && words[0] == "words")
        return list_clauses(options);
    return tell_result(options, intercept_command(link_to_mgmtd(options), words));
}

// --- Bypasses

int tell_bypasses(const ctl_options &options, const ctl_link &link) {
    traffic_queries mgmtd = {link};
    instance_list bypasses;
    traffic_state traffic;
    if (!mgmtd.ask_configuration(NODE_BYPASS_CONFIG, &bypasses) || !mgmtd.ask_traffic(&traffic))
        return tell_failure(options, mgmtd.failure);
    ctl_json all = ctl_json::array();
    for (const auto &[prefix, nodes] : bypasses) {
        const auto found = nodes.find("until");
        const int64_t until = found == nodes.end() ? 0 : std::atoll(found->second.c_str());
        const int64_t left = until - time(nullptr);
        if (!options.json)
            write_output(prefix +
                         (until == 0  ? ""
                          : left <= 0 ? "  is over"
                                      : "  for " + std::to_string(left) + " s more") +
                         "\n");
        all.push_back({{"prefix", prefix}, {"until", until ? ctl_json(until) : ctl_json(nullptr)}});
    }
    if (options.json)
        write_output(json_line({{"tunneld", tunneld_word(traffic.tunneld)}, {"bypasses", all}}));
    else
        put_absence(traffic.tunneld);
    return CTL_OK;
}

int ctl_bypass(const ctl_options &options, const std::vector<std::string> &words) {
    if (words.size() == 1 && words[0] == "show")
        return tell_bypasses(options, link_to_mgmtd(options));
    return tell_result(options, bypass_command(link_to_mgmtd(options), words, time(nullptr)));
}

// --- Tunnels

namespace {
std::string refused_text(const refused_counts &refused) {
    std::string out;
    for (const auto &[reason, packets] : refused)
        if (packets > 0)
            out += "  " + reason + " " + count_text(packets);
    return out.empty() ? "" : "  refused by reason:" + out + "\n";
}

std::string count_of_bytes(const traffic_count &count) {
    return count_text(count.packets) + " (" + count_text(count.bytes) + " bytes)";
}

void put_protection(const protection_state &state) {
    write_output("protection of flows " +
                 (state.time ? "for " + std::to_string(state.time) + " s" : std::string("switched off")) +
                 "\n  " + protection_text(state.sum) + "\n");
    for (const protected_group &each : state.groups)
        write_output("  group " + std::to_string(each.group) +
                     (each.covered ? "  " + std::to_string(each.slots) + " slots passed on\n"
                                   : "  not covered: " + each.reason + "\n"));
    for (const auto &[address, counts] : state.members)
        write_output("  appliance " + address + "  " + protection_text(counts) + "\n");
}

void put_tunnels(const traffic_state &traffic) {
    write_output("data plane " + traffic.plane + "\n" +
                 (traffic.plane_reason.empty() ? "" : "  not used: " + traffic.plane_reason + "\n") +
                 refused_text(traffic.refused));
    for (const traffic_tunnel &tunnel : traffic.tunnels)
        write_output("tunnel " + std::to_string(tunnel.id) + "  " + tunnel.local + " to " + tunnel.remote +
                     (tunnel.interface.empty() ? "" : "  on " + tunnel.interface) + "  index " +
                     std::to_string(tunnel.index) + "\n  in " + count_of_bytes(tunnel.in) + "  out " +
                     count_of_bytes(tunnel.out) + "  fragments " + count_text(tunnel.fragments) +
                     "\n  sorted: " + sorted_text(tunnel.sorted) + "\n" + refused_text(tunnel.refused));
    if (traffic.protection.time != 0)
        put_protection(traffic.protection);
    for (const auto &[address, packets] : traffic.refused_sources)
        write_output("refused " + count_text(packets) + " from " + address + "\n");
    if (traffic.refused_sources.size() >= REFUSED_SOURCES_MAX)
        write_output("refused sources beyond these " + std::to_string(REFUSED_SOURCES_MAX) +
                     " are not listed\n");
}
} // namespace

int tell_tunnels(const ctl_options &options, const ctl_link &link) {
    traffic_queries mgmtd = {link};
    traffic_state traffic;
    if (!mgmtd.ask_traffic(&traffic))
        return tell_failure(options, mgmtd.failure);
    const bool running = traffic.tunneld == tunneld_condition::running;
    ctl_json out = traffic_json(traffic);
    out["accepted"] = ctl_json::array();
    if (!options.json && running)
        put_tunnels(traffic);
    for (const auto &[address, router] : traffic.accepted) {
        out["accepted"].push_back(
            {{"address", address}, {"router", router.empty() ? ctl_json(nullptr) : ctl_json(router)}});
        if (!options.json)
            write_output("accepted " + address + (router.empty() ? "" : " beside router " + router) + "\n");
    }
    if (!options.json)
        put_reasons(traffic_reasons(traffic), -1);
    if (options.json)
        write_output(json_line(out));
    else
        put_absence(traffic.tunneld);
    return running ? CTL_OK : CTL_UNREACHABLE;
}

int ctl_tunnel(const ctl_options &options, const std::vector<std::string> &words) {
    if (words.size() == 1 && words[0] == "show")
        return tell_tunnels(options, link_to_mgmtd(options));
    return tell_result(options, tunnel_command(link_to_mgmtd(options), words));
}

// --- Protection of flows

namespace {
int tell_protection(const ctl_options &options, const ctl_link &link) {
    traffic_queries mgmtd = {link};
    traffic_state traffic;
    if (!mgmtd.ask_traffic(&traffic))
        return tell_failure(options, mgmtd.failure);
    const bool running = traffic.tunneld == tunneld_condition::running;
    if (options.json)
        write_output(
            json_line({{"tunneld", tunneld_word(traffic.tunneld)},
                       {"protection", running ? protection_json(traffic.protection) : ctl_json(nullptr)}}));
    else if (running)
        put_protection(traffic.protection);
    else
        put_absence(traffic.tunneld);
    return running ? CTL_OK : CTL_UNREACHABLE;
}
} // namespace

int ctl_protection(const ctl_options &options, const std::vector<std::string> &words) {
    if (words.empty())
        return tell_protection(options, link_to_mgmtd(options));
    return tell_result(options, protection_command(link_to_mgmtd(options), words));
}
