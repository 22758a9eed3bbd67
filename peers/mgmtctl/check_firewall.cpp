#include "peers/mgmtctl/check_firewall.h"

#include <algorithm>
#include <map>
#include <vector>

#include "peers/mgmtctl/check.h"

namespace {
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

struct rules_of_chain {
    ctl_json head; // of the chain
    std::vector<ctl_json> rules;
};

struct walker {
    const filtered_packet &packet;
    std::map<std::string, rules_of_chain> chains; // by "FAMILY TABLE CHAIN"
    std::map<std::string, ctl_json> sets;         // elements by "FAMILY TABLE SET"
    std::string table;                            // "FAMILY TABLE " of the chain that is walked
    bool may_accept = false, may_drop = false;    // by a rule whose condition is not clear

    answer is_value(const ctl_json &value, const std::string &own) const;
    answer is_number(const ctl_json &value, int own) const;
    template <typename Compare>
    answer is_any(const ctl_json &right, const Compare &compare) const;
    answer holds(const ctl_json &left, const ctl_json &right) const;
    answer matches(const ctl_json &match) const;
    fate apply(const std::string &verdict, const ctl_json &body, answer condition, int depth);
    fate end_unclear(answer condition);
    fate apply_extension(const ctl_json &body, bool last, answer *inout_condition);
    fate walk_rule(const ctl_json &rule, int depth);
    fate walk_chain(const std::string &name, int depth);
};

// A name may end in "*".
answer walker::is_value(const ctl_json &value, const std::string &own) const {
    if (!value.is_text() || own.empty())
        return answer::maybe;
    if (value.text.ends_with('*'))
        return answer_of(own.starts_with(value.text.substr(0, value.text.size() - 1)));
    return answer_of(value.text == own);
}

answer walker::is_number(const ctl_json &value, int own) const {
    const auto signed_number = [](const ctl_json &number) { return static_cast<int64_t>(number.number); };
    const std::vector<ctl_json> &range = value["range"].items;
    if (value.is_whole_number())
        return answer_of(signed_number(value) == own);
    if (range.size() == 2 && range[0].is_whole_number() && range[1].is_whole_number())
        return answer_of(signed_number(range[0]) <= own && own <= signed_number(range[1]));
    if (value.text == "udp" || value.text == "gre")
        return answer_of(own == (value.text == "udp" ? UDP_NUMBER : GRE_NUMBER));
    // The name of another protocol; it may also be the name of a port, which stays unclear.
    return value.is_text() && (own == UDP_NUMBER || own == GRE_NUMBER) ? answer::no : answer::maybe;
}

// Whether the packet has this value, or one of a set.
template <typename Compare>
answer walker::is_any(const ctl_json &right, const Compare &compare) const {
    const ctl_json *list = &right;
    if (right.contains("set"))
        list = &right["set"];
    if (list->text.starts_with('@')) {
        const auto found = sets.find(table + list->text.substr(1));
        if (found == sets.end())
            return answer::maybe;
        list = &found->second;
    }
    if (!list->is_array())
        return compare(*list);
    answer any = answer::no;
    for (const ctl_json &one : list->items)
        any = std::max(any, compare(one["elem"].contains("val") ? one["elem"]["val"] : one));
    return any;
}

answer walker::holds(const ctl_json &left, const ctl_json &right) const {
    const auto number = [&](int own) {
        return is_any(right, [&](const ctl_json &one) { return is_number(one, own); });
    };
    const auto word = [&](const std::string &own) {
        return is_any(right, [&](const ctl_json &one) { return is_value(one, own); });
    };
    const int protocol = packet.gre ? GRE_NUMBER : UDP_NUMBER;
    if (left.contains("payload")) {
        const std::string of = left["payload"]["protocol"].text, field = left["payload"]["field"].text;
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
        const std::string key = left["meta"]["key"].text;
        if (key == "l4proto")
            return number(protocol);
        if (key == "nfproto")
            return word("ipv4");
        if (key == (packet.outgoing ? "oifname" : "iifname") || key == (packet.outgoing ? "oif" : "iif"))
            return word(packet.interface);
    }
    if (left.contains("ct") && left["ct"]["key"].text == "state")
        return word("new");
    return answer::maybe;
}

answer walker::matches(const ctl_json &match) const {
    const std::string op = match["op"].text;
    if (!match.contains("left") || !match.contains("right"))
        return answer::maybe;
    const answer equal = holds(match["left"], match["right"]);
    if (op == "==" || op == "in")
        return equal;
    // A packet without the field matches neither "==" nor "!=".
    const ctl_json &left = match["left"];
    const std::string &of = left["payload"]["protocol"].text;
    if (!of.empty() && of != "ip" && of != "th" && (of != "udp" || packet.gre))
        return equal;
    return op == "!=" ? negate_answer(equal) : answer::maybe;
}

fate walker::apply(const std::string &verdict, const ctl_json &body, answer condition, int depth) {
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
        result = walk_chain(table + body["target"].text, depth + 1);
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
fate walker::apply_extension(const ctl_json &body, bool last, answer *inout_condition) {
    const std::string name = body["name"].text, type = body["type"].text;
    for (const char *harmless : {"LOG", "NFLOG", "MARK", "CONNMARK", "CT", "TCPMSS", "CHECKSUM", "CLASSIFY"})
        if (name == harmless)
            return fate::goes_on;
    if (name == "REJECT")
        return apply("reject", ctl_json(), *inout_condition, 0);
    if (type == "target" || (type.empty() && last))
        return end_unclear(*inout_condition);
    *inout_condition = all_hold(*inout_condition, answer::maybe);
    return fate::goes_on;
}

fate walker::walk_rule(const ctl_json &rule, int depth) {
    answer condition = answer::yes;
    const ctl_json &statements = rule["expr"];
    if (!statements.is_array())
        return fate::goes_on;
    for (const ctl_json &statement : statements.items) {
        if (statement.names.empty())
            continue;
        const std::string &kind = statement.names[0];
        const ctl_json &body = statement.items[0];
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
            const ctl_json &pairs = body["data"]["set"];
            if (!pairs.is_array()) {
                (void)end_unclear(condition);
                continue;
            }
            for (const ctl_json &pair : pairs.items) {
                if (!pair.is_array() || pair.items.size() != 2 || pair.items[1].names.empty())
                    continue;
                const fate result = apply(pair.items[1].names[0], pair.items[1].items[0],
                                          all_hold(condition, holds(body["key"], pair.items[0])), depth);
                if (result != fate::goes_on)
                    return result;
            }
        } else if (kind == "xt") {
            const fate result = apply_extension(body, &statement == &statements.items.back(), &condition);
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
    for (const ctl_json &rule : chain->second.rules) {
        const fate result = walk_rule(rule, depth);
        if (result != fate::goes_on)
            return result;
    }
    return fate::goes_on;
}

bool is_on_the_way(const ctl_json &chain, const filtered_packet &packet) {
    const std::string hook = chain["hook"].text, family = chain["family"].text;
    if (hook.empty() || (family != "ip" && family != "inet" && family != "netdev"))
        return false;
    // Chains of all types and priorities count.
    if (packet.outgoing ? hook != "output" && hook != "postrouting" && hook != "egress"
                        : hook != "ingress" && hook != "prerouting" && hook != "input")
        return false;
    const ctl_json &device = chain["dev"];
    if (device.is_null() || packet.interface.empty())
        return true;
    return device.text == packet.interface ||
           std::any_of(device.items.begin(), device.items.end(),
                       [&](const ctl_json &each) { return each.text == packet.interface; });
}

void read_listing(const ctl_json &objects, walker *out) {
    for (const ctl_json &object : objects.items) {
        if (object.names.empty())
            continue;
        const std::string &kind = object.names[0];
        const ctl_json &body = object.items[0];
        const std::string above = body["family"].text + " " + body["table"].text + " ";
        if (body["family"].text == "ip" && body["table"].text == OWN_TABLE)
            continue;
        if (kind == "chain")
            out->chains[above + body["name"].text].head = body;
        else if (kind == "rule")
            out->chains[above + body["chain"].text].rules.push_back(body);
        else if (kind == "set")
            out->sets[above + body["name"].text] = body.contains("elem") ? body["elem"] : ctl_json::array();
    }
}
} // namespace

filter_finding judge_packet(const ctl_json &objects, const filtered_packet &packet) {
    walker walk = {packet, {}, {}, "", false, false};
    read_listing(objects, &walk);
    filter_finding worst;
    // The packet passes only if every chain on its way accepts it: the worst result counts.
    for (const auto &[name, chain] : walk.chains) {
        if (!is_on_the_way(chain.head, packet))
            continue;
        walk.table = chain.head["family"].text + " " + chain.head["table"].text + " ";
        walk.may_accept = walk.may_drop = false;
        // A chain that ends without a verdict has that of its policy.
        fate end = walk.walk_chain(name, 0);
        if (end != fate::accepted && end != fate::dropped)
            end = chain.head["policy"].text == "drop" ? fate::dropped : fate::accepted;
        const filter_result result = end == fate::dropped
                                         ? walk.may_accept ? filter_result::unclear : filter_result::drops
                                     : walk.may_drop ? filter_result::unclear
                                                     : filter_result::passes;
        if (result > worst.result)
            worst = {result, name};
    }
    return worst;
}
