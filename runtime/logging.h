// The one logging entry point of the process, its levels and its state. Lines go to the log daemon's socket
// without ever blocking the caller for long; logging.cpp explains how.
#pragma once

#include <atomic>
#include <cstdarg>
#include <cstdint>

#include "runtime/common.h"

enum : int32_t {
    LC_LOG_EMERG = 0,
    LC_LOG_ALERT = 1,
    LC_LOG_CRIT = 2,
    LC_LOG_ERR = 3,
    LC_LOG_WARNING = 4,
    LC_LOG_NOTICE = 5,
    LC_LOG_INFO = 6,
    LC_LOG_DEBUG = 7,
};

// Line flags.
enum : uint32_t {
    LC_LOG_FLAG_EXACT = 0x1,
    LC_LOG_FLAG_NO_PID = 0x2,
    LC_LOG_FLAG_NO_HEADER = 0x4,
    LC_LOG_FLAG_STAMP_SEC = 0x8,
    LC_LOG_FLAG_STAMP_TENTH = 0x10,
    LC_LOG_FLAG_STAMP_CENTI = 0x20,
    LC_LOG_FLAG_STAMP_MSEC = 0x40,
    LC_LOG_FLAG_STAMP_USEC = 0x80,
    LC_LOG_FLAG_RELATIVE = 0x100,
    LC_LOG_FLAG_MOD_MILLION = 0x200,
    LC_LOG_FLAG_MOD_TEN = 0x400,
    LC_LOG_FLAG_POSITION = 0x800,
    LC_LOG_FLAG_NO_THREAD = 0x1000,
};

extern std::atomic<int32_t> G_log_level;       // effective system level
extern std::atomic<int8_t> G_daemon_log_level; // per-process level, -1 for none
extern std::atomic<int32_t> G_logging_suspended;
constexpr int32_t lc_is_multithreaded = 1; // lines carry thread ids
struct lc_log_state;
extern lc_log_state *G_log_state;
extern lc_lock *G_log_state_lock;

extern const lc_enum_entry lc_log_level_table[];       // "emerg" to "debug"
extern const lc_enum_entry lc_log_level_upper_table[]; // "EMERG" to "DEBUG"
extern const lc_enum_entry lc_log_component_table[];
extern const lc_enum_entry lc_log_facility_table[]; // "kern" 0 to "local7" 184

// Read by lc_log_get_facility at the start of a program: lines of a word and a number. The word "system"
// gives the facility of the daemons; mgmtd writes it.
constexpr const char *LC_LOG_FACILITY_FILE = "/var/opt/rvl/syslog_fac.conf";

// True when a line of this level would be written: the test that every statement makes first.
inline bool lc_log_check_level(int32_t level) {
    // NOLINTNEXTLINE(bugprone-signed-char-misuse): the sign means "none"
    const int32_t own = G_daemon_log_level.load(std::memory_order_relaxed);
    return (own != -1 ? own : G_log_level.load(std::memory_order_relaxed)) >= level;
}

lc_status lc_log_init(const char *process_name, const char *prefix, uint32_t default_flags,
                      uint32_t default_component, int32_t max_level, int32_t facility, uint8_t destinations);
lc_status lc_log_close();
lc_status lc_log_internal(const char *function, const char *file, int line, uint32_t flags,
                          uint32_t component, int32_t level, const char *format, ...)
    __attribute__((format(printf, 7, 8)));
lc_status qv_log_internal(int32_t level, const char *function, const char *prefix, const char *format, ...)
    __attribute__((format(printf, 4, 5)));
void util_log(int32_t level, const char *prefix, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

lc_status lc_log_set_max_log_level(const char *name);
lc_status lc_log_get_max_log_level(int32_t *out_level);
lc_status lc_log_set_daemon_log_level(int32_t level);
int32_t lc_log_get_daemon_log_level();
const char *lc_log_get_lls_process_name();
lc_status lc_log_get_syslog_facility(int32_t *out_facility);
lc_status lc_log_set_override_log_level(const char *name);
lc_status lc_log_enable_override_log_level(int32_t system_wide, int32_t enable);
// All that was set of the levels, for a process that initialises its log anew and wants to keep them.
struct lc_log_levels {
    int32_t own, system, override, system_override, class_override;
};
lc_status lc_log_save_levels(lc_log_levels *out);
lc_status lc_log_restore_levels(const lc_log_levels *saved);

// The facility of a process: from its file, or with a session from the management tree, for which the host of
// this room lends `lc_log_facility_from_session` (null until it does).
struct mdc;
int32_t lc_log_get_facility(mdc *session, const char *process_name);
extern lc_status (*lc_log_facility_from_session)(mdc *session, uint32_t *out_facility);

// One line to a plain file, "/var/log/debug_log" when `path` is null. 1 when it cannot be opened.
int lc_log_file(const char *path, const char *format, ...) __attribute__((format(printf, 2, 3)));

// The daemon's ordinary line. Nothing is evaluated when the level does not pass.
#define QV_LOG(level, ...)                                                                                   \
    do {                                                                                                     \
        if (lc_log_check_level(level))                                                                       \
            (void)qv_log_internal((level), nullptr, nullptr, __VA_ARGS__);                                   \
    } while (0)
// A line of the framework's own (management protocol, loop, containers).
#define LC_LOG(level, ...)                                                                                   \
    do {                                                                                                     \
        if (lc_log_check_level(level))                                                                       \
            (void)lc_log_internal(__func__, LC_FILE_NAME, __LINE__, 0, 0, (level), __VA_ARGS__);             \
    } while (0)
