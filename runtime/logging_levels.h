// The log state, for the sources of the log only; everything else uses runtime/logging.h. G_log_state_lock
// guards the record; unless noted, callers of these functions hold it. Nothing that may log may be called
// with it held.
#pragma once

#include <cstdint>
#include <ctime>

#include <sys/time.h>
#include <sys/types.h>

#include "runtime/logging.h"
#include "runtime/syslog_socket.h"

enum : uint8_t { LOG_TO_SYSLOG = 1, LOG_TO_STDOUT = 2, LOG_TO_STDERR = 4 };

struct lc_log_state {
    char process_name[32];
    char prefix[80];
    uint32_t default_flags;
    uint32_t default_component; // the number shifted left by 16
    int32_t initial_max_level;
    uint8_t destinations;
    int32_t facility; // as in syslog(3): 8 times the number
    char host_name[256];
    pid_t process_id;
    int32_t openlog_options;
    timeval last_line;
    time_t level_link_looked, time_zone_looked;     // when the files were last checked, in seconds
    timespec level_link_changed, time_zone_changed; // their modification times; zero: no such file
    bool relative;                                  // stamps are relative to relative_base
    timeval relative_base;
    uint8_t max_level;
    int8_t system_level;
    int32_t time_header; // 1: the destinations include a console
    uint64_t calls, lines;
    int32_t polls_level_link, polls_time_zone;
    uint8_t override_level;
    int32_t system_override, class_override;
    uint8_t current_level;
    syslog_socket log_daemon;
};

// Whether the program gets its levels from the management tree, and therefore doesn't check the files again.
// No lock.
bool log_is_managed(const char *process_name);

// Sets the system level, and the mask of the socket, to the level in the level link, or to NOTICE without a
// link.
void log_take_system_level(lc_log_state *state);
// Check the files, at most once a second, for a process that isn't managed. `now` in seconds.
void log_poll_level_link(lc_log_state *state, time_t now);
bool log_poll_time_zone(lc_log_state *state, time_t now); // true: the time zone has changed
// Modification times, zero if there is no such file. No lock.
timespec log_level_link_time();
timespec log_time_zone_time();
