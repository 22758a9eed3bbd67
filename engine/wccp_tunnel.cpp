// The process-wide table of GRE tunnels.
//
// Each record is for one pair of this appliance's address and a router's id. Service groups with the same
// pair share the tunnel and are counted in `ref_count`. Tunnel ids come from a range of 32; a clear bit in
// tunnel_free_ids means that a record has the id or an add for it is in progress. Commands to tunneld go
// through the mailbox (wccpd_common.cpp), which waits for the answer.
//
// The tunnel mutex guards the list and the bitmap. It is taken after the engine lock and before the mailbox's
// mutex. An add releases it while it waits for tunneld; a delete and a restore hold it. Two adds for the same
// new key exclude each other by the engine lock, which all callers of wccp_add_tunnel hold.
//
// Callers are the receive threads (add), the timer thread (delete, when a router times out), whichever thread
// stops a group (delete), and the main thread at exit (delete all, without the engine lock).

#include "engine/wccp_tunnel.h"

#include <cstdio>

#include "engine/wccp_complaints.h"
#include "engine/wccp_host.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "runtime/guards.h"
#include "runtime/list.h"
#include "runtime/logging.h"

namespace {

pthread_mutex_t tunnel_mutex = PTHREAD_MUTEX_INITIALIZER;
wccp_tunnel *tunnel_list; // newest first
uint32_t tunnel_free_ids = 0xFFFFFFFF;

mailbox_address to_mailbox_address(be32 address) {
    return {{to_host(address), 0}};
}

void free_tunnel(wccp_tunnel *tunnel) {
    wccp_free(tunnel);
}

// tunnel_mutex held.
wccp_tunnel *find_tunnel(be32 local, be32 remote) {
    for (wccp_tunnel *tunnel = tunnel_list; tunnel; tunnel = tunnel->next)
        if (tunnel->local_ipa == local && tunnel->remote_ipa == remote)
            return tunnel;
    return nullptr;
}

// tunnel_mutex held.
void release_tunnel_id(uint32_t id) {
    if (id >= g_qv_encap_wccp_first && id <= g_qv_encap_wccp_last && id - g_qv_encap_wccp_first < 32)
        tunnel_free_ids |= 1u << (id - g_qv_encap_wccp_first);
}

// The id of an add that is in progress. It is released unless the add has succeeded and cleared `taken`.
struct owned_tunnel_id {
    ~owned_tunnel_id() {
        if (taken) {
            const mutex_guard guard(&tunnel_mutex);
            release_tunnel_id(id);
        }
    }
    bool take_lowest() {
        const mutex_guard guard(&tunnel_mutex);
        if (tunnel_free_ids == 0)
            return false;
        const uint32_t bit = static_cast<uint32_t>(__builtin_ctz(tunnel_free_ids));
        id = static_cast<uint16_t>(g_qv_encap_wccp_first + bit);
        if (id == 65535) // not a valid id
            return false;
        tunnel_free_ids &= ~(1u << bit);
        taken = true;
        return true;
    }
    uint16_t id = 0;
    bool taken = false;
};

// Takes a record out of the table at the end of the scope. tunnel_mutex held.
struct tunnel_removal {
    explicit tunnel_removal(wccp_tunnel *removed) : tunnel(removed) {}
    ~tunnel_removal() {
        list_unlink(tunnel);
        release_tunnel_id(tunnel->tunnel_id);
        free_tunnel(tunnel);
    }
    tunnel_removal(const tunnel_removal &) = delete;
    tunnel_removal &operator=(const tunnel_removal &) = delete;
    wccp_tunnel *tunnel;
};

// Notes why an add for a router failed, instead of an earlier failure of another kind. Engine lock held.
void note_tunnel_failure(int group, wccp_reason_code code, be32 remote, const wccp_reason_text &offered,
                         const wccp_reason_text &wanted) {
    static constexpr wccp_reason_code failures[] = {
        WCCP_REASON_NO_MEMORY,      WCCP_REASON_TUNNEL_IDS_EXHAUSTED, WCCP_REASON_MAILBOX_MISSING,
        WCCP_REASON_TUNNEL_TIMEOUT, WCCP_REASON_TUNNELD_SILENT,       WCCP_REASON_TUNNEL_REFUSED};
    wccp_service_group *record = wccp_find_group(group);
    if (!record)
        return;
    for (const wccp_reason_code each : failures)
        if (each != code)
            wccp_forget_reason(record, each, remote);
    wccp_note_reason(record, code, remote, offered, wanted);
}

} // namespace

