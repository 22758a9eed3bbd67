#include "peers/mgmtctl/check_firewall.h"

#include <algorithm>
#include <map>
#include <vector>

#include <nlohmann/json.hpp>

#include "peers/mgmtctl/check.h"

namespace {
using json = nlohmann::json;

constexpr int UDP_NUMBER = 17, GRE_NUMBER = 47;
constexpr int DEPTH_MAX = 16; // of jumps, as in the kernel
constexpr const char *OWN_TABLE = "tunneld";

enum class answer { no, maybe, yes };
answer all_hold(answer a, answer b) {
    return std::min(a, b);
}
answer negate_answer(answer a) {
    return a == answer::maybe ? a : a == answer::yes ? answer::no : answer::yes;
}
answer answer_of(bool holds) {
    return holds ? answer::yes : answer::no;
}

enum class fate { goes_on, returned, accepted, dropped };

std::string text_at(const json &object, const char *key) {
    const auto found = object.is_object() ? object.find(key) : object.end();
    return found != object.end() && found->is_string() ? found->get<std::string>() : std::string();
}

struct rules_of_chain { // NOLINT(bugprone-exception-escape): moving JSON does not throw
    json head;          // of the chain
    std::vector<json> rules;
};

struct walker {
    const filtered_packet &packet;
    std::map<std::string, rules_of_chain> chains; // by "FAMILY TABLE CHAIN"
    std::map<std::string, json> sets;             // elements by "FAMILY TABLE SET"
    std::string table;                            // "FAMILY TABLE " of the chain that is walked
    bool may_accept = false, may_drop = false;    // by a rule whose condition is not clear

