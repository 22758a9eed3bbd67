// The configuration: read completely at the start, then followed change by change while groups run.
//
// mgmtd holds the configuration as bindings; the daemon keeps none of it except the table of policy
// memberships. There are two paths into the engine. The group path builds a whole wccp_grp_config from the
// subtree of a group and adds the group, or deletes the group. It is used for every group at the start, and
// later for a change that adds or removes the root node of a group. The node path modifies one field of a
// running group for each changed binding. The table in wccpd_group_nodes.cpp defines the nodes of a group for
// both.
//
// A binding of the wrong type ends the walk of its array; what was applied before it stays. Nodes are found
// by name through the index of the array, so that the time of the start grows linearly with the size of the
// tree.
//
// Main thread only. No function waits for mgmtd in the middle of a walk.
#include "daemon/wccpd_config.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "daemon/wccpd_group_nodes.h"
#include "daemon/wccpd_main.h"
#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_config.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "mgmt/bnode.h"
#include "mgmt/log_sync.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

namespace {

constexpr const char *GROUP_ROOTS = NODE_GROUP_CONFIG "/*";
constexpr const char *POLICY_ROOTS = NODE_POLICY_CONFIG "/*";
constexpr uint16_t ORPHANED_POLICY = 300; // where the members of a deleted policy group go

// --- The arrays of bindings

struct config_walk {
    const bn_binding_array *bindings;
    config_change_time time;
    const uint32_t *router_entries; // number of router entries of a group, by the index of its root's binding
};

// Needed for a change during the start: the answer may have had its group already, or no longer.
bool group_exists(uint8_t id) {
    const wccp_engine_lock lock;
    return wccp_find_group(id) != nullptr;
}

lc_status read_deleted_mark(const bn_binding *binding, bool *out) {
    uint32_t flags = 0;
    CHECK_STATUS(bn_binding_get_type(binding, bn_attrib_value, nullptr, &flags));
    *out = (flags & bn_flag_deleted) != 0;
    return LC_OK;
}

lc_status read_root_deleted_mark(const bn_binding_array *bindings, const char *root, bool *out) {
    const bn_binding *binding = nullptr;
    CHECK_STATUS(bn_binding_array_get_binding_by_name(bindings, root, &binding));
    if (!binding)
        CHECK_STATUS(LC_NOT_FOUND);
    CHECK_STATUS(read_deleted_mark(binding, out));
    return LC_OK;
}

// If `name` is a router entry, outputs the index of the binding of its group's root, otherwise -1.
lc_status find_root_of_router_entry(const bn_binding_array *bindings, const char *name, int32_t *out_index) {
    constexpr std::string_view list = "/router";
    std::string_view root = name;
    *out_index = -1;
    root = root.substr(0, root.rfind('/'));
    char text[512];
    if (!root.ends_with(list) || root.size() >= sizeof text)
        return LC_OK;
    root.remove_suffix(list.size());
    memcpy(text, root.data(), root.size());
    text[root.size()] = 0;
    CHECK_STATUS(bn_binding_array_get_index_by_name(bindings, text, out_index));
    return LC_OK;
}

// Counts for all groups in one pass: a pass for each group would take too long at the start.
lc_status count_router_entries(const bn_binding_array *bindings, uint32_t *counts) {
    const uint32_t length = bn_binding_array_length_quick(bindings);
    for (uint32_t i = 0; i < length; i++) {
        const bn_binding *binding = bn_binding_array_get_quick(bindings, i);
        const char *name = binding ? bn_binding_get_name_quick(binding) : nullptr;
        int32_t root = -1;
        if (name)
            CHECK_STATUS(find_root_of_router_entry(bindings, name, &root));
        if (root >= 0)
            counts[root]++;
    }
    return LC_OK;
}

// --- Whole groups

void delete_engine_group(uint8_t id, config_change_time time) {
    if (time != CONFIG_CHANGE_RUNNING && !group_exists(id))
        QV_LOG(LC_LOG_INFO, "WCCP update: Group %d was deleted before the start read it", id);
    else if (wccp_del_group(id) == 0)
        QV_LOG(LC_LOG_INFO, "WCCP update: Deleted Group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "WCCP update: Failed to delete Group %d", id);
}

// With N entries, looks for the numbers 1 to N. A gap in the numbers therefore loses the last entries.
lc_status take_routers(const group_node *node, const config_walk *walk, const char *root,
                       wccp_grp_config *config) {
    int32_t place = -1;
    CHECK_STATUS(bn_binding_array_get_index_by_name(walk->bindings, root, &place));
    const uint32_t count = place < 0 ? 0 : walk->router_entries[place];
    for (uint32_t number = 1; number <= count; number++) {
        char relative[48];
        snprintf(relative, sizeof relative, "router/%u/ipaddr", number);
        const bn_binding *binding = nullptr;
        CHECK_STATUS(bn_binding_array_get_binding_by_name_rel(walk->bindings, root, relative, &binding));
        if (binding)
            CHECK_STATUS(node->take(node, config, binding));
    }
    return LC_OK;
}

lc_status take_group_nodes(const config_walk *walk, const char *root, wccp_grp_config *config) {
    for (const group_node &node : group_nodes) {
        if (!node.name) {
            CHECK_STATUS(take_routers(&node, walk, root, config));
            continue;
        }
        const bn_binding *binding = nullptr;
        CHECK_STATUS(bn_binding_array_get_binding_by_name_rel(walk->bindings, root, node.name, &binding));
        if (binding)
            CHECK_STATUS(node.take(&node, config, binding));
    }
    return LC_OK;
}

lc_status wccpd_config_update_group(const char *id_text, const config_walk *walk, const char *root) {
    CHECK_NULL(id_text);
    CHECK_NULL(walk);
    CHECK_NULL(root);
    const uint8_t id = static_cast<uint8_t>(strtol(id_text, nullptr, 10)); // the low 8 bits: 300 is group 44
    QV_LOG(LC_LOG_INFO, "WCCP config query group %s(%d) - %s", id_text, id, root);
    wccp_grp_config config = {};
    bool deleted = false;
    CHECK_STATUS(read_root_deleted_mark(walk->bindings, root, &deleted));
    if (deleted) {
        delete_engine_group(id, walk->time);
        leave_policy_group(id); // also when the group could not be deleted
        return LC_OK;
    }
    if (walk->time != CONFIG_CHANGE_RUNNING && group_exists(id)) {
        QV_LOG(LC_LOG_INFO, "WCCP update: Group %d was added before the start read it", id);
        return LC_OK;
    }
    config.group_id = id;
    // Nodes that are absent leave their fields 0; without `admin` the group is added but not started.
    CHECK_STATUS(take_group_nodes(walk, root, &config));
    if (wccp_add_group(&config) == 0)
        QV_LOG(LC_LOG_INFO, "Created WCCP group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "FAILED to create WCCP group %d", id); // the walk continues with the next group
    return LC_OK;
}

lc_status wccpd_config_update_policy_group(const bn_binding_array *bindings, const char *root,
                                           const char *id_text) {
    CHECK_NULL(bindings);
    const uint16_t id = static_cast<uint16_t>(strtol(id_text, nullptr, 10));
    QV_LOG(LC_LOG_INFO, "WCCP policy config query group %s(%d) - %s", id_text, id, root);
    bool deleted = false;
    CHECK_STATUS(read_root_deleted_mark(bindings, root, &deleted));
    if (!deleted) {
        // This only publishes the role; the members follow with the nodes of their groups.
        if (wccp_add_policy_grp(id, 0, nullptr) == 0)
            QV_LOG(LC_LOG_INFO, "WCCP update: Added policy Group %d", id);
        else
            QV_LOG(LC_LOG_ERR, "WCCP update: Failed to add policy Group %d", id);
        return LC_OK;
    }
    if (wccp_del_entire_policy_grp(id) == 0)
        QV_LOG(LC_LOG_INFO, "WCCP update: Deleted policy Group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "WCCP update: Failed to delete policy Group %d", id);
    move_policy_members(id, ORPHANED_POLICY);
    return LC_OK;
}

lc_status wccpd_config_update_handler(const bn_binding_array *, uint32_t, bn_binding *, const tstring *name,
                                      const tstr_array *, const tstring *last_part, const tstring *,
                                      void *walk) {
    CHECK_STATUS(
        wccpd_config_update_group(ts_str(last_part), static_cast<const config_walk *>(walk), ts_str(name)));
    return LC_OK;
}

lc_status wccpd_config_policy_update_handler(const bn_binding_array *bindings, uint32_t, bn_binding *,
                                             const tstring *name, const tstr_array *,
                                             const tstring *last_part, const tstring *, void *) {
    CHECK_STATUS(wccpd_config_update_policy_group(bindings, ts_str(name), ts_str(last_part)));
    return LC_OK;
}

lc_status walk_policy_groups(const bn_binding_array *bindings, config_change_time, uint32_t *out_count) {
    CHECK_STATUS(mdc_foreach_binding_prequeried(bindings, POLICY_ROOTS, nullptr,
                                                wccpd_config_policy_update_handler, nullptr, out_count));
    return LC_OK;
}

lc_status walk_groups(const bn_binding_array *bindings, config_change_time time, uint32_t *out_count) {
    // The extra element is for an empty array: calloc(0) may return null, as if there were no memory.
    owned<void, bn_free_memory> counts(
        calloc(bn_binding_array_length_quick(bindings) + size_t{1}, sizeof(uint32_t)));
    CHECK_NULL(counts.pointer);
    uint32_t *router_entries = static_cast<uint32_t *>(counts.pointer);
    CHECK_STATUS(count_router_entries(bindings, router_entries));
    config_walk walk = {bindings, time, router_entries};
    CHECK_STATUS(mdc_foreach_binding_prequeried(bindings, GROUP_ROOTS, nullptr, wccpd_config_update_handler,
                                                &walk, out_count));
    return LC_OK;
}

// --- One changed node

lc_status change_facility(const bn_binding *binding) {
    uint32_t facility = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &facility));
    const char *name = lc_enum_to_string(lc_log_facility_table, static_cast<int32_t>(facility));
    // Facilities are multiples of 8 in syslog's numbers.
    LC_LOG(LC_LOG_INFO, "system facility to %d(%s), %s", static_cast<int>(facility >> 3), name,
           wccpd_program_name);
    (void)lc_log_file(nullptr, "system facility set to %s, %s", name, wccpd_program_name);
    // lc_log_init resets the log levels that management has set. They do not depend on the facility.
    lc_log_levels levels;
    CHECK_STATUS(lc_log_save_levels(&levels));
    CHECK_STATUS(lc_log_init(wccpd_program_name, nullptr, 0, WCCPD_LOG_COMPONENT, LC_LOG_DEBUG,
                             static_cast<int32_t>(facility), 1));
    CHECK_STATUS(lc_log_restore_levels(&levels));
    return LC_OK;
}

lc_status change_global(const char *name, const bn_binding *binding) {
    if (strcmp(name, NODE_MCAST_TTL) != 0) {
        QV_LOG(LC_LOG_ERR, "WCCP update: Unknown global binding %s", name);
        return LC_OK;
    }
    uint32_t ttl = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &ttl));
    if (wccp_set_mcast_ttl(static_cast<uint8_t>(ttl)) != 0)
        QV_LOG(LC_LOG_ERR, "FAILED to update multicast TTL (%d)", static_cast<uint8_t>(ttl));
    return LC_OK;
}

