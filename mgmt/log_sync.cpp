// Log levels and the time zone from the management tree. A node that doesn't exist leaves its level
// unchanged.
#include "mgmt/log_sync.h"

#include <cstdio>
#include <cstring>

#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {

// The path of the file is a single part of the name; therefore its slashes are escaped.
#define MESSAGES_FILE NODE_SYSLOG "/action/file/\\/var\\/log\\/messages"
constexpr const char *SYSTEM_LEVEL = MESSAGES_FILE "/facility/all/min_priority";
constexpr const char *OVERRIDE_ENABLE = MESSAGES_FILE "/facility/override/enable";

struct node_name {
    char text[160];
};
node_name process_level_node() {
    node_name name;
    snprintf(name.text, sizeof name.text, NODE_SYSLOG "/process/%s/log_level", lc_log_get_lls_process_name());
    return name;
}
// The number of the process's syslog facility among the local ones: 1 for local1.
int class_index() {
    int32_t facility = 0;
    (void)lc_log_get_syslog_facility(&facility);
    // The low three bits are for the level. Local facilities begin at number 16.
    return ((facility >> 3) & 127) - 16;
}
node_name class_level_node() {
    node_name name;
    snprintf(name.text, sizeof name.text, MESSAGES_FILE "/facility/single/local%d/min_priority",
             class_index());
    return name;
}

lc_status read_level_text(mdc *session, const char *node, owned_tstring *out) {
    owned_binding binding;
    CHECK_STATUS(mdc_get_binding(session, nullptr, nullptr, 0, &binding.pointer, node, nullptr));
    if (binding.pointer)
        CHECK_STATUS(
            bn_binding_get_tstr(binding.pointer, bn_attrib_value, bn_type_str, nullptr, &out->pointer));
    return LC_OK;
}
bool is_filled(const owned_tstring &text) {
    return text.pointer && ts_length(text.pointer) > 0;
}

lc_status enable_class_override(const char *level) {
    // In this order: a level that isn't a level's name turns the switch off again.
    CHECK_STATUS(lc_log_enable_override_log_level(0, 1));
    CHECK_STATUS(lc_log_set_override_log_level(level));
    return LC_OK;
}

lc_status set_daemon_level(const char *name) {
    int32_t level = 0;
    CHECK_QUIET(lc_string_to_enum(lc_log_level_table, name, &level));
    CHECK_STATUS(lc_log_set_daemon_log_level(level));
    return LC_OK;
}

} // namespace

lc_status qv_init_log_level(mdc *session) {
    owned_tstring system, own, override_level;
    // A system level that can't be read or parsed stays as it is, and the other nodes are still read.
    if (read_level_text(session, SYSTEM_LEVEL, &system) == LC_OK && is_filled(system) &&
        lc_log_set_max_log_level(ts_str(system.pointer)) == LC_OK)
        LC_LOG(LC_LOG_NOTICE, "Synchronized system log level to '%s'", ts_str(system.pointer));
    if (read_level_text(session, process_level_node().text, &own) == LC_OK && is_filled(own)) {
        CHECK_QUIET(set_daemon_level(ts_str(own.pointer)));
        LC_LOG(LC_LOG_NOTICE, "Synchronized daemon log level to '%s'", ts_str(own.pointer));
    }
    owned_binding enable;
    CHECK_STATUS(mdc_get_binding(session, nullptr, nullptr, 0, &enable.pointer, OVERRIDE_ENABLE, nullptr));
    if (enable.pointer) {
        uint32_t value = 0;
        CHECK_STATUS(bn_binding_get_tbool(enable.pointer, bn_attrib_value, nullptr, &value));
        CHECK_STATUS(lc_log_enable_override_log_level(1, value ? 1 : 0));
    }
    CHECK_STATUS(read_level_text(session, class_level_node().text, &override_level));
    if (is_filled(override_level)) {
        CHECK_STATUS(enable_class_override(ts_str(override_level.pointer)));
        LC_LOG(LC_LOG_NOTICE, "Synchronized override log level to \"%s\"", ts_str(override_level.pointer));
    }
    return LC_OK;
}

// lc_log_get_facility calls this, if it is given a session.
lc_status qv_read_log_facility(mdc *session, uint32_t *out_facility) {
    owned_binding binding;
    CHECK_STATUS(
        mdc_get_binding(session, nullptr, nullptr, 0, &binding.pointer, NODE_SYSTEM_FACILITY, nullptr));
    CHECK_NULL(binding.pointer);
    CHECK_STATUS(bn_binding_get_uint32(binding.pointer, bn_attrib_value, nullptr, out_facility));
    return LC_OK;
}

