// wccpd gives up on a command after two seconds: it then withdraws an add, and overwrites a delete or an L2
// return with its next command. Therefore a command is read twice, to detect that it was overwritten
// meanwhile, and compared once more before it is answered. A command that is gone by then is not answered,
// because wccpd would take the answer for that of the next one; an add that is gone is undone, because wccpd
// does not know that the tunnel exists.
//
// As in wccpd, a tunnel is identified by its two ends, and its id is only a handle. An add of known ends
// under another id, or of other ends under a known id (its delete was lost), replaces the old tunnel.
#include "peers/tunneld/commands.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>

#include <nlohmann/json.hpp>

#include "peers/tunneld/link_names.h"
#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {

// True when a signal has interrupted the sleep.
bool sleep_or_end(int64_t ms) {
    const timespec time = {ms / 1000, (ms % 1000) * 1000000};
    return nanosleep(&time, nullptr) != 0 && errno == EINTR;
}

void print_command(const command_desk &desk, const mailbox_command &command, const std::string &result) {
    if (command.code == MAILBOX_L2_RETURN) {
        print_line(desk,
                   {{"command", "l2_return"},
                    {"group", command.l2_group},
                    {"value", command.l2_value},
                    {"result", result}},
                   "L2 return group " + std::to_string(command.l2_group) + " value " +
                       std::to_string(command.l2_value) + ": " + result);
        return;
    }
    if (command.code != MAILBOX_ADD_TUNNEL && command.code != MAILBOX_DELETE_TUNNEL) {
        print_line(desk, {{"command", "unknown"}, {"code", command.code}, {"result", result}},
                   "unknown command " + std::to_string(command.code) + ": " + result);
        return;
    }
    const std::string word = command.code == MAILBOX_ADD_TUNNEL ? "add" : "delete";
    nlohmann::ordered_json line = {{"command", word},
                                   {"tunnel_id", command.tunnel_id},
                                   {"local", address_text(command.local)},
                                   {"remote", address_text(command.remote)},
                                   {"index", nullptr},
                                   {"result", result},
                                   {"tunnels", desk.tunnels.size()}};
    std::string index = "none";
    if (command.index != WCCP_NO_INDEX) {
        line["index"] = command.index;
        index = std::to_string(command.index);
    }
    print_line(desk, line,
               word + " tunnel " + std::to_string(command.tunnel_id) + " " + address_text(command.local) +
                   " <=> " + address_text(command.remote) + " index " + index + ": " + result);
}

mailbox_command read_command(uint16_t code) {
    mailbox_command command = {};
    command.code = code;
    if (code == MAILBOX_L2_RETURN) {
        wccp_get_config_paramters(&command.l2_group, &command.l2_value);
        return command;
    }
    mailbox_address local = {}, remote = {};
    wccp_get_tunnel_parameters(&command.tunnel_id, &local, &remote, &command.index);
    command.local = static_cast<uint32_t>(local.words[0]);
    command.remote = static_cast<uint32_t>(remote.words[0]);
    return command;
}

// The code is read last once more: wccpd clears it before it writes the parameters of another command.
bool is_still_pending(const mailbox_command &command) {
    return wccp_get_tunnel_command() == command.code && read_command(command.code) == command &&
           wccp_get_tunnel_command() == command.code;
}

// False when wccpd has given up on the command, which is then not answered.
bool answer_command(const mailbox_command &given, uint32_t index, uint32_t status) {
    if (!is_still_pending(given))
        return false;
    // The outputs come first: wccpd reads them as soon as the status has been set.
    if (given.code != MAILBOX_L2_RETURN)
        wccp_set_fmst_index(index);
    return wccp_set_tunnel_command_status(status);
}

uint32_t take_next_index(command_desk *desk) {
    const uint32_t index = desk->next_index;
    if (index != WCCP_NO_INDEX && ++desk->next_index == WCCP_NO_INDEX)
        desk->next_index = 1;
    return index;
}

void apply_table(command_desk *desk) {
    if (desk->apply)
        desk->apply(&desk->tunnels);
}

