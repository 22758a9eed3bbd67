// The daemon's one thread. It looks at the mailbox each millisecond for a second after a command, since more
// follow, less often the longer it has been quiet, and four times a second while there is no mailbox. wccpd
// waits for two seconds, of which the longest pause takes a small part. The thread sleeps in sigtimedwait: a
// signal ends it at once, and nothing else interrupts it.
//
// wccpd gives a command up after two seconds: an add is then withdrawn, a delete or an L2 return is
// overwritten by the next command. Therefore a command is checked again after it has been read and once more
// before it is answered. One that is gone by then gets no answer, since that would be taken for the answer to
// another, and an add that is gone is undone, since nobody knows its tunnel.
//
// A tunnel's ends are its identity and its id a handle, as on wccpd's side: an add under another id, or under
// an id whose delete was lost, replaces what was there.

#include "peers/tunneld/tunneld.h"

#include <arpa/inet.h>
#include <signal.h>

#include <ctime>

#include <nlohmann/json.hpp>

#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"
#include "runtime/ttime.h"

namespace {

constexpr int64_t DETACHED_MS = 250, ROLES_EVERY_MS = 1000;

// The time to the next look at the mailbox, by the time since the last command or the start.
int64_t pause_ms(int64_t quiet_ms) {
    if (quiet_ms < 1000)
        return 1;
    return quiet_ms < 60000 ? 5 : 50;
}

sigset_t end_signals() {
    sigset_t set;
    sigemptyset(&set);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP})
        sigaddset(&set, signal);
    return set;
}

// True when one of the signals that end the daemon has come.
bool sleep_or_end(int64_t ms) {
    const sigset_t set = end_signals();
    const timespec time = {ms / 1000, (ms % 1000) * 1000000};
    return sigtimedwait(&set, nullptr, &time) > 0;
}

std::string address(uint32_t host_order) {
    const in_addr wire = {htonl(host_order)};
    char text[INET_ADDRSTRLEN];
    return inet_ntop(AF_INET, &wire, text, sizeof text);
}

void print(tunneld *daemon, const nlohmann::ordered_json &line, const std::string &text) {
    fprintf(daemon->out, "%s\n", daemon->options.json ? line.dump().c_str() : text.c_str());
    fflush(daemon->out);
}

void print_command(tunneld *daemon, const tunneld_command &command, const std::string &result) {
    if (command.code == MAILBOX_L2_RETURN) {
        print(daemon,
              {{"command", "l2_return"},
               {"group", command.l2_group},
               {"value", command.l2_value},
               {"result", result}},
              "L2 return group " + std::to_string(command.l2_group) + " value " +
                  std::to_string(command.l2_value) + ": " + result);
        return;
    }
    if (command.code != MAILBOX_ADD_TUNNEL && command.code != MAILBOX_DELETE_TUNNEL) {
        print(daemon, {{"command", "unknown"}, {"code", command.code}, {"result", result}},
              "unknown command " + std::to_string(command.code) + ": " + result);
        return;
    }
    const std::string word = command.code == MAILBOX_ADD_TUNNEL ? "add" : "delete";
    nlohmann::ordered_json line = {{"command", word},
                                   {"tunnel_id", command.tunnel_id},
                                   {"local", address(command.local)},
                                   {"remote", address(command.remote)},
                                   {"index", nullptr},
                                   {"result", result},
                                   {"tunnels", daemon->tunnels.size()}};
    std::string index = "none";
    if (command.index != WCCP_NO_INDEX) {
        line["index"] = command.index;
        index = std::to_string(command.index);
    }
    print(daemon, line,
          word + " tunnel " + std::to_string(command.tunnel_id) + " " + address(command.local) + " <=> " +
              address(command.remote) + " index " + index + ": " + result);
}