const group_node *find_changing_node(const char *name) {
    for (const group_node &node : group_nodes)
        if (node.changes && strcmp(node.name, name) == 0)
            return &node;
    return nullptr;
}

// Applies a changed or deleted node of a group. A running group cannot follow some changes: a deleted node
// deletes the group, and router entries, priority and protocol are fixed. If the answer contains the change
// there is nothing to do for these, because the group was added with their new values.
lc_status change_group(const char *name, const tstr_array *parts, const bn_binding *binding, bool deleted,
                       config_change_time time) {
    constexpr uint32_t GROUP_PART = 5, NODE_PART = 6, NODE_PARTS = 7;
    const char *id_text = tstr_array_get_str_quick(parts, GROUP_PART);
    const uint8_t id = static_cast<uint8_t>(id_text ? strtol(id_text, nullptr, 10) : 0);
    // Deeper nodes, such as router entries, have more parts.
    const char *last =
        tstr_array_length_quick(parts) == NODE_PARTS ? tstr_array_get_str_quick(parts, NODE_PART) : nullptr;
    const group_node *node = last ? find_changing_node(last) : nullptr;
    const bool known = node || (last && strcmp(last, "assign_detail") == 0); // which has no effect
    if (time == CONFIG_CHANGE_IN_ANSWER && (deleted || !known)) {
        QV_LOG(LC_LOG_INFO, "WCCP update: %s was changed before the start read it", name);
        return LC_OK;
    }
    if (deleted) { // any node: the whole group is deleted
        delete_engine_group(id, time);
        return LC_OK;
    }
    if (!known) {
        QV_LOG(LC_LOG_ERR, "WCCP update: Unknown binding %s", name);
        return LC_OK;
    }
    if (time != CONFIG_CHANGE_RUNNING && !group_exists(id)) {
        QV_LOG(LC_LOG_INFO, "WCCP update: Group %d was deleted before the start read it", id);
        return LC_OK;
    }
    wccp_grp_config config = {};
    config.group_id = id;
    // For a node without a flag, such as policy_grp, `take` does everything, and there is nothing to modify.
    if (node)
        CHECK_STATUS(node->take(node, &config, binding));
    if (wccp_modify_grp(&config) != 0)
        QV_LOG(LC_LOG_ERR, "WCCP update group %d failed.", id);
    return LC_OK;
}

