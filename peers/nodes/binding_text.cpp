#include "peers/nodes/binding_text.h"

const char *type_name(uint32_t type) {
    return lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(type));
}

bool type_named(const std::string &name, uint32_t *out_type) {
    int32_t type = 0;
    if (lc_string_to_enum(bn_type_table, name.c_str(), &type) != LC_OK)
        return false;
    *out_type = static_cast<uint32_t>(type);
    return true;
}

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
    // The field also has the flags.
    out.type &= BN_TYPE_MASK;
    // A node may be reported without its value. Its type counts all the same.
    if (!(flags & bn_flag_no_value) &&
        bn_binding_get_str(binding, bn_attrib_value, 0, nullptr, &text.pointer) == LC_OK && text.pointer)
        out.text = text.pointer;
    return out;
}

std::string name_of(const bn_binding *binding) {
    const char *name = binding ? bn_binding_get_name_quick(binding) : nullptr;
    return name ? name : "";
}

std::vector<event_field> fields_of(const bn_request_msg *msg) {
    std::vector<event_field> out;
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    out.reserve(count);
    for (uint32_t i = 0; i < count; i++)
        if (const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i))
            out.push_back({name_of(node->binding), value_of(node->binding)});
    return out;
}

std::vector<event_field> fields_of(const bn_response_msg *msg) {
    std::vector<event_field> out;
    const uint32_t count = bn_response_per_node_array_length_quick(msg->nodes);
    out.reserve(count);
    for (uint32_t i = 0; i < count; i++)
        if (const bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i))
            out.push_back({name_of(node->binding), value_of(node->binding)});
    return out;
}

const std::string *find_field(const std::vector<event_field> &fields, const char *name) {
    for (const event_field &field : fields)
        if (field.name == name)
            return &field.value.text;
    return nullptr;
}
