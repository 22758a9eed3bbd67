// The log state of the process, and lc_log_internal, through which every line is written.
//
// Any thread may log. G_log_state_lock guards the state; the levels are atomic and are read without it, so
// that a line which isn't written costs two loads. Cancellation is disabled while the lock is held. The
// buffers are on the stack, and a line of ordinary length allocates nothing: logging works when memory is
// exhausted. syslog_socket.cpp sends the lines and never blocks for long; lines that are lost because the
// daemon doesn't read are counted, and the number is logged before the next line that can be sent.
//
// The lock is created by the first lc_log_init, or by a first line of the main thread, and never destroyed: a
// thread that logs after lc_log_close finds no state, and its line is dropped. A function that the log calls
// with its lock held may fail and log that; such a line is dropped too (inside_the_log).
//
// A line is formatted once: the caller's format is appended to the head of the line, which contains no "%".
// If the two are longer than FORMAT_CHARACTERS, they are cut, and a conversion at the end that is now
// incomplete is removed.
#include "runtime/logging_levels.h"

#include <pthread.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <sys/stat.h>
#include <sys/syscall.h>
#include <syslog.h>
#include <unistd.h>

#include "runtime/guards.h"
#include "runtime/ttime.h"

constexpr uint32_t FORMAT_CHARACTERS = 1023;
constexpr const char *DEBUG_LOG = "/var/log/debug_log";
constexpr off_t DEBUG_LOG_MAX_BYTES = 2000000;
#define WCCP_STRING(text) #text
#define WCCP_TEXT(number) WCCP_STRING(number)
constexpr const char *WCCP_BUILD = WCCP_TEXT(WCCP_BUILD_NUMBER);

std::atomic<int32_t> G_logging_suspended;
lc_log_state *G_log_state;
lc_lock *G_log_state_lock;

namespace {

int32_t lost_lines;               // because the daemon didn't read; G_log_state_lock guards it
thread_local bool inside_the_log; // this thread holds G_log_state_lock

// --- Initialization and shutdown

void report_lock_failure(int status, const char *function, int line) {
    if (status != 0)
        (void)lc_check_status(status, function, LC_FILE_NAME, line);
}
void lc_log_lock() {
    report_lock_failure(lc_lock_lock(G_log_state_lock), __func__, __LINE__);
}
void lc_log_unlock() {
    report_lock_failure(lc_lock_unlock(G_log_state_lock), __func__, __LINE__);
}

lc_status create_state_lock() {
    if (G_log_state_lock)
        return LC_OK;
    if (lc_lock_init(&G_log_state_lock, 0) != 0)
        return LC_GENERIC;
    // Otherwise a child forked while another thread logs would inherit a lock that nobody ever releases.
    (void)lc_lock_atfork(lc_log_lock, lc_log_unlock);
    return LC_OK;
}

lc_status init_with_lock(const char *process_name, const char *prefix, uint32_t default_flags,
                         uint32_t default_component, int32_t max_level, int32_t facility,
                         uint8_t destinations) {
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    const bool first = G_log_state == nullptr;
    if (first)
        G_log_state = static_cast<lc_log_state *>(calloc(1, sizeof *G_log_state));
    lc_log_state *state = G_log_state;
    if (!state)
        return LC_NULL;
    const int32_t options = default_flags & LC_LOG_FLAG_NO_PID ? LOG_NDELAY : LOG_PID | LOG_NDELAY;
    // The connection is kept if nothing that it depends on has changed.
    const bool reopen = first ||
                        strncmp(state->process_name, process_name, sizeof state->process_name - 1) != 0 ||
                        state->facility != facility || state->openlog_options != options;
    state->polls_level_link = state->polls_time_zone = !log_is_managed(process_name);
    state->default_flags = default_flags;
    state->default_component = default_component;
    state->initial_max_level = max_level;
    state->max_level = static_cast<uint8_t>(max_level);
    state->destinations = destinations;
    state->facility = facility;
    // Overrides of an earlier call end here; lc_log_save_levels is for a caller that wants to keep them.
    state->override_level = 0;
    state->system_override = state->class_override = 0;
    strlcpy(state->prefix, prefix ? prefix : "", sizeof state->prefix);
    strlcpy(state->process_name, process_name, sizeof state->process_name);
    // The time is read before the link: a change between the two is then noticed at the next look.
    state->level_link_changed = log_level_link_time();
    log_take_system_level(state);
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
        // For libraries that call syslog(3) themselves. Without LOG_NDELAY this opens no socket.
        static char ident[sizeof state->process_name];
        closelog();
        strlcpy(ident, state->process_name, sizeof ident);
        openlog(ident, options & ~LOG_NDELAY, facility);
    }
    // A name that is too long may come without a NUL; the record's last byte is never written and stays 0.
    gethostname(state->host_name, sizeof state->host_name - 1);
    state->host_name[strcspn(state->host_name, ".")] = '\0';
    if (default_flags & LC_LOG_FLAG_RELATIVE) {
        state->relative = true;
        gettimeofday(&state->relative_base, nullptr);
    }
    state->time_zone_changed = log_time_zone_time();
    state->time_header = (destinations & (LOG_TO_STDOUT | LOG_TO_STDERR)) != 0;
    G_daemon_log_level = -1;
    return LC_OK;
}

} // namespace

