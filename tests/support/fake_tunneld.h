// tunneld's side of the mailbox, on a thread: records each command and answers as the test requires.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "platform/tunnel_mailbox.h"

struct seen_command {
    uint16_t code;
    uint16_t tunnel_id;
    uint32_t local, remote, index; // host order
    uint8_t l2_group;
    uint32_t l2_value;
    bool operator==(const seen_command &) const = default;
};
struct tunneld_answer {
    uint32_t status;
    uint32_t index;
};

struct fake_tunneld {
    // Called for each command, on the thread. std::nullopt: no answer.
    using answer_fn = std::function<std::optional<tunneld_answer>(const seen_command &)>;
    explicit fake_tunneld(answer_fn answer);
    ~fake_tunneld();
    fake_tunneld(const fake_tunneld &) = delete;
    fake_tunneld &operator=(const fake_tunneld &) = delete;

    void answer_with(answer_fn answer);
    std::vector<seen_command> take_commands();
    // Waits until there is a command without an answer.
    void wait_for_command();

private:
    void run();
    std::mutex mutex;
    answer_fn answer;
    std::vector<seen_command> commands;
    std::atomic<bool> stop = false;
    std::atomic<bool> pending = false;
    std::thread thread;
};

// Success; an add gets the index 1000 + tunnel id.
std::optional<tunneld_answer> tunneld_does(const seen_command &command);
// No answer.
std::optional<tunneld_answer> tunneld_is_silent(const seen_command &command);

// Writes mem.conf and lets this process create the mailbox again. Call it before wccp_init_shmem.
void write_mem_conf();