lc_status wccpd_config_handle_change(bn_binding_array *, uint32_t, bn_binding *binding, void *data) {
    const config_change_time time = *static_cast<const config_change_time *>(data);
    const tstring *stored = nullptr;
    CHECK_STATUS(bn_binding_get_name(binding, &stored));
    const char *name = ts_str(stored);
    CHECK_NULL(name);
    owned_tstr_array parts;
    CHECK_STATUS(bn_binding_name_to_parts(name, &parts.pointer, nullptr));
    LC_LOG(LC_LOG_INFO, "%s: updating %s", __func__, name);
    // The facility is not below wccpd's own nodes, therefore it is handled before the filter.
    if (strcmp(name, NODE_SYSTEM_FACILITY) == 0) {
        CHECK_STATUS(change_facility(binding));
        return LC_OK;
    }
    if (!wccpd_is_under(name, NODE_WCCPD) && strcmp(name, NODE_SYSTEM_MODE) != 0) {
        LC_LOG(LC_LOG_DEBUG, "%s: %s not for us, discarding", __func__, name);
        return LC_OK;
    }
    bool deleted = false;
    CHECK_STATUS(read_deleted_mark(binding, &deleted));
    if (wccpd_is_under(name, NODE_WCCPD_CONFIG)) {
        CHECK_STATUS(change_global(name, binding));
    } else if (wccpd_is_under(name, NODE_GROUP_CONFIG)) {
        CHECK_STATUS(change_group(name, parts.pointer, binding, deleted, time));
    } else if (strcmp(name, NODE_SYSTEM_MODE) == 0) {
        owned_tstring mode;
        CHECK_STATUS(wccpd_read_text(binding, &mode));
        (void)wccp_system_mode_change_event(ts_str(mode.pointer));
    } else if (!wccpd_is_under(name, NODE_POLICY_CONFIG)) {
        QV_LOG(LC_LOG_INFO, "WCCP update: Unsupported binding %s", name);
    }
    return LC_OK;
}