namespace {

// --- A change event

lc_status get_value_text(const bn_binding *binding, owned_tstring *out) {
    CHECK_STATUS(bn_binding_get_tstr(binding, bn_attrib_value, 0, nullptr, &out->pointer));
    return LC_OK;
}

// Each function applies one changed node and reports in `ended` whether the other nodes are left alone. A
// level that was emptied or deleted doesn't end the search.
lc_status change_process_level(const bn_binding *binding, bool *ended) {
    owned_tstring value;
    uint32_t flags = 0;
    CHECK_STATUS(bn_binding_get_type(binding, bn_attrib_value, nullptr, &flags));
    const bool deleted = (flags & bn_flag_deleted) != 0;
    if (!deleted)
        CHECK_STATUS(get_value_text(binding, &value));
    LC_LOG(LC_LOG_INFO, "Found process to change level: %s=%s", bn_binding_get_name_quick(binding),
           value.pointer ? ts_str(value.pointer) : "");
    *ended = is_filled(value);
    if (*ended) {
        CHECK_QUIET(set_daemon_level(ts_str(value.pointer)));
        LC_LOG(LC_LOG_INFO, "Process log_level='%s'", ts_str(value.pointer));
    } else if (deleted || value.pointer) {
        // The process has no level of its own any more. A binding without any value changes nothing.
        CHECK_STATUS(lc_log_set_daemon_log_level(-1));
    }
    return LC_OK;
}

lc_status change_system_level(const bn_binding *binding, bool *ended) {
    owned_tstring value;
    CHECK_STATUS(get_value_text(binding, &value));
    *ended = is_filled(value);
    if (!*ended)
        return LC_OK;
    CHECK_STATUS(lc_log_set_max_log_level(ts_str(value.pointer)));
    LC_LOG(LC_LOG_INFO, "Syslog log level is set to \"%s\"", ts_str(value.pointer));
    return LC_OK;
}

lc_status change_system_override(const bn_binding *binding, bool *) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_tbool(binding, bn_attrib_value, nullptr, &value));
    CHECK_STATUS(lc_log_enable_override_log_level(1, value ? 1 : 0));
    LC_LOG(LC_LOG_INFO, "Syslog system-wide override is %s", value ? "enabled" : "disabled");
    return LC_OK;
}

lc_status change_class_override(const bn_binding *binding, bool *) {
    owned_tstring value;
    CHECK_STATUS(get_value_text(binding, &value));
    const int index = class_index();
    if (is_filled(value)) {
        CHECK_STATUS(enable_class_override(ts_str(value.pointer)));
        LC_LOG(LC_LOG_INFO, "Syslog per-class local%d override is enabled, log level is \"%s\"", index,
               ts_str(value.pointer));
    } else {
        CHECK_STATUS(lc_log_enable_override_log_level(0, 0));
        LC_LOG(LC_LOG_INFO, "Syslog per-class local%d override is disabled", index);
    }
    return LC_OK;
}

} // namespace

lc_status qv_handle_log_level_change(const bn_binding_array *bindings) {
    if (!bindings)
        return LC_OK;
    const node_name process = process_level_node(), own_class = class_level_node();
    const struct {
        const char *node;
        lc_status (*change)(const bn_binding *binding, bool *ended);
    } levels[] = {
        {process.text, change_process_level},
        {SYSTEM_LEVEL, change_system_level},
        {OVERRIDE_ENABLE, change_system_override},
        {own_class.text, change_class_override},
    };
    for (const auto &level : levels) {
        const bn_binding *binding = nullptr;
        CHECK_STATUS(bn_binding_array_get_binding_by_name(bindings, level.node, &binding));
        if (!binding)
            continue;
        bool ended = true;
        CHECK_QUIET(level.change(binding, &ended));
        if (ended)
            return LC_OK;
    }
    return LC_OK;
}

// --- Time zone

lc_status qv_register_time_zone_change(mdc *session) {
    CHECK_STATUS(mdc_send_action_with_bindings_str_va(session, nullptr, nullptr, ACTION_ADD_INTEREST, 1,
                                                      "event_name", static_cast<uint32_t>(bn_type_name),
                                                      EVENT_TIME_ZONE));
    return LC_OK;
}

lc_status qv_handle_time_zone_change(const char *event_name) {
    if (!event_name || strcmp(event_name, EVENT_TIME_ZONE) != 0)
        return LC_NOT_FOUND;
    CHECK_STATUS(lt_timezone_handle_changed());
    LC_LOG(LC_LOG_INFO, "Time zone change handled OK");
    return LC_OK;
}
