#include "tests/support/fake_tunneld.h"

#include <gtest/gtest.h>
#include <sys/shm.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "runtime/cmem.h"

using namespace std::chrono_literals;

fake_tunneld::fake_tunneld(answer_fn first) : answer(std::move(first)), thread([this] { run(); }) {}

fake_tunneld::~fake_tunneld() {
    stop = true;
    thread.join();
}

void fake_tunneld::answer_with(answer_fn next) {
    const std::lock_guard lock(mutex);
    answer = std::move(next);
    pending = false; // a command that is waiting is read again
}

std::vector<seen_command> fake_tunneld::take_commands() {
    const std::lock_guard lock(mutex);
    return std::move(commands);
}

void fake_tunneld::wait_for_command() {
    while (!pending)
        std::this_thread::sleep_for(200us);
}

void fake_tunneld::run() {
    seen_command last = {};
    for (; !stop; std::this_thread::sleep_for(200us)) {
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
        last = command;
        commands.push_back(command);
        const std::optional<tunneld_answer> given = answer(command);
        pending = !given;
        if (!given)
            continue;
        if (command.code != MAILBOX_L2_RETURN)
            wccp_set_fmst_index(given->index);
        wccp_set_tunnel_command_status(given->status);
    }
}

std::optional<tunneld_answer> tunneld_does(const seen_command &command) {
    return tunneld_answer{0, 1000u + command.tunnel_id};
}
std::optional<tunneld_answer> tunneld_is_silent(const seen_command &) {
    return std::nullopt;
}

// A process creates its block only once. For a test that starts the engine again, the records of the blocks
// are cleared; the segments remain.
static void forget_blocks() {
    constexpr size_t RECORD_BYTES = 336000;
    const int id = shmget(CMEM_REGISTRY_KEY, 0, 0);
    void *registry = id >= 0 ? shmat(id, nullptr, 0) : reinterpret_cast<void *>(-1);
    if (registry == reinterpret_cast<void *>(-1))
        return;
    memset(registry, 0, RECORD_BYTES);
    shmdt(registry);
}

void write_mem_conf() {
    const std::filesystem::path path = CMEM_CONF_PATH;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << "# name node pages key\n" << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
    forget_blocks();
}
