// Although mgmtd has checked the configuration, every value is checked and bounded again here, since it
// becomes part of kernel rules. The nodes of an intercept are rows of a table with the function that reads
// the text.
#include "peers/tunneld/session_config.h"

#include <algorithm>
#include <cstring>
#include <sstream>

#include <arpa/inet.h>

#include "mgmt/node_paths.h"
#include "peers/nodes/schema.h"

// --- Values

namespace {
bool parse_number(const std::string &text, int64_t min, int64_t max, int64_t *out) {
    if (text.empty() || text.size() > 12 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    // At most 12 digits, which always fit.
    *out = std::stoll(text);
    return *out >= min && *out <= max;
}

template <typename Number>
bool take_number(const std::string &text, int64_t min, int64_t max, Number *out) {
    int64_t number = 0;
    if (!parse_number(text, min, max, &number))
        return false;
    *out = static_cast<Number>(number);
    return true;
}

template <typename Value>
struct word {
    const char *text;
    Value value;
};
template <typename Value, size_t N>
bool take_word(const std::string &text, const word<Value> (&words)[N], Value *out) {
    for (const word<Value> &each : words)
        if (text == each.text) {
            *out = each.value;
            return true;
        }
    return false;
}
} // namespace

bool parse_address(const std::string &text, uint32_t *out) {
    in_addr address{};
    if (inet_pton(AF_INET, text.c_str(), &address) != 1)
        return false;
    *out = ntohl(address.s_addr);
    return true;
}

bool parse_prefix(const std::string &text, ip_prefix *out) {
    const size_t slash = text.find('/');
    int64_t length = 32;
    if (!parse_address(text.substr(0, slash), &out->address) ||
        (slash != std::string::npos && !parse_number(text.substr(slash + 1), 0, 32, &length)))
        return false;
    out->length = static_cast<uint8_t>(length);
    // A shift by 32 bits would be undefined.
    out->address &= length ? UINT32_MAX << (32 - length) : 0;
    return true;
}

bool parse_ports(const std::string &text, std::vector<port_range> *out) {
    out->clear();
    if (text == "all")
        return true;
    std::istringstream words(text);
    for (std::string word; words >> word;) {
        const size_t dash = word.find('-');
        port_range range{};
        // The first port is the lower bound of the second: 90-80 is refused.
        if (out->size() == PORT_RANGES_MAX || !take_number(word.substr(0, dash), 1, 65535, &range.first) ||
            !take_number(dash == std::string::npos ? word : word.substr(dash + 1), range.first, 65535,
                         &range.last))
            return false;
        out->push_back(range);
    }
    return !out->empty();
}

// --- Intercepts

namespace {
bool take_prefixes(const std::string &text, std::vector<ip_prefix> *out) {
    out->clear();
    std::istringstream words(text);
    // A bad prefix does not make the others invalid: a bypass that is left out would intercept its packets.
    bool good = true;
    for (std::string word; words >> word;) {
        ip_prefix prefix{};
        if (out->size() < INTERCEPT_BYPASSES_MAX && parse_prefix(word, &prefix))
            out->push_back(prefix);
        else
            good = false;
    }
    return good;
}

bool take_argument(const std::string &text, std::string *out) {
    if (text.size() > 255 || std::any_of(text.begin(), text.end(), [](char c) {
            return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
        }))
        return false;
    *out = text;
    return true;
}

constexpr word<uint8_t> protocols[] = {{"tcp", 6}, {"udp", 17}};
constexpr word<leftover> leftovers[] = {
    {"return", leftover::give_back}, {"forward", leftover::forward}, {"drop", leftover::drop}};
constexpr word<bool> downs[] = {{"return", false}, {"drop", true}};
constexpr word<check_kind> checks[] = {
    {"tcp", check_kind::tcp}, {"http", check_kind::http}, {"command", check_kind::command}};
constexpr word<bool> bools[] = {{"false", false}, {"true", true}};

struct intercept_node {
    const char *name;
    bool needed; // the intercept is left out without it
    bool (*take)(const std::string &text, intercept *out);
};
#define TAKE(call) [](const std::string &text, intercept *out) { return call; }
constexpr intercept_node intercept_nodes[] = {
    {"protocol", true, TAKE(take_word(text, protocols, &out->protocol))},
    {"ports", true, TAKE(parse_ports(text, &out->ports))},
    {"to", true, TAKE(take_number(text, 1, 65535, &out->to))},
    {"bypass", false, TAKE(take_prefixes(text, &out->bypass))},
    {"rest", false, TAKE(take_word(text, leftovers, &out->rest))},
    {"down", false, TAKE(take_word(text, downs, &out->drop_when_down))},
    {"check", false, TAKE(take_word(text, checks, &out->check.kind))},
    {"check_argument", false, TAKE(take_argument(text, &out->check.argument))},
    {"interval", false, TAKE(take_number(text, 1, 3600, &out->check.interval_s))},
    {"rise", false, TAKE(take_number(text, 1, 1000, &out->check.rise))},
    {"fall", false, TAKE(take_number(text, 1, 1000, &out->check.fall))},
    {"leave_after", false, TAKE(take_number(text, 0, UINT32_MAX, &out->leave_after_s))},
    {"limit", false, TAKE(take_number(text, 0, UINT32_MAX, &out->limit))},
    {"slow_start", false, TAKE(take_number(text, 0, 86400, &out->slow_start_s))},
};
#undef TAKE

// The state of one reading of the configuration.
struct reading {
    configured_view view;
    std::map<uint8_t, std::map<std::string, bool>> taken; // by intercept and node: whether the text was good
    std::vector<std::string> *complaints;

