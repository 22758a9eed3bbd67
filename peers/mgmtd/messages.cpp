#include "peers/mgmtd/messages.h"

#include "mgmt/bnode_proto.h"
#include "mgmt/node_paths.h"

// --- Events

namespace {

bool append_field(bn_request_msg *msg, const std::string &name, const node_value &value) {
    owned_binding binding(make_binding(name, value));
    return binding.pointer &&
           bn_event_request_msg_append_binding_takeover(msg, 0, &binding.pointer, nullptr) == LC_OK;
}

} // namespace

bn_request_msg *make_event(const std::string &name, const std::vector<event_field> &fields) {
    owned_request msg;
    if (bn_event_request_msg_create(&msg.pointer, name.c_str()) != LC_OK)
        return nullptr;
    for (const event_field &field : fields)
        if (!append_field(msg.pointer, field.name, field.value))
            return nullptr;
    return msg.take();
}

// --- Changes

bn_request_msg *make_change_event(const std::vector<const node_change *> &changes) {
    if (changes.empty())
        return nullptr;
    owned_request msg;
    if (bn_event_request_msg_create(&msg.pointer, EVENT_CONFIG_CHANGE) != LC_OK)
        return nullptr;
    // Readers sort the entries by name. Numbers of the same width keep the order of the tree.
    const size_t width = std::to_string(changes.size()).size();
    size_t number = 0;
    for (const node_change *change : changes) {
        const std::string digits = std::to_string(++number);
        const std::string entry = EVENT_CHANGES "/" + std::string(width - digits.size(), '0') + digits;
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
