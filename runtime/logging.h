// Logging: what writes a line, and the levels that decide whether it is written. Any thread may log, with any
// lock held but the log's own and lc_env_lock. Lines go to the syslog daemon's socket and block the caller
// for milliseconds at most (runtime/syslog_socket.cpp).
//
// Use the macros QV_LOG and LC_LOG at the end of this file. They leave errno alone; therefore "%m" can be
// used.
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

// Flags of a line. The default flags given to lc_log_init are added unless LC_LOG_FLAG_EXACT is set.
enum : uint32_t {
    LC_LOG_FLAG_EXACT = 0x1,
    LC_LOG_FLAG_NO_PID = 0x2,    // no process id after the process name
    LC_LOG_FLAG_NO_HEADER = 0x4, // no time, host and process name on a console
    LC_LOG_FLAG_STAMP_SEC = 0x8, // a time stamp in the body; the finest of these five counts
    LC_LOG_FLAG_STAMP_TENTH = 0x10,
    LC_LOG_FLAG_STAMP_CENTI = 0x20,
    LC_LOG_FLAG_STAMP_MSEC = 0x40,
    LC_LOG_FLAG_STAMP_USEC = 0x80,
    LC_LOG_FLAG_RELATIVE = 0x100,    // stamps count from when this flag was first set
    LC_LOG_FLAG_MOD_MILLION = 0x200, // seconds of the stamp modulo 1000000, or 10
    LC_LOG_FLAG_MOD_TEN = 0x400,
    LC_LOG_FLAG_POSITION = 0x800,   // function, file and line of the caller, and the build
    LC_LOG_FLAG_NO_THREAD = 0x1000, // no thread id
};

extern std::atomic<int32_t> G_log_level;         // the effective system level, LC_LOG_...
extern std::atomic<int8_t> G_daemon_log_level;   // the level of this process, which overrides it; -1 for none
extern std::atomic<int32_t> G_logging_suspended; // not 0: nothing is logged
constexpr int32_t lc_is_multithreaded = 1;       // lines carry thread ids
struct lc_log_state;                             // runtime/logging_levels.h
extern lc_log_state *G_log_state;
extern lc_lock *G_log_state_lock;

extern const lc_enum_entry lc_log_level_table[];       // "emerg" to "debug"
extern const lc_enum_entry lc_log_level_upper_table[]; // "EMERG" to "DEBUG"
extern const lc_enum_entry lc_log_component_table[];
extern const lc_enum_entry lc_log_facility_table[]; // "kern" 0 to "local7" 184

// Lines of a word and a number; that of the word "system" is the syslog facility of the daemons. mgmtd writes
// the file, and lc_log_get_facility reads it when a program starts.
constexpr const char *LC_LOG_FACILITY_FILE = "/var/opt/rvl/syslog_fac.conf";

// Whether a line of this level is written. Every log statement makes this test before it evaluates its
// arguments.
inline bool lc_log_check_level(int32_t level) {
    // NOLINTNEXTLINE(bugprone-signed-char-misuse): the sign means "none"
    const int32_t own = G_daemon_log_level.load(std::memory_order_relaxed);
    return (own != -1 ? own : G_log_level.load(std::memory_order_relaxed)) >= level;
}

// Sets up the log of the process, or applies other arguments to it. `prefix` may be null. `default_component`
// is the component's number shifted left by 16. `max_level`: lines above it are dropped while the process has
// no level of its own. `facility` as in syslog(3). `destinations`: 1 syslog, 2 standard output, 4 standard
// error, or a sum of these. Resets the levels. On the main thread.
lc_status lc_log_init(const char *process_name, const char *prefix, uint32_t default_flags,
                      uint32_t default_component, int32_t max_level, int32_t facility, uint8_t destinations);
lc_status lc_log_close(); // LC_NULL when it isn't set up; lines are dropped afterwards
// Writes one line. `function`, `file` and `line` are those of the caller and only used with
// LC_LOG_FLAG_POSITION. `component` is usually 0. The result says whether the log is usable, and callers
// ignore it.
lc_status lc_log_internal(const char *function, const char *file, int line, uint32_t flags,
                          uint32_t component, int32_t level, const char *format, ...)
    __attribute__((format(printf, 7, 8)));
// The text is cut at 1023 bytes. `function` is ignored, `prefix` may be null.
lc_status qv_log_internal(int32_t level, const char *function, const char *prefix, const char *format, ...)
    __attribute__((format(printf, 4, 5)));
void util_log(int32_t level, const char *prefix, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

// The levels, on the main thread. Names are those of lc_log_level_table; an unknown one is LC_BAD_TYPE, not
// logged. LC_NULL when the log isn't set up.
lc_status lc_log_set_max_log_level(const char *name); // the system level; ignored by a process with a console
lc_status lc_log_get_max_log_level(int32_t *out_level);
lc_status lc_log_set_daemon_log_level(int32_t level); // -1: none
int32_t lc_log_get_daemon_log_level();
const char *lc_log_get_lls_process_name();
lc_status lc_log_get_syslog_facility(int32_t *out_facility);
// The override level replaces the system level while both its switches are on, the system-wide one and that
// of the process's class. An unknown name ends the override.
lc_status lc_log_set_override_log_level(const char *name);
lc_status lc_log_enable_override_log_level(int32_t system_wide, int32_t enable);
// All levels and switches, for a process that calls lc_log_init again and wants to keep them.
struct lc_log_levels {
    int32_t own, system, override, system_override, class_override;
};
lc_status lc_log_save_levels(lc_log_levels *out);
lc_status lc_log_restore_levels(const lc_log_levels *saved);

// The syslog facility of a process: from LC_LOG_FACILITY_FILE, or with a session from the management tree, by
// `lc_log_facility_from_session`, which mgmt/ sets (mdc_init). local1 by default.
struct mdc;
int32_t lc_log_get_facility(mdc *session, const char *process_name);
extern lc_status (*lc_log_facility_from_session)(mdc *session, uint32_t *out_facility);

// Appends a line to a file, "/var/log/debug_log" if `path` is null; for what happens before syslog can be
// used. Returns 1 if the file can't be opened, else 0.
int lc_log_file(const char *path, const char *format, ...) __attribute__((format(printf, 2, 3)));

// An ordinary line. The arguments are evaluated only if the line is written.
#define QV_LOG(level, ...)                                                                                   \
    do {                                                                                                     \
        if (lc_log_check_level(level))                                                                       \
            (void)qv_log_internal((level), nullptr, nullptr, __VA_ARGS__);                                   \
    } while (0)
// The same for the code of runtime/, mgmt/ and the loop; the text is not limited to 1023 bytes.
#define LC_LOG(level, ...)                                                                                   \
    do {                                                                                                     \
        if (lc_log_check_level(level))                                                                       \
            (void)lc_log_internal(__func__, LC_FILE_NAME, __LINE__, 0, 0, (level), __VA_ARGS__);             \
    } while (0)
