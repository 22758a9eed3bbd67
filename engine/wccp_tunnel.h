// The process-wide table of GRE tunnels, one for each pair of this appliance's address and a router's id.
// Takes its own mutex, behind the engine lock.
#pragma once

#include "engine/wccp_records.h"

struct wccp_tunnel {
    wccp_tunnel *next, **prev_link;
    uint16_t tunnel_id;
    be32 local_ipa;
    be32 remote_ipa;
    uint32_t dataplane_index;
    std::atomic<uint32_t> ref_count;
};

int wccp_add_tunnel(uint32_t group_id, be32 local, be32 remote);
int wccp_del_tunnel(uint32_t group_id, be32 local, be32 remote, int force);
int wccp_del_all_tunnels();
int wccp_restore_all_tunnels();
