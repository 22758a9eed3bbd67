// wccpd's side of the mailbox to tunneld, a block of shared memory with one command slot.
//
// Only the process that created the block writes to it. If a second wccpd is started, its creation is refused
// and it has no mailbox: its commands fail at once, it publishes no roles, and its exit resets nothing.
//
// The mailbox mutex is the last in the engine's order of locks. It is held from the first input of a command
// to the end of the wait for its answer, so that commands never overlap, whichever other locks their callers
// hold. `command` is cleared before the inputs are written, because a delete or an L2 return that timed out
// is still in the slot and tunneld may be reading it. It is written last, with release order; the answer is
// read with acquire order.
//
// A command that has been written wakes tunneld by a datagram. The wait polls the slot every millisecond, two
// thousand times. An add without an answer is withdrawn, since nobody would know the tunnel; the other
// commands stay in the slot. No thread is cancelled during a wait (wccp_mgr.cpp).
//
// Callers wait with the engine lock held, and a tunneld that hangs must not take down groups that need no
// tunnel. After a time-out, therefore, adds and L2 returns fail at once as if they had timed out, for ten
// seconds or until tunneld has cleared a command that stayed in the slot; then one is tried again. These
// seconds are the monotonic clock's, because wccp_g.seconds does not advance while a tick waits. A delete is
// always sent, since nobody repeats it, but not waited for if the command that timed out was a delete as
// well. During the exit nothing is waited for after the first time-out.
//
// The reset at exit runs on the main thread while an engine thread may be waiting. It sets `abandon`, which
// ends the wait at the next poll as a time-out, and resets the block once it has the mutex, so that no waiter
// takes the cleared `command` for an answer. Later commands, for the tunnels that are deleted at exit, work
// as usual. Memberships are cleared before the roles are reset, so that an engine thread that still changes a
// role reaches no policy group and tunneld sees UNKNOWN for all of them.

#include "engine/wccpd_common.h"

#include <poll.h>
#include <pthread.h>

#include <cstring>

#include "engine/wccp_complaints.h"
#include "engine/wccp_host.h"
#include "runtime/cmem.h"
#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {

pthread_mutex_t mailbox_mutex = PTHREAD_MUTEX_INITIALIZER;
std::atomic<bool> abandon;
wccp_tunnel_mailbox *created_mailbox; // null until this process has created the block

constexpr int ANSWER_POLLS = 2000;        // one every millisecond
constexpr int64_t RETRY_AFTER_MS = 10000; // after a time-out

// The last command that timed out, until tunneld answers a later one.
struct unanswered_command {
    uint16_t code; // MAILBOX_IDLE: none
    bool during_exit;
    int64_t since_ms;
};
unanswered_command unanswered; // mailbox_mutex

// mailbox_mutex held.
void reset_mailbox(wccp_tunnel_mailbox *mailbox, uint32_t index) {
    // First, so that tunneld does not take the values below for a command.
    mailbox->command.store(MAILBOX_IDLE, std::memory_order_release);
    mailbox_put(mailbox->tunnel_id, uint16_t{0});
    mailbox_put(mailbox->status, 0u);
    mailbox_put(mailbox->local_ip, 0u);
    mailbox_put(mailbox->remote_ip, 0u);
    mailbox_put(mailbox->fmst_index, index);
    mailbox_put(mailbox->l2_group, uint8_t{0});
    memset(mailbox->padding, 0, sizeof mailbox->padding);
    mailbox_put(mailbox->l2_value, 0u);
    for (uint32_t i = 0; i < WCCP_POLICY_GROUPS; i++) {
        wccp_policy_role *entry = &mailbox->policy_roles[i];
        mailbox_put(entry->policy_group, static_cast<uint16_t>(i));
        entry->padding = 0;
        entry->role.store(2, std::memory_order_relaxed);
    }
}

} // namespace

int wccp_init_shmem() {
    constexpr uint32_t length = sizeof(wccp_tunnel_mailbox);
    auto *mailbox = static_cast<wccp_tunnel_mailbox *>(cmem_create_block(length, WCCP_MAILBOX_NAME));
    if (!mailbox) {
        QV_LOG(LC_LOG_ERR, "WCCP: Failed to create shared memory of size %u bytes", length);
        return 1;
    }
    {
        const mutex_guard guard(&mailbox_mutex);
        reset_mailbox(mailbox, WCCP_NO_INDEX);
        unanswered = {};
        mailbox_put(wccp_mailbox, mailbox);
        mailbox_put(created_mailbox, mailbox);
    }
    wccp_init_policy_grp_mgr();
    QV_LOG(LC_LOG_DEBUG, "WCCP: Created shared memory of size: %u bytes", length);
    return 0;
}