int wccp_add_tunnel(uint32_t group_id, be32 local, be32 remote) {
    const int group = static_cast<int>(group_id & 0xff);
    {
        const mutex_guard guard(&tunnel_mutex);
        if (wccp_tunnel *tunnel = find_tunnel(local, remote)) {
            tunnel->ref_count.fetch_add(1);
            return 0;
        }
    }
    owned<wccp_tunnel, free_tunnel> tunnel(static_cast<wccp_tunnel *>(wccp_calloc(1, sizeof(wccp_tunnel))));
    if (!tunnel.pointer) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: Failed to alloc tunnel memory", group);
        note_tunnel_failure(group, WCCP_REASON_NO_MEMORY, remote, wccp_reason_value("its tunnel"), {});
        return 1;
    }
    tunnel.pointer->dataplane_index = WCCP_NO_INDEX;
    owned_tunnel_id id;
    if (!id.take_lowest()) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: No free tunnel id available", group);
        note_tunnel_failure(group, WCCP_REASON_TUNNEL_IDS_EXHAUSTED, remote, {},
                            wccp_reason_value("ids %u to %u", g_qv_encap_wccp_first, g_qv_encap_wccp_last));
        return 1;
    }
    wccp_reason_code failure = WCCP_REASON_NONE;
    // Waits for tunneld, two seconds at most, without the tunnel mutex.
    if (wccp_add_tunnel_or_say_why(id.id, to_mailbox_address(local), to_mailbox_address(remote),
                                   &tunnel.pointer->dataplane_index, &failure) == 1) {
        note_tunnel_failure(group, failure, remote, wccp_reason_value("tunnel id %d", id.id),
                            wccp_reason_value("from %s", addr_text(local).s));
        WCCP_COMPLAIN(LC_LOG_NOTICE, "WCCP GRP %d: failed to add tunnel: id: %d %s <=> %s", group, id.id,
                      addr_text(local).s, addr_text(remote).s);
        return 1;
    }
    tunnel.pointer->tunnel_id = id.id;
    tunnel.pointer->local_ipa = local;
    tunnel.pointer->remote_ipa = remote;
    tunnel.pointer->ref_count.store(1);
    {
        const mutex_guard guard(&tunnel_mutex);
        list_push_head(&tunnel_list, tunnel.take());
        // The record has the id now; from here on a delete gives it back.
        id.taken = false;
    }
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: created GRE tunnel id %d %s <=> %s", group, id.id, addr_text(local).s,
           addr_text(remote).s);
    return 0;
}

int wccp_del_tunnel(uint32_t group_id, be32 local, be32 remote, int force) {
    char group[16] = " ";
    if (group_id & 0xff) // 0: not on behalf of a group
        snprintf(group, sizeof group, " GRP %d", static_cast<int>(group_id & 0xff));
    const mutex_guard guard(&tunnel_mutex);
    wccp_tunnel *tunnel = find_tunnel(local, remote);
    if (!tunnel)
        return 0;
    if (!force && tunnel->ref_count.fetch_sub(1) > 1) // others still use it
        return 0;
    // The record is removed even if tunneld does not answer: otherwise its id would be lost.
    const tunnel_removal removal(tunnel); // after the log lines, which still use the record
    const int result = wccp_del_tunnel_encap(tunnel->tunnel_id, to_mailbox_address(local),
                                             to_mailbox_address(remote), &tunnel->dataplane_index);
    if (result != 1) {
        QV_LOG(LC_LOG_INFO, "WCCP%s: deleted GRE tunnel id: %d %s <=> %s", group, tunnel->tunnel_id,
               addr_text(local).s, addr_text(remote).s);
        return 0;
    }
    if (wccpd_exiting.load() == 1) // tunneld may be ending as well: not worth a warning
        return 0;
    QV_LOG(LC_LOG_WARNING, "WCCP%s: failed to delete GRE tunnel id: %d %s <=> %s", group, tunnel->tunnel_id,
           addr_text(local).s, addr_text(remote).s);
    return 1;
}

// The mutex is released between two deletes; therefore no pointer into the list may be kept. Each delete
// removes the head.
int wccp_del_all_tunnels() {
    for (;;) {
        be32 local, remote;
        {
            const mutex_guard guard(&tunnel_mutex);
            if (!tunnel_list)
                return 0;
            local = tunnel_list->local_ipa;
            remote = tunnel_list->remote_ipa;
        }
        wccp_del_tunnel(0, local, remote, 1);
    }
}

int wccp_restore_all_tunnels() {
    QV_LOG(LC_LOG_INFO, "WCCP: Restore all gre tunnels");
    const mutex_guard guard(&tunnel_mutex);
    // With the mutex held throughout, which keeps the list in place for all the waits.
    for (wccp_tunnel *tunnel = tunnel_list; tunnel; tunnel = tunnel->next)
        if (wccp_add_tunnel_encap(tunnel->tunnel_id, to_mailbox_address(tunnel->local_ipa),
                                  to_mailbox_address(tunnel->remote_ipa), &tunnel->dataplane_index) == 1)
            QV_LOG(LC_LOG_NOTICE, "WCCP:retore tunnel: failed to create tunnel. id: %d %s <=> %s",
                   tunnel->tunnel_id, addr_text(tunnel->local_ipa).s, addr_text(tunnel->remote_ipa).s);
    return 0;
}
