// Facts about the system that the engine needs and mgmtd knows: whether it is a bridge, and the primary WAN
// interface, which follows from the system mode and from the bonding and speed of its ports. Called by the
// main thread during the engine's start; each read waits for mgmtd.
#include <cstring>

#include "daemon/wccpd_main.h"
#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_host.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

int32_t bonding_enabled;
char wccp_primary_wan_interface_name[32];

namespace {

// If the node does not exist, `out` stays as it is.
lc_status read_bool_node(mdc *handle, const char *node, int32_t *out, bool *out_present) {
    *out_present = false;
    owned_binding binding;
    CHECK_STATUS(mdc_get_binding(handle, nullptr, nullptr, 0, &binding.pointer, node, nullptr));
    if (!binding.pointer)
        return LC_OK;
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_tbool(binding.pointer, bn_attrib_value, nullptr, &value));
    *out = value ? 1 : 0;
    *out_present = true;
    return LC_OK;
}

lc_status mgmt_is_bonding_enabled(mdc *handle, int32_t *out) {
    bool present = false;
    *out = 0;
    CHECK_STATUS(read_bool_node(handle, NODE_SYSTEM_BONDING, out, &present));
    return LC_OK;
}

lc_status mgmt_is_10g_enabled(mdc *handle, int32_t *out) {
    bool present = false;
    *out = 0;
    CHECK_STATUS(read_bool_node(handle, NODE_SYSTEM_10G, out, &present));
    return LC_OK;
}

lc_status choose_interface_name(const char *mode, const char **out_name) {
    if (bonding_enabled) {
        *out_name = "bwan0";
        return LC_OK;
    }
    // Any mode that begins with this word.
    if (strncmp(mode, "server", 6) == 0) {
        *out_name = "mgmt0";
        return LC_OK;
    }
    int32_t bonding = 0, ten_gigabit = 0;
    CHECK_STATUS(mgmt_is_bonding_enabled(wccpd_mcc, &bonding));
    if (bonding) {
        *out_name = "bwan0";
        return LC_OK;
    }
    CHECK_STATUS(mgmt_is_10g_enabled(wccpd_mcc, &ten_gigabit));
    *out_name = ten_gigabit ? "twan0" : "wan0";
    return LC_OK;
}

lc_status read_system_mode(owned_tstring *out) {
    owned_binding binding;
    CHECK_STATUS(
        mdc_get_binding(wccpd_mcc, nullptr, nullptr, 0, &binding.pointer, NODE_SYSTEM_MODE, nullptr));
    CHECK_NULL(binding.pointer);
    CHECK_STATUS(wccpd_read_text(binding.pointer, out));
    return LC_OK;
}

} // namespace

int wccp_is_system_in_bridge_mode() {
    owned_tstring mode;
    // Without an answer the engine runs as in router mode.
    if (read_system_mode(&mode) != LC_OK)
        return 0;
    QV_LOG(LC_LOG_INFO, "WCCP current system mode: %s", ts_str(mode.pointer));
    return strcmp(ts_str(mode.pointer), "bridge") == 0;
}

lc_status wccp_init_primary_wan_interface() {
    bool present = false;
    // An absent node leaves the default, without bonding.
    CHECK_STATUS(read_bool_node(wccpd_mcc, NODE_SYSTEM_BONDING, &bonding_enabled, &present));
    if (present)
        LC_LOG(LC_LOG_INFO, "bonding_enabled: %s", lc_bool_to_str(bonding_enabled));
    owned_tstring mode;
    CHECK_STATUS(read_system_mode(&mode));
    LC_LOG(LC_LOG_INFO, "system mode is %s", ts_str(mode.pointer));
    const char *name = nullptr;
    CHECK_STATUS(choose_interface_name(ts_str(mode.pointer), &name));
    strlcpy(wccp_primary_wan_interface_name, name, sizeof wccp_primary_wan_interface_name);
    return LC_OK;
}
