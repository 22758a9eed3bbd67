// What the configuration may hold: one row for each kind of node. "*" in a pattern is a part that the
// operator chooses. Everything that mgmtd knows of a node, it knows from its row; mgmtctl helps out of the
// same.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <vector>

// A name by its parts, unescaped. Parts that are numbers are ordered as numbers, so that 2 comes before 10,
// and before all others.
struct node_name {
    std::vector<std::string> parts;

    std::string text() const; // absolute, escaped
    bool is_under(const node_name &above) const;
    node_name below(const std::string &part) const;
    friend bool operator==(const node_name &, const node_name &) = default;
    friend std::strong_ordering operator<=>(const node_name &a, const node_name &b);
};
// False for a name that is relative, has no parts, an empty one, or more than any node has.
bool parse_node_name(const std::string &text, node_name *out);
node_name parsed_name(const std::string &text); // no parts for a text that is no name

struct schema_row {
    const char *pattern;
    uint32_t type;
    const char *fallback; // the default, or null: the node is absent then
    int64_t min, max;     // of a number; of the length of a text; of the number that an instance goes by
    const char *words;    // of a text, separated by "|"
    // Further checks: null, and the text is brought into its one form, or the reason why it is refused.
    const char *(*check)(std::string *inout);
    // The node is one of many: its value is the last part of its name, which is a number, an address or a
    // prefix by the row's type. Its children need it.
    bool instance = false;
    bool recreates =
        false; // a running group follows a change of it only when it is deleted and created again
    node_name parts = {};
};
const std::vector<schema_row> &schema();
// Patterns of the nodes that the daemons answer for.
const std::vector<const char *> &wccpd_state_nodes();
const std::vector<const char *> &tunneld_state_nodes();
const schema_row *find_schema_row(const node_name &name); // null: there is no such node
bool matches(const node_name &pattern, const node_name &name);

// A text from outside as messages quote it: without control characters, and cut when it is long.
std::string shown_text(const std::string &text);
// Checks the parts of the name and brings the value into its one form. False with the reason for a bad one;
// the reason repeats no password.
bool check_value(const schema_row &row, const node_name &name, const std::string &text, std::string *out_text,
                 std::string *out_reason);
// Text of one type into the form that the type's own conversion gives.
bool canonical_text(uint32_t type, const std::string &text, std::string *out_text);
// The words for the numbers in wccpd's reports.
const char *alarm_name(const std::string &type);
const char *role_name(const std::string &role);
