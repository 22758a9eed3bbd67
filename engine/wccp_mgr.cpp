// Start and stop of the engine, and the timer thread.
//
// This file defines wccp_g, the global record. wccp_init_mgr and wccp_exit_mgr are called by the main thread
// without the engine lock.
//
// Threads. "WCCP_TIMER" runs one tick a second; it is not created in bridge mode. Each interface that has had
// an address has a receive thread "WCCP_RX_<name>" (wccp_network.cpp), which waits for a datagram without a
// lock and processes it with the engine lock held.
//
// Cancellation is the only way in which these threads end. It is requested either with the engine lock held
// (bridge mode) or after the last group has been deleted (exit). A cancelled thread is therefore in its sleep
// or its poll, or waits for the engine lock, which acts on the request before any work begins (struct
// wccp_engine_lock). A thread is never cancelled in the middle of a tick, while it processes a packet of a
// group, or while it waits for tunneld: code that runs with the engine lock held need not expect it.
//
// Bridge mode. The groups are stopped and the threads cancelled in one hold of the engine lock. It is
// released before the threads are joined, because any of them may be waiting for it. Nothing starts them
// again.
//
// Exit. The groups are deleted first, each with its shutdown message, then the threads end. Notifications and
// datagrams that arrive meanwhile are ignored: nothing may create a thread after all of them have been
// joined.
//
// The platform's notifier thread runs until the process is gone. Everything that its callbacks can reach,
// wccp_g above all, therefore has no destructor.
//
// wccp_g.track_primary is always 0: groups do not depend on the primary interface, which is an ordinary entry
// of the interface table.

#include "engine/wccp_mgr.h"

#include <errno.h>
#include <time.h>

#include <cstring>
#include <new>
#include <type_traits>

#include "engine/cthread.h"
#include "engine/wccp_complaints.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_link_mgr.h"
#include "engine/wccp_state.h"
#include "engine/wccp_tunnel.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "platform/qvcommon.h"
#include "runtime/logging.h"

// Usable before wccp_init_mgr: all zero is also an unlocked mutex.
constinit wccp_global wccp_g = {};
static_assert(std::is_trivially_destructible_v<wccp_global>);

namespace {

constexpr uint8_t DEFAULT_MCAST_TTL = 5;

int start_timer_thread() {
    cthread *timer = cthread_init("WCCP_TIMER", wccp_timer_thread_fn, nullptr, nullptr, nullptr, 0, 0, 0, 0);
    if (timer && cthread_start(timer) == 0)
        return 0;
    // The thread is not running: this only frees its context, if there is one.
    cthread_join(timer);
    QV_LOG(LC_LOG_ERR, "WCCP: Failed to spawn timer thread");
    return 1;
}

} // namespace

int wccp_init_mgr() {
    QV_LOG(LC_LOG_INFO, "WCCP: Initialize WCCP manager");
    new (&wccp_g) wccp_global{}; // its atomics rule out assignment and memset
    pthread_mutex_init(&wccp_g.lock, nullptr);
    wccp_g.mcast_ttl = DEFAULT_MCAST_TTL;

    wccp_init_network();
    if (wccp_is_system_in_bridge_mode()) {
        QV_LOG(LC_LOG_NOTICE, "WCCP timer/rx threads are not launched in non Router mode");
    } else if (start_timer_thread()) {
        QV_LOG(LC_LOG_ERR, "WCCP: Cannot spawn threads");
        return 1;
    }
    if (wccp_init_shmem()) {
        QV_LOG(LC_LOG_ERR, "WCCP: Cannot init shared memory");
        return 1;
    }
    // Without notifications groups run with the interface states that were found when they were added.
    if (wccp_init_link_mgr())
        QV_LOG(LC_LOG_ERR, "WCCP: Cannot init link manager");
    else
        QV_LOG(LC_LOG_INFO, "WCCP: Done init link manager");
    return 0;
}

int wccp_exit_mgr() {
    QV_LOG(LC_LOG_NOTICE, "WCCP: wccp manager is exiting");
    wccp_del_all_groups();
    cthread_cancel_all();
    // Only now, because the threads were using the sockets.
    wccp_deinit_link_mgr();
    wccp_del_all_tunnels();
    return 0;
}

int wccp_system_mode_change_event(const char *mode) {
    if (!mode)
        return 1;
    // Leaving bridge mode starts nothing: the threads ended when it was entered.
    if (strcmp(mode, "router") == 0 || strcmp(mode, "server") == 0)
        return 0;
    if (strcmp(mode, "bridge") != 0) {
        QV_LOG(LC_LOG_WARNING, "WCCP cannot recognize new system mode: %s", mode);
        return 1;
    }
    cthread *ended;
    {
        const wccp_engine_lock lock;
        wccp_stop_all_service_groups();
        ended = cthread_cancel_listed();
    }
    cthread_join_chain(ended);
    return 0;
}

int wccp_init_network() {
    if (g_qvif_skfd < 0)
        qvif_network_init_sockets();
    return 0;
}

void wccp_tick() {
    // Without waiting for the lock, which the exit holds while it deletes the groups.
    if (wccpd_shutdown_in_progress() == 1)
        return;
    const wccp_engine_lock lock;
    if (wccpd_shutdown_in_progress() == 1) // the exit began while this thread waited for the lock
        return;
    wccp_g.seconds++;
    wccp_report_suppressed_complaints();
    for (wccp_service_group *group = wccp_g.group_list; group; group = group->next)
        if (group->admin_state == WCCP_ADMIN_UP)
            wccp_process_timers(group);
    wccp_recover_interfaces_due();
}

void *wccp_timer_thread_fn(void *) {
    for (;;) {
        // The sleep is relative: a tick that takes long delays the next one, and `seconds` counts ticks.
        timespec left = {.tv_sec = 1, .tv_nsec = 0};
        // After an interruption it continues with the time that was left.
        while (clock_nanosleep(CLOCK_MONOTONIC, 0, &left, &left) == EINTR) {
        }
        wccp_tick();
    }
}