    void complain(const std::string &line) const {
        if (complaints->size() < COMPLAINTS_MAX)
            complaints->push_back(line);
    }
};

void read_intercept(reading *self, uint8_t group, const std::string &leaf, const std::string &text) {
    for (const intercept_node &node : intercept_nodes) {
        if (leaf != node.name)
            continue;
        // The first node of an intercept creates it, with defaults. leave_out_unsound() removes it if
        // something is missing.
        const bool good = node.take(text, &self->view.intercepts[group]);
        self->taken[group][leaf] = good;
        if (!good && !node.needed)
            self->complain("intercept " + std::to_string(group) + ": " + leaf + " \"" + shown_text(text) +
                           "\" ignored");
    }
}

void leave_out_unsound(reading *self) {
    // Only after all nodes have been read, whose order is not known.
    for (auto at = self->view.intercepts.begin(); at != self->view.intercepts.end();) {
        const auto &[group, rules] = *at;
        const auto &taken = self->taken[group];
        std::string missing;
        for (const intercept_node &node : intercept_nodes)
            if (const auto found = taken.find(node.name);
                node.needed && (found == taken.end() || !found->second))
                missing = missing.empty() ? node.name : missing;
        const std::string &argument = rules.check.argument; // a blank would end the path in an HTTP request
        if (missing.empty() && rules.check.kind != check_kind::tcp &&
            (argument.empty() ||
             (rules.check.kind == check_kind::http && argument.find(' ') != std::string::npos)))
            missing = "check_argument";
        if (missing.empty()) {
            ++at;
            continue;
        }
        self->complain("intercept " + std::to_string(group) + " ignored: " + missing + " is missing or bad");
        at = self->view.intercepts.erase(at);
    }
}

// --- Groups

void read_group(reading *self, uint8_t group, const std::string &leaf, const std::string &text) {
    group_view &view = self->view.groups[group];
    bool good = true;
    if (leaf == "interface") {
        // The longest name that Linux allows, without characters that it refuses in one.
        good = text.size() <= 15 && text.find_first_of("/ \t:") == std::string::npos;
        view.interface = good ? text : "";
    } else if (leaf == "policy_grp") {
        good = take_number(text, 0, 65535, &view.policy_group);
    } else if (leaf == "force_l2_return") {
        good = take_word(text, bools, &view.force_l2_return);
    }
    if (!good)
        self->complain("group " + std::to_string(group) + ": " + leaf + " \"" + shown_text(text) +
                       "\" ignored");
}

void read_drain(reading *self, uint8_t group, const std::string &leaf, const std::string &text) {
    // The instance itself has the state of the drain as its value.
    if (leaf.empty())
        self->view.drains[group] = text != "draining";
}

// --- Nodes by instance

// The part of the name below `root`, and the part below that one, or "". False for names with more parts.
bool split_name(const node_name &name, const node_name &root, std::string *out_instance,
                std::string *out_leaf) {
    const size_t depth = root.parts.size();
    if (!name.is_under(root) || name.parts.size() > depth + 2)
        return false;
    *out_instance = name.parts[depth];
    *out_leaf = name.parts.size() > depth + 1 ? name.parts[depth + 1] : "";
    return true;
}

void read_bypass(reading *self, const std::string &instance, const std::string &leaf,
                 const std::string &text) {
    std::vector<bypass_entry> &entries = self->view.bypasses;
    bypass_entry entry{};
    if (!parse_prefix(instance, &entry.prefix) ||
        (leaf == "until" && !take_number(text, 0, UINT32_MAX, &entry.until))) {
        self->complain("bypass \"" + shown_text(instance) + "\" ignored");
        return;
    }
    // All nodes of an instance come one after the other.
    if (!entries.empty() && entries.back().prefix == entry.prefix)
        entries.back().until = leaf == "until" ? entry.until : entries.back().until;
    else if (entries.size() < BYPASSES_MAX)
        entries.push_back(entry);
    else
        self->complain("bypass entries after the first " + std::to_string(BYPASSES_MAX) + " ignored");
}

void read_accepted(reading *self, const std::string &instance, const std::string &leaf,
                   const std::string &text) {
    std::vector<accepted_source> &sources = self->view.accepted;
    accepted_source source{};
    if (!parse_address(instance, &source.address) || !source.address ||
        (leaf == "router" && !parse_address(text, &source.router))) {
        self->complain("accepted source \"" + shown_text(instance) + "\" ignored");
        return;
    }
    if (!sources.empty() && sources.back().address == source.address)
        sources.back().router = leaf == "router" ? source.router : sources.back().router;
    else if (sources.size() < ACCEPTED_MAX)
        sources.push_back(source);
    else
        self->complain("accepted sources after the first " + std::to_string(ACCEPTED_MAX) + " ignored");
}

// The node has no instance: its own name is used instead.
void read_protection(reading *self, const std::string &leaf, const std::string &, const std::string &text) {
    if (leaf == "time" && !take_number(text, 0, 86400, &self->view.protection_s))
        self->complain("protection: time \"" + shown_text(text) + "\" ignored");
}

template <void (*Read)(reading *, uint8_t, const std::string &, const std::string &)>
void read_by_group(reading *self, const std::string &instance, const std::string &leaf,
                   const std::string &text) {
    uint8_t group = 0;
    if (take_number(instance, 0, 255, &group))
        Read(self, group, leaf, text);
}

constexpr struct {
    const char *root;
    void (*read)(reading *self, const std::string &instance, const std::string &leaf,
                 const std::string &text);
} readers[] = {
    {NODE_GROUP_CONFIG, read_by_group<read_group>},
    {NODE_INTERCEPT_CONFIG, read_by_group<read_intercept>},
    {NODE_BYPASS_CONFIG, read_bypass},
    {NODE_ACCEPT_CONFIG, read_accepted},
    {NODE_PROTECTION_CONFIG, read_protection},
    {NODE_DRAINS, read_by_group<read_drain>},
};
} // namespace

std::vector<std::string> list_configuration_roots() {
    std::vector<std::string> roots;
    for (const auto &reader : readers)
        roots.emplace_back(reader.root);
    return roots;
}

configured_view read_configuration(const std::vector<event_field> &nodes,
                                   std::vector<std::string> *out_complaints) {
    reading self;
    self.complaints = out_complaints;
    std::vector<node_name> roots;
    for (const auto &reader : readers)
        roots.push_back(parsed_name(reader.root));
    std::string instance, leaf;
    for (const event_field &node : nodes) {
        const node_name name = parsed_name(node.name);
        for (size_t i = 0; i < roots.size(); i++)
            if (split_name(name, roots[i], &instance, &leaf))
                readers[i].read(&self, instance, leaf, node.value.text);
    }
    leave_out_unsound(&self);
    return std::move(self.view);
}

std::map<uint8_t, size_t> count_configured_routers(const std::vector<event_field> &nodes) {
    static const node_name root = parsed_name(NODE_GROUP_CONFIG);
    const size_t depth = root.parts.size();
    std::map<uint8_t, size_t> out;
    std::map<uint8_t, bool> down;
    for (const event_field &node : nodes) {
        const node_name name = parsed_name(node.name);
        uint8_t group = 0;
        if (!name.is_under(root) || !take_number(name.parts[depth], 0, 255, &group))
            continue;
        size_t &count = out[group];
        // ROOT/GROUP/admin and ROOT/GROUP/router/NUMBER/ipaddr.
        if (name.parts.size() == depth + 2 && name.parts.back() == "admin")
            down[group] = node.value.text == "down";
        else if (name.parts.size() == depth + 4 && name.parts[depth + 1] == "router" &&
                 name.parts.back() == "ipaddr")
            count++;
    }
    std::erase_if(out, [&](const auto &each) { return down[each.first]; });
    return out;
}

// --- State of wccpd

std::map<uint8_t, std::string> read_group_owners(const std::vector<event_field> &nodes) {
    static const node_name root = parsed_name(NODE_GROUP_STATE);
    const size_t depth = root.parts.size();
    std::map<uint8_t, std::string> out;
    for (const event_field &node : nodes) {
        const node_name name = parsed_name(node.name);
        uint8_t group = 0;
        if (name.is_under(root) && name.parts.size() == depth + 2 && name.parts.back() == "owners" &&
            take_number(name.parts[depth], 0, 255, &group))
            out[group] = node.value.text;
    }
    return out;
}

std::map<uint8_t, group_role> read_group_roles(const std::vector<event_field> &nodes) {
    static const node_name root = parsed_name(NODE_GROUP_STATE);
    std::map<uint8_t, group_role> out;
    for (const event_field &node : nodes) {
        const node_name name = parsed_name(node.name);
        std::string instance, leaf;
        uint8_t group = 0;
        if (!split_name(name, root, &instance, &leaf) || !take_number(instance, 0, 255, &group))
            continue;
        if (leaf == "oper") // "ACTIVE, DESIGNATED"
            out[group].active = node.value.text.starts_with("ACTIVE");
        else if (leaf == "num_appliances")
            // The number includes this appliance.
            out[group].alone = node.value.text == "0" || node.value.text == "1";
    }
    return out;
}

std::map<uint8_t, std::vector<group_router>> read_group_routers(const std::vector<event_field> &nodes) {
    static const node_name root = parsed_name(NODE_GROUP_STATE);
    static constexpr word<travel> methods[] = {{"GRE", travel::gre}, {"L2", travel::l2}};
    const size_t depth = root.parts.size(); // GROUP "router" NUMBER LEAF
    std::map<uint8_t, std::map<uint16_t, group_router>> found;
    for (const event_field &node : nodes) {
        const node_name name = parsed_name(node.name);
        uint8_t group = 0;
        uint16_t number = 0;
        // Beyond the limit, only further nodes of routers that have been taken already.
        if (!name.is_under(root) || name.parts.size() != depth + 4 || name.parts[depth + 1] != "router" ||
            !take_number(name.parts[depth], 0, 255, &group) ||
            !take_number(name.parts[depth + 2], 0, 65535, &number) ||
            (found[group].size() >= GROUP_ROUTERS_MAX && !found[group].contains(number)))
            continue;
        group_router &router = found[group][number];
        const std::string &leaf = name.parts.back(), &text = node.value.text;
        if (leaf == "id")
            (void)parse_address(text, &router.id);
        else if (leaf == "ipaddr")
            (void)parse_address(text, &router.address);
        else if (leaf == "fwd_method")
            (void)take_word(text, methods, &router.forward);
        else if (leaf == "ret_method")
            (void)take_word(text, methods, &router.give_back);
    }
    std::map<uint8_t, std::vector<group_router>> out;
    // A router without an id has not answered yet.
    for (const auto &[group, routers] : found)
        for (const auto &[number, router] : routers)
            if (router.id)
                out[group].push_back(router);
    return out;
}
