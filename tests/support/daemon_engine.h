// The engine for tests of the daemon, without threads, sockets or a session. Its interface is not ready:
// groups exist, and nothing is sent.
#pragma once

#include <gtest/gtest.h>

#include "engine/wccp_config.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "mgmt/bnode.h"
#include "tests/support/gcl_log.h"
#include "tests/support/owners.h"

struct daemon_test : testing::Test {
    gcl_log log;
    wccp_interface *interface;

    daemon_test() {
        new (&wccp_g) wccp_global{};
        wccp_g.mcast_ttl = 5;
        wccp_g.seconds = 1000;
        for (wccp_interface &each : wccp_g.interfaces)
            each.ucast_fd = each.mcast_fd = -1;
        interface = &wccp_g.interfaces[wccp_g.if_count++];
        strcpy(interface->name, "lan0");
        interface->ipa = to_be32(0x0a000001);
        wccp_init_policy_grp_mgr();
    }
    ~daemon_test() override {
        wccp_del_all_groups();
        EXPECT_EQ(wccp_g.group_count, 0u);
        EXPECT_EQ(wccp_g.stat_allocs, wccp_g.stat_frees);
    }
    int said(const std::string &line) { return log.count(line); } // lines that contain this text
};

constexpr be32 address(uint32_t last_octet) { // 10.0.0.x
    return to_be32(0x0a000000 | last_octet);
}

// An array of bindings.
struct binding_list {
    owner<bn_binding_array, bn_binding_array_free> array;

    binding_list() { EXPECT_EQ(bn_binding_array_new(&array), LC_OK); }
    binding_list &add(const std::string &name, uint32_t type, const std::string &text, uint32_t flags = 0) {
        bn_binding *binding = nullptr;
        EXPECT_EQ(bn_binding_new_str(&binding, name.c_str(), bn_attrib_value, type, flags, text.c_str()),
                  LC_OK)
            << name;
        EXPECT_EQ(bn_binding_array_append_takeover(array, &binding), LC_OK);
        return *this;
    }
    const bn_binding *last() const {
        return bn_binding_array_get_quick(array, bn_binding_array_length_quick(array) - 1);
    }
};