    answer is_value(const json &value, const std::string &own) const;
    answer is_number(const json &value, int own) const;
    template <typename Compare>
    answer is_any(const json &right, const Compare &compare) const;
    answer holds(const json &left, const json &right) const;
    answer matches(const json &match) const;
    fate apply(const std::string &verdict, const json &body, answer condition, int depth);
    fate end_unclear(answer condition);
    fate apply_extension(const json &body, bool last, answer *inout_condition);
    fate walk_rule(const json &rule, int depth);
    fate walk_chain(const std::string &name, int depth);
};

// A name may end in "*".
answer walker::is_value(const json &value, const std::string &own) const {
    if (!value.is_string() || own.empty())
        return answer::maybe;
    const std::string text = value.get<std::string>();
    if (text.ends_with('*'))
        return answer_of(own.starts_with(text.substr(0, text.size() - 1)));
    return answer_of(text == own);
}

answer walker::is_number(const json &value, int own) const {
    if (value.is_number_integer())
        return answer_of(value.get<int64_t>() == own);
    if (value.is_object() && value.contains("range") && value["range"].is_array() &&
        value["range"].size() == 2 && value["range"][0].is_number_integer() &&
        value["range"][1].is_number_integer())
        return answer_of(value["range"][0].get<int64_t>() <= own && own <= value["range"][1].get<int64_t>());
    if (value.is_string() && (value == "udp" || value == "gre"))
        return answer_of(own == (value == "udp" ? UDP_NUMBER : GRE_NUMBER));
    // The name of another protocol; it may also be the name of a port, which stays unclear.
    return value.is_string() && (own == UDP_NUMBER || own == GRE_NUMBER) ? answer::no : answer::maybe;
}

// Whether the packet has this value, or one of a set.
template <typename Compare>
answer walker::is_any(const json &right, const Compare &compare) const {
    const json *list = &right;
    if (right.is_object() && right.contains("set"))
        list = &right["set"];
    if (list->is_string() && list->get<std::string>().starts_with('@')) {
        const auto found = sets.find(table + list->get<std::string>().substr(1));
        if (found == sets.end())
            return answer::maybe;
        list = &found->second;
    }
    if (!list->is_array())
        return compare(*list);
    answer any = answer::no;
    for (const json &one : *list)
        any = std::max(any, compare(one.is_object() && one.contains("elem") && one["elem"].contains("val")
                                        ? one["elem"]["val"]
                                        : one));
    return any;
}

answer walker::holds(const json &left, const json &right) const {
    if (!left.is_object())
        return answer::maybe;
    const auto number = [&](int own) {
        return is_any(right, [&](const json &one) { return is_number(one, own); });
    };
    const auto word = [&](const std::string &own) {
        return is_any(right, [&](const json &one) { return is_value(one, own); });
    };
    const int protocol = packet.gre ? GRE_NUMBER : UDP_NUMBER;
    if (left.contains("payload")) {
        const std::string of = text_at(left["payload"], "protocol"),
                          field = text_at(left["payload"], "field");
        if (of == "ip")
            return field == "protocol" ? number(protocol) : answer::maybe;
        // "th" is the header after IP's, whatever it is. In a GRE packet such a condition compares other
        // fields: it is unclear.
        if (of == "udp" || (of == "th" && !packet.gre)) {
            if (packet.gre)
                return answer::no;
            return field == "dport" || field == "sport" ? number(WCCP_UDP_PORT) : answer::maybe;
        }
        for (const char *other : {"tcp", "icmp", "icmpv6", "ip6", "sctp", "dccp", "udplite", "arp"})
            if (of == other)
                return answer::no;
        return answer::maybe;
    }
    if (left.contains("meta")) {
        const std::string key = text_at(left["meta"], "key");
        if (key == "l4proto")
            return number(protocol);
        if (key == "nfproto")
            return word("ipv4");
        if (key == (packet.outgoing ? "oifname" : "iifname") || key == (packet.outgoing ? "oif" : "iif"))
            return word(packet.interface);
    }
    if (left.contains("ct") && text_at(left["ct"], "key") == "state")
        return word("new");
    return answer::maybe;
}

answer walker::matches(const json &match) const {
    const std::string op = text_at(match, "op");
    if (!match.contains("left") || !match.contains("right"))
        return answer::maybe;
    const answer equal = holds(match["left"], match["right"]);
    if (op == "==" || op == "in")
        return equal;
    // A packet without the field matches neither "==" nor "!=".
    const json &left = match["left"];
    const std::string of = left.contains("payload") ? text_at(left["payload"], "protocol") : "";
    if (!of.empty() && of != "ip" && of != "th" && (of != "udp" || packet.gre))
        return equal;
    return op == "!=" ? negate_answer(equal) : answer::maybe;
}

fate walker::apply(const std::string &verdict, const json &body, answer condition, int depth) {
    fate result = fate::goes_on;
    if (condition == answer::no)
        return result;
    if (verdict == "drop" || verdict == "reject")
        result = fate::dropped;
    else if (verdict == "return")
        result = fate::returned;
    // After a chain that returns, a jump continues with the next rule. A goto does not come back: it ends the
    // present chain as a return would.
    else if (verdict == "jump" || verdict == "goto") {
        result = walk_chain(table + text_at(body, "target"), depth + 1);
        if (result == fate::returned || (result == fate::goes_on && verdict == "goto"))
            result = verdict == "goto" ? fate::returned : fate::goes_on;
    } else if (verdict != "continue")
        result = fate::accepted; // or changed, or passed to a program
    // A rule that applies only perhaps is noted, and the evaluation continues. The verdict of a queue is that
    // of another program, and never known.
    if (condition == answer::yes && verdict != "queue")
        return result;
    // What follows a return, a rule or the policy, may be either.
    may_accept = may_accept || result == fate::accepted || result == fate::returned;
    may_drop = may_drop || result == fate::dropped || result == fate::returned || verdict == "queue";
    return verdict == "queue" && condition == answer::yes ? fate::accepted : fate::goes_on;
}

fate walker::end_unclear(answer condition) {
    may_accept = may_accept || condition != answer::no;
    may_drop = may_drop || condition != answer::no;
    return fate::goes_on;
}

// A statement of iptables-nft. Older libraries give no name: the last statement of a rule may then be a
// target, the others are matches.
fate walker::apply_extension(const json &body, bool last, answer *inout_condition) {
    const std::string name = text_at(body, "name"), type = text_at(body, "type");
    for (const char *harmless : {"LOG", "NFLOG", "MARK", "CONNMARK", "CT", "TCPMSS", "CHECKSUM", "CLASSIFY"})
        if (name == harmless)
            return fate::goes_on;
    if (name == "REJECT")
        return apply("reject", json(), *inout_condition, 0);
    if (type == "target" || (type.empty() && last))
        return end_unclear(*inout_condition);
    *inout_condition = all_hold(*inout_condition, answer::maybe);
    return fate::goes_on;
}

fate walker::walk_rule(const json &rule, int depth) {
    answer condition = answer::yes;
    if (!rule.contains("expr") || !rule["expr"].is_array())
        return fate::goes_on;
    for (const json &statement : rule["expr"]) {
        if (!statement.is_object() || statement.empty())
            continue;
        const std::string kind = statement.begin().key();
        const json &body = statement.begin().value();
        const auto is_one_of = [&](std::initializer_list<const char *> kinds) {
            return std::find(kinds.begin(), kinds.end(), kind) != kinds.end();
        };
        if (kind == "match")
            condition = all_hold(condition, matches(body));
        else if (is_one_of({"accept", "drop", "reject", "return", "continue", "queue", "jump", "goto", "snat",
                            "dnat", "masquerade", "redirect"})) {
            const fate result = apply(kind, body, condition, depth);
            if (result != fate::goes_on)
                return result;
        } else if (kind == "vmap" && body.contains("key") && body.contains("data")) {
            const json &data = body["data"];
            if (!data.is_object() || !data.contains("set") || !data["set"].is_array()) {
                (void)end_unclear(condition);
                continue;
            }
            for (const json &pair : data["set"]) {
                if (!pair.is_array() || pair.size() != 2 || !pair[1].is_object() || pair[1].empty())
                    continue;
                const fate result = apply(pair[1].begin().key(), pair[1].begin().value(),
                                          all_hold(condition, holds(body["key"], pair[0])), depth);
                if (result != fate::goes_on)
                    return result;
            }
        } else if (kind == "xt") {
            const fate result = apply_extension(body, &statement == &rule["expr"].back(), &condition);
            if (result != fate::goes_on)
                return result;
        } else if (!is_one_of({"counter", "log", "notrack", "mangle", "flow", "ct helper", "comment"}))
            condition = all_hold(condition, answer::maybe); // a limit, or something that is not understood
    }
    return fate::goes_on;
}

fate walker::walk_chain(const std::string &name, int depth) {
    const auto chain = chains.find(name);
    if (chain == chains.end() || depth > DEPTH_MAX)
        return fate::goes_on;
    for (const json &rule : chain->second.rules) {
        const fate result = walk_rule(rule, depth);
        if (result != fate::goes_on)
            return result;
    }
    return fate::goes_on;
}

bool is_on_the_way(const json &chain, const filtered_packet &packet) {
    const std::string hook = text_at(chain, "hook"), family = text_at(chain, "family");
    if (hook.empty() || (family != "ip" && family != "inet" && family != "netdev"))
        return false;
    // Chains of all types and priorities count.
    if (packet.outgoing ? hook != "output" && hook != "postrouting" && hook != "egress"
                        : hook != "ingress" && hook != "prerouting" && hook != "input")
        return false;
    const auto device = chain.find("dev");
    if (device == chain.end() || packet.interface.empty())
        return true;
    return device->is_array() ? std::find(device->begin(), device->end(), packet.interface) != device->end()
                              : *device == packet.interface;
}

void read_listing(const json &objects, walker *out) {
    for (const json &object : objects) {
        if (!object.is_object() || object.empty())
            continue;
        const std::string kind = object.begin().key();
        const json &body = object.begin().value();
        const std::string above = text_at(body, "family") + " " + text_at(body, "table") + " ";
        if (text_at(body, "family") == "ip" && text_at(body, "table") == OWN_TABLE)
            continue;
        if (kind == "chain")
            out->chains[above + text_at(body, "name")].head = body;
        else if (kind == "rule")
            out->chains[above + text_at(body, "chain")].rules.push_back(body);
        else if (kind == "set")
            out->sets[above + text_at(body, "name")] = body.contains("elem") ? body["elem"] : json::array();
    }
}
} // namespace

filter_finding judge_packet(const json &objects, const filtered_packet &packet) {
    walker walk = {packet, {}, {}, "", false, false};
    read_listing(objects, &walk);
    filter_finding worst;
    // The packet passes only if every chain on its way accepts it: the worst result counts.
    for (const auto &[name, chain] : walk.chains) {
        if (!is_on_the_way(chain.head, packet))
            continue;
        walk.table = text_at(chain.head, "family") + " " + text_at(chain.head, "table") + " ";
        walk.may_accept = walk.may_drop = false;
        // A chain that ends without a verdict has that of its policy.
        fate end = walk.walk_chain(name, 0);
        if (end != fate::accepted && end != fate::dropped)
            end = text_at(chain.head, "policy") == "drop" ? fate::dropped : fate::accepted;
        const filter_result result = end == fate::dropped
                                         ? walk.may_accept ? filter_result::unclear : filter_result::drops
                                     : walk.may_drop ? filter_result::unclear
                                                     : filter_result::passes;
        if (result > worst.result)
            worst = {result, name};
    }
    return worst;
}
