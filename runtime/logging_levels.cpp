// Log levels and the syslog facility.
//
// Three levels determine what is written: the system level (from a symbolic link at start, later from the
// management tree); an override level, which replaces it while both its switches are on; and the level of
// this process, which takes precedence over both. The first two are combined in G_log_level, the last is
// G_daemon_log_level. The mask of the syslog socket is set to the effective one. A process that logs to a
// console keeps the level that it started with.
//
// The main thread calls the functions that change a level, while other threads may be logging. They change
// the state under its lock; anything that could fail and log is done before the lock is taken or after it is
// released. That is why most of them have a part of their own for what is done under the lock.
#include "runtime/logging_levels.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include "runtime/guards.h"

constexpr const char *LEVEL_LINK = "/var/opt/rvl/output/sysloglevel";
constexpr const char *TIME_ZONE_FILE = "/var/opt/rvl/output/localtime";
constexpr int32_t DEFAULT_FACILITY = LOG_LOCAL1;

std::atomic<int32_t> G_log_level{LC_LOG_NOTICE};
std::atomic<int8_t> G_daemon_log_level{-1};
lc_status (*lc_log_facility_from_session)(mdc *session, uint32_t *out_facility);

const lc_enum_entry lc_log_level_table[] = {
    {0, "emerg"},  {1, "alert"}, {2, "crit"},  {3, "err"},   {4, "warning"},
    {5, "notice"}, {6, "info"},  {7, "debug"}, {0, nullptr},
};
const lc_enum_entry lc_log_level_upper_table[] = {
    {0, "EMERG"},  {1, "ALERT"}, {2, "CRIT"},  {3, "ERR"},   {4, "WARNING"},
    {5, "NOTICE"}, {6, "INFO"},  {7, "DEBUG"}, {0, nullptr},
};
const lc_enum_entry lc_log_component_table[] = {
    {5, "mgmtd"}, {9, "libs"}, {11, "unk"}, {257, "tunneld"}, {262, "wccpd"}, {0, nullptr},
};
const lc_enum_entry lc_log_facility_table[] = {
    {0, "kern"},     {8, "user"},     {16, "mail"},    {24, "daemon"},  {32, "auth"},     {40, "syslog"},
    {48, "lpr"},     {56, "news"},    {64, "uucp"},    {72, "cron"},    {80, "authpriv"}, {88, "ftp"},
    {128, "local0"}, {136, "local1"}, {144, "local2"}, {152, "local3"}, {160, "local4"},  {168, "local5"},
    {176, "local6"}, {184, "local7"}, {0, nullptr},
};

bool log_is_managed(const char *process_name) {
    static const char *const managed[] = {"wccpd", "tunneld", "mgmtd"};
    for (const char *known : managed)
        if (strcmp(known, process_name) == 0)
            return true;
    return false;
}

// --- The level link

namespace {

// The link's target is the level as a decimal number. False if there is no link, or its target is anything
// else.
bool read_level_link(int32_t *out_level) {
    char target[16];
    const ssize_t length = readlink(LEVEL_LINK, target, sizeof target - 1);
    if (length <= 0)
        return false;
    // readlink() adds no NUL.
    target[length] = '\0';
    char *end = nullptr;
    const long level = strtol(target, &end, 10);
    if (*end != '\0' || level < LC_LOG_EMERG || level > LC_LOG_DEBUG)
        return false;
    *out_level = static_cast<int32_t>(level);
    return true;
}

} // namespace

void log_take_system_level(lc_log_state *state) {
    int32_t level = LC_LOG_NOTICE;
    (void)read_level_link(&level);
    syslog_set_mask(level);
    state->system_level = static_cast<int8_t>(level);
}

