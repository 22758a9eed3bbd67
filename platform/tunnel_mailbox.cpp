// The mailbox as tunneld uses it, and the attaching that both sides share.
//
// Nothing here takes a lock: tunneld has one thread for its commands, and a role is one load. Every field is
// read and written in one access of its own width with acquire and release order; neither the compiler nor
// the machine moves an input across the `command` that hands it over.
//
// wccpd gives up a command after about two seconds and may then replace it while tunneld is still reading.
// Therefore the inputs are read twice, with `command` checked before, between and after: wccpd sets `command`
// to 0 before it touches an input, hence inputs that agree, with no 0 seen, belong to one command. A reader
// that does not get there in a thousand tries (there is no command any more, or wccpd is held up in the
// middle of writing one) takes what it has; it checks `command` again before it acts.

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
    if (cmem_exists_block(WCCP_MAILBOX_NAME) != 1)
        return false;
    uint64_t length = 0;
    void *block = cmem_attach_block(WCCP_MAILBOX_NAME, &length);
    if (!block)
        return false;
    if (length < sizeof(wccp_tunnel_mailbox)) {
        static std::atomic<bool> logged; // once: this is tried again and again
        if (!logged.exchange(true))
            QV_LOG(LC_LOG_ERR, "Block %s has %lu bytes instead of %lu and is not used", WCCP_MAILBOX_NAME,
                   static_cast<unsigned long>(length),
                   static_cast<unsigned long>(sizeof(wccp_tunnel_mailbox)));
        shmdt(block);
        return false;
    }
    auto *mailbox = static_cast<wccp_tunnel_mailbox *>(block);
    mailbox_put(wccp_mailbox, mailbox);
    return true;
}

// Both sides end a command by an exchange: exactly one of them finds it in the slot.
bool wccp_withdraw_command(wccp_tunnel_mailbox *mailbox) {
    return mailbox->command.exchange(MAILBOX_IDLE, std::memory_order_acq_rel) != MAILBOX_IDLE;
}

// A socket for each time: a tunneld that has been restarted has bound a new one, and commands are rare.
void wccp_wake_tunneld() {
    const cancel_off_guard whole;
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return;
    sockaddr_un to = {};
    to.sun_family = AF_UNIX;
    memcpy(to.sun_path, WCCP_WAKE_UP_PATH, sizeof WCCP_WAKE_UP_PATH);
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

inputs read_once(const wccp_tunnel_mailbox *mailbox) {
    return {mailbox_get(mailbox->tunnel_id),  mailbox_get(mailbox->local_ip), mailbox_get(mailbox->remote_ip),
            mailbox_get(mailbox->fmst_index), mailbox_get(mailbox->l2_group), mailbox_get(mailbox->l2_value)};
}

inputs read_inputs(const wccp_tunnel_mailbox *mailbox) {
    for (int tries = 0;; tries++) {
        const uint16_t before = mailbox->command.load(std::memory_order_acquire);
        const inputs first = read_once(mailbox);
        const uint16_t between = mailbox->command.load(std::memory_order_acquire);
        const inputs second = read_once(mailbox);
        const uint16_t after = mailbox->command.load(std::memory_order_acquire);
        const bool whole = before == between && between == after && before != MAILBOX_IDLE && first == second;
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
    mailbox_put(mailbox->status, status);
    return mailbox->command.exchange(MAILBOX_IDLE, std::memory_order_acq_rel) != MAILBOX_IDLE;
}

uint32_t wccp_get_role(uint16_t policy_group) {
    if (!wccp_attach_mailbox())
        return 2;
    return wccp_mailbox->policy_roles[policy_group].role.load(std::memory_order_relaxed);
}
