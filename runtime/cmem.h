// Named blocks of System V shared memory, found by all processes of the appliance through one registry
// segment.
#pragma once

#include <pthread.h>

#include <cstdint>

constexpr int32_t CMEM_REGISTRY_KEY = static_cast<int32_t>(0xBEEFFEED);
constexpr const char *CMEM_CONF_PATH = "/etc/opt/rvl/mem.conf";

// 1 when the block stands in the registry as this process sees it and its key exists, else 0.
int cmem_exists_block(const char *name);
// A new zeroed block of at least `length` bytes, or the zeroed block of a creator that has gone; null on
// failure.
void *cmem_create_block(uint64_t length, const char *name);
// The block that another process has made, read and write; null on failure. `out_length`, when given, gets
// the size of the segment behind it.
void *cmem_attach_block(const char *name, uint64_t *out_length = nullptr);

// A named mutex with default attributes.
struct cmutex;
cmutex *cmutex_alloc(const char *name);
void cmutex_free(cmutex **inout_mutex);
int cmutex_lock(cmutex *mutex);
int cmutex_unlock(cmutex *mutex);