bool wccp_publish_policy_role(uint16_t policy, uint32_t role) {
    wccp_tunnel_mailbox *mailbox = mailbox_get(created_mailbox);
    if (mailbox)
        mailbox->policy_roles[policy].role.store(role, std::memory_order_relaxed);
    return mailbox != nullptr;
}

int wccp_cleanup_shmem() {
    wccp_tunnel_mailbox *mailbox = mailbox_get(created_mailbox);
    if (!mailbox)
        return 0;
    wccp_init_policy_grp_mgr(); // before the roles are reset, see above
    abandon.store(true, std::memory_order_release);
    const mutex_guard guard(&mailbox_mutex);
    reset_mailbox(mailbox, 0);
    abandon.store(false, std::memory_order_release);
    return 0;
}

namespace {

struct mailbox_inputs {
    uint16_t tunnel_id;
    uint32_t local_ip, remote_ip, fmst_index;
    uint8_t l2_group;
    uint32_t l2_value;
};

// A command, with the log line for its time-out.
struct command_kind {
    uint16_t code;
    int32_t time_out_level;
    const char *time_out_line;
};
const command_kind add_tunnel = {MAILBOX_ADD_TUNNEL, LC_LOG_NOTICE, "GRE tunnel add timed out"};
const command_kind delete_tunnel = {MAILBOX_DELETE_TUNNEL, LC_LOG_DEBUG, "GRE tunnel delete timed out"};
const command_kind set_l2_return = {MAILBOX_L2_RETURN, LC_LOG_ERR, "GRE tunnel L2 return add timed out"};

enum class effort { NONE, GIVE, GIVE_AND_WAIT };

// How a command is handled: not sent, sent, or sent and waited for. mailbox_mutex held.
effort choose_effort(uint16_t code, const wccp_tunnel_mailbox *mailbox) {
    const bool exiting = wccpd_shutdown_in_progress() == 1;
    // A time-out before the exit does not count during the exit: one more command is waited for.
    if (unanswered.code == MAILBOX_IDLE || (exiting && !unanswered.during_exit))
        return effort::GIVE_AND_WAIT;
    // A withdrawn add leaves the slot clear whether or not tunneld is working.
    const bool cleared = unanswered.code != MAILBOX_ADD_TUNNEL &&
                         mailbox->command.load(std::memory_order_acquire) == MAILBOX_IDLE;
    if (!exiting && (cleared || lt_monotonic_ms() - unanswered.since_ms >= RETRY_AFTER_MS))
        return effort::GIVE_AND_WAIT;
    if (code != MAILBOX_DELETE_TUNNEL) // its caller tries again later
        return effort::NONE;
    return exiting || unanswered.code == MAILBOX_DELETE_TUNNEL ? effort::GIVE : effort::GIVE_AND_WAIT;
}

void write_command(wccp_tunnel_mailbox *mailbox, uint16_t code, const mailbox_inputs *inputs) {
    // A command that timed out may still be in the slot, and tunneld may be reading its inputs.
    mailbox->command.store(MAILBOX_IDLE, std::memory_order_release);
    if (code == MAILBOX_L2_RETURN) {
        mailbox_put(mailbox->l2_group, inputs->l2_group);
        mailbox_put(mailbox->l2_value, inputs->l2_value);
    } else {
        mailbox_put(mailbox->tunnel_id, inputs->tunnel_id);
        mailbox_put(mailbox->local_ip, inputs->local_ip);
        mailbox_put(mailbox->remote_ip, inputs->remote_ip);
        mailbox_put(mailbox->fmst_index, inputs->fmst_index);
    }
    mailbox->command.store(code, std::memory_order_release);
    wccp_wake_tunneld();
}

enum class wait_end { ANSWERED, TIMED_OUT, ABANDONED };

wait_end wait_for_answer(wccp_tunnel_mailbox *mailbox, uint16_t code) {
    wait_end end = wait_end::TIMED_OUT;
    for (int i = 0; i < ANSWER_POLLS && end == wait_end::TIMED_OUT; i++) {
        poll(nullptr, 0, 1); // sleeps for a millisecond
        if (mailbox->command.load(std::memory_order_acquire) == MAILBOX_IDLE)
            return wait_end::ANSWERED;
        if (abandon.load(std::memory_order_acquire))
            end = wait_end::ABANDONED;
    }
    if (code == MAILBOX_ADD_TUNNEL && !wccp_withdraw_command(mailbox))
        return wait_end::ANSWERED; // at the last moment: the tunnel exists
    return end;
}

// Sends the command and waits, as choose_effort decides. True when tunneld has answered, with its answer in
// the outputs; otherwise `out_failure` is the reason.
bool run_command(const command_kind *kind, const mailbox_inputs *inputs, uint32_t *out_status,
                 uint32_t *out_index, wccp_reason_code *out_failure) {
    const mutex_guard guard(&mailbox_mutex);
    wccp_tunnel_mailbox *mailbox = mailbox_get(created_mailbox);
    *out_failure = WCCP_REASON_MAILBOX_MISSING;
    if (!mailbox)
        return false;
    const effort made = choose_effort(kind->code, mailbox);
    if (made != effort::NONE)
        write_command(mailbox, kind->code, inputs);
    *out_failure = made == effort::GIVE_AND_WAIT ? WCCP_REASON_TUNNEL_TIMEOUT : WCCP_REASON_TUNNELD_SILENT;
    wait_end end = wait_end::TIMED_OUT;
    if (made == effort::GIVE_AND_WAIT) {
        end = wait_for_answer(mailbox, kind->code);
        if (end == wait_end::TIMED_OUT)
            unanswered = {kind->code, wccpd_shutdown_in_progress() == 1, lt_monotonic_ms()};
    }
    if (end == wait_end::TIMED_OUT) // also for a command that was not sent, but not at the reset
        WCCP_COMPLAIN(kind->time_out_level, "%s", kind->time_out_line);
    if (end != wait_end::ANSWERED)
        return false;
    unanswered = {}; // tunneld works again
    *out_status = mailbox_get(mailbox->status);
    *out_index = mailbox_get(mailbox->fmst_index);
    return true;
}

mailbox_inputs make_tunnel_inputs(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                                  uint32_t index) {
    return {.tunnel_id = tunnel_id,
            // An IPv4 address is in the low 32 bits of the 16 bytes.
            .local_ip = static_cast<uint32_t>(local.words[0]),
            .remote_ip = static_cast<uint32_t>(remote.words[0]),
            .fmst_index = index,
            .l2_group = 0,
            .l2_value = 0};
}

} // namespace