lc_status lc_log_init(const char *process_name, const char *prefix, uint32_t default_flags,
                      uint32_t default_component, int32_t max_level, int32_t facility, uint8_t destinations) {
    CHECK_NULL(process_name);
    if (create_state_lock() != LC_OK)
        return LC_GENERIC;
    CHECK_STATUS(init_with_lock(process_name, prefix, default_flags, default_component, max_level, facility,
                                destinations));
    return LC_OK;
}

namespace {

lc_status close_with_lock() {
    const cancel_off_guard uncancelled;
    const lc_lock_guard guard(G_log_state_lock);
    lc_log_state *state = G_log_state;
    if (!state)
        return LC_NULL;
    // The state is unlinked before it is freed, so that a line logged by the close finds none.
    G_log_state = nullptr;
    syslog_socket_close(&state->log_daemon);
    free(state);
    return LC_OK;
}

} // namespace

lc_status lc_log_close() {
    return G_log_state_lock ? close_with_lock() : LC_NULL;
}

const char *lc_log_get_lls_process_name() {
    return G_log_state ? G_log_state->process_name : "";
}

namespace {

// Sets the log up for a process that logs before lc_log_init, under the name of its program.
lc_status init_unnamed() {
    char path[32], name[80] = "";
    snprintf(path, sizeof path, "/proc/%d/cmdline", static_cast<int>(getpid()));
    FILE *file = fopen(path, "re");
    if (file) {
        const size_t count = fread(name, 1, sizeof name - 1, file);
        name[count] = '\0';
        fclose(file);
    }
    // cmdline has NULs between the arguments: this is only the first, the program's path.
    const char *slash = strrchr(name, '/');
    char full[96];
    snprintf(full, sizeof full, "%s-UNINIT", name[0] ? (slash ? slash + 1 : name) : "UNKNOWN");
    // 0xb0000 is component 11, "unk", shifted left by 16.
    return lc_log_init(full, "unk", 0, 0xb0000, LC_LOG_DEBUG, LOG_USER, LOG_TO_SYSLOG);
}

// --- Writing a line

// The parts of a line besides the caller's text.
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

void append_text(line_format *format, const char *pattern, ...) __attribute__((format(printf, 2, 3)));
// Removes an incomplete conversion from the end of a format that was cut.
void drop_half_conversion(line_format *format) {
    const char *const end = format->text + format->used;
    // "%%" needs no case of its own: its second character is taken for the conversion character.
    for (const char *at = format->text; at < end;) {
        if (*at++ != '%')
            continue;
        const char *const begin = at - 1;
        // Flags, width, precision and length. If the conversion character that must follow is missing, it was
        // cut off.
        at += strspn(at, "-+ #0'I*.123456789hlqjztL");
        if (at < end) {
            at++;
            continue;
        }
        format->used = static_cast<size_t>(begin - format->text);
        format->text[format->used] = '\0';
        return;
    }
}

void append_text(line_format *format, const char *pattern, ...) {
    va_list arguments;
    va_start(arguments, pattern);
    const int length =
        vsnprintf(format->text + format->used, sizeof format->text - format->used, pattern, arguments);
    va_end(arguments);
    // vsnprintf returns the length that the text would have had without the limit.
    if (length > 0)
        format->used += static_cast<size_t>(length);
    if (format->used > FORMAT_CHARACTERS) {
        format->used = FORMAT_CHARACTERS;
        drop_half_conversion(format);
    }
}

void append_stamp(line_format *format, const log_line *line) {
    // The finest stamp that is requested is used; therefore it is tested first.
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
            append_text(format, "[%ld] ", seconds);
        else
            append_text(format, "[%ld.%0*ld] ", seconds, form.digits,
                        static_cast<long>(line->stamp.tv_usec) / form.divisor);
        return;
    }
}

void append_thread_id(line_format *format, const log_line *line) {
    if (!lc_is_multithreaded || (line->flags & LC_LOG_FLAG_NO_THREAD))
        return;
    // The kernel's thread id, which ps and gdb show, rather than pthread_self().
    append_text(format, "TID %lu: ", static_cast<unsigned long>(syscall(SYS_gettid)));
}

const char *component_name(uint32_t component) {
    const char *name =
        lc_enum_to_string_quiet_null(lc_log_component_table, static_cast<int32_t>(component >> 16));
    return name ? name : "UNKNOWN_COMP";
}

void build_body(line_format *body, const log_line *line, const char *format) {
    append_thread_id(body, line);
    append_stamp(body, line);
    append_text(body, "[%s.%s]: ", component_name(line->component),
                lc_enum_to_string_quiet(lc_log_level_upper_table, line->level));
    if (line->state->prefix[0])
        append_text(body, "%s: ", line->state->prefix);
    // The caller's format is copied with its conversions, which write_line fills.
    if (line->flags & LC_LOG_FLAG_POSITION)
        append_text(body, "%s(), %s:%d, build %s: %s\n", line->function ? line->function : "",
                    line->file ? line->file : "", line->line, WCCP_BUILD, format);
    else
        append_text(body, "%s\n", format);
}