// The walk over an array ends only with this status.
lc_status change_or_halt(bn_binding_array *bindings, uint32_t index, bn_binding *binding, void *data) {
    return wccpd_config_handle_change(bindings, index, binding, data) == LC_OK ? LC_OK
                                                                               : LC_FOREACH_HALT_ERROR;
}

// --- The whole configuration, and a change event

lc_status query_tree(const char *root, owned_bindings *out) {
    CHECK_STATUS(mdc_get_binding_children(wccpd_mcc, nullptr, nullptr, 1, &out->pointer, 0, 1, root));
    return LC_OK;
}

lc_status query_nodes(const char *root) {
    config_change_time time = CONFIG_CHANGE_RUNNING;
    owned_bindings bindings;
    CHECK_STATUS(query_tree(root, &bindings));
    if (bindings.pointer)
        CHECK_STATUS(bn_binding_array_foreach(bindings.pointer, change_or_halt, &time));
    return LC_OK;
}

lc_status query_roots(const char *root,
                      lc_status (*walk_roots)(const bn_binding_array *bindings, config_change_time time,
                                              uint32_t *out_count)) {
    owned_bindings bindings;
    CHECK_STATUS(query_tree(root, &bindings));
    if (bindings.pointer)
        CHECK_STATUS(walk_roots(bindings.pointer, CONFIG_CHANGE_RUNNING, nullptr));
    return LC_OK;
}

} // namespace

lc_status wccpd_config_query() {
    forget_policy_memberships();
    CHECK_STATUS(query_nodes(NODE_SYSTEM_CONFIG)); // the system mode takes effect before there are groups
    CHECK_STATUS(query_nodes(NODE_WCCPD_CONFIG));
    (void)qv_init_log_level(wccpd_mcc); // without it the levels stay as they are
    // Policy groups come before the service groups that join them.
    CHECK_STATUS(query_roots(NODE_POLICY_CONFIG, walk_policy_groups));
    CHECK_STATUS(query_roots(NODE_GROUP_CONFIG, walk_groups));
    return LC_OK;
}

lc_status wccpd_config_apply(bn_binding_array *new_values, config_change_time time) {
    // An event may also carry the log levels.
    (void)qv_handle_log_level_change(new_values);
    uint32_t count = 0;
    CHECK_STATUS(walk_policy_groups(new_values, time, &count));
    QV_LOG(LC_LOG_INFO, "WCCP Group policy config callbacks: %d", static_cast<int>(count));
    CHECK_STATUS(walk_groups(new_values, time, &count));
    QV_LOG(LC_LOG_INFO, "WCCP Group config callbacks: %d", static_cast<int>(count));
    if (count != 0) // the event adds or deletes a group: single nodes in it are not applied
        return LC_OK;
    CHECK_STATUS(bn_binding_array_foreach(new_values, change_or_halt, &time));
    QV_LOG(LC_LOG_INFO, "WCCP Modify config complete");
    return LC_OK;
}
