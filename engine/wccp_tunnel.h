// The process-wide table of GRE tunnels, one for each pair of this appliance's address and a router's id. Its
// mutex is taken after the engine lock. Commands to tunneld are waited for under both, but for an add, which
// holds the engine lock alone.
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

// One reference more; the first creates the tunnel. 1, with a line, when it cannot be created. Engine lock
// held. `group_id` is for the log, here and below.
int wccp_add_tunnel(uint32_t group_id, be32 local, be32 remote);
// One reference less, or with `force` all; the last removes the tunnel. 1, with a line, when tunneld did not
// delete it; it is out of the table all the same.
int wccp_del_tunnel(uint32_t group_id, be32 local, be32 remote, int force);
int wccp_del_all_tunnels();
// Orders every tunnel of the table once more, for a tunneld that has lost them.
int wccp_restore_all_tunnels();
