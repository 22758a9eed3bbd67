// Answering monitoring queries, and decoding the event that reports a configuration change.
//
// A monitoring query contains the nodes that the daemon has registered, as "registration_info" nodes. They
// are put into a tree for the time of the query, and only names in that tree can be iterated. For a
// registered wildcard ("/a/*") the daemon is asked for the names of the children.
//
// All of this runs in the session's callback. The work that a query can cause is limited: in the depth and
// number of registered names, since the tree is processed recursively, and in the size of the answer.
#include <cstdlib>
#include <cstring>

#include "mgmt/mdc_main.h"
#include "mgmt/mdc_remote_reg.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

constexpr const char *WILDCARD = "*";
// A name of more parts isn't registered: the tree is processed and freed by recursion, and a peer chooses the
// names.
constexpr uint32_t REGISTERED_PARTS_MAX = 64;
// For all names together: a node of the tree takes far more memory than a name part takes in a message.
constexpr uint32_t REGISTERED_TOTAL_MAX = 4096;

// --- Registered nodes

struct mdc_remote_reg {
    tstring *name;
    uint32_t cap_mask;
};

void mdc_remote_reg_free(mdc_remote_reg **inout) {
    if (!inout || !*inout)
        return;
    ts_free(&(*inout)->name);
    free(*inout);
    *inout = nullptr;
}

namespace {

void free_reg(mdc_remote_reg *record) {
    mdc_remote_reg_free(&record);
}

} // namespace

using owned_reg = owned<mdc_remote_reg, free_reg>;

void mdc_remote_reg_free_for_tree(void *value) {
    free_reg(static_cast<mdc_remote_reg *>(value));
}

lc_status mdc_remote_reg_new_node(mdc_remote_reg **out, const char *name, uint32_t cap_mask) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_reg record(static_cast<mdc_remote_reg *>(calloc(1, sizeof(mdc_remote_reg))));
    CHECK_NULL(record.pointer);
    CHECK_STATUS(ts_new_str(&record.pointer->name, name));
    record.pointer->cap_mask = cap_mask;
    *out = record.take();
    return LC_OK;
}

// On success the tree owns the record.
lc_status mdc_remote_reg_add_node(tree *registered, mdc_remote_reg **inout_record) {
    CHECK_NULL(inout_record);
    CHECK_NULL(*inout_record);
    // A name that is registered twice has the later record; the tree frees the earlier one.
    CHECK_STATUS(tree_set_node_value_by_path_str(registered, nullptr, ts_str((*inout_record)->name),
                                                 *inout_record, 1, nullptr));
    *inout_record = nullptr;
    return LC_OK;
}

lc_status mdc_remote_reg_get_node_tree(const tree *registered, const tstr_array *parts, tree_node **out_node,
                                       const mdc_remote_reg **out_record) {
    *out_node = nullptr;
    *out_record = nullptr;
    const lc_status status = tree_get_node_by_path_wildcarded(registered, nullptr, parts, WILDCARD, out_node);
    if (status == LC_NOT_FOUND) {
        *out_node = nullptr;
        return LC_OK;
    }
    CHECK_STATUS(status);
    void *value = nullptr;
    CHECK_STATUS(tree_node_get_value(registered, *out_node, &value));
    *out_record = static_cast<const mdc_remote_reg *>(value);
    return LC_OK;
}

const char *mdc_remote_reg_get_name(const mdc_remote_reg *record) {
    return record ? ts_str(record->name) : nullptr;
}
uint32_t mdc_remote_reg_get_cap_mask(const mdc_remote_reg *record) {
    return record ? record->cap_mask : 0;
}

// --- Iterating over the registered nodes

