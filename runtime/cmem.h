// Named blocks of System V shared memory, found by all processes of the appliance through one registry
// segment.
#pragma once

#include <pthread.h>

#include <cstdint>

constexpr int32_t CMEM_REGISTRY_KEY = static_cast<int32_t>(0xBEEFFEED);
constexpr const char *CMEM_CONF_PATH = "/etc/opt/rvl/mem.conf";

// What is wrong with a file of that kind; nothing is logged, and no memory attached. Lines are counted
// from 1.
struct cmem_conf_faults {
    int error;         // errno of reading it, or 0
    uint32_t bad_line; // the first one that is passed over, or 0
    bool has_key;      // for the block `name`, without which it cannot be created
};
cmem_conf_faults cmem_check_conf(const char *path, const char *name);

// Attaches the registry, and loads "mem.conf" into it when no other process has. The other operations do this
// when they need it. False, with an error line, when another process has been loading for 5 seconds; a
// registry that cannot be attached ends the process.
bool cmem_attach_registry();
// 1 when the block is in the registry that this process has attached and its key exists, else 0.
int cmem_exists_block(const char *name);
// A new zeroed block of at least `length` bytes, or the zeroed block of a creator that has gone; null, with a
// line, on failure. Of several processes that create one block, exactly one gets it.
void *cmem_create_block(uint64_t length, const char *name);
// The block that another process has created, read and write; null, with a line, on failure. `out_length`,
// when given, gets the bytes that can be used: the segment in whole pages.
void *cmem_attach_block(const char *name, uint64_t *out_length = nullptr);
// The process that has created the block most recently; 0 when there is no such block. `out_lives`: whether
// it still runs.
int32_t cmem_find_creator(const char *name, bool *out_lives);

// A named mutex with default attributes.
struct cmutex;
cmutex *cmutex_alloc(const char *name);
void cmutex_free(cmutex **inout_mutex);
int cmutex_lock(cmutex *mutex);
int cmutex_unlock(cmutex *mutex);
