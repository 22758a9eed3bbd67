// The rows of the schema, and the checks that they use.
//
// Values are converted by the functions of the bindings, so that whatever is accepted here can be sent
// unchanged. In addition a row has a range, a length, words or a check. Numbers may be hexadecimal, which is
// usual for masks, and are kept in decimal.
//
// With the defaults, a group takes part once its interface and routers are set. The default of a text that
// may be empty is the empty text. Without a default, deleting the node would have a running group deleted and
// created again.
#include "peers/nodes/schema.h"

#include <algorithm>
#include <cstring>
#include <new>

#include "mgmt/bnode.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "mgmt/protocol_names.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/value_lists.h"
#include "runtime/logging.h"

namespace {

constexpr size_t PART_MAX_BYTES = 255;  // of a name
constexpr size_t SHOWN_MAX_BYTES = 400; // of a text in a message

const char *check_level(std::string *inout) {
    const std::string &text = *inout;
    int32_t level = 0;
    for (const lc_enum_entry *entry = lc_log_level_table; entry->name; entry++)
        if (text == entry->name)
            level = 1;
    // Where a level may not be empty, the least length of the row refuses it.
    return level || text.empty() ? nullptr : "is not a log level (emerg to debug)";
}

const char *check_facility(std::string *inout) {
    const std::string &text = *inout;
    for (const lc_enum_entry *entry = lc_log_facility_table; entry->name; entry++)
        if (text == std::to_string(entry->value))
            return nullptr;
    return "is not a log facility (a multiple of 8 up to 184)";
}

const char *check_protocol(std::string *inout) {
    const std::string &text = *inout;
    const bool digits = !text.empty() && text.find_first_not_of("0123456789") == std::string::npos;
    if (digits)
        // The length first: stoi throws on numbers that are too large.
        return text.size() > 3 || std::stoi(text) < 1 || std::stoi(text) > 255 ? "is not between 1 and 255"
                                                                               : nullptr;
    const int number = ip_protocol_by_name(text.c_str());
    if (number == 0)
        return "is not a protocol of its own; name one that is carried in it";
    return number < 0 ? "is not a protocol; give a name such as tcp or udp, or a number from 1 to 255"
                      : nullptr;
}

const char *check_interface(std::string *inout) {
    const std::string &text = *inout;
    // The kernel refuses these characters in the name of an interface.
    return text.find_first_of("/ \t:") == std::string::npos ? nullptr : "is not an interface name";
}

const char *check_path(std::string *inout) {
    return inout->empty() || inout->front() == '/' ? nullptr : "does not begin with \"/\"";
}

#define GROUP NODE_GROUP_CONFIG "/*"
#define POLICY NODE_POLICY_CONFIG "/*"
#define INTERCEPT NODE_INTERCEPT_CONFIG "/*"
#define BYPASS NODE_BYPASS_CONFIG "/*"
#define ACCEPT NODE_ACCEPT_CONFIG "/*"
#define MESSAGES NODE_SYSLOG "/action/file/*/facility"
#define MAIN_MESSAGES NODE_SYSLOG "/action/file/\\/var\\/log\\/messages/facility"

const std::vector<schema_row> rows = [] {
    constexpr int64_t NUMBER_MAX = 0xffffffff;
    std::vector<schema_row> made = {
        {NODE_SYSTEM_MODE, bn_type_str, "router", 1, 15, "router|server|bridge", nullptr},
        {NODE_SYSTEM_BONDING, bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {NODE_SYSTEM_10G, bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {NODE_MCAST_TTL, bn_type_uint32, "1", 1, 255, nullptr, nullptr},

        {POLICY, bn_type_uint16, nullptr, 1, 65535, nullptr, nullptr, true},
        {POLICY "/name", bn_type_str, "", 0, 63, nullptr, nullptr},

        {GROUP, bn_type_uint8, nullptr, 0, 255, nullptr, nullptr, true},
        {GROUP "/admin", bn_type_str, "up", 1, 15, "up|down", nullptr},
        {GROUP "/interface", bn_type_str, nullptr, 1, 15, nullptr, check_interface, false, true},
        {GROUP "/router/*", bn_type_uint8, nullptr, 1, 32, nullptr, nullptr, true},
        {GROUP "/router/*/ipaddr", bn_type_ipv4addr, nullptr, 0, 0, nullptr, nullptr, false, true},
        {GROUP "/priority", bn_type_uint32, "200", 0, 255, nullptr, nullptr, false, true},
        {GROUP "/protocol", bn_type_str, "tcp", 1, 31, nullptr, check_protocol, false, true},
        // Eight bytes are the size of the field in the protocol.
        {GROUP "/password", bn_type_str, "", 0, 8, nullptr, nullptr},
        {GROUP "/encap", bn_type_str, "either", 1, 15, "gre|l2|either", nullptr},
        {GROUP "/weight", bn_type_uint32, "100", 0, 65535, nullptr, nullptr},
        {GROUP "/policy_grp", bn_type_uint32, nullptr, 1, 65535, nullptr, nullptr},
        {GROUP "/force_l2_return", bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {GROUP "/assign_method", bn_type_str, "either", 1, 15, "hash|mask|either", nullptr},
        {GROUP "/assign_detail", bn_type_str, "", 0, 255, nullptr, nullptr},
        {GROUP "/hash_src_ip", bn_type_bool, "true", 0, 0, nullptr, nullptr},
        {GROUP "/hash_dst_ip", bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {GROUP "/hash_src_port", bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {GROUP "/hash_dst_port", bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {GROUP "/mask_src_ip", bn_type_uint32, "0", 0, NUMBER_MAX, nullptr, nullptr},
        // 0xf00
        {GROUP "/mask_dst_ip", bn_type_uint32, "3840", 0, NUMBER_MAX, nullptr, nullptr},
        {GROUP "/mask_src_port", bn_type_uint16, "0", 0, 65535, nullptr, nullptr},
        {GROUP "/mask_dst_port", bn_type_uint16, "0", 0, 65535, nullptr, nullptr},
        {GROUP "/compatibility", bn_type_str, "ios", 1, 15, "ios|nexus", nullptr},

        // By service group: the redirected packets that go to a local proxy.
        {INTERCEPT, bn_type_uint8, nullptr, 0, 255, nullptr, nullptr, true},
        {INTERCEPT "/protocol", bn_type_str, "tcp", 1, 15, "tcp|udp", nullptr},
        {INTERCEPT "/ports", bn_type_str, "", 0, 1023, nullptr, check_ports},
        {INTERCEPT "/to", bn_type_uint16, nullptr, 1, 65535, nullptr, nullptr},
        {INTERCEPT "/bypass", bn_type_str, "", 0, 2047, nullptr, check_prefixes},
        {INTERCEPT "/rest", bn_type_str, "return", 1, 15, "return|forward|drop", nullptr},
        {INTERCEPT "/down", bn_type_str, "return", 1, 15, "return|drop", nullptr},
        {INTERCEPT "/check", bn_type_str, "tcp", 1, 15, "tcp|http|command", nullptr},
        {INTERCEPT "/check_argument", bn_type_str, "", 0, 255, nullptr, check_path},
        {INTERCEPT "/interval", bn_type_uint32, "5", 1, 3600, nullptr, nullptr},
        {INTERCEPT "/rise", bn_type_uint32, "2", 1, 100, nullptr, nullptr},
        {INTERCEPT "/fall", bn_type_uint32, "3", 1, 100, nullptr, nullptr},
        {INTERCEPT "/leave_after", bn_type_uint32, "30", 0, 86400, nullptr, nullptr},
        {INTERCEPT "/limit", bn_type_uint32, "0", 0, 10'000'000, nullptr, nullptr},
        {INTERCEPT "/slow_start", bn_type_uint32, "0", 0, 86400, nullptr, nullptr},
        {BYPASS, bn_type_ipv4prefix, nullptr, 0, 0, nullptr, check_prefix, true},
        {BYPASS "/until", bn_type_uint32, "0", 0, NUMBER_MAX, nullptr, nullptr},
        {ACCEPT, bn_type_ipv4addr, nullptr, 0, 0, nullptr, check_host_address, true},
        {ACCEPT "/router", bn_type_ipv4addr, "0.0.0.0", 0, 0, nullptr, check_host_address_or_none},

        {NODE_PROTECTION_TIME, bn_type_uint32, "300", 0, 86400, nullptr, nullptr},
        {NODE_DRAIN_TIME, bn_type_uint32, "60", 0, 86400, nullptr, nullptr},

        {NODE_SYSTEM_FACILITY, bn_type_uint32, "136", 0, 184, nullptr, check_facility},
        {NODE_SYSLOG "/process/*/log_level", bn_type_str, nullptr, 1, 15, nullptr, check_level},
        {MESSAGES "/all/min_priority", bn_type_str, nullptr, 0, 15, nullptr, check_level},
        // Before the general row, because the first row that matches counts: only this file has a default.
        {MAIN_MESSAGES "/override/enable", bn_type_bool, "false", 0, 0, nullptr, nullptr},
        {MESSAGES "/override/enable", bn_type_bool, nullptr, 0, 0, nullptr, nullptr},
        {MESSAGES "/single/*/min_priority", bn_type_str, nullptr, 0, 15, nullptr, check_level},
    };
    for (schema_row &row : made)
        (void)parse_node_name(row.pattern, &row.parts);
    return made;
}();

} // namespace

const std::vector<schema_row> &schema_rows() {
    return rows;
}

#define REASONS(node)                                                                                        \
    node "/reason/*", node "/reason/*/code", node "/reason/*/sender", node "/reason/*/source",               \
        node "/reason/*/offered", node "/reason/*/wanted", node "/reason/*/count", node "/reason/*/first",   \
        node "/reason/*/last"

const std::vector<const char *> &wccpd_state_nodes() {
    static const std::vector<const char *> nodes = {
        NODE_WCCPD_STATE "/proto_ver",
        NODE_WCCPD_VERSION,
        NODE_WCCPD_STATUS,
        NODE_WCCPD_STATE "/debug_global",
        NODE_WCCPD_STATE "/debug_all",
        REASONS(NODE_WCCPD_STATE),
        NODE_WCCPD_STATE "/metric/*",
        NODE_WCCPD_STATE "/interface/*",
        NODE_WCCPD_STATE "/interface/*/address",
        NODE_WCCPD_STATE "/interface/*/link",
        NODE_WCCPD_STATE "/interface/*/starts",
        NODE_WCCPD_STATE "/interface/*/stops",
        NODE_WCCPD_STATE "/interface/*/link_downs",
        NODE_WCCPD_STATE "/interface/*/address_changes",
        NODE_GROUP_STATE "/*",
        NODE_GROUP_STATE "/*/oper",
        NODE_GROUP_STATE "/*/uptime",
        NODE_GROUP_STATE "/*/app_id",
        NODE_GROUP_STATE "/*/num_routers",
        NODE_GROUP_STATE "/*/num_appliances",
        NODE_GROUP_STATE "/*/since",
        NODE_GROUP_STATE "/*/pending_acks",
        REASONS(NODE_GROUP_STATE "/*"),
        NODE_GROUP_STATE "/*/counter/*",
        NODE_GROUP_STATE "/*/debug",
        NODE_GROUP_STATE "/*/assignment",
        // Its instances cannot be listed, so that walks leave it out.
        NODE_GROUP_STATE "/*/metric/*",
        NODE_GROUP_STATE "/*/owners",
        NODE_GROUP_STATE "/*/router/*",
        NODE_GROUP_STATE "/*/router/*/state",
        NODE_GROUP_STATE "/*/router/*/fwd_method",
        NODE_GROUP_STATE "/*/router/*/ret_method",
        NODE_GROUP_STATE "/*/router/*/assign_method",
        NODE_GROUP_STATE "/*/router/*/id",
        NODE_GROUP_STATE "/*/router/*/ipaddr",
        NODE_GROUP_STATE "/*/router/*/conn_time",
        NODE_GROUP_STATE "/*/router/*/heard",
        NODE_GROUP_STATE "/*/router/*/appliance/*",
        NODE_GROUP_STATE "/*/router/*/appliance/*/load_dist",
        // Appliances are queried by their numbers. As a node of its own the number keeps walks out of them.
        NODE_GROUP_STATE "/*/appliance/*",
        NODE_GROUP_STATE "/*/appliance/*/ipaddr",
        NODE_GROUP_STATE "/*/appliance/*/weight",
    };
    return nodes;
}

#define SORTED(node)                                                                                         \
    node "/in", node "/in_bytes", node "/to_proxy", node "/to_proxy_bytes", node "/bypassed",                \
        node "/bypassed_bytes", node "/returned", node "/returned_bytes", node "/down", node "/down_bytes",  \
        node "/forwarded", node "/forwarded_bytes", node "/dropped", node "/dropped_bytes", node "/own",     \
        node "/own_bytes", node "/passed", node "/passed_bytes", node "/overload", node "/overload_bytes"

const std::vector<const char *> &tunneld_state_nodes() {
    static const std::vector<const char *> nodes = {
        NODE_PLANE_STATE "/name",
        NODE_PLANE_STATE "/reason",
        NODE_PLANE_STATE "/lack",
        NODE_PLANE_STATE "/failure",
        NODE_PLANE_STATE "/own",
        NODE_PLANE_STATE "/clamped",
        NODE_PLANE_STATE "/refused/*",
        NODE_PLANE_STATE "/refused_source/*",
        NODE_PLANE_STATE "/first_ms/*",
        NODE_PLANE_STATE "/first_ms/refused_source/*",
        NODE_PLANE_STATE "/first_ms/overload/*",
        NODE_PLANE_STATE "/first_ms/unprotected/*",
        NODE_PLANE_STATE "/last_ms/*",
        NODE_PLANE_STATE "/last_ms/refused_source/*",
        NODE_TUNNEL_STATE "/*",
        NODE_TUNNEL_STATE "/*/local",
        NODE_TUNNEL_STATE "/*/remote",
        NODE_TUNNEL_STATE "/*/interface",
        NODE_TUNNEL_STATE "/*/index",
        NODE_TUNNEL_STATE "/*/packets_in",
        NODE_TUNNEL_STATE "/*/bytes_in",
        NODE_TUNNEL_STATE "/*/packets_out",
        NODE_TUNNEL_STATE "/*/bytes_out",
        NODE_TUNNEL_STATE "/*/fragments",
        NODE_TUNNEL_STATE "/*/refused/*",
        SORTED(NODE_TUNNEL_STATE "/*"),
        NODE_INTERCEPT_STATE "/*",
        NODE_INTERCEPT_STATE "/*/proxy",
        NODE_INTERCEPT_STATE "/*/proxy_reason",
        NODE_INTERCEPT_STATE "/*/proxy_ms",
        NODE_INTERCEPT_STATE "/*/active",
        NODE_INTERCEPT_STATE "/*/left",
        NODE_INTERCEPT_STATE "/*/flows",
        NODE_INTERCEPT_STATE "/*/overloaded",
        NODE_INTERCEPT_STATE "/*/weight_percent",
        SORTED(NODE_INTERCEPT_STATE "/*"),
        NODE_PROTECTION_STATE "/time",
        NODE_PROTECTION_STATE "/passed",
        NODE_PROTECTION_STATE "/received",
        NODE_PROTECTION_STATE "/delivered",
        NODE_PROTECTION_STATE "/returned",
        NODE_PROTECTION_STATE "/group/*",
        NODE_PROTECTION_STATE "/group/*/covered",
        NODE_PROTECTION_STATE "/group/*/reason",
        NODE_PROTECTION_STATE "/group/*/slots",
        NODE_PROTECTION_STATE "/member/*",
        NODE_PROTECTION_STATE "/member/*/interface",
        NODE_PROTECTION_STATE "/member/*/passed",
        NODE_PROTECTION_STATE "/member/*/received",
        NODE_PROTECTION_STATE "/member/*/delivered",
        NODE_PROTECTION_STATE "/member/*/returned",
    };
    return nodes;
}

// --- Names

namespace {

bool is_number(const std::string &part) {
    // 18 digits fit into 64 bits.
    return !part.empty() && part.size() <= 18 && part[0] >= '0' && part[0] <= '9' &&
           part.find_first_not_of("0123456789") == std::string::npos;
}

std::strong_ordering compare_parts(const std::string &a, const std::string &b) {
    if (a == b)
        return std::strong_ordering::equal;
    if (is_number(a) != is_number(b))
        return is_number(b) <=> is_number(a);
    if (is_number(a))
        if (const auto by_value = std::stoull(a) <=> std::stoull(b); by_value != 0)
            return by_value;
    // Also for numbers of the same value: "1" and "01" are different names.
    return a.compare(b) <=> 0;
}

} // namespace

std::strong_ordering operator<=>(const node_name &a, const node_name &b) {
    const size_t common = std::min(a.parts.size(), b.parts.size());
    for (size_t i = 0; i < common; i++)
        if (const auto order = compare_parts(a.parts[i], b.parts[i]); order != 0)
            return order;
    // A node precedes the nodes below it.
    return a.parts.size() <=> b.parts.size();
}

std::string node_name::text() const {
    owned_tstr_array joined;
    owned_text name;
    lc_status status = tstr_array_new(&joined.pointer, nullptr);
    for (size_t i = 0; i < parts.size() && status == LC_OK; i++)
        status = tstr_array_append_str(joined.pointer, parts[i].c_str());
    if (status != LC_OK || bn_binding_name_parts_to_name(joined.pointer, 1, &name.pointer) != LC_OK)
        throw std::bad_alloc();
    return name.pointer;
}

bool node_name::is_under(const node_name &above) const {
    return parts.size() > above.parts.size() &&
           std::equal(above.parts.begin(), above.parts.end(), parts.begin());
}

node_name node_name::below(const std::string &part) const {
    node_name out = *this;
    out.parts.push_back(part);
    return out;
}

namespace {

// Limit for any name from outside. A peer may send names of millions of parts.
constexpr uint32_t NAME_PARTS_MAX = 64;

} // namespace

bool parse_node_name(const std::string &text, node_name *out) {
    owned_tstr_array split;
    int absolute = 0;
    out->parts.clear();
    // The functions below take C strings and would silently cut the name.
    if (text.find('\0') != std::string::npos ||
        bn_binding_name_to_parts(text.c_str(), &split.pointer, &absolute) != LC_OK || !absolute)
        return false;
    const uint32_t count = tstr_array_length_quick(split.pointer);
    if (count > NAME_PARTS_MAX)
        return false;
    for (uint32_t i = 0; i < count; i++) {
        const char *part = tstr_array_get_str_quick(split.pointer, i);
        if (!part || !*part)
            return false;
        out->parts.emplace_back(part);
    }
    return count > 0;
}

node_name parsed_name(const std::string &text) {
    node_name out;
    return parse_node_name(text, &out) ? out : node_name{};
}

bool matches_pattern(const node_name &pattern, const node_name &name) {
    return pattern.parts.size() == name.parts.size() &&
           std::equal(pattern.parts.begin(), pattern.parts.end(), name.parts.begin(),
                      [](const std::string &wanted, const std::string &part) {
                          return wanted == "*" || wanted == part;
                      });
}

const schema_row *find_schema_row(const node_name &name) {
    for (const schema_row &row : rows)
        if (matches_pattern(row.parts, name))
            return &row;
    return nullptr;
}

// --- Values

std::string shown_text(const std::string &text) {
    std::string out = text.substr(0, SHOWN_MAX_BYTES);
    for (char &c : out)
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f)
            c = '?';
    return text.size() > out.size() ? out + "..." : out;
}

bool canonical_text(uint32_t type, const std::string &text, std::string *out_text) {
    // A NUL would end the value for the C functions, and the rest would be lost without a word.
    if (text.find('\0') != std::string::npos)
        return false;
    owned_attrib attrib;
    owned_text out;
    if (bn_attrib_new_str(&attrib.pointer, bn_attrib_value, type, 0, text.c_str()) != LC_OK ||
        bn_attrib_get_str(attrib.pointer, nullptr, 0, nullptr, &out.pointer) != LC_OK || !out.pointer)
        return false;
    *out_text = out.pointer;
    return true;
}

namespace {

std::string read_hexadecimal(uint32_t type, const std::string &text) {
    // At most 16 digits, so that stoull can't overflow. The conversion refuses longer numbers.
    if (!bn_type_numeric(type) || text.size() < 3 || text.size() > 18 || text[0] != '0' ||
        (text[1] != 'x' && text[1] != 'X') ||
        text.find_first_not_of("0123456789abcdefABCDEF", 2) != std::string::npos)
        return text;
    return std::to_string(std::stoull(text.substr(2), nullptr, 16));
}

bool is_one_of(const char *words, const std::string &text) {
    for (const char *word = words; word;) {
        const char *end = strchr(word, '|');
        if (text == (end ? std::string(word, end) : std::string(word)))
            return true;
        word = end ? end + 1 : nullptr;
    }
    return false;
}

std::string describe_range(const schema_row &row) {
    return std::to_string(row.min) + " and " + std::to_string(row.max);
}

// Instances that are not named by numbers, with the reason to refuse another name.
const struct {
    uint32_t type;
    const char *fault;
} other_instances[] = {
    {bn_type_ipv4addr, "is no IPv4 address such as 10.0.0.1"},
    {bn_type_ipv4prefix, "is no IPv4 prefix such as 10.0.0.0/8"},
};

// The name has to be in canonical form, or one thing could have two nodes.
bool check_instance(const schema_row &row, const std::string &part, std::string *out_reason) {
    const bool numeric = bn_type_numeric(row.type);
    std::string kept;
    *out_reason = "\"" + shown_text(part) + "\" ";
    if (!canonical_text(row.type, part, &kept) || kept != part ||
        // stoll can't throw: the part is a canonical number of the type.
        (numeric && (std::stoll(part) < row.min || std::stoll(part) > row.max))) {
        std::string fault = "is not a number between " + describe_range(row);
        for (const auto &[type, other] : other_instances)
            if (type == row.type)
                fault = other;
        *out_reason += fault;
        return false;
    }
    if (const char *reason = row.check ? row.check(&kept) : nullptr) {
        *out_reason += reason;
        return false;
    }
    return true;
}

// Refuses parts that the configuration file would not reproduce, and parts that would be invisible.
bool check_part(const std::string &part, std::string *out_reason) {
    const auto is_control = [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7f; };
    const char *fault = nullptr;
    if (std::any_of(part.begin(), part.end(), is_control))
        fault = "has control characters";
    else if (part.front() == ' ' || part.back() == ' ')
        fault = "begins or ends with a blank";
    else if (part.back() == '\\')
        fault = "ends with a backslash";
    else if (part.size() > PART_MAX_BYTES)
        fault = "is longer than 255 characters";
    if (fault)
        *out_reason = "the part \"" + shown_text(part) + "\" of the name " + fault + "; write it without";
    return !fault;
}

} // namespace

bool check_value(const schema_row &row, const node_name &name, const std::string &text, std::string *out_text,
                 std::string *out_reason) {
    for (const std::string &part : name.parts)
        if (!check_part(part, out_reason))
            return false;
    // All instances in the name: a child may be set before they exist.
    for (const schema_row &above : rows) {
        const size_t depth = above.parts.parts.size();
        if (!above.instance || depth > name.parts.size())
            continue;
        const node_name root = {{name.parts.begin(), name.parts.begin() + static_cast<ptrdiff_t>(depth)}};
        if (matches_pattern(above.parts, root) && !check_instance(above, root.parts.back(), out_reason))
            return false;
    }
    if (row.instance) {
        *out_text = name.parts.back();
        // The value may be repeated, as walks report it.
        if (text.empty() || text == *out_text)
            return true;
        *out_reason = "the value of this node is the last part of its name";
        return false;
    }
    const bool secret = name.parts.back() == "password";
    const std::string shown = secret ? "the password" : "\"" + shown_text(text) + "\"";
    if (!canonical_text(row.type, read_hexadecimal(row.type, text), out_text)) {
        *out_reason = shown + " is not a valid " + type_name(row.type);
        return false;
    }
    if (bn_type_string(row.type)) {
        // In bytes: the fields of the daemons have fixed sizes.
        const auto length = static_cast<int64_t>(text.size());
        const bool printable = std::all_of(text.begin(), text.end(),
                                           [](char c) { return static_cast<unsigned char>(c) >= 0x20; });
        if (row.words && !is_one_of(row.words, text))
            *out_reason = shown + " is not one of " + row.words;
        else if (!printable)
            *out_reason = shown + " has control characters";
        else if (length < row.min)
            *out_reason = "the text may not be empty";
        else if (length > row.max)
            *out_reason = shown + " is longer than " + std::to_string(row.max) + " characters";
        else
            out_reason->clear();
        if (!out_reason->empty())
            return false;
    } else if (bn_type_numeric(row.type) &&
               (std::stoll(*out_text) < row.min || std::stoll(*out_text) > row.max)) {
        *out_reason = shown + " is not between " + describe_range(row);
        return false;
    }
    if (const char *reason = row.check ? row.check(out_text) : nullptr) {
        *out_reason = shown + " " + reason;
        return false;
    }
    return true;
}

// --- Reports

const char *alarm_name(const std::string &type) {
    static const struct {
        int type;
        const char *name;
    } alarms[] = {{ALARM_TYPE_ADJACENCY, "adjacency"},
                  {ALARM_TYPE_ASSIGNMENT, "assignment"},
                  {ALARM_TYPE_OVERLOAD, "overload"},
                  {ALARM_TYPE_RESTARTS, "restart-loop"}};
    for (const auto &alarm : alarms)
        if (type == std::to_string(alarm.type))
            return alarm.name;
    return "unknown";
}

const char *role_name(const std::string &role) {
    return role == "0" ? "ACTIVE" : role == "1" ? "BACKUP" : "UNKNOWN";
}