namespace {

// The size of the answer so far. If it exceeds a frame, which can't be sent, the search ends at once: the
// memory of this process may be locked.
struct mon_answer {
    uint64_t bytes;
    bool too_large;
};
struct mon_walk {
    tree *registered;
    uint32_t flags;
    mdc_mon_get_function get;
    void *get_data;
    mdc_mon_iterate_function iterate;
    void *iterate_data;
    bn_binding_array *found;
    mon_answer *answer;
};

lc_status mdc_mon_iterate_node_internal(const mon_walk *walk, tstr_array *parts, uint32_t depth);

// The number of bytes that a binding takes in a message; a little too large for a name with escapes.
uint64_t wire_bytes(const bn_binding *binding) {
    constexpr uint64_t NODE_BYTES = 13, PART_BYTES = 4, ATTRIBUTE_BYTES = 20;
    uint64_t bytes = NODE_BYTES;
    const char *name = bn_binding_get_name_quick(binding);
    for (; name && *name; name++)
        bytes += *name == '/' ? PART_BYTES : 1;
    const bn_attrib *value = nullptr;
    if (bn_binding_get_attrib(binding, bn_attrib_value, &value) == LC_OK && value)
        bytes += ATTRIBUTE_BYTES + value->value_size;
    return bytes;
}

lc_status report_node(const mon_walk *walk, const char *name, const tstr_array *parts) {
    // The daemon may append any number of bindings; only those are counted.
    uint32_t at = bn_binding_array_length_quick(walk->found);
    CHECK_STATUS(walk->get(name, parts, walk->get_data, walk->found));
    for (; at < bn_binding_array_length_quick(walk->found); at++)
        walk->answer->bytes += wire_bytes(bn_binding_array_get_quick(walk->found, at));
    walk->answer->too_large = walk->answer->bytes > GCL_FRAME_MAX;
    return LC_OK;
}

lc_status walk_child(const mon_walk *walk, tstr_array *parts, const char *child, uint32_t depth) {
    owned_tstring name;
    CHECK_STATUS(ts_new_str(&name.pointer, child));
    CHECK_STATUS(tstr_array_append_takeover(parts, &name.pointer));
    // The parts are restored also after a failure, before it is returned.
    const lc_status status = mdc_mon_iterate_node_internal(walk, parts, depth);
    owned_tstring popped;
    CHECK_STATUS(tstr_array_pop(parts, &popped.pointer));
    CHECK_STATUS(status);
    return LC_OK;
}

struct child_walk {
    const mon_walk *walk;
    tstr_array *parts;
    uint32_t depth;
};

lc_status walk_tree_child(tree *, tree_node *, const char *name, void *value, void *data) {
    (void)value;
    const child_walk *child = static_cast<const child_walk *>(data);
    CHECK_STATUS(walk_child(child->walk, child->parts, name, child->depth));
    return LC_OK;
}

// The name is that of a registered wildcard: the daemon is asked for the children of its parent.
lc_status walk_wildcard(const mon_walk *walk, tstr_array *parts, uint32_t depth) {
    owned_tstring last;
    CHECK_STATUS(tstr_array_pop(parts, &last.pointer));
    owned_tstring parent;
    // No early return until the last part is back in its place.
    lc_status status = bn_binding_name_parts_to_name_tstr(parts, 1, &parent.pointer);
    owned_tstr_array names;
    if (status == LC_OK)
        status = tstr_array_new(&names.pointer, nullptr);
    if (status == LC_OK)
        status = walk->iterate(ts_str(parent.pointer), parts, walk->iterate_data, names.pointer);
    const uint32_t count = tstr_array_length_quick(names.pointer);
    for (uint32_t i = 0; i < count && status == LC_OK; i++)
        status = walk_child(walk, parts, tstr_array_get_str_quick(names.pointer, i), depth);
    CHECK_STATUS(tstr_array_append_takeover(parts, &last.pointer));
    CHECK_STATUS(status);
    return LC_OK;
}

lc_status walk_children(const mon_walk *walk, tstr_array *parts, tree_node *node, uint32_t depth) {
    child_walk child = {walk, parts, depth};
    CHECK_STATUS(tree_foreach(walk->registered, node, 0, walk_tree_child, &child));
    return LC_OK;
}

lc_status mdc_mon_iterate_node_internal(const mon_walk *walk, tstr_array *parts, uint32_t depth) {
    // Depth 0 is the node that was asked for, 1 its children. Nothing below them is wanted without the flag.
    if ((depth >= 2 && !(walk->flags & bn_qf_subtree)) || walk->answer->too_large)
        return LC_OK;
    owned_tstring name;
    CHECK_STATUS(bn_binding_name_parts_to_name_tstr(parts, 1, &name.pointer));
    tree_node *node = nullptr;
    const mdc_remote_reg *record = nullptr;
    CHECK_STATUS(mdc_remote_reg_get_node_tree(walk->registered, parts, &node, &record));
    // Not registered: only this branch ends.
    if (!node)
        return LC_OK;
    if (!record)
        // Only an intermediate node of registered names.
        return walk_children(walk, parts, node, depth + 1);
    const char *text = ts_str(name.pointer);
    if (lc_is_suffix("/*", mdc_remote_reg_get_name(record), 0) && lc_is_suffix("/*", text, 0))
        // The wildcard is not a level of its own: its children count as those of its parent.
        return walk_wildcard(walk, parts, depth == 0 ? 1 : depth);
    if (depth > 0 || (walk->flags & bn_qf_include_self)) {
        uint32_t children = 0;
        CHECK_STATUS(tree_node_get_num_children(walk->registered, node, &children));
        if (!(walk->flags & bn_qf_walk_only) && (!(walk->flags & bn_qf_leaves_only) || children == 0))
            CHECK_STATUS(report_node(walk, text, parts));
    }
    return walk_children(walk, parts, node, depth + 1);
}

// --- The query

// `inout_total`: the number of parts of all names so far.
lc_status add_registration(tree *registered, const bn_binding *binding, uint32_t *inout_total) {
    const bn_attrib *attribute = nullptr;
    CHECK_STATUS(bn_binding_get_attrib(binding, bn_attrib_capability_mask, &attribute));
    CHECK_NULL(attribute);
    uint32_t id = 0, mask = 0;
    CHECK_STATUS(bn_attrib_get_uint32(attribute, &id, nullptr, &mask));
    if (id != bn_attrib_capability_mask) {
        LC_LOG(LC_LOG_ERR, "Expected cap_mask attribute got %d", static_cast<int>(id));
        return LC_OK;
    }
    const tstr_array *parts = nullptr;
    CHECK_STATUS(bn_binding_get_name_parts_const(binding, &parts, nullptr));
    const uint32_t count = tstr_array_length_quick(parts);
    if (count > REGISTERED_PARTS_MAX) {
        LC_LOG(LC_LOG_ERR, "Ignoring a registered name of %u parts, the limit is %u", count,
               REGISTERED_PARTS_MAX);
        return LC_OK;
    }
    if (*inout_total > REGISTERED_TOTAL_MAX)
        return LC_OK;
    // The first name beyond the limit is logged, further ones are ignored silently by the test above.
    *inout_total += count;
    if (*inout_total > REGISTERED_TOTAL_MAX) {
        LC_LOG(LC_LOG_ERR, "Registered names have more than %u parts in all, ignoring %s and what follows",
               REGISTERED_TOTAL_MAX, bn_binding_get_name_quick(binding));
        return LC_OK;
    }
    owned_reg record;
    CHECK_STATUS(mdc_remote_reg_new_node(&record.pointer, bn_binding_get_name_quick(binding), mask));
    CHECK_STATUS(mdc_remote_reg_add_node(registered, &record.pointer));
    return LC_OK;
}

lc_status answer_node(const mon_walk *walk, const bn_node_info *info, const bn_binding *binding) {
    const char *name = bn_binding_get_name_quick(binding);
    const tstr_array *known = nullptr;
    CHECK_STATUS(bn_binding_get_name_parts_const(binding, &known, nullptr));
    // Iterating changes the parts and needs a copy, which takes many times the bytes of the name, which a
    // peer chooses. A name with more parts than a registered one can have isn't in the tree anyway.
    owned_tstr_array parts;
    const bool walked = info->subop == bn_query_iterate;
    if (walked && tstr_array_length_quick(known) > REGISTERED_PARTS_MAX)
        return LC_OK;
    if (walked || !known)
        CHECK_STATUS(bn_binding_get_name_parts(binding, &parts.pointer));
    switch (info->subop) {
    case bn_query_get:
        CHECK_STATUS(report_node(walk, name, known ? known : parts.pointer));
        return LC_OK;
    case bn_query_iterate:
        CHECK_STATUS(mdc_mon_iterate_node_internal(walk, parts.pointer, 0));
        return LC_OK;
    default:
        LC_LOG(LC_LOG_ERR, "Unexpected query subop %d; ignoring request for binding %s",
               static_cast<int>(info->subop), name);
        return LC_OK;
    }
}

lc_status move_to_response(bn_response_msg *response, bn_binding_array *found, uint32_t node_id) {
    const uint32_t count = bn_binding_array_length_quick(found);
    for (uint32_t i = 0; i < count; i++) {
        owned_binding binding;
        // No shift: removing from the front one by one would take quadratic time.
        CHECK_STATUS(bn_binding_array_remove_no_shift(found, i, &binding.pointer));
        if (binding.pointer)
            CHECK_STATUS(bn_query_response_msg_append_binding_takeover(response, &binding.pointer, node_id));
    }
    CHECK_STATUS(bn_binding_array_empty(found));
    return LC_OK;
}

lc_status refuse_large_answer(const bn_request_msg *request, bn_response_msg **inout_response) {
    CHECK_STATUS(bn_response_msg_free(inout_response));
    CHECK_STATUS(bn_query_response_msg_create(inout_response,
                                              static_cast<uint32_t>(bn_request_get_msg_id(request)),
                                              LC_NO_BUFFER_SPACE, BN_TOO_LARGE));
    return LC_OK;
}

void free_tree(tree *registered) {
    (void)tree_free(&registered);
}

} // namespace

