// What the engine needs from its program, for tests.

#include "tests/support/engine_fixture.h"

std::atomic<int32_t> wccpd_exiting;
uint32_t g_qv_encap_wccp_first = 1000, g_qv_encap_wccp_last = 1031;
char wccp_primary_wan_interface_name[32];
int test_host_bridge_mode;

int32_t wccpd_shutdown_in_progress() {
    return wccpd_exiting == 1 ? 1 : 0;
}
lc_status wccp_init_primary_wan_interface() {
    return LC_OK;
}
int wccp_is_system_in_bridge_mode() {
    return test_host_bridge_mode;
}
