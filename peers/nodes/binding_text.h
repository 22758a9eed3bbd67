// Converts bindings to text and back, for mgmtd and mgmtctl.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "mgmt/owners.h"

struct node_value {
    uint32_t type;
    std::string text;
    friend bool operator==(const node_value &, const node_value &) = default;
};
struct event_field {
    std::string name;
    node_value value;
};

const char *type_name(uint32_t type); // "uint32", "string", "ipv4addr"
bool type_named(const std::string &name, uint32_t *out_type);

// A binding with the value of that text. Null when the text is no value of the type, or there is no memory.
bn_binding *make_binding(const std::string &name, const node_value &value);
// The value as text, "" when there is none, and the type without its flags.
node_value value_of(const bn_binding *binding);
std::string name_of(const bn_binding *binding);

// The bindings of a message, in their order.
std::vector<event_field> fields_of(const bn_request_msg *msg);
std::vector<event_field> fields_of(const bn_response_msg *msg);
const std::string *find_field(const std::vector<event_field> &fields, const char *name);