lc_status mdc_dispatch_mon_request(gcl_session *session, bn_request_msg *request, mdc_mon_get_function get,
                                   void *get_data, mdc_mon_iterate_function iterate, void *iterate_data) {
    uint16_t type = 0;
    owned_bindings bindings;
    owned_uint32_array ids;
    owned_node_info info;
    CHECK_STATUS(bn_request_get(request, &type, nullptr, 1, &bindings.pointer, &ids.pointer, &info.pointer));
    CHECK_CONDITION(type == bn_msg_query_request);
    const uint32_t count = bn_binding_array_length_quick(bindings.pointer);
    CHECK_CONDITION(count > 0);
    owned_response response;
    CHECK_STATUS(bn_query_response_msg_create(
        &response.pointer, static_cast<uint32_t>(bn_request_get_msg_id(request)), 0, nullptr));
    // Holds the bindings of one node at a time, until they are moved to the response.
    owned_bindings found;
    CHECK_STATUS(bn_binding_array_new(&found.pointer));
    tree_options options;
    CHECK_STATUS(tree_options_get_defaults(&options));
    options.free_value = mdc_remote_reg_free_for_tree;
    options.parts_to_name = bn_binding_name_parts_to_name;
    options.name_to_parts = bn_binding_name_to_parts;
    owned<tree, free_tree> registered;
    CHECK_STATUS(tree_new(&registered.pointer, &options));
    // A pass of its own, since a registration may follow the node that needs it.
    uint32_t registered_parts = 0;
    for (uint32_t i = 0; i < count; i++)
        if (info.pointer[i].subop == bn_query_registration_info)
            CHECK_STATUS(add_registration(registered.pointer, bn_binding_array_get_quick(bindings.pointer, i),
                                          &registered_parts));
    mon_answer answer = {};
    for (uint32_t i = 0; i < count && !answer.too_large; i++) {
        if (info.pointer[i].subop == bn_query_registration_info)
            continue;
        const mon_walk walk = {registered.pointer, info.pointer[i].flags, get,    get_data, iterate,
                               iterate_data,       found.pointer,         &answer};
        CHECK_STATUS(answer_node(&walk, &info.pointer[i], bn_binding_array_get_quick(bindings.pointer, i)));
        CHECK_STATUS(
            move_to_response(response.pointer, found.pointer, uint32_array_get_quick(ids.pointer, i)));
    }
    if (answer.too_large)
        CHECK_STATUS(refuse_large_answer(request, &response.pointer));
    CHECK_STATUS(bn_response_msg_send(session, response.pointer));
    return LC_OK;
}

