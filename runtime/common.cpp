// The table of status descriptions, what the CHECK_ macros log, enumeration tables, bounded and allocated
// strings, the environment, and the lock that tracks its owner.
//
// Everything else in the system is built on this file; of the rest of the system it calls only the log, and
// the log calls back into it: into the locks, the tables and strlcpy. Nothing here may therefore log while it
// holds a lock that the log takes (lc_env_lock, see env_guard).
//
// A cancelled thread normally releases its locks when its stack is unwound, by lc_lock_guard. For a thread
// that ends while it holds a lock without a guard, each lock has a thread-specific key whose destructor
// releases it.
#include "runtime/common.h"

#include <pthread.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <strings.h>

#include "runtime/guards.h"
#include "runtime/logging.h"

const lc_enum_entry lc_status_table[] = {
    {LC_OK, "no error"},
    {LC_GENERIC, "generic error"},
    {LC_NULL, "unexpected NULL"},
    {LC_ASSERTION, "assertion failed"},
    {LC_NOT_IMPLEMENTED, "not yet implemented"},
    {LC_NOT_FOUND, "item not found"},
    {LC_EXISTS, "item unexpectedly already exists"},
    {LC_MULTIPLE, "expected single item, found multiple"},
    {LC_EOF, "unexpected EOF"},
    {LC_BAD_ARGUMENT, "unknown command line argument"},
    {LC_BAD_PATH, "invalid path name"},
    {LC_BAD_FILE, "invalid file"},
    {LC_NO_BUFFER_SPACE, "buffer space exhausted"},
    {LC_PARSE_ERROR, "generic parser error"},
    {LC_FILE_NOT_FOUND, "file or path not found"},
    {LC_IO_ERROR, "generic IO error"},
    {LC_IO_WOULD_BLOCK, "IO source/sink would block"},
    {LC_IO_CLOSED, "IO source/sink is closed"},
    {LC_IO_TIMED_OUT, "IO operation timed out"},
    {LC_IO_FILE_EXISTS, "IO operation had unexpected file existence"},
    {LC_UNEXPECTED_CASE, "unexpected case in switch statement"},
    {LC_BAD_TYPE, "type conversion failed"},
    {LC_BAD_UTF8, "bad UTF-8 character sequence"},
    {LC_DIVIDE_BY_ZERO, "divide by zero"},
    {LC_NO_SPACE, "filesystem out of space"},
    {LC_TREE_HAS_CHILDREN, "tree: tried to delete node with children"},
    {LC_TREE_NOT_ANCESTOR, "tree: node is not an ancestor"},
    {LC_TREE_NO_PATH, "tree: no preexisting path to specified node"},
    {LC_FOREACH_DELETE, "foreach: delete current element"},
    {LC_FOREACH_REMOVE, "foreach: remove current element"},
    {LC_FOREACH_HALT_ERROR, "foreach: halt iteration with error"},
    {LC_FOREACH_HALT_OK, "foreach: halt iteration without error"},
    {LC_SHELL_RESET_TIMER, "CLI shell: reset timer for event callback"},
    {LC_SHELL_DELETE_EVENT, "CLI shell: delete event callback registration"},
    {LC_SHELL_NOT_AVAILABLE, "CLI shell func called but not available"},
    {LC_CANCELLED, "Operation cancelled"},
    {LC_BAD_LOGIN, "Invalid user/password for login"},
    {LC_BAD_STRING_NAME, "Invalid string name was passed in."},
    {LC_UPGRADE_FAILED, "Upgrade failed, no continue."},
    {0, nullptr},
};

// --- The failure checks

// The empty asm keeps the optimiser from removing the calls, which a breakpoint needs.
__attribute__((noinline)) void bail_debug() {
    asm volatile("");
}
__attribute__((noinline)) void bail_quiet_debug() {
    asm volatile("");
}

#define LOG_AT(...)                                                                                          \
    do {                                                                                                     \
        if (lc_log_check_level(LC_LOG_ERR))                                                                  \
            (void)lc_log_internal(function, file, line, LC_LOG_FLAG_POSITION, 0, LC_LOG_ERR, __VA_ARGS__);   \
    } while (0)

lc_status lc_check_status(lc_status status, const char *function, const char *file, int line) {
    if (status == LC_CANCELLED) {
        bail_quiet_debug();
        return status;
    }
    const char *words = lc_enum_to_string_quiet_null(lc_status_table, status);
    if (words)
        LOG_AT("Error code %d (%s) returned", status, words);
    else
        LOG_AT("Error code %d returned", status);
    bail_debug();
    return status;
}

