// The log state of the process and the one function through which every line goes.
//
// Any thread may log. The state is guarded by G_log_state_lock; the level cells are read without it, so that
// a line which doesn't pass costs two loads. Cancellation is off while the lock is held: a cancelled thread
// never takes it along. Buffers are on the stack and nothing is allocated, so that logging works when memory
// has run out. Lines go to the log daemon through syslog_socket.cpp, which never blocks for long; a line that
// was lost to a daemon that doesn't read is counted, and the count told ahead of the next line that gets
// through.
//
// The caller's format is pasted behind the line's own head and used once: the head holds no "%".
#include "runtime/logging.h"

#include <pthread.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <syslog.h>
#include <unistd.h>

#include "runtime/guards.h"
#include "runtime/syslog_socket.h"
#include "runtime/ttime.h"

constexpr const char *LEVEL_LINK = "/var/opt/rvl/output/sysloglevel";
constexpr const char *TIME_ZONE_FILE = "/var/opt/rvl/output/localtime";
constexpr const char *FACILITY_FILE = "/var/opt/rvl/syslog_fac.conf";
constexpr const char *DEBUG_LOG = "/var/log/debug_log";
constexpr off_t DEBUG_LOG_MAX_BYTES = 2000000;
constexpr int32_t DEFAULT_FACILITY = LOG_LOCAL1;
constexpr uint32_t FORMAT_CHARACTERS = 1023;
#define WCCP_STRING(text) #text
#define WCCP_TEXT(number) WCCP_STRING(number)
constexpr const char *WCCP_BUILD = WCCP_TEXT(WCCP_BUILD_NUMBER);
enum : uint8_t { TO_SYSLOG = 1, TO_STDOUT = 2, TO_STDERR = 4 };

std::atomic<int32_t> G_log_level{LC_LOG_NOTICE};
std::atomic<int8_t> G_daemon_log_level{-1};
std::atomic<int32_t> G_logging_suspended;
lc_log_state *G_log_state;
lc_lock *G_log_state_lock;
lc_status (*lc_log_facility_from_session)(mdc *session, uint32_t *out_facility);

struct lc_log_thread {
    uint64_t native_id;
    uint32_t logged_id;
};

struct lc_log_state {
    char process_name[32];
    char prefix[80];
    uint32_t default_flags;
    uint32_t default_component; // shifted
    int32_t initial_max_level;
    uint8_t destinations;
    int32_t facility;
    lc_log_thread *threads; // sorted, null until used
    uint32_t thread_count;
    char host_name[256];
    pid_t process_id;
    int32_t openlog_options;
    timeval last_line;
    time_t level_link_looked, time_zone_looked; // seconds of the last look
    time_t level_link_changed, time_zone_changed;
    bool relative; // stamps are relative to the base
    timeval relative_base;
    uint8_t max_level;
    int8_t system_level;
    int32_t time_header;
    uint64_t calls, lines;
    int32_t polls_level_link, polls_time_zone;
    uint8_t override_level;
    int32_t system_override, class_override;
    uint8_t current_level;
    syslog_socket log_daemon;
};

static uint32_t lost_lines; // to a log daemon that would have blocked; guarded by the state's lock

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

// The programs that get their levels and facility from management and so don't look at the files again.
static bool is_managed(const char *name) {
    static const char *const managed[] = {"wccpd", "tunneld", "mgmtd"};
    for (const char *known : managed)
        if (strcmp(known, name) == 0)
            return true;
    return false;
}

static void set_syslog_mask(int32_t level) {
    setlogmask((1 << ((level + 1) & 31)) - 1);
}

// --- Levels
// ---------------------------------------------------------------------------------------------------------

// The link's target is a decimal level. False when there is no link.
static bool read_level_link(int32_t *out_level) {
    char target[16];
    const ssize_t length = readlink(LEVEL_LINK, target, sizeof target - 1);
    if (length < 0)
        return false;
    target[length] = '\0';
    *out_level = atoi(target) & 7;
    return true;
}

static void take_system_level_from_link(lc_log_state *state) {
    int32_t level = LC_LOG_NOTICE;
    if (read_level_link(&level))
        set_syslog_mask(level);
    state->system_level = static_cast<int8_t>(level);
}

static void make_current(lc_log_state *state, uint8_t level) {
    state->current_level = level;
    const int32_t own = G_daemon_log_level;
    set_syslog_mask(own != -1 ? own : level);
    G_log_level = level;
}

static bool has_console(const lc_log_state *state) {
    return state->time_header != 0;
}
static bool overridden(const lc_log_state *state) {
    return state->system_override && state->class_override;
}