// --- The change event

constexpr const char *CHANGE_PATTERN = EVENT_CHANGES "/*";
constexpr uint32_t CHANGE_PARTS = 4;

namespace {

struct change_entry {
    const char *name; // of the changed node
    const bn_binding *old_value;
    const bn_binding *new_value;
    bn_binding_array *old_values; // null if the caller doesn't want them
    bn_binding_array *new_values;
};

lc_status add_renamed(bn_binding_array *out, const bn_binding *value, const char *name) {
    if (!out)
        return LC_OK;
    owned_binding copy;
    CHECK_STATUS(bn_binding_dup(value, &copy.pointer));
    CHECK_STATUS(bn_binding_set_name(copy.pointer, name));
    CHECK_STATUS(bn_binding_array_append_takeover(out, &copy.pointer));
    return LC_OK;
}

lc_status change_add(const change_entry *entry) {
    CHECK_CONDITION(entry->new_value != nullptr && entry->old_value == nullptr);
    CHECK_STATUS(add_renamed(entry->new_values, entry->new_value, entry->name));
    return LC_OK;
}

lc_status change_delete(const change_entry *entry) {
    CHECK_CONDITION(entry->old_value != nullptr && entry->new_value == nullptr);
    CHECK_STATUS(add_renamed(entry->old_values, entry->old_value, entry->name));
    if (!entry->new_values)
        return LC_OK;
    uint32_t type = 0;
    // In the new values a deletion is a binding of the old type with the marks and without a value.
    CHECK_STATUS(bn_binding_get_type(entry->old_value, bn_attrib_value, &type, nullptr));
    owned_binding gone;
    CHECK_STATUS(bn_binding_new_str(&gone.pointer, entry->name, bn_attrib_value, type & 0xffff,
                                    bn_flag_deleted | bn_flag_absent, nullptr));
    CHECK_STATUS(bn_binding_array_append_takeover(entry->new_values, &gone.pointer));
    return LC_OK;
}

lc_status change_modify(const change_entry *entry) {
    CHECK_CONDITION(entry->old_value != nullptr && entry->new_value != nullptr);
    CHECK_STATUS(add_renamed(entry->old_values, entry->old_value, entry->name));
    CHECK_STATUS(add_renamed(entry->new_values, entry->new_value, entry->name));
    return LC_OK;
}

const struct {
    const char *type;
    lc_status (*take)(const change_entry *entry);
} change_types[] = {{"add", change_add}, {"delete", change_delete}, {"modify", change_modify}};

lc_status add_change(bn_binding_array *bindings, const char *entry_name, bn_binding_array *old_values,
                     bn_binding_array *new_values) {
    owned_tstring type, name;
    CHECK_STATUS(bn_binding_array_get_value_tstr_by_name_rel(bindings, entry_name, "change_type", nullptr,
                                                             &type.pointer));
    CHECK_STATUS(
        bn_binding_array_get_value_tstr_by_name_rel(bindings, entry_name, "name", nullptr, &name.pointer));
    CHECK_NULL(type.pointer);
    CHECK_NULL(name.pointer);
    // Either may be absent; which of them a change needs depends on its type.
    const bn_binding *new_value = nullptr, *old_value = nullptr;
    CHECK_STATUS(
        bn_binding_array_get_binding_by_name_rel(bindings, entry_name, "new_attribs/value", &new_value));
    CHECK_STATUS(
        bn_binding_array_get_binding_by_name_rel(bindings, entry_name, "prev_attribs/value", &old_value));
    const change_entry entry = {ts_str(name.pointer), old_value, new_value, old_values, new_values};
    for (const auto &known : change_types)
        if (strcmp(known.type, ts_str(type.pointer)) == 0) {
            CHECK_STATUS(known.take(&entry));
            return LC_OK;
        }
    LC_LOG(LC_LOG_ERR, "Unexpected change type %s under binding %s", ts_str(type.pointer), entry_name);
    return LC_OK;
}

} // namespace