lc_status lc_check_null(const char *function, const char *file, int line) {
    LOG_AT("Unexpected NULL");
    bail_debug();
    return LC_NULL;
}

lc_status lc_check_condition(const char *function, const char *file, int line) {
    LOG_AT("Required condition was not met");
    bail_debug();
    return LC_ASSERTION;
}

lc_status lc_check_forced(lc_status status, const char *function, const char *file, int line) {
    const char *words = lc_enum_to_string_quiet_null(lc_status_table, status);
    if (words)
        LOG_AT("Bail forced with error code %d (%s)", status, words);
    else
        LOG_AT("Bail forced with error code %d", status);
    bail_debug();
    return status;
}

// --- Enumeration tables

namespace {

const char *find_enum_name(const lc_enum_entry *table, int32_t value) {
    for (const lc_enum_entry *entry = table; entry->name; entry++)
        if (entry->value == value)
            return entry->name;
    return nullptr;
}

} // namespace

constexpr const char *NO_MAP = "ERROR-NO-MAP";

const char *lc_enum_to_string(const lc_enum_entry *table, int32_t value) {
    if (!table) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return NO_MAP;
    }
    const char *name = find_enum_name(table, value);
    if (!name)
        LC_LOG(LC_LOG_ERR, "Could not find a mapping for enum value %d", value);
    return name ? name : NO_MAP;
}

const char *lc_enum_to_string_quiet(const lc_enum_entry *table, int32_t value) {
    const char *name = table ? find_enum_name(table, value) : nullptr;
    return name ? name : NO_MAP;
}

const char *lc_enum_to_string_quiet_null(const lc_enum_entry *table, int32_t value) {
    if (!table) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return nullptr;
    }
    return find_enum_name(table, value);
}

lc_status lc_string_to_enum(const lc_enum_entry *table, const char *string, int32_t *out_value) {
    CHECK_NULL(out_value);
    *out_value = 0;
    CHECK_NULL(table);
    CHECK_NULL(string);
    for (const lc_enum_entry *entry = table; entry->name; entry++)
        if (strcmp(entry->name, string) == 0) {
            *out_value = entry->value;
            return LC_OK;
        }
    return LC_BAD_TYPE;
}

const char *lc_bool_to_str(int32_t value) {
    return value ? "true" : "false";
}

lc_status lc_str_to_bool(const char *string, int32_t *out_value) {
    static const lc_enum_entry words[] = {
        {1, "true"},  {1, "TRUE"}, {1, "t"}, {1, "T"},   {1, "on"},  {1, "ON"},    {0, "false"},
        {0, "FALSE"}, {0, "f"},    {0, "F"}, {0, "off"}, {0, "OFF"}, {0, nullptr},
    };
    return lc_string_to_enum(words, string, out_value);
}

int lc_is_prefix(const char *prefix, const char *string, int ignore_case) {
    if (!prefix || !string)
        return 0;
    // A string shorter than the prefix differs at its NUL.
    const size_t length = strlen(prefix);
    return (ignore_case ? strncasecmp(prefix, string, length) : strncmp(prefix, string, length)) == 0;
}

int lc_is_suffix(const char *suffix, const char *string, int ignore_case) {
    if (!suffix || !string)
        return 0;
    const size_t length = strlen(suffix), whole = strlen(string);
    if (length > whole)
        return 0;
    const char *tail = string + whole - length;
    return (ignore_case ? strcasecmp(suffix, tail) : strcmp(suffix, tail)) == 0;
}

const char *lc_signal_num_to_name(int number) {
    static const lc_enum_entry names[] = {
        {SIGHUP, "SIGHUP"},   {SIGINT, "SIGINT"},       {SIGQUIT, "SIGQUIT"}, {SIGILL, "SIGILL"},
        {SIGTRAP, "SIGTRAP"}, {SIGABRT, "SIGABRT"},     {SIGBUS, "SIGBUS"},   {SIGFPE, "SIGFPE"},
        {SIGKILL, "SIGKILL"}, {SIGUSR1, "SIGUSR1"},     {SIGSEGV, "SIGSEGV"}, {SIGUSR2, "SIGUSR2"},
        {SIGPIPE, "SIGPIPE"}, {SIGALRM, "SIGALRM"},     {SIGTERM, "SIGTERM"}, {SIGSTKFLT, "SIGSTKFLT"},
        {SIGCHLD, "SIGCHLD"}, {SIGCONT, "SIGCONT"},     {SIGSTOP, "SIGSTOP"}, {SIGTSTP, "SIGTSTP"},
        {SIGTTIN, "SIGTTIN"}, {SIGTTOU, "SIGTTOU"},     {SIGURG, "SIGURG"},   {SIGXCPU, "SIGXCPU"},
        {SIGXFSZ, "SIGXFSZ"}, {SIGVTALRM, "SIGVTALRM"}, {SIGPROF, "SIGPROF"}, {SIGWINCH, "SIGWINCH"},
        {SIGIO, "SIGIO"},     {SIGPWR, "SIGPWR"},       {SIGSYS, "SIGSYS"},   {0, nullptr},
    };
    return lc_enum_to_string_quiet(names, number);
}

