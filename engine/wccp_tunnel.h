// The process-wide table of GRE tunnels, one for each pair of this appliance's address and a router's id.
//
// The functions take the tunnel mutex themselves, after the engine lock if the caller holds that. They wait
// for tunneld, up to about 2 seconds for each command; an add does so without the mutex, a delete and a
// restore with it. `group_id` is only for the log and for reasons; only its low 8 bits count, and 0 means no
// group.
#pragma once

#include "engine/wccp_records.h"

struct wccp_tunnel {
    wccp_tunnel *next, **prev_link;
    uint16_t tunnel_id;
    be32 local_ipa;
    be32 remote_ipa;
    uint32_t dataplane_index; // tunneld's own, WCCP_NO_INDEX until it has answered
    std::atomic<uint32_t> ref_count;
};

// Adds a reference; the first one creates the tunnel. 0, or 1, logged and noted as a reason of the group,
// when it cannot be created. Engine lock held.
int wccp_add_tunnel(uint32_t group_id, be32 local, be32 remote);
// Drops a reference, or with `force` all of them; the last one removes the tunnel. 0, also for an unknown
// one, or 1, with a line in the log, when tunneld has not confirmed. The tunnel is out of the table in any
// case. During the exit this failure is neither logged nor returned.
int wccp_del_tunnel(uint32_t group_id, be32 local, be32 remote, int force);
int wccp_del_all_tunnels(); // by force; always 0
// Sends tunneld an add for every tunnel of the table, in case it has lost them. Always 0; failures are
// logged. Nothing calls it at present.
int wccp_restore_all_tunnels();