lc_status mdc_event_config_change_notif_extract(bn_binding_array *bindings, bn_binding_array **out_old,
                                                bn_binding_array **out_new) {
    if (out_old)
        *out_old = nullptr;
    if (out_new)
        *out_new = nullptr;
    CHECK_NULL(bindings);
    owned_bindings old_values, new_values;
    if (out_old)
        CHECK_STATUS(bn_binding_array_new(&old_values.pointer));
    if (out_new)
        CHECK_STATUS(bn_binding_array_new(&new_values.pointer));
    // Sorted, so that the same names are neighbours and the searches below are by bisection.
    CHECK_STATUS(bn_binding_array_sort(bindings));
    const uint32_t count = bn_binding_array_length_quick(bindings);
    const char *before = nullptr;
    for (uint32_t i = 0; i < count; i++) {
        const bn_binding *binding = bn_binding_array_get_quick(bindings, i);
        const char *name = binding ? bn_binding_get_name_quick(binding) : nullptr;
        // A name that occurs several times is processed once: each time would copy its values, and a peer
        // could use up the memory by repeating it.
        if (!name || (before && strcmp(before, name) == 0))
            continue;
        before = name;
        owned_tstr_array parts;
        int absolute = 0;
        CHECK_STATUS(bn_binding_name_to_parts(name, &parts.pointer, &absolute));
        if (tstr_array_length_quick(parts.pointer) != CHANGE_PARTS ||
            !bn_binding_name_parts_pattern_match(parts.pointer, absolute, CHANGE_PATTERN))
            continue;
        CHECK_STATUS(add_change(bindings, name, old_values.pointer, new_values.pointer));
    }
    if (out_old)
        *out_old = old_values.take();
    if (out_new)
        *out_new = new_values.take();
    return LC_OK;
}
