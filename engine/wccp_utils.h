// Small things that the whole engine shares: address text for log lines, the assignment block, words for
// codes.
#pragma once

#include "engine/wccp_records.h"
#include "platform/qvcommon.h"
#include "runtime/logging.h"

// The group with this id, or null. Lock held; only the low 8 bits count.
wccp_service_group *wccp_find_group(int id);

// Whether the interface has a link and an address; false for null. Lock held.
bool wccp_if_is_ready(const wccp_interface *interface);
// Whether the group has been started, on an interface that is ready, and not stopped since. Lock held.
bool wccp_group_is_running(const wccp_service_group *group);

// Zeroed memory, or null with an error line; counted in wccp_g. For free() use wccp_free, which takes null.
void *wccp_calloc(uint32_t count, uint32_t size);
void *wccp_malloc(uint32_t size);
void wccp_free(void *memory);

// Writes "days:hours:minutes:seconds" into `buffer`; nothing when `length` is below 32 bytes.
void wccp_seconds_to_str(uint32_t seconds, char *buffer, uint32_t length);

// Dotted text of an address, by value: addr_text(ipa).s in the arguments of a log line.
struct wccp_addr_text {
    char s[46];
};
wccp_addr_text addr_text(be32 address);

// Zeroes the block from dsg_appliance_count up to and including pending_acks.
void wccp_clear_assignment_block(wccp_service_group *group);

// "none", "gre", "L2", "gre or L2" and "none", "hash", "mask", "hash or mask"; "INVALID" from code 4 on.
const char *wccp_method_name(uint32_t code);
const char *wccp_assign_method_name(uint32_t code);

// Number of 1 bits over the four fields, 0 for null.
uint32_t util_wccp_mask_get_bits_set(const wccp_mask *mask);

// The engine lock for a scope. Once it has the lock it checks whether its thread has been cancelled
// meanwhile, and ends the thread there: a thread that waited while the engine was stopped never touches what
// was stopped.
struct wccp_engine_lock {
    wccp_engine_lock();
    ~wccp_engine_lock();
    wccp_engine_lock(const wccp_engine_lock &) = delete;
    wccp_engine_lock &operator=(const wccp_engine_lock &) = delete;
};