// Returns the index of the tunnel, which is the old one if the tunnel exists; WCCP_NO_INDEX when it cannot be
// made.
uint32_t add_ordered_tunnel(command_desk *desk, const mailbox_command &command) {
    for (auto it = desk->tunnels.begin(); it != desk->tunnels.end();) {
        const bool same_id = it->first == command.tunnel_id;
        const bool same_ends = it->second.local == command.local && it->second.remote == command.remote;
        const bool replaced = same_id != same_ends; // both the same: it is this tunnel
        it = replaced ? desk->tunnels.erase(it) : std::next(it);
    }
    const command_tunnel wanted = {command.local, command.remote, WCCP_NO_INDEX};
    // insert() leaves the entry of a known tunnel, and its index, unchanged.
    const auto [tunnel, is_new] = desk->tunnels.insert({command.tunnel_id, wanted});
    apply_table(desk); // also for a known tunnel: somebody may have removed its interface
    if (!desk->apply && is_new)
        tunnel->second.index = take_next_index(desk);
    const uint32_t index = tunnel->second.index;
    if (index == WCCP_NO_INDEX) {
        // What was made of the tunnel is removed again: wccpd regards the add as failed and does not delete
        // it.
        desk->tunnels.erase(command.tunnel_id);
        apply_table(desk);
    }
    return index;
}

int32_t read_wccpd_pid() {
    int32_t pid = 0;
    if (FILE *file = fopen(WCCPD_FILE, "re")) {
        if (fscanf(file, "%9d", &pid) != 1)
            pid = 0;
        fclose(file);
    }
    return pid;
}

void write_wccpd_pid(int32_t pid) {
    mkdir("/run/tunneld", 0755); // fails when it exists
    FILE *file = fopen(WCCPD_FILE, "we");
    if (!file || fprintf(file, "%d\n", pid) < 0)
        LC_LOG(LC_LOG_WARNING, "Cannot write %s: %m", WCCPD_FILE);
    if (file)
        fclose(file);
}

// Returns the status for the answer: 1 for a failure, otherwise 0.
uint32_t execute_command(command_desk *desk, const mailbox_command &command, uint32_t *out_index,
                         const char **out_result) {
    const auto found = desk->tunnels.find(command.tunnel_id);
    const bool known = found != desk->tunnels.end() && found->second.local == command.local &&
                       found->second.remote == command.remote;
    *out_index = known ? found->second.index : WCCP_NO_INDEX;
    *out_result = "refused";
    if (desk->options.refuse)
        return 1;
    *out_result = "done";
    switch (command.code) {
    case MAILBOX_ADD_TUNNEL:
        *out_index = add_ordered_tunnel(desk, command);
        desk->ordered.insert(command.tunnel_id);
        // The status is success all the same: wccpd takes a missing index for a failure.
        if (*out_index == WCCP_NO_INDEX)
            *out_result = "done, without an index";
        return 0;
    case MAILBOX_DELETE_TUNNEL:
        if (!known) {
            *out_result = "no such tunnel";
            return 1;
        }
        desk->tunnels.erase(found);
        desk->ordered.erase(command.tunnel_id);
        apply_table(desk);
        return 0;
    case MAILBOX_L2_RETURN:
        if (desk->set_l2_return)
            desk->set_l2_return(command.l2_group, command.l2_value != 0);
        return 0;
    default:
        *out_result = "refused";
        return 1;
    }
}

} // namespace

void watch_wccpd(command_desk *desk, int64_t now_ms) {
    bool lives = false;
    const int32_t pid = cmem_find_creator(WCCP_MAILBOX_NAME, &lives);
    desk->wccpd_lives = pid != 0 && lives;
    if (!desk->wccpd_lives || pid == desk->wccpd_pid)
        return;
    // After a restart of tunneld, the file says whether this wccpd has ordered the tunnels that were found.
    const int32_t before = desk->wccpd_pid ? desk->wccpd_pid : read_wccpd_pid();
    desk->wccpd_pid = pid;
    if (pid == before)
        return;
    write_wccpd_pid(pid);
    desk->ordered.clear();
    if (before == 0 ||
        desk->tunnels.empty()) // 0: whether wccpd is new is unknown, and the tunnels may be in use
        return;
    LC_LOG(LC_LOG_NOTICE, "A new wccpd has been started: %zu tunnels wait to be ordered again",
           desk->tunnels.size());
    desk->unordered_until_ms = now_ms + UNORDERED_MS;
}