lc_status lc_log_set_max_log_level(const char *name) {
    int32_t level = 0;
    CHECK_QUIET(lc_string_to_enum(lc_log_level_table, name, &level));
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    CHECK_NULL(G_log_state);
    if (has_console(G_log_state))
        return LC_OK;
    G_log_state->system_level = static_cast<int8_t>(level);
    if (!overridden(G_log_state))
        make_current(G_log_state, static_cast<uint8_t>(level));
    return LC_OK;
}

lc_status lc_log_get_max_log_level(int32_t *out_level) {
    CHECK_NULL(out_level);
    *out_level = G_log_level;
    return LC_OK;
}

lc_status lc_log_set_daemon_log_level(int32_t level) {
    G_daemon_log_level = static_cast<int8_t>(level);
    set_syslog_mask(level == -1 ? G_log_level.load() : level);
    return LC_OK;
}

int32_t lc_log_get_daemon_log_level() {
    return G_daemon_log_level;
}

const char *lc_log_get_lls_process_name() {
    return G_log_state ? G_log_state->process_name : nullptr;
}

lc_status lc_log_get_syslog_facility(int32_t *out_facility) {
    CHECK_NULL(out_facility);
    *out_facility = 0;
    CHECK_NULL(G_log_state);
    *out_facility = G_log_state->facility;
    return LC_OK;
}

static void settle_overrides(lc_log_state *state) {
    if (has_console(state))
        return;
    make_current(state,
                 overridden(state) ? state->override_level : static_cast<uint8_t>(state->system_level));
}

lc_status lc_log_enable_override_log_level(int32_t system_wide, int32_t enable) {
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    CHECK_NULL(G_log_state);
    (system_wide ? G_log_state->system_override : G_log_state->class_override) = enable;
    settle_overrides(G_log_state);
    if (!system_wide && !enable)
        G_log_state->override_level = G_log_state->current_level;
    return LC_OK;
}

lc_status lc_log_set_override_log_level(const char *name) {
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    CHECK_NULL(G_log_state);
    int32_t level = 0;
    if (lc_string_to_enum(lc_log_level_table, name, &level) != LC_OK) {
        level = G_log_state->system_level;
        G_log_state->class_override = 0;
    }
    G_log_state->override_level = static_cast<uint8_t>(level);
    if (overridden(G_log_state))
        settle_overrides(G_log_state);
    return LC_OK;
}

// --- Facility
// -------------------------------------------------------------------------------------------------------

static void facility_from_file(const char *process_name, int32_t *facility) {
    FILE *file = fopen(FACILITY_FILE, "re");
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
        (void)lc_log_file(nullptr, "Skipping facility type: %s for %s", word, process_name);
    }
    fclose(file);
}

int32_t lc_log_get_facility(mdc *session, const char *process_name) {
    int32_t facility = DEFAULT_FACILITY;
    if (!process_name || !is_managed(process_name))
        return facility;
    uint32_t from_session = 0;
    if (!session)
        facility_from_file(process_name, &facility);
    else if (lc_log_facility_from_session && lc_log_facility_from_session(session, &from_session) == LC_OK)
        facility = static_cast<int32_t>(from_session);
    return facility;
}

int lc_log_file(const char *path, const char *format, ...) {
    struct stat status = {};
    const bool small = stat(DEBUG_LOG, &status) != 0 || status.st_size <= DEBUG_LOG_MAX_BYTES;
    FILE *file = fopen(path ? path : DEBUG_LOG, small ? "ae" : "we");
    if (!file)
        return 1;
    const time_t now = time(nullptr);
    tm local = {};
    localtime_r(&now, &local);
    char stamp[32];
    strftime(stamp, sizeof stamp, "%m%d%y %d%H%M", &local);
    fprintf(file, "%s ", stamp);
    va_list arguments;
    va_start(arguments, format);
    vfprintf(file, format, arguments);
    va_end(arguments);
    fputc('\n', file);
    fclose(file);
    return 0;
}

// --- Start and end
// --------------------------------------------------------------------------------------------------

static void report_lock_failure(int status, const char *function, int line) {
    if (status != 0)
        (void)lc_check_status(status, function, LC_FILE_NAME, line);
}
static void lc_log_lock() {
    report_lock_failure(lc_lock_lock(G_log_state_lock), __func__, __LINE__);
}
static void lc_log_unlock() {
    report_lock_failure(lc_lock_unlock(G_log_state_lock), __func__, __LINE__);
}

static lc_status create_state_lock() {
    if (G_log_state_lock)
        return LC_OK;
    if (lc_lock_init(&G_log_state_lock, 0) != 0)
        return LC_GENERIC;
    (void)lc_lock_atfork(lc_log_lock, lc_log_unlock);
    return LC_OK;
}

