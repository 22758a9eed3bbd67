#include "platform/mgmtd/messages.h"

#include "mgmt/bnode_proto.h"

const char *const CHANGE_EVENT = "/mgmtd/notify/dbchange";

bn_binding *make_binding(const std::string &name, const node_value &value) {
    owned_binding binding;
    if (bn_binding_new_str_autoinval(&binding.pointer, name.c_str(), bn_attrib_value, value.type, 0,
                                     value.text.c_str()) != LC_OK)
        return nullptr;
    return binding.take();
}

node_value value_of(const bn_binding *binding) {
    node_value out{bn_type_none, ""};
    uint32_t flags = 0;
    owned_text text;
    if (!binding || !binding->attributes ||
        bn_attrib_array_length_quick(binding->attributes) <= bn_attrib_value ||
        bn_binding_get_type(binding, bn_attrib_value, &out.type, &flags) != LC_OK)
        return out;
    out.type &= BN_TYPE_MASK;
    if (!(flags & bn_flag_no_value) &&
        bn_binding_get_str(binding, bn_attrib_value, 0, nullptr, &text.pointer) == LC_OK && text.pointer)
        out.text = text.pointer;
    return out;
}

std::string name_of(const bn_binding *binding) {
    const char *name = binding ? bn_binding_get_name_quick(binding) : nullptr;
    return name ? name : "";
}

// --- Events

static bool append_field(bn_request_msg *msg, const std::string &name, const node_value &value) {
    owned_binding binding(make_binding(name, value));
    return binding.pointer &&
           bn_event_request_msg_append_binding_takeover(msg, 0, &binding.pointer, nullptr) == LC_OK;
}

bn_request_msg *make_event(const std::string &name, const std::vector<event_field> &fields) {
    owned_request msg;
    if (bn_event_request_msg_create(&msg.pointer, name.c_str()) != LC_OK)
        return nullptr;
    for (const event_field &field : fields)
        if (!append_field(msg.pointer, field.name, field.value))
            return nullptr;
    return msg.take();
}

std::vector<event_field> fields_of(const bn_request_msg *msg) {
    std::vector<event_field> out;
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    for (uint32_t i = 0; i < count; i++)
        if (const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i))
            out.push_back({name_of(node->binding), value_of(node->binding)});
    return out;
}

const std::string *find_field(const std::vector<event_field> &fields, const char *name) {
    for (const event_field &field : fields)
        if (field.name == name)
            return &field.value.text;
    return nullptr;
}

// --- Changes

bn_request_msg *make_change_event(const std::vector<const node_change *> &changes) {
    if (changes.empty())
        return nullptr;
    owned_request msg;
    if (bn_event_request_msg_create(&msg.pointer, CHANGE_EVENT) != LC_OK)
        return nullptr;
    // Readers sort the entries by name: numbers of one width keep the order of the tree.
    const size_t width = std::to_string(changes.size()).size();
    size_t number = 0;
    for (const node_change *change : changes) {
        const std::string digits = std::to_string(++number);
        const std::string entry =
            "/mgmtd/notification/dbchange/" + std::string(width - digits.size(), '0') + digits;
        const char *kind = !change->before ? "add" : !change->after ? "delete" : "modify";
        bool made = append_field(msg.pointer, entry, {bn_type_uint32, std::to_string(number)}) &&
                    append_field(msg.pointer, entry + "/change_type", {bn_type_str, kind}) &&
                    append_field(msg.pointer, entry + "/name", {bn_type_str, change->name.text()});
        if (made && change->after)
            made = append_field(msg.pointer, entry + "/new_attribs/value", *change->after);
        if (made && change->before)
            made = append_field(msg.pointer, entry + "/prev_attribs/value", *change->before);
        if (!made)
            return nullptr;
    }
    return msg.take();
}

bool interest_matches(const std::string &pattern, const node_name &name) {
    node_name wanted;
    if (!parse_node_name(pattern, &wanted))
        return false;
    for (size_t i = 0; i < wanted.parts.size(); i++) {
        if (wanted.parts[i] == "**")
            return true;
        if (i >= name.parts.size() || (wanted.parts[i] != "*" && wanted.parts[i] != name.parts[i]))
            return false;
    }
    return wanted.parts.size() == name.parts.size();
}