// --- Strings

char *safe_strdup(const char *string) {
    return string ? strdup(string) : nullptr;
}

extern "C" size_t strlcpy(char *dst, const char *src, size_t size) noexcept {
    const size_t length = strlen(src);
    if (size > 0) {
        const size_t copied = length < size ? length : size - 1;
        memcpy(dst, src, copied);
        dst[copied] = '\0';
    }
    return length;
}

extern "C" size_t strlcat(char *dst, const char *src, size_t size) noexcept {
    // If the buffer has no NUL at all, nothing is appended, and the result counts as truncated.
    const size_t held = strnlen(dst, size);
    return held + strlcpy(dst + held, src, size - held);
}

constexpr size_t FIRST_FORMAT_BYTES = 100;

namespace {

// Formats into 100 bytes, and if that was too short once more into exactly as many as it takes.
lc_status format_new(char **out_string, uint32_t *out_length, const char *format, va_list arguments) {
    *out_string = nullptr;
    if (out_length)
        *out_length = 0;
    CHECK_NULL(format);
    owned_text text(static_cast<char *>(malloc(FIRST_FORMAT_BYTES)));
    CHECK_NULL(text.pointer);
    va_list again;
    // A va_list can be used only once; the second pass needs its own copy.
    va_copy(again, arguments);
    const int first = vsnprintf(text.pointer, FIRST_FORMAT_BYTES, format, arguments);
    int length = first;
    bool enlarged = true;
    if (first >= static_cast<int>(FIRST_FORMAT_BYTES)) {
        const size_t needed = static_cast<size_t>(first) + 1;
        char *larger = static_cast<char *>(realloc(text.pointer, needed));
        enlarged = larger != nullptr;
        if (enlarged) {
            text.pointer = larger;
            length = vsnprintf(larger, needed, format, again);
        }
    }
    va_end(again);
    // Only now, since FAIL_WITH returns: va_end has to come first.
    if (!enlarged)
        FAIL_WITH(LC_NULL);
    // The second length differs if an argument was changed meanwhile by another thread.
    CHECK_CONDITION(first >= 0 && length == first);
    if (out_length)
        *out_length = static_cast<uint32_t>(length);
    *out_string = text.take();
    return LC_OK;
}

} // namespace

char *vsmprintf(const char *format, va_list arguments) {
    char *text = nullptr;
    (void)format_new(&text, nullptr, format, arguments);
    return text;
}

char *smprintf(const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    char *text = vsmprintf(format, arguments);
    va_end(arguments);
    return text;
}

lc_status vsnmprintf(char **out_string, uint32_t *out_length, const char *format, va_list arguments) {
    CHECK_NULL(out_string);
    return format_new(out_string, out_length, format, arguments);
}

lc_status snmprintf(char **out_string, uint32_t *out_length, const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    const lc_status status = vsnmprintf(out_string, out_length, format, arguments);
    va_end(arguments);
    return status;
}

// --- Environment

namespace {

// Holds lc_env_lock if it exists; before lc_init there is only one thread. The log takes this lock while it
// holds its own, when the time zone changes. Logging with lc_env_lock held could therefore deadlock.
struct env_guard {
    env_guard() : held(lc_env_lock) {
        if (held)
            lc_lock_lock(held);
    }
    ~env_guard() {
        if (held)
            lc_lock_unlock(held);
    }
    env_guard(const env_guard &) = delete;
    env_guard &operator=(const env_guard &) = delete;
    lc_lock *held;
};

} // namespace

lc_status lc_getenv_ts(const char *name, char **out_text) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    CHECK_NULL(name);
    bool found = false;
    {
        const env_guard guard;
        const char *value = getenv(name);
        found = value != nullptr;
        *out_text = safe_strdup(value);
    }
    // Outside the lock, since a failure is logged.
    CHECK_CONDITION(!found || *out_text);
    return LC_OK;
}

namespace {

int setenv_with_lock(const char *name, const char *value, int overwrite) {
    const env_guard guard;
    return setenv(name, value, overwrite);
}

} // namespace