static time_t changed_at(const char *path, int (*look)(const char *, struct stat *)) {
    struct stat status = {};
    return look(path, &status) == 0 ? status.st_mtime : 0;
}

lc_status lc_log_init(const char *process_name, const char *prefix, uint32_t default_flags,
                      uint32_t default_component, int32_t max_level, int32_t facility, uint8_t destinations) {
    if (!process_name)
        return LC_NULL;
    if (create_state_lock() != LC_OK)
        return LC_GENERIC;
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    const bool first = G_log_state == nullptr;
    if (first)
        G_log_state = static_cast<lc_log_state *>(calloc(1, sizeof *G_log_state));
    lc_log_state *state = G_log_state;
    if (!state)
        return LC_NULL;
    const int32_t options = default_flags & LC_LOG_FLAG_NO_PID ? LOG_NDELAY : LOG_PID | LOG_NDELAY;
    const bool reopen = first ||
                        strncmp(state->process_name, process_name, sizeof state->process_name - 1) != 0 ||
                        state->facility != facility || state->openlog_options != options;
    state->polls_level_link = state->polls_time_zone = !is_managed(process_name);
    state->default_flags = default_flags;
    state->default_component = default_component;
    state->initial_max_level = max_level;
    state->max_level = static_cast<uint8_t>(max_level);
    state->destinations = destinations;
    state->facility = facility;
    state->override_level = 0;
    state->system_override = state->class_override = 0;
    strlcpy(state->prefix, prefix ? prefix : "", sizeof state->prefix);
    strlcpy(state->process_name, process_name, sizeof state->process_name);
    take_system_level_from_link(state);
    state->current_level =
        state->class_override ? state->override_level : static_cast<uint8_t>(state->system_level);
    G_log_level = state->current_level;
    if (!(default_flags & LC_LOG_FLAG_NO_PID))
        state->process_id = getpid();
    if (reopen) {
        if (!first)
            syslog_socket_close(&state->log_daemon);
        state->openlog_options = options;
        syslog_socket_open(&state->log_daemon, state->process_name, (options & LOG_PID) != 0, facility);
    }
    gethostname(state->host_name, sizeof state->host_name - 1);
    state->host_name[strcspn(state->host_name, ".")] = '\0';
    if (default_flags & LC_LOG_FLAG_RELATIVE) {
        state->relative = true;
        gettimeofday(&state->relative_base, nullptr);
    }
    state->level_link_changed = changed_at(LEVEL_LINK, lstat);
    state->time_zone_changed = changed_at(TIME_ZONE_FILE, stat);
    state->time_header = (destinations & (TO_STDOUT | TO_STDERR)) != 0;
    G_daemon_log_level = -1;
    return LC_OK;
}

lc_status lc_log_close() {
    if (!G_log_state)
        return LC_NULL;
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    syslog_socket_close(&G_log_state->log_daemon);
    free(G_log_state->threads);
    free(G_log_state);
    G_log_state = nullptr;
    return LC_OK;
}

// The first line of a process that never set logging up.
static lc_status init_unnamed() {
    char path[32], name[80] = "";
    snprintf(path, sizeof path, "/proc/%d/cmdline", static_cast<int>(getpid()));
    FILE *file = fopen(path, "re");
    if (file) {
        const size_t count = fread(name, 1, sizeof name - 1, file);
        name[count] = '\0';
        fclose(file);
    }
    const char *slash = strrchr(name, '/');
    char full[96];
    snprintf(full, sizeof full, "%s-UNINIT", name[0] ? (slash ? slash + 1 : name) : "UNKNOWN");
    return lc_log_init(full, "unk", 0, 0xb0000, LC_LOG_DEBUG, LOG_USER, TO_SYSLOG);
}

// --- A line
// ---------------------------------------------------------------------------------------------------------

// One log line in the making.
struct log_line {
    lc_log_state *state;
    const char *function;
    const char *file;
    int line;
    uint32_t flags;
    uint32_t component;
    int32_t level;
    timeval stamp;
};
struct line_format {
    char text[FORMAT_CHARACTERS + 1];
    size_t used;
};

static void add(line_format *format, const char *pattern, ...) __attribute__((format(printf, 2, 3)));
static void add(line_format *format, const char *pattern, ...) {
    va_list arguments;
    va_start(arguments, pattern);
    const int length =
        vsnprintf(format->text + format->used, sizeof format->text - format->used, pattern, arguments);
    va_end(arguments);
    if (length > 0)
        format->used += static_cast<size_t>(length);
    if (format->used > FORMAT_CHARACTERS)
        format->used = FORMAT_CHARACTERS;
}

