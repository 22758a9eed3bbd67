// Status codes and the macros that check and propagate them, enumeration tables, bounded strings, locks.
//
// Almost every operation of runtime/ and mgmt/ returns an lc_status: 0 is success, failures are 14000 to
// 14502, and lc_status_table has their descriptions. A caller wraps each call in one of the CHECK_ macros
// below, which return a failure to the next caller. Resources are owned by scope guards (runtime/guards.h):
// an early return leaks nothing. CHECK_STATUS logs a line with function, file and line number: a failure
// leaves one line per level of the call chain, innermost first. LC_CANCELLED is propagated without logging:
// the operation was ended on purpose.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>

using lc_status = int32_t;

enum : lc_status {
    LC_OK = 0,
    LC_GENERIC = 14000,
    LC_NULL = 14001,
    LC_ASSERTION = 14002,
    LC_NOT_IMPLEMENTED = 14003,
    LC_NOT_FOUND = 14004,
    LC_EXISTS = 14005,
    LC_MULTIPLE = 14006,
    LC_EOF = 14007,
    LC_BAD_ARGUMENT = 14008,
    LC_BAD_PATH = 14009,
    LC_BAD_FILE = 14010,
    LC_NO_BUFFER_SPACE = 14011,
    LC_PARSE_ERROR = 14012,
    LC_FILE_NOT_FOUND = 14013,
    LC_IO_ERROR = 14014,
    LC_IO_WOULD_BLOCK = 14015,
    LC_IO_CLOSED = 14016,
    LC_IO_TIMED_OUT = 14017,
    LC_IO_FILE_EXISTS = 14018,
    LC_UNEXPECTED_CASE = 14019,
    LC_BAD_TYPE = 14020,
    LC_BAD_UTF8 = 14021,
    LC_DIVIDE_BY_ZERO = 14022,
    LC_NO_SPACE = 14023,
    LC_TREE_HAS_CHILDREN = 14090,
    LC_TREE_NOT_ANCESTOR = 14091,
    LC_TREE_NO_PATH = 14092,
    LC_FOREACH_DELETE = 14100,
    LC_FOREACH_REMOVE = 14101,
    LC_FOREACH_HALT_ERROR = 14102,
    LC_FOREACH_HALT_OK = 14103,
    LC_SHELL_RESET_TIMER = 14110,
    LC_SHELL_DELETE_EVENT = 14111,
    LC_SHELL_NOT_AVAILABLE = 14115,
    LC_CANCELLED = 14120,
    LC_BAD_LOGIN = 14500,
    LC_BAD_STRING_NAME = 14501,
    LC_UPGRADE_FAILED = 14502,
};

// A table of values and names, ended by an entry whose name is null. It is searched from the start: the first
// match counts. Several names may have one value.
struct lc_enum_entry {
    int32_t value;
    const char *name;
};
extern const lc_enum_entry lc_status_table[];

// The name of a value, in static storage. For an unknown value the first two return "ERROR-NO-MAP", the third
// null. Only the first logs an unknown value; a null table is logged by the first and the third.
const char *lc_enum_to_string(const lc_enum_entry *table, int32_t value);
const char *lc_enum_to_string_quiet(const lc_enum_entry *table, int32_t value);
const char *lc_enum_to_string_quiet_null(const lc_enum_entry *table, int32_t value);
// Exact, case-sensitive match. LC_BAD_TYPE, not logged, for an unknown name; `out_value` is then 0.
lc_status lc_string_to_enum(const lc_enum_entry *table, const char *string, int32_t *out_value);

const char *lc_bool_to_str(int32_t value); // "true" or "false"
// true, t and on give 1, false, f and off 0, each in lower or upper case throughout; anything else, the
// digits included, is LC_BAD_TYPE.
lc_status lc_str_to_bool(const char *string, int32_t *out_value);
// 1 or 0; 0 when either string is null.
int lc_is_prefix(const char *prefix, const char *string, int ignore_case);
int lc_is_suffix(const char *suffix, const char *string, int ignore_case);
const char *lc_signal_num_to_name(int number); // "SIGTERM"; "ERROR-NO-MAP" for an unknown number

// Copies are the caller's, to be freed with free(). Null stays null.
char *safe_strdup(const char *string);
// The environment is read and changed under lc_env_lock. `out_text` is null for a variable that isn't set. A
// name with a "=" is LC_GENERIC.
lc_status lc_getenv_ts(const char *name, char **out_text);
lc_status lc_setenv(const char *name, const char *value, int overwrite);
// 0 when the environment variable PROD_DEV is set, as on development machines, else 1.
int lc_devel_is_production();

// As in the BSDs: the result is NUL-terminated unless `size` is 0, and the return value is the length that it
// would have had without the limit; a value of `size` or more means that the text was truncated.
extern "C" size_t strlcpy(char *dst, const char *src, size_t size) noexcept;
extern "C" size_t strlcat(char *dst, const char *src, size_t size) noexcept;

