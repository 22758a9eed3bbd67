// Helpers that the whole engine uses, and the engine lock.
//
// The engine lock is taken by the timer thread for a tick, by a receive thread for a packet, by the main
// thread for each call of configuration and monitoring, and by the notifier thread for a callback.
//
// Waiting for a mutex is not a cancellation point. A receive thread that waits for the lock while the groups
// are stopped gets it afterwards with its cancellation still pending; if it went on, it would add routers to
// stopped groups and send commands to tunneld. The constructor of the guard therefore calls
// pthread_testcancel, which ends such a thread before it has touched anything. The main thread and the
// notifier are never cancelled.

#include "engine/wccp_utils.h"

#include <bit>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"

wccp_engine_lock::wccp_engine_lock() {
    // Until the constructor returns, the destructor does not run; this guard then releases the lock.
    mutex_guard guard(&wccp_g.lock);
    pthread_testcancel();
    guard.held = nullptr;
}

wccp_engine_lock::~wccp_engine_lock() {
    pthread_mutex_unlock(&wccp_g.lock);
}

wccp_addr_text addr_text(be32 address) {
    wccp_addr_text text;
    get_addr_str(4, address, 0, text.s, sizeof text.s);
    return text;
}

void wccp_clear_assignment_block(wccp_service_group *group) {
    // The first and the last field of the block, as marked in the record.
    constexpr size_t begin = offsetof(wccp_service_group, dsg_appliance_count);
    constexpr size_t end = offsetof(wccp_service_group, pending_acks) + sizeof(group->pending_acks);
    memset(reinterpret_cast<uint8_t *>(group) + begin, 0, end - begin);
}

const char *wccp_method_name(uint32_t code) {
    static constexpr const char *names[] = {"none", "gre", "L2", "gre or L2"};
    return code < 4 ? names[code] : "INVALID";
}

const char *wccp_assign_method_name(uint32_t code) {
    static constexpr const char *names[] = {"none", "hash", "mask", "hash or mask"};
    return code < 4 ? names[code] : "INVALID";
}

uint32_t util_wccp_mask_get_bits_set(const wccp_mask *mask) {
    if (!mask)
        return 0;
    return static_cast<uint32_t>(std::popcount(mask->src_ip) + std::popcount(mask->dst_ip) +
                                 std::popcount(mask->src_port) + std::popcount(mask->dst_port));
}

wccp_service_group *wccp_find_group(int id) {
    return wccp_g.groups[id & 0xff];
}

bool wccp_if_is_ready(const wccp_interface *interface) {
    return interface && (interface->ready_flags & WCCP_ALL_READY) == WCCP_ALL_READY;
}

// hia_timer is active exactly from the start of a group to its stop.
bool wccp_group_is_running(const wccp_service_group *group) {
    return group->hia_timer.active == 1 && wccp_if_is_ready(group->interfaces[0]);
}

namespace {

void *counted_calloc(const char *failure, uint32_t count, uint32_t size) {
    void *memory = calloc(count, size);
    if (memory) {
        wccp_g.stat_allocs.fetch_add(1, std::memory_order_relaxed);
        return memory;
    }
    wccp_g.stat_alloc_fails.fetch_add(1, std::memory_order_relaxed);
    // An overflow does no harm here: calloc checks for it, and this product is only printed.
    QV_LOG(LC_LOG_ERR, failure, static_cast<int>(count * size));
    return nullptr;
}

} // namespace

void *wccp_calloc(uint32_t count, uint32_t size) {
    return counted_calloc("WCCP wccp_calloc: memory allocation failed. size: %d bytes", count, size);
}

void *wccp_malloc(uint32_t size) {
    return counted_calloc("WCCP wccp_malloc: memory allocation failed. size: %d bytes", 1, size);
}

void wccp_free(void *memory) {
    if (!memory)
        return;
    wccp_g.stat_frees.fetch_add(1, std::memory_order_relaxed);
    free(memory);
}

void wccp_seconds_to_str(uint32_t seconds, char *buffer, uint32_t length) {
    length &= 0xff;
    if (!buffer || length < 32)
        return;
    // Days, hours, minutes and seconds.
    snprintf(buffer, length, "%u:%u:%u:%u", seconds / 86400, seconds / 3600 % 24, seconds / 60 % 60,
             seconds % 60);
}