void drop_unordered(command_desk *desk, int64_t now_ms) {
    if (desk->unordered_until_ms < 0 || now_ms < desk->unordered_until_ms)
        return;
    desk->unordered_until_ms = -1;
    const size_t dropped = std::erase_if(
        desk->tunnels, [&](const auto &tunnel) { return !desk->ordered.contains(tunnel.first); });
    if (dropped == 0)
        return;
    LC_LOG(LC_LOG_NOTICE, "%zu tunnels that wccpd has not ordered again are removed", dropped);
    apply_table(desk);
}

void forget_wccpd() {
    unlink(WCCPD_FILE);
}

void print_roles(command_desk *desk) {
    static const char *const words[] = {"ACTIVE", "BACKUP", "UNKNOWN"};
    for (uint32_t i = 0; i < WCCP_POLICY_GROUPS; i++) {
        const auto group = static_cast<uint16_t>(i);
        const uint32_t role = wccp_get_role(group);
        const auto known = desk->roles.find(group);
        // Roles other than UNKNOWN (2) are kept: most of the 65536 policy groups have none.
        if (role == (known == desk->roles.end() ? 2 : known->second))
            continue;
        if (role == 2)
            desk->roles.erase(group);
        else
            desk->roles[group] = role;
        const std::string word = role < 3 ? words[role] : std::to_string(role);
        print_line(*desk, {{"policy_group", group}, {"role", word}},
                   "policy group " + std::to_string(group) + " role " + word);
    }
}

bool take_command(command_desk *desk, bool *out_end) {
    *out_end = false;
    const uint16_t code = wccp_get_tunnel_command();
    if (!desk->attached && wccp_mailbox) {
        desk->attached = true;
        print_line(*desk, {{"event", "attached"}}, "attached to the mailbox");
    }
    if (code == MAILBOX_IDLE) {
        desk->passed_over.reset();
        return false;
    }
    mailbox_command command = read_command(code);
    if (wccp_get_tunnel_command() != code) // overwritten while it was read
        return true;
    if (desk->options.silent) {
        if (desk->passed_over != command)
            print_command(*desk, command, "not answered");
        desk->passed_over = command;
        return false;
    }
    // Before the command is executed: for a new wccpd this clears `ordered`, to which the command may add a
    // tunnel.
    watch_wccpd(desk, lt_monotonic_ms());
    const mailbox_command given = command;
    const auto before = desk->tunnels;
    const char *result;
    const uint32_t status = execute_command(desk, command, &command.index, &result);
    *out_end = desk->options.slow_ms && sleep_or_end(desk->options.slow_ms);
    if (!answer_command(given, command.index, status)) {
        if (code == MAILBOX_ADD_TUNNEL) {
            desk->tunnels = before;
            apply_table(desk);
        }
        result = "withdrawn";
    }
    print_command(*desk, command, result);
    return true;
}

void print_line(const command_desk &desk, const nlohmann::ordered_json &line, const std::string &text) {
    fprintf(desk.out, "%s\n", desk.options.json ? line.dump().c_str() : text.c_str());
    fflush(desk.out);
}

int open_wake_up() {
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    sockaddr_un own = {};
    own.sun_family = AF_UNIX;
    memcpy(own.sun_path, WCCP_WAKE_UP_PATH, sizeof WCCP_WAKE_UP_PATH);
    unlink(WCCP_WAKE_UP_PATH);
    if (fd >= 0 && bind(fd, reinterpret_cast<const sockaddr *>(&own), sizeof own) == 0)
        return fd;
    LC_LOG(LC_LOG_WARNING, "%s: %m: the mailbox is polled instead", WCCP_WAKE_UP_PATH);
    if (fd >= 0)
        close(fd);
    return -1;
}

void take_wake_ups(int fd) {
    char byte;
    while (recv(fd, &byte, sizeof byte, 0) >= 0)
        continue;
}

void close_wake_up(int *inout_fd) {
    if (*inout_fd < 0)
        return;
    unlink(WCCP_WAKE_UP_PATH);
    close(*inout_fd);
    *inout_fd = -1;
}

int64_t mailbox_pause_ms(bool attached, bool is_woken, int64_t quiet_ms) {
    if (!attached || is_woken)
        return 250;
    if (quiet_ms < 1000)
        return 1;
    return quiet_ms < 60000 ? 5 : 60;
}

bool start_commands(command_desk *desk, const command_options &options, FILE *out) {
    desk->options = options;
    desk->out = out;
    desk->next_index = options.first_index;
    return cmem_attach_registry(); // the mailbox is found through it once wccpd has created it
}
