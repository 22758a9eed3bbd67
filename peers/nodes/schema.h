// The nodes that a configuration may have: one row for each kind of node. In a pattern "*" is a part that the
// operator chooses. mgmtd checks nodes by this table, and mgmtctl takes its help texts from it.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <vector>

// A name as its parts, unescaped. Parts that are numbers are ordered by their value, so that 2 comes before
// 10, and come before other parts.
struct node_name {
    std::vector<std::string> parts;

    std::string text() const; // absolute, escaped
    bool is_under(const node_name &above) const;
    node_name below(const std::string &part) const;
    friend bool operator==(const node_name &, const node_name &) = default;
    friend std::strong_ordering operator<=>(const node_name &a, const node_name &b);
};
// False for a relative name, one without parts or with an empty part, and one with more than 64 parts.
bool parse_node_name(const std::string &text, node_name *out);
node_name parsed_name(const std::string &text); // without parts if the text is not a name

struct schema_row {
    const char *pattern;
    uint32_t type;
    const char *fallback; // the default; null: without a value the node is absent
    int64_t min, max;     // of a number, of the length of a text, or of the number of an instance
    const char *words;    // values of a text, separated by "|"; null: any
    // Brings the value into its canonical form and gives null, or gives why it is refused. May be null.
    const char *(*check)(std::string *inout);
    // The node is one of many, such as a group. Its value is the last part of its name: a number, an address
    // or a prefix, by the type of the row. Its children exist only with it.
    bool instance = false;
    bool recreates = false; // a running group follows a change only when it is deleted and created again
    node_name parts = {};   // of the pattern
};
const std::vector<schema_row> &schema_rows();
// Patterns of the state nodes that wccpd and tunneld answer.
const std::vector<const char *> &wccpd_state_nodes();
const std::vector<const char *> &tunneld_state_nodes();
const schema_row *find_schema_row(const node_name &name); // null: there is no such node
bool matches_pattern(const node_name &pattern, const node_name &name);

// A text from outside for use in a message: without control characters, and cut when it is long.
std::string shown_text(const std::string &text);
// Checks the parts of the name and the value, and brings the value into its canonical form. False with the
// reason, in which a password is not repeated.
bool check_value(const schema_row &row, const node_name &name, const std::string &text, std::string *out_text,
                 std::string *out_reason);
// Brings a value of the type into canonical form by the conversions of the bindings.
bool canonical_text(uint32_t type, const std::string &text, std::string *out_text);
// The names of an alarm type and of a role, which events have as decimal numbers; "unknown" and "UNKNOWN" for
// others.
const char *alarm_name(const std::string &type);
const char *role_name(const std::string &role);
