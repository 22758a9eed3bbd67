// tunneld's side of the mailbox, on a thread: records each command and answers as the test requires.
#pragma once

#include <gtest/gtest.h>
#include <sys/shm.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <thread>

#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"

struct seen_command {
    uint16_t code, tunnel_id;
    uint32_t local, remote, index; // host order
    uint8_t l2_group;
    uint32_t l2_value;
    bool operator==(const seen_command &) const = default;
};
struct tunneld_answer {
    uint32_t status, index;
};

struct fake_tunneld {
    // Called for each command, on the thread. std::nullopt: no answer.
    using answer_fn = std::function<std::optional<tunneld_answer>(const seen_command &)>;
    explicit fake_tunneld(answer_fn first) : answer(std::move(first)), thread([this] { run(); }) {}
    ~fake_tunneld() {
        stop = true;
        thread.join();
    }
    fake_tunneld(const fake_tunneld &) = delete;
    fake_tunneld &operator=(const fake_tunneld &) = delete;

    void answer_with(answer_fn next) {
        const std::lock_guard lock(mutex);
        answer = std::move(next);
        pending = false; // a command that is waiting is read again
    }
    std::vector<seen_command> take_commands() {
        const std::lock_guard lock(mutex);
        return std::move(commands);
    }
    // Waits until there is a command without an answer.
    void wait_for_command() {
        while (!pending)
            pause();
    }

private:
    static void pause() { std::this_thread::sleep_for(std::chrono::microseconds(200)); }
    void run() {
        seen_command last = {};
        for (; !stop; pause()) {
            seen_command command = {};
            command.code = wccp_get_tunnel_command();
            if (command.code == MAILBOX_IDLE) {
                pending = false;
                continue;
            }
            mailbox_address local = {}, remote = {};
            wccp_get_tunnel_parameters(&command.tunnel_id, &local, &remote, &command.index);
            wccp_get_config_paramters(&command.l2_group, &command.l2_value);
            command.local = static_cast<uint32_t>(local.words[0]);
            command.remote = static_cast<uint32_t>(remote.words[0]);
            const std::lock_guard lock(mutex);
            if (wccp_get_tunnel_command() != command.code || (pending && command == last))
                continue;
            commands.push_back(last = command);
            const std::optional<tunneld_answer> given = answer(command);
            pending = !given;
            if (!given)
                continue;
            if (command.code != MAILBOX_L2_RETURN)
                wccp_set_fmst_index(given->index);
            wccp_set_tunnel_command_status(given->status);
        }
    }
    std::mutex mutex;
    answer_fn answer;
    std::vector<seen_command> commands;
    std::atomic<bool> stop = false, pending = false;
    std::thread thread;
};

// Success; an add gets the index 1000 + tunnel id.
inline std::optional<tunneld_answer> tunneld_does(const seen_command &command) {
    return tunneld_answer{0, 1000u + command.tunnel_id};
}
// No answer.
inline std::optional<tunneld_answer> tunneld_is_silent(const seen_command &) {
    return std::nullopt;
}

// Writes mem.conf and lets this process, which creates its block only once, create the mailbox again: the
// records of the blocks are cleared; the segments remain. Call it before wccp_init_shmem.
inline void write_mem_conf() {
    constexpr size_t RECORD_BYTES = 336000;
    const std::filesystem::path path = CMEM_CONF_PATH;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << "# name node pages key\n" << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
    const int id = shmget(CMEM_REGISTRY_KEY, 0, 0);
    void *registry = id >= 0 ? shmat(id, nullptr, 0) : reinterpret_cast<void *>(-1);
    if (registry == reinterpret_cast<void *>(-1))
        return;
    memset(registry, 0, RECORD_BYTES);
    shmdt(registry);
}