static void add_stamp(line_format *format, const log_line *line) {
    static const struct {
        uint32_t flag;
        long divisor;
        int digits;
    } forms[] = {
        {LC_LOG_FLAG_STAMP_USEC, 1, 6},      {LC_LOG_FLAG_STAMP_MSEC, 1000, 3},
        {LC_LOG_FLAG_STAMP_CENTI, 10000, 2}, {LC_LOG_FLAG_STAMP_TENTH, 100000, 1},
        {LC_LOG_FLAG_STAMP_SEC, 0, 0},
    };
    long seconds = line->stamp.tv_sec;
    if (line->flags & LC_LOG_FLAG_MOD_MILLION)
        seconds %= 1000000;
    if (line->flags & LC_LOG_FLAG_MOD_TEN)
        seconds %= 10;
    for (const auto &form : forms) {
        if (!(line->flags & form.flag))
            continue;
        if (form.divisor == 0)
            add(format, "[%ld] ", seconds);
        else
            add(format, "[%ld.%0*ld] ", seconds, form.digits,
                static_cast<long>(line->stamp.tv_usec) / form.divisor);
        return;
    }
}

static void add_thread_mark(line_format *format, const log_line *line) {
    if (line->flags & LC_LOG_FLAG_NO_THREAD)
        return;
    const uint64_t native = static_cast<uint64_t>(syscall(SYS_gettid));
    for (uint32_t i = 0; i < line->state->thread_count; i++)
        if (line->state->threads[i].native_id == native) {
            add(format, "%s %lu: ", "tid", static_cast<unsigned long>(line->state->threads[i].logged_id));
            return;
        }
    add(format, "%s %lu: ", "TID", static_cast<unsigned long>(native));
}

static const char *component_name(uint32_t component) {
    const char *name =
        lc_enum_to_string_quiet_null(lc_log_component_table, static_cast<int32_t>(component >> 16));
    return name ? name : "UNKNOWN_COMP";
}

static void build_body(line_format *body, const log_line *line, const char *format) {
    add_thread_mark(body, line);
    add_stamp(body, line);
    add(body, "[%s.%s]: ", component_name(line->component),
        lc_enum_to_string_quiet(lc_log_level_upper_table, line->level));
    if (line->state->prefix[0])
        add(body, "%s: ", line->state->prefix);
    if (line->flags & LC_LOG_FLAG_POSITION)
        add(body, "%s(), %s:%d, build %s: %s\n", line->function ? line->function : "",
            line->file ? line->file : "", line->line, WCCP_BUILD, format);
    else
        add(body, "%s\n", format);
}

static void build_header(line_format *full, const log_line *line) {
    const lc_log_state *state = line->state;
    if (!state->time_header || (line->flags & LC_LOG_FLAG_NO_HEADER))
        return;
    char text[32] = "";
    const time_t seconds = line->stamp.tv_sec;
    ctime_r(&seconds, text);
    add(full, "%.15s %s ", strlen(text) > 4 ? text + 4 : text, state->host_name);
    if (line->flags & LC_LOG_FLAG_NO_PID)
        add(full, "%s: ", state->process_name);
    else
        add(full, "%s[%d]: ", state->process_name, static_cast<int>(state->process_id));
}

// Looks once a second at the files that a process without management follows.
static void poll_level_link(lc_log_state *state, time_t now) {
    if (!state->polls_level_link || state->level_link_looked == now)
        return;
    state->level_link_looked = now;
    const time_t changed = changed_at(LEVEL_LINK, lstat);
    if (changed != 0 && changed != state->level_link_changed) {
        take_system_level_from_link(state);
        if (!overridden(state))
            G_log_level = state->current_level = static_cast<uint8_t>(state->system_level);
    }
    state->level_link_changed = changed;
}
static void poll_time_zone(lc_log_state *state, time_t now) {
    if (!state->polls_time_zone || state->time_zone_looked == now)
        return;
    state->time_zone_looked = now;
    const time_t changed = changed_at(TIME_ZONE_FILE, stat);
    if (changed != state->time_zone_changed) {
        state->time_zone_changed = changed;
        (void)lt_timezone_handle_changed();
    }
}

static void take_stamp(log_line *line, const timeval *now) {
    lc_log_state *state = line->state;
    const bool relative = (line->flags & LC_LOG_FLAG_RELATIVE) != 0;
    line->stamp = *now;
    if (relative != state->relative) {
        state->relative = relative;
        state->relative_base = *now;
    }
    if (relative)
        timersub(now, &state->relative_base, &line->stamp);
}