void build_header(line_format *full, const log_line *line) {
    const lc_log_state *state = line->state;
    if (!state->time_header || (line->flags & LC_LOG_FLAG_NO_HEADER))
        return;
    char text[32] = "";
    const time_t seconds = line->stamp.tv_sec;
    ctime_r(&seconds, text);
    // ctime_r writes "Thu Jan  2 03:04:05 2020"; the weekday and the year are left out.
    append_text(full, "%.15s %s ", strlen(text) > 4 ? text + 4 : text, state->host_name);
    if (line->flags & LC_LOG_FLAG_NO_PID)
        append_text(full, "%s: ", state->process_name);
    else
        append_text(full, "%s[%d]: ", state->process_name, static_cast<int>(state->process_id));
}

void set_stamp(log_line *line, const timeval *now) {
    lc_log_state *state = line->state;
    const bool relative = (line->flags & LC_LOG_FLAG_RELATIVE) != 0;
    line->stamp = *now;
    // Whenever the flag changes from one line to the next, the stamps start again from 0.
    if (relative != state->relative) {
        state->relative = relative;
        state->relative_base = *now;
    }
    if (relative)
        timersub(now, &state->relative_base, &line->stamp);
}

void report_lost_lines(log_line *line) {
    errno = 0;
    // Sent directly, without the head of an ordinary line.
    if (syslog_socket_send(&line->state->log_daemon, LC_LOG_ERR,
                           "messages lost due to non-blocking syslog (count=%d)", lost_lines) != EAGAIN)
        lost_lines = 0;
}

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
void write_line(const log_line *line, const line_format *full, const line_format *body, va_list arguments) {
    static const struct {
        uint8_t destination;
        FILE **stream;
    } consoles[] = {{LOG_TO_STDOUT, &stdout}, {LOG_TO_STDERR, &stderr}};
    const int saved = errno; // for a "%m" in the format
    // Only the body: the head with time, program and process id is added by the socket's own format.
    if (line->state->destinations & LOG_TO_SYSLOG) {
        va_list copy;
        va_copy(copy, arguments);
        if (syslog_socket_vsend(&line->state->log_daemon, line->level, body->text, copy) == EAGAIN)
            lost_lines++;
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

lc_status log_with_lock(log_line *line, int saved_errno, const char *format, va_list arguments) {
    lc_log_state *state = G_log_state;
    // The log has been closed, or there was no memory for its state.
    if (!state)
        return LC_GENERIC;
    line->state = state;
    state->calls++;
    if (lost_lines > 0)
        report_lost_lines(line);
    timeval now;
    gettimeofday(&now, nullptr);
    log_poll_level_link(state, now.tv_sec);
    // Repeated under the lock: the level link may just have changed the level.
    if (!lc_log_check_level(line->level) ||
        (line->level > state->initial_max_level && G_daemon_log_level == -1))
        return LC_OK;
    if (!(line->flags & LC_LOG_FLAG_EXACT))
        line->flags |= state->default_flags;
    line->component |= state->default_component;
    set_stamp(line, &now);
    if (log_poll_time_zone(state, now.tv_sec))
        (void)lt_timezone_handle_changed();
    line_format full = {}, body = {};
    build_header(&full, line);
    build_body(&body, line, format);
    if (state->time_header)
        append_text(&full, "%s", body.text);
    // The functions above may have changed errno, and the caller's format may contain "%m".
    errno = saved_errno;
    write_line(line, &full, &body, arguments);
    state->lines++;
    state->last_line = now;
    return LC_OK;
}

} // namespace

lc_status lc_log_internal(const char *function, const char *file, int line, uint32_t flags,
                          uint32_t component, int32_t level, const char *format, ...) {
    if (G_logging_suspended)
        return LC_OK;
    // Before anything that could change it, so that the caller's errno survives.
    const int saved_errno = errno;
    if (!lc_log_check_level(level))
        return LC_OK;
    const cancel_off_guard uncancelled;
    if (inside_the_log)
        return LC_OK;
    // A first line before lc_log_init; there is only the main thread by then.
    if (!G_log_state_lock)
        (void)init_unnamed();
    if (!G_log_state_lock)
        return LC_GENERIC;
    const int locked = lc_lock_lock(G_log_state_lock);
    if (locked != 0)
        return locked;
    log_line entry = {nullptr, function, file, line, flags, component, level, {}};
    va_list arguments;
    va_start(arguments, format);
    inside_the_log = true;
    const lc_status status = log_with_lock(&entry, saved_errno, format, arguments);
    va_end(arguments);
    inside_the_log = false;
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
    // As an argument of "%s", so that a "%" in the text isn't taken for a conversion.
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

// --- The plain log file

int lc_log_file(const char *path, const char *format, ...) {
    const cancel_off_guard uncancelled;
    struct stat status = {};
    const bool small = stat(DEBUG_LOG, &status) != 0 || status.st_size <= DEBUG_LOG_MAX_BYTES;
    // A file that has become too large is truncated rather than rotated.
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