lc_status lc_setenv(const char *name, const char *value, int overwrite) {
    CHECK_NULL(name);
    CHECK_NULL(value);
    if (strchr(name, '=')) {
        LC_LOG(LC_LOG_ERR, "Environment variable name \"%s\" contains illegal character '='", name);
        return LC_GENERIC;
    }
    // The function releases the lock before it returns; only then may a failure be logged.
    CHECK_CONDITION(setenv_with_lock(name, value, overwrite) == 0);
    return LC_OK;
}

int lc_devel_is_production() {
    char *value = nullptr;
    (void)lc_getenv_ts("PROD_DEV", &value);
    const owned_text owner(value);
    return value == nullptr;
}

// --- Locks

lc_lock *lc_env_lock, *lc_dso_lock, *lc_utmpx_lock;

struct lc_lock {
    pthread_mutex_t mutex;
    std::atomic<int32_t> locked;
    uint32_t nesting;
    std::atomic<int64_t> owner; // a thread id, -1 when free
    int recursive;
    pthread_key_t key;
};

namespace {

int64_t own_thread_id() {
    return static_cast<int64_t>(pthread_self());
}

// Destructor of the key: the thread has ended while it held the lock. A recursive lock is unlocked at every
// level.
void release_at_thread_end(void *held) {
    lc_lock *lock = static_cast<lc_lock *>(held);
    // The mutex of a recursive lock has to be released as often as it was acquired.
    while (lock->locked && lock->owner == own_thread_id() && lc_lock_unlock(lock) == 0) {
    }
}

} // namespace

int lc_lock_init(lc_lock **out_lock, int recursive) {
    if (!out_lock)
        return 1;
    *out_lock = nullptr;
    lc_lock *lock = static_cast<lc_lock *>(calloc(1, sizeof *lock));
    if (!lock)
        return ENOMEM;
    pthread_mutexattr_t attributes;
    pthread_mutexattr_init(&attributes);
    if (recursive)
        pthread_mutexattr_settype(&attributes, PTHREAD_MUTEX_RECURSIVE);
    int result = pthread_mutex_init(&lock->mutex, &attributes);
    pthread_mutexattr_destroy(&attributes);
    if (result == 0) {
        // A process has 1024 keys at most (PTHREAD_KEYS_MAX), which also limits the number of locks.
        result = pthread_key_create(&lock->key, release_at_thread_end);
        if (result != 0)
            pthread_mutex_destroy(&lock->mutex);
    }
    if (result != 0) {
        free(lock);
        return result;
    }
    lock->owner = -1;
    lock->recursive = recursive;
    *out_lock = lock;
    return 0;
}

int lc_lock_lock(lc_lock *lock) {
    if (!lock)
        return 1;
    const int result = pthread_mutex_lock(&lock->mutex);
    if (result != 0)
        return result;
    lock->owner = own_thread_id();
    lock->locked = 1;
    // If this fails for lack of memory, the lock works but isn't released at the end of the thread.
    if (lock->nesting++ == 0)
        (void)pthread_setspecific(lock->key, lock);
    return 0;
}

int lc_lock_unlock(lc_lock *lock) {
    // Tested without holding the mutex: only the thread itself can have stored its own id as the owner.
    if (!lock || !lock->locked || lock->owner != own_thread_id())
        return 1;
    // The fields are changed while the mutex is still held: after the unlock they belong to the next owner.
    if (--lock->nesting == 0 || !lock->recursive) {
        lock->nesting = 0;
        lock->owner = -1;
        lock->locked = 0;
        pthread_setspecific(lock->key, nullptr);
    }
    return pthread_mutex_unlock(&lock->mutex);
}

int lc_lock_deinit(lc_lock **inout_lock) {
    if (!inout_lock || !*inout_lock)
        return 1;
    lc_lock *lock = *inout_lock;
    if (lock->locked)
        return 1;
    const int result = pthread_mutex_destroy(&lock->mutex);
    if (result != 0)
        return result;
    pthread_key_delete(lock->key);
    free(lock);
    *inout_lock = nullptr;
    return 0;
}

int lc_lock_atfork(void (*prepare)(), void (*parent_and_child)()) {
    // In the child, pthread_self() has the value of the thread that called fork(). The child is therefore the
    // owner of the locks taken before, and can release them.
    return pthread_atfork(prepare, parent_and_child, parent_and_child);
}

lc_status lc_init() {
    for (lc_lock **lock : {&lc_env_lock, &lc_dso_lock, &lc_utmpx_lock})
        if (!*lock && lc_lock_init(lock, 0) != 0)
            return LC_GENERIC;
    return LC_OK;
}