static void tell_lost_lines(log_line *line) {
    char text[128];
    const int length = snprintf(text, sizeof text, "messages lost due to non-blocking syslog (count=%d)",
                                static_cast<int>(lost_lines));
    errno = 0;
    const int result =
        syslog_socket_send(&line->state->log_daemon, LC_LOG_ERR, text, static_cast<size_t>(length));
    if (result != EAGAIN)
        lost_lines = 0;
}

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
static void send_to_daemon(lc_log_state *state, int32_t level, const char *format, va_list arguments) {
    char text[4096];
    const int saved = errno;
    int length = vsnprintf(text, sizeof text, format, arguments);
    if (length < 0)
        return;
    if (length >= static_cast<int>(sizeof text)) {
        length = sizeof text - 1;
        text[length - 1] = '\n';
    }
    const int result = syslog_socket_send(&state->log_daemon, level, text, static_cast<size_t>(length));
    if (result == EAGAIN && saved != EAGAIN)
        lost_lines++;
}

static void write_out(const log_line *line, const line_format *full, const line_format *body,
                      va_list arguments) {
    static const struct {
        uint8_t destination;
        FILE **stream;
    } consoles[] = {{TO_STDOUT, &stdout}, {TO_STDERR, &stderr}};
    const int saved = errno; // what a "%m" in the format means
    if (line->state->destinations & TO_SYSLOG) {
        va_list copy;
        va_copy(copy, arguments);
        send_to_daemon(line->state, line->level, body->text, copy);
        va_end(copy);
    }
    for (const auto &console : consoles) {
        if (!(line->state->destinations & console.destination))
            continue;
        va_list copy;
        va_copy(copy, arguments);
        errno = saved;
        vfprintf(*console.stream, full->text, copy);
        va_end(copy);
        fflush(*console.stream);
    }
}
#pragma GCC diagnostic pop

static lc_status log_locked(log_line *line, int saved_errno, const char *format, va_list arguments) {
    lc_log_state *state = G_log_state;
    if (!state)
        return LC_GENERIC;
    line->state = state;
    state->calls++;
    if (lost_lines > 0)
        tell_lost_lines(line);
    timeval now;
    gettimeofday(&now, nullptr);
    poll_level_link(state, now.tv_sec);
    if (!lc_log_check_level(line->level) ||
        (line->level > state->initial_max_level && G_daemon_log_level == -1))
        return LC_OK;
    if (!(line->flags & LC_LOG_FLAG_EXACT))
        line->flags |= state->default_flags;
    line->component |= state->default_component;
    take_stamp(line, &now);
    poll_time_zone(state, now.tv_sec);
    line_format full = {}, body = {};
    build_header(&full, line);
    build_body(&body, line, format);
    if (state->time_header)
        add(&full, "%s", body.text);
    errno = saved_errno;
    write_out(line, &full, &body, arguments);
    state->lines++;
    state->last_line = now;
    return LC_OK;
}

lc_status lc_log_internal(const char *function, const char *file, int line, uint32_t flags,
                          uint32_t component, int32_t level, const char *format, ...) {
    if (G_logging_suspended)
        return LC_OK;
    const int saved_errno = errno;
    if (!lc_log_check_level(level))
        return LC_OK;
    const cancel_off_guard uncancelled;
    if (!G_log_state)
        (void)init_unnamed();
    if (!G_log_state_lock)
        return LC_GENERIC;
    const int locked = lc_lock_lock(G_log_state_lock);
    if (locked != 0)
        return locked;
    log_line entry = {nullptr, function, file, line, flags, component, level, {}};
    va_list arguments;
    va_start(arguments, format);
    const lc_status status = log_locked(&entry, saved_errno, format, arguments);
    va_end(arguments);
    (void)lc_lock_unlock(G_log_state_lock);
    errno = saved_errno;
    return status;
}

lc_status qv_log_internal(int32_t level, const char *function, const char *prefix, const char *format, ...) {
    (void)function;
    char text[1024];
    const int saved_errno = errno;
    size_t used = strlcpy(text, prefix ? prefix : "", sizeof text);
    if (used >= sizeof text)
        used = sizeof text - 1;
    errno = saved_errno;
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(text + used, sizeof text - used, format, arguments);
    va_end(arguments);
    return lc_log_internal(nullptr, nullptr, 0, 0, 0, level, "%s", text);
}

void util_log(int32_t level, const char *prefix, const char *format, ...) {
    char text[2048];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(text, sizeof text, format, arguments);
    va_end(arguments);
    if (lc_log_check_level(level))
        (void)qv_log_internal(level, nullptr, nullptr, "%s%s", prefix ? prefix : "", text);
}