tunneld_command read_command(uint16_t code) {
    tunneld_command command = {};
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

bool still_there(const tunneld_command &command) {
    return wccp_get_tunnel_command() == command.code && read_command(command.code) == command &&
           wccp_get_tunnel_command() == command.code;
}

// False when wccpd has given the command up: it gets no answer.
bool answer(const tunneld_command &given, uint32_t index, uint32_t status) {
    if (!still_there(given))
        return false;
    if (given.code != MAILBOX_L2_RETURN)
        wccp_set_fmst_index(index);
    return wccp_set_tunnel_command_status(status);
}

uint32_t take_index(tunneld *daemon) {
    const uint32_t index = daemon->next_index;
    if (index != WCCP_NO_INDEX && ++daemon->next_index == WCCP_NO_INDEX)
        daemon->next_index = 1;
    return index;
}

// The index of the tunnel, an old one where its ends and its id are known.
uint32_t add(tunneld *daemon, const tunneld_command &command) {
    for (auto it = daemon->tunnels.begin(); it != daemon->tunnels.end();) {
        const bool same_id = it->first == command.tunnel_id;
        const bool same_ends = it->second.local == command.local && it->second.remote == command.remote;
        if (same_id && same_ends)
            return it->second.index;
        it = same_id || same_ends ? daemon->tunnels.erase(it) : std::next(it);
    }
    const uint32_t index = take_index(daemon);
    if (index != WCCP_NO_INDEX)
        daemon->tunnels[command.tunnel_id] = {command.local, command.remote, index};
    return index;
}

// Carries the command out; the status that it is answered with.
uint32_t carry_out(tunneld *daemon, const tunneld_command &command, uint32_t *out_index,
                   const char **out_result) {
    const auto found = daemon->tunnels.find(command.tunnel_id);
    const bool known = found != daemon->tunnels.end() && found->second.local == command.local &&
                       found->second.remote == command.remote;
    *out_index = known ? found->second.index : WCCP_NO_INDEX;
    *out_result = "refused";
    if (daemon->options.refuse)
        return 1;
    *out_result = "done";
    switch (command.code) {
    case MAILBOX_ADD_TUNNEL:
        *out_index = add(daemon, command);
        if (*out_index == WCCP_NO_INDEX)
            *out_result = "done, without an index";
        return 0;
    case MAILBOX_DELETE_TUNNEL:
        if (!known) {
            *out_result = "no such tunnel";
            return 1;
        }
        daemon->tunnels.erase(found);
        return 0;
    case MAILBOX_L2_RETURN:
        return 0;
    default:
        *out_result = "refused";
        return 1;
    }
}

void print_roles(tunneld *daemon) {
    static const char *const words[] = {"ACTIVE", "BACKUP", "UNKNOWN"};
    for (uint32_t i = 0; i < WCCP_POLICY_GROUPS; i++) {
        const auto group = static_cast<uint16_t>(i);
        const uint32_t role = wccp_get_role(group);
        const auto known = daemon->roles.find(group);
        if (role == (known == daemon->roles.end() ? 2 : known->second))
            continue;
        if (role == 2)
            daemon->roles.erase(group);
        else
            daemon->roles[group] = role;
        const std::string word = role < 3 ? words[role] : std::to_string(role);
        print(daemon, {{"policy_group", group}, {"role", word}},
              "policy group " + std::to_string(group) + " role " + word);
    }
}

// One look. `*out_end` is set when a signal came while the command was under way.
bool step(tunneld *daemon, bool *out_end) {
    const uint16_t code = wccp_get_tunnel_command();
    if (!daemon->attached && wccp_mailbox) {
        daemon->attached = true;
        print(daemon, {{"event", "attached"}}, "attached to the mailbox");
    }
    if (code == MAILBOX_IDLE) {
        daemon->passed_over.reset();
        return false;
    }
    tunneld_command command = read_command(code);
    if (wccp_get_tunnel_command() != code)
        return true;
    if (daemon->options.silent) {
        if (daemon->passed_over != command)
            print_command(daemon, command, "not answered");
        daemon->passed_over = command;
        return false;
    }
    const tunneld_command given = command;
    const auto before = daemon->tunnels;
    const char *result;
    const uint32_t status = carry_out(daemon, command, &command.index, &result);
    *out_end = daemon->options.slow_ms && sleep_or_end(daemon->options.slow_ms);
    if (!answer(given, command.index, status)) {
        if (code == MAILBOX_ADD_TUNNEL)
            daemon->tunnels = before;
        result = "withdrawn";
    }
    print_command(daemon, command, result);
    return true;
}

} // namespace

bool tunneld_start(tunneld *daemon, const tunneld_options &options, FILE *out) {
    daemon->options = options;
    daemon->out = out;
    daemon->next_index = options.first_index;
    return cmem_attach_registry(); // through which the mailbox is found once wccpd has created it
}

bool tunneld_step(tunneld *daemon) {
    bool end = false;
    return step(daemon, &end);
}

void tunneld_run(tunneld *daemon) {
    int64_t last_command = lt_monotonic_ms(), roles_at = 0;
    for (bool end = false; !end;) {
        const int64_t now = lt_monotonic_ms();
        if (step(daemon, &end)) {
            last_command = now;
            continue;
        }
        if (daemon->options.roles && daemon->attached && now >= roles_at) {
            print_roles(daemon);
            roles_at = now + ROLES_EVERY_MS;
        }
        end = sleep_or_end(daemon->attached ? pause_ms(now - last_command) : DETACHED_MS);
    }
}
