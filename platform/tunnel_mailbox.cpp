// tunneld's functions on the mailbox, and what both sides share.
//
// Nothing here takes a lock: one thread of tunneld handles commands, and a role is a single load without an
// order. Every field of a command is accessed as a whole and with acquire and release order, so that no
// access to an input is moved across an access to `command`.
//
// wccpd withdraws a command that isn't answered within about two seconds and may then write another one,
// while tunneld is still reading the first. Therefore the inputs are read twice, and `command` before,
// between and after: wccpd sets `command` to 0 before it changes an input; therefore, if all agree and no 0
// was seen, the inputs belong to one command. After a thousand attempts (because there is no command any
// more, or wccpd was interrupted while it wrote one) the reader uses what it has, and checks `command` again
// before it acts on it.

#include "platform/tunnel_mailbox.h"

#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "runtime/cmem.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

wccp_tunnel_mailbox *wccp_mailbox;

bool wccp_attach_mailbox() {
    if (mailbox_get(wccp_mailbox))
        return true;
    // A tunneld that starts before wccpd finds no block yet.
    if (cmem_exists_block(WCCP_MAILBOX_NAME) != 1)
        return false;
    uint64_t length = 0;
    void *block = cmem_attach_block(WCCP_MAILBOX_NAME, &length);
    if (!block)
        return false;
    if (length < sizeof(wccp_tunnel_mailbox)) {
        static std::atomic<bool> logged; // tunneld repeats this until it succeeds
        if (!logged.exchange(true))
            QV_LOG(LC_LOG_ERR, "Shared memory block %s has %lu bytes instead of %lu and is not used",
                   WCCP_MAILBOX_NAME, static_cast<unsigned long>(length),
                   static_cast<unsigned long>(sizeof(wccp_tunnel_mailbox)));
        shmdt(block);
        return false;
    }
    auto *mailbox = static_cast<wccp_tunnel_mailbox *>(block);
    mailbox_put(wccp_mailbox, mailbox);
    return true;
}

// Both sides end a command by an exchange: exactly one of them finds it still there.
bool wccp_withdraw_command(wccp_tunnel_mailbox *mailbox) {
    return mailbox->command.exchange(MAILBOX_IDLE, std::memory_order_acq_rel) != MAILBOX_IDLE;
}

// A new socket for each call: commands are rare, and after a restart tunneld has a new socket at the path.
void wccp_wake_tunneld() {
    // Cancellation in sendto or close would leave the descriptor open.
    const cancel_off_guard whole;
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return;
    sockaddr_un to = {};
    to.sun_family = AF_UNIX;
    memcpy(to.sun_path, WCCP_WAKE_UP_PATH, sizeof WCCP_WAKE_UP_PATH);
    // Errors do not matter: tunneld also polls the slot, and only answers later.
    (void)sendto(fd, "", 1, MSG_DONTWAIT | MSG_NOSIGNAL, reinterpret_cast<const sockaddr *>(&to), sizeof to);
    close(fd);
}

uint16_t wccp_get_tunnel_command() {
    if (!wccp_attach_mailbox())
        return MAILBOX_IDLE;
    return wccp_mailbox->command.load(std::memory_order_acquire);
}

namespace {

struct inputs {
    uint16_t tunnel_id;
    uint32_t local_ip, remote_ip, fmst_index;
    uint8_t l2_group;
    uint32_t l2_value;
    bool operator==(const inputs &) const = default;
};

inputs read_inputs_once(const wccp_tunnel_mailbox *mailbox) {
    return {mailbox_get(mailbox->tunnel_id),  mailbox_get(mailbox->local_ip), mailbox_get(mailbox->remote_ip),
            mailbox_get(mailbox->fmst_index), mailbox_get(mailbox->l2_group), mailbox_get(mailbox->l2_value)};
}

inputs read_inputs(const wccp_tunnel_mailbox *mailbox) {
    for (int tries = 0;; tries++) {
        // A 0 at any of the three reads means that wccpd may have been writing in between.
        const uint16_t before = mailbox->command.load(std::memory_order_acquire);
        const inputs first = read_inputs_once(mailbox);
        const uint16_t between = mailbox->command.load(std::memory_order_acquire);
        const inputs second = read_inputs_once(mailbox);
        const uint16_t after = mailbox->command.load(std::memory_order_acquire);
        const bool whole = before == between && between == after && before != MAILBOX_IDLE && first == second;
        // The limit keeps tunneld from waiting for a wccpd that was stopped while it wrote.
        if (whole || tries == 1000)
            return second;
    }
}

} // namespace

void wccp_get_tunnel_parameters(uint16_t *out_tunnel_id, mailbox_address *out_local,
                                mailbox_address *out_remote, uint32_t *out_index) {
    const wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    if (!mailbox)
        return;
    const inputs read = read_inputs(mailbox);
    *out_tunnel_id = read.tunnel_id;
    *out_local = {{read.local_ip, 0}};
    *out_remote = {{read.remote_ip, 0}};
    *out_index = read.fmst_index;
}

void wccp_get_config_paramters(uint8_t *out_group, uint32_t *out_value) {
    const wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    if (!mailbox)
        return;
    const inputs read = read_inputs(mailbox);
    *out_group = read.l2_group;
    *out_value = read.l2_value;
}

void wccp_set_fmst_index(uint32_t index) {
    if (wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox))
        mailbox_put(mailbox->fmst_index, index);
}

uint32_t wccp_get_fmst_index() {
    const wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    return mailbox ? mailbox_get(mailbox->fmst_index) : WCCP_NO_INDEX;
}

bool wccp_set_tunnel_command_status(uint32_t status) {
    wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    if (!mailbox)
        return false;
    // The result first: wccpd reads it as soon as it finds `command` cleared.
    mailbox_put(mailbox->status, status);
    return mailbox->command.exchange(MAILBOX_IDLE, std::memory_order_acq_rel) != MAILBOX_IDLE;
}

uint32_t wccp_get_role(uint16_t policy_group) {
    if (!wccp_attach_mailbox())
        return 2; // UNKNOWN
    // The table has a place for each 16-bit number.
    return wccp_mailbox->policy_roles[policy_group].role.load(std::memory_order_relaxed);
}
