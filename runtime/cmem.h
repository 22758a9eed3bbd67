// Named blocks of System V shared memory, which all processes of the appliance find through one registry
// segment. Names have at most 31 characters. Any thread may call these functions; none is a cancellation
// point. A block stays when its processes end, and nothing here removes one.
#pragma once

#include <pthread.h>

#include <cstdint>

constexpr int32_t CMEM_REGISTRY_KEY = static_cast<int32_t>(0xBEEFFEED); // of shmget(2)
constexpr const char *CMEM_CONF_PATH = "/etc/opt/rvl/mem.conf";

// Checks a file that has the format of CMEM_CONF_PATH, without logging anything and without attaching any
// memory.
struct cmem_conf_faults {
    int error;         // the errno of reading it, or 0
    uint32_t bad_line; // the number of the first line that is ignored, counted from 1, or 0
    bool has_key;      // the block `name` has a key, without which it can't be created
};
cmem_conf_faults cmem_check_conf(const char *path, const char *name);

// Attaches the registry, and loads CMEM_CONF_PATH into it if no other process has. The other functions call
// it when they need it. False, logged, if another process has been loading it for 5 seconds. A registry that
// can't be attached ends the process.
bool cmem_attach_registry();
// 1 if the block is in the registry and its segment exists, else 0; 0 in a process that has not attached the
// registry.
int cmem_exists_block(const char *name);
// Creates a block of `length` bytes, rounded up to its page size, or takes over that of a process that has
// ended; its bytes are zero in either case. Null, logged, on failure. If several processes create the same
// block, one succeeds.
void *cmem_create_block(uint64_t length, const char *name);
// Attaches a block that another process has created, for reading and writing. Null, logged, on failure.
// `out_length` may be null; it gets the usable length in bytes, which is that of the segment in whole pages.
void *cmem_attach_block(const char *name, uint64_t *out_length = nullptr);
// The id of the process that created the block, the most recent one if there were several; 0 if there is no
// such block, or if this process has not attached the registry. `out_lives`: whether it is still running.
int32_t cmem_find_creator(const char *name, bool *out_lives);

// A mutex within the process, with default attributes and a name for debugging. Lock and unlock return 0, 1
// for null, else an errno.
struct cmutex;
cmutex *cmutex_alloc(const char *name);
void cmutex_free(cmutex **inout_mutex);
int cmutex_lock(cmutex *mutex);
int cmutex_unlock(cmutex *mutex);