// Formatted text in new memory, for the caller to free with free(). The first two return null on failure.
char *smprintf(const char *format, ...) __attribute__((format(printf, 1, 2)));
char *vsmprintf(const char *format, va_list arguments) __attribute__((format(printf, 1, 0)));
lc_status snmprintf(char **out_string, uint32_t *out_length, const char *format, ...)
    __attribute__((format(printf, 3, 4)));
lc_status vsnmprintf(char **out_string, uint32_t *out_length, const char *format, va_list arguments)
    __attribute__((format(printf, 3, 0)));

// Creates the process-wide locks declared below. main() calls it before anything else; calling it again does
// nothing.
lc_status lc_init();

// A mutex that knows its owner: only the thread that holds it can unlock it, and a thread that ends while it
// holds it releases it. Locking waits without limit and is not a cancellation point. All operations return 0,
// 1 for a null pointer or a refusal, else the error number of the pthread function.
struct lc_lock;
// `recursive`: the owner may lock it again. Deinit refuses a lock that is held.
int lc_lock_init(lc_lock **out_lock, int recursive);
int lc_lock_lock(lc_lock *lock);
int lc_lock_unlock(lc_lock *lock);
int lc_lock_deinit(lc_lock **inout_lock);
// pthread_atfork: `prepare` runs before each fork(), the other one after it in both processes.
int lc_lock_atfork(void (*prepare)(), void (*parent_and_child)());
extern lc_lock *lc_env_lock, *lc_dso_lock, *lc_utmpx_lock;

// Holds a lock for a scope. A null lock is allowed and locks nothing.
struct lc_lock_guard {
    explicit lc_lock_guard(lc_lock *lock) : held(lock) { lc_lock_lock(held); }
    ~lc_lock_guard() { lc_lock_unlock(held); }
    lc_lock_guard(const lc_lock_guard &) = delete;
    lc_lock_guard &operator=(const lc_lock_guard &) = delete;
    lc_lock *held;
};

// Empty functions to set breakpoints on: the checks call the first for a failure that is logged, the second
// for one that is not.
void bail_debug();
void bail_quiet_debug();

// The out-of-line parts of the macros: each logs the failure and returns its status. The macros don't use
// that return value but return the constant themselves, so that a static analyser which sees only the caller
// knows that it is not 0.
lc_status lc_check_status(lc_status status, const char *function, const char *file, int line);
lc_status lc_check_null(const char *function, const char *file, int line);
lc_status lc_check_condition(const char *function, const char *file, int line);
lc_status lc_check_forced(lc_status status, const char *function, const char *file, int line);

#define LC_FILE_NAME (__builtin_strrchr("/" __FILE__, '/') + 1)

// Logs and returns a failure of `expression`; LC_CANCELLED is returned without logging.
#define CHECK_STATUS(expression)                                                                             \
    do {                                                                                                     \
        const lc_status check_status_ = (expression);                                                        \
        if (__builtin_expect(check_status_ != 0, 0)) {                                                       \
            (void)lc_check_status(check_status_, __func__, LC_FILE_NAME, __LINE__);                          \
            return check_status_;                                                                            \
        }                                                                                                    \
    } while (0)
// Returns a failure without logging it: the callee has logged it, or it is an ordinary result such as
// LC_NOT_FOUND.
#define CHECK_QUIET(expression)                                                                              \
    do {                                                                                                     \
        const lc_status check_status_ = (expression);                                                        \
        if (__builtin_expect(check_status_ != 0, 0)) {                                                       \
            bail_quiet_debug();                                                                              \
            return check_status_;                                                                            \
        }                                                                                                    \
    } while (0)
// Logs a null pointer and returns LC_NULL.
#define CHECK_NULL(pointer)                                                                                  \
    do {                                                                                                     \
        if (__builtin_expect((pointer) == nullptr, 0)) {                                                     \
            (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);                                           \
            return LC_NULL;                                                                                  \
        }                                                                                                    \
    } while (0)
// Logs a false condition and returns LC_ASSERTION.
#define CHECK_CONDITION(condition)                                                                           \
    do {                                                                                                     \
        if (__builtin_expect(!(condition), 0)) {                                                             \
            (void)lc_check_condition(__func__, LC_FILE_NAME, __LINE__);                                      \
            return LC_ASSERTION;                                                                             \
        }                                                                                                    \
    } while (0)
// Logs and returns a failure that the caller itself has found.
#define FAIL_WITH(status)                                                                                    \
    do {                                                                                                     \
        const lc_status forced_status_ = (status);                                                           \
        (void)lc_check_forced(forced_status_, __func__, LC_FILE_NAME, __LINE__);                             \
        return forced_status_;                                                                               \
    } while (0)
// Logs as CHECK_STATUS does and continues.
#define LOG_STATUS(status)                                                                                   \
    do {                                                                                                     \
        const lc_status log_status_ = (status);                                                              \
        if (__builtin_expect(log_status_ != 0, 0))                                                           \
            (void)lc_check_status(log_status_, __func__, LC_FILE_NAME, __LINE__);                            \
    } while (0)