namespace {

// `look`: stat or lstat.
timespec modification_time(const char *path, int (*look)(const char *, struct stat *)) {
    struct stat status = {};
    return look(path, &status) == 0 ? status.st_mtim : timespec{};
}
bool same_time(const timespec &a, const timespec &b) {
    return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

} // namespace

timespec log_level_link_time() {
    // The link itself: it points to a number, not to a file.
    return modification_time(LEVEL_LINK, lstat);
}
timespec log_time_zone_time() {
    return modification_time(TIME_ZONE_FILE, stat);
}

namespace {

bool has_console(const lc_log_state *state) {
    return state->time_header != 0;
}
bool is_overridden(const lc_log_state *state) {
    return state->system_override && state->class_override;
}

void set_current_level(lc_log_state *state, uint8_t level) {
    state->current_level = level;
    const int32_t own = lc_log_get_daemon_log_level();
    syslog_set_mask(own != -1 ? own : level);
    G_log_level = level;
}

} // namespace

void log_poll_level_link(lc_log_state *state, time_t now) {
    if (!state->polls_level_link || state->level_link_looked == now)
        return;
    state->level_link_looked = now;
    const timespec changed = log_level_link_time();
    // A link that has been removed leaves the level as it is. Its time is forgotten below, so that a new link
    // is read even if it has the time of the old one.
    if (changed.tv_sec != 0 && !same_time(changed, state->level_link_changed)) {
        log_take_system_level(state);
        set_current_level(state, is_overridden(state) ? state->override_level
                                                      : static_cast<uint8_t>(state->system_level));
    }
    state->level_link_changed = changed;
}

bool log_poll_time_zone(lc_log_state *state, time_t now) {
    if (!state->polls_time_zone || state->time_zone_looked == now)
        return false;
    state->time_zone_looked = now;
    const timespec changed = log_time_zone_time();
    const bool differs = !same_time(changed, state->time_zone_changed);
    state->time_zone_changed = changed;
    return differs;
}

// --- Levels as management sets them

namespace {

// The log state, with its lock held for a scope; null before lc_log_init and after lc_log_close.
struct locked_state {
    locked_state() : guard(G_log_state_lock), state(G_log_state_lock ? G_log_state : nullptr) {}
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard;
    lc_log_state *const state;
};

lc_status set_system_level_with_lock(int32_t level) {
    const locked_state log;
    if (!log.state)
        return LC_NULL;
    if (has_console(log.state))
        return LC_OK;
    log.state->system_level = static_cast<int8_t>(level);
    if (!is_overridden(log.state))
        set_current_level(log.state, static_cast<uint8_t>(level));
    return LC_OK;
}

} // namespace

lc_status lc_log_set_max_log_level(const char *name) {
    int32_t level = 0;
    CHECK_QUIET(lc_string_to_enum(lc_log_level_table, name, &level));
    CHECK_STATUS(set_system_level_with_lock(level));
    return LC_OK;
}

lc_status lc_log_get_max_log_level(int32_t *out_level) {
    CHECK_NULL(out_level);
    *out_level = G_log_level;
    return LC_OK;
}

lc_status lc_log_set_daemon_log_level(int32_t level) {
    CHECK_CONDITION(level >= -1 && level <= LC_LOG_DEBUG);
    // Without the lock: both are atomic, and lines that are being written now may still use the old level.
    G_daemon_log_level = static_cast<int8_t>(level);
    syslog_set_mask(level == -1 ? G_log_level.load() : level);
    return LC_OK;
}

int32_t lc_log_get_daemon_log_level() {
    return G_daemon_log_level;
}

namespace {

// Makes the override level current, or the system level.
void apply_override(lc_log_state *state, bool overrides) {
    // On a console only this record changes; the level in use stays.
    state->current_level = overrides ? state->override_level : static_cast<uint8_t>(state->system_level);
    if (!has_console(state))
        set_current_level(state, state->current_level);
}

lc_status switch_override_with_lock(int32_t system_wide, int32_t enable) {
    const locked_state log;
    if (!log.state)
        return LC_NULL;
    (system_wide ? log.state->system_override : log.state->class_override) = enable;
    apply_override(log.state, is_overridden(log.state));
    // Turning the class's switch off leaves an override level that changes nothing when it is turned on
    // again.
    if (!system_wide && !enable)
        log.state->override_level = log.state->current_level;
    return LC_OK;
}

} // namespace

lc_status lc_log_enable_override_log_level(int32_t system_wide, int32_t enable) {
    CHECK_STATUS(switch_override_with_lock(system_wide, enable));
    return LC_OK;
}

namespace {

// -1 means the system level, and turns the class's switch off.
lc_status set_override_level_with_lock(int32_t level) {
    const locked_state log;
    if (!log.state)
        return LC_NULL;
    // Read before the switch is turned off: the end of an override that was in effect restores the system
    // level.
    const bool counted = is_overridden(log.state);
    log.state->override_level = static_cast<uint8_t>(level == -1 ? log.state->system_level : level);
    if (level == -1)
        log.state->class_override = 0;
    if (counted)
        apply_override(log.state, is_overridden(log.state));
    return LC_OK;
}

} // namespace

lc_status lc_log_set_override_log_level(const char *name) {
    CHECK_NULL(name);
    int32_t level = 0;
    if (lc_string_to_enum(lc_log_level_table, name, &level) != LC_OK)
        level = -1;
    CHECK_STATUS(set_override_level_with_lock(level));
    return LC_OK;
}

namespace {

lc_status save_levels_with_lock(lc_log_levels *out) {
    const locked_state log;
    if (!log.state)
        return LC_NULL;
    *out = {G_daemon_log_level, log.state->system_level, log.state->override_level,
            log.state->system_override, log.state->class_override};
    return LC_OK;
}

} // namespace

lc_status lc_log_save_levels(lc_log_levels *out) {
    CHECK_NULL(out);
    *out = {-1, G_log_level, G_log_level, 0, 0};
    CHECK_STATUS(save_levels_with_lock(out));
    return LC_OK;
}

namespace {

lc_status restore_levels_with_lock(const lc_log_levels *saved) {
    const locked_state log;
    if (!log.state)
        return LC_NULL;
    G_daemon_log_level = static_cast<int8_t>(saved->own);
    log.state->system_level = static_cast<int8_t>(saved->system);
    log.state->override_level = static_cast<uint8_t>(saved->override);
    log.state->system_override = saved->system_override;
    log.state->class_override = saved->class_override;
    apply_override(log.state, is_overridden(log.state));
    return LC_OK;
}

} // namespace

lc_status lc_log_restore_levels(const lc_log_levels *saved) {
    CHECK_NULL(saved);
    CHECK_STATUS(restore_levels_with_lock(saved));
    return LC_OK;
}

// --- Facility

lc_status lc_log_get_syslog_facility(int32_t *out_facility) {
    CHECK_NULL(out_facility);
    *out_facility = 0;
    CHECK_NULL(G_log_state);
    *out_facility = G_log_state->facility;
    return LC_OK;
}

namespace {

void facility_from_file(const char *process_name, int32_t *facility) {
    FILE *file = fopen(LC_LOG_FACILITY_FILE, "re");
    if (!file)
        return;
    char line[256];
    while (fgets(line, sizeof line, file)) {
        char word[256];
        unsigned number = 0;
        if (line[0] == '#' || sscanf(line, "%255s %u", word, &number) != 2)
            continue;
        if (strcmp(word, "system") == 0) {
            *facility = static_cast<int32_t>(number);
            break;
        }
        // Such words are for other classes of processes. The log isn't set up yet, therefore the plain file.
        (void)lc_log_file(nullptr, "Skipping facility type: %s for %s", word, process_name);
    }
    fclose(file);
}

} // namespace

int32_t lc_log_get_facility(mdc *session, const char *process_name) {
    const cancel_off_guard uncancelled;
    int32_t facility = DEFAULT_FACILITY;
    if (!process_name || !log_is_managed(process_name))
        return facility;
    uint32_t from_session = 0;
    if (!session)
        facility_from_file(process_name, &facility);
    else if (lc_log_facility_from_session && lc_log_facility_from_session(session, &from_session) == LC_OK)
        facility = static_cast<int32_t>(from_session);
    return facility;
}