int wccp_add_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index) {
    wccp_reason_code unused;
    return wccp_add_tunnel_or_say_why(tunnel_id, local, remote, inout_index, &unused);
}

int wccp_add_tunnel_or_say_why(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                               uint32_t *inout_index, wccp_reason_code *out_failure) {
    const mailbox_inputs inputs = make_tunnel_inputs(tunnel_id, local, remote, *inout_index);
    uint32_t status, index;
    if (!run_command(&add_tunnel, &inputs, &status, &index, out_failure))
        return 1;
    *out_failure = WCCP_REASON_TUNNEL_REFUSED; // the only failure that an answer can report
    *inout_index = index;
    // An answer without an index is a failure, whatever its status.
    return index == WCCP_NO_INDEX ? 1 : static_cast<int>(status);
}

int wccp_del_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index) {
    const mailbox_inputs inputs = make_tunnel_inputs(tunnel_id, local, remote, *inout_index);
    uint32_t status, index;
    wccp_reason_code unused;
    if (!run_command(&delete_tunnel, &inputs, &status, &index, &unused))
        return 1;
    *inout_index = index;
    return static_cast<int>(status);
}

int wccp_set_L2_return(uint8_t group_id, uint32_t value) {
    mailbox_inputs inputs = {};
    inputs.l2_group = group_id;
    inputs.l2_value = value;
    uint32_t status, index;
    wccp_reason_code unused;
    if (!run_command(&set_l2_return, &inputs, &status, &index, &unused))
        return 1;
    return static_cast<int>(status);
}
