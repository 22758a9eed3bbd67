// Helpers that the whole engine uses: look-ups, memory with statistics, texts for log lines, and the engine
// lock as a scope guard.
#pragma once

#include "engine/wccp_records.h"
#include "platform/qvcommon.h"
#include "runtime/logging.h"

// The group whose id is the low 8 bits of `id`, or null. Lock held.
wccp_service_group *wccp_find_group(int id);

// Whether the interface has a link and an address; false for null. Lock held.
bool wccp_if_is_ready(const wccp_interface *interface);
// Whether the group has been started and not stopped since, and its interface is ready. Lock held.
bool wccp_group_is_running(const wccp_service_group *group);

// Both return zeroed memory, to be freed with wccp_free, or null, with a line in the log. Sizes are in bytes.
// Calls are counted in wccp_g. No lock needed.
void *wccp_calloc(uint32_t count, uint32_t size);
void *wccp_malloc(uint32_t size);
void wccp_free(void *memory); // null: nothing

// Writes "days:hours:minutes:seconds", no part padded, into `buffer`. `length` is its size in bytes; only the
// low 8 bits count, and below 32 nothing is written.
void wccp_seconds_to_str(uint32_t seconds, char *buffer, uint32_t length);

// The dotted text of an address, returned by value so that addr_text(ipa).s can be an argument of a log line.
struct wccp_addr_text {
    char s[46];
};
wccp_addr_text addr_text(be32 address);

// Zeroes the fields of a group from dsg_appliance_count to pending_acks, both included. Lock held.
void wccp_clear_assignment_block(wccp_service_group *group);

// "none", "gre", "L2", "gre or L2"; "INVALID" for other codes.
const char *wccp_method_name(uint32_t code);
// "none", "hash", "mask", "hash or mask"; "INVALID" for other codes.
const char *wccp_assign_method_name(uint32_t code);

// The number of bits set in all four fields together; 0 for null.
uint32_t util_wccp_mask_get_bits_set(const wccp_mask *mask);

// Holds the engine lock for a scope. If the thread has been cancelled by the time it gets the lock, the
// constructor releases the lock and ends the thread: see wccp_utils.cpp.
struct wccp_engine_lock {
    wccp_engine_lock();
    ~wccp_engine_lock();
    wccp_engine_lock(const wccp_engine_lock &) = delete;
    wccp_engine_lock &operator=(const wccp_engine_lock &) = delete;
};
