// The log state as the sources of logging share it; everybody else uses runtime/logging.h. G_log_state_lock
// guards the record. Nothing that may log is called under it.
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
    uint32_t default_component; // shifted
    int32_t initial_max_level;
    uint8_t destinations;
    int32_t facility;
    char host_name[256];
    pid_t process_id;
    int32_t openlog_options;
    timeval last_line;
    time_t level_link_looked, time_zone_looked;     // seconds of the last look
    timespec level_link_changed, time_zone_changed; // zero: not there
    bool relative;                                  // stamps are relative to the base
    timeval relative_base;
    uint8_t max_level;
    int8_t system_level;
    int32_t time_header; // set when a console is among the destinations
    uint64_t calls, lines;
    int32_t polls_level_link, polls_time_zone;
    uint8_t override_level;
    int32_t system_override, class_override;
    uint8_t current_level;
    syslog_socket log_daemon;
};

// The programs that get their levels and facility from management and so don't look at the files again.
bool log_is_managed(const char *process_name);

// The system level as the level link has it, NOTICE without one; the mask passes it.
void log_take_system_level(lc_log_state *state);
// Looks once a second at the files that a process without management follows.
void log_poll_level_link(lc_log_state *state, time_t now);
bool log_poll_time_zone(lc_log_state *state, time_t now); // true: it has changed
timespec log_level_link_time();
timespec log_time_zone_time();
