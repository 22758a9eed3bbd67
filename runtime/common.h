// Status codes and the pattern by which a failure travels, enumeration tables, bounded strings, locks.
//
// Every operation of the framework returns an lc_status: 0 is success, failures lie in 14000 to 14502 and
// have words in lc_status_table. After each call one of the four checks below logs a failure at the place
// where it was seen and returns it; whatever the operation owns sits in guards, so that the return releases
// it. One failure so logs one line at each level that it passes. LC_CANCELLED travels without a line.
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

// Value to name, ended by a null name. Scanned from the start, first match wins.
struct lc_enum_entry {
    int32_t value;
    const char *name;
};
extern const lc_enum_entry lc_status_table[];

const char *lc_enum_to_string(const lc_enum_entry *table, int32_t value);
const char *lc_enum_to_string_quiet(const lc_enum_entry *table, int32_t value);
const char *lc_enum_to_string_quiet_null(const lc_enum_entry *table, int32_t value);
lc_status lc_string_to_enum(const lc_enum_entry *table, const char *string, int32_t *out_value);

const char *lc_bool_to_str(int32_t value);
lc_status lc_str_to_bool(const char *string, int32_t *out_value);
int lc_is_prefix(const char *prefix, const char *string, int ignore_case);
int lc_is_suffix(const char *suffix, const char *string, int ignore_case);
const char *lc_signal_num_to_name(int number);

// The caller frees the copies that these give, with free().
char *safe_strdup(const char *string);
lc_status lc_getenv_ts(const char *name, char **out_text);
lc_status lc_setenv(const char *name, const char *value, int overwrite);
int lc_devel_is_production();

// The BSD pair: the result is the length that the text would have had without a limit.
extern "C" size_t strlcpy(char *dst, const char *src, size_t size) noexcept;
extern "C" size_t strlcat(char *dst, const char *src, size_t size) noexcept;
char *smprintf(const char *format, ...) __attribute__((format(printf, 1, 2)));
char *vsmprintf(const char *format, va_list arguments) __attribute__((format(printf, 1, 0)));
lc_status snmprintf(char **out_string, uint32_t *out_length, const char *format, ...)
    __attribute__((format(printf, 3, 4)));
lc_status vsnmprintf(char **out_string, uint32_t *out_length, const char *format, va_list arguments)
    __attribute__((format(printf, 3, 0)));

// Creates the process-wide locks. The first call of main.
lc_status lc_init();

// A lock that knows its owner. Operations return 0, 1 for a null lock or a refusal, else the pthread error.
struct lc_lock;
int lc_lock_init(lc_lock **out_lock, int recursive);
int lc_lock_lock(lc_lock *lock);
int lc_lock_unlock(lc_lock *lock);
int lc_lock_deinit(lc_lock **inout_lock);
int lc_lock_atfork(void (*prepare)(), void (*parent_and_child)());
extern lc_lock *lc_env_lock, *lc_dso_lock, *lc_utmpx_lock;

struct lc_lock_guard {
    explicit lc_lock_guard(lc_lock *lock) : held(lock) { lc_lock_lock(held); }
    ~lc_lock_guard() { lc_lock_unlock(held); }
    lc_lock_guard(const lc_lock_guard &) = delete;
    lc_lock_guard &operator=(const lc_lock_guard &) = delete;
    lc_lock *held;
};

// Places for a debugger to stop, called by the checks.
void bail_debug();
void bail_quiet_debug();

// The bodies of the checks; each logs as its check says and gives the status to return. The macros return it
// themselves, so that whoever reads the caller alone, a static analyser for one, sees that it is a failure.
lc_status lc_check_status(lc_status status, const char *function, const char *file, int line);
lc_status lc_check_null(const char *function, const char *file, int line);
lc_status lc_check_condition(const char *function, const char *file, int line);
lc_status lc_check_forced(lc_status status, const char *function, const char *file, int line);

#define LC_FILE_NAME (__builtin_strrchr("/" __FILE__, '/') + 1)

// Status check: a failure of `expression` is logged and returned (LC_CANCELLED without a line).
#define CHECK_STATUS(expression)                                                                             \
    do {                                                                                                     \
        const lc_status check_status_ = (expression);                                                        \
        if (__builtin_expect(check_status_ != 0, 0)) {                                                       \
            (void)lc_check_status(check_status_, __func__, LC_FILE_NAME, __LINE__);                          \
            return check_status_;                                                                            \
        }                                                                                                    \
    } while (0)
// Quiet check: a failure is returned without a line.
#define CHECK_QUIET(expression)                                                                              \
    do {                                                                                                     \
        const lc_status check_status_ = (expression);                                                        \
        if (__builtin_expect(check_status_ != 0, 0)) {                                                       \
            bail_quiet_debug();                                                                              \
            return check_status_;                                                                            \
        }                                                                                                    \
    } while (0)
// Null check: a null pointer is logged and LC_NULL returned.
#define CHECK_NULL(pointer)                                                                                  \
    do {                                                                                                     \
        if (__builtin_expect((pointer) == nullptr, 0)) {                                                     \
            (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);                                           \
            return LC_NULL;                                                                                  \
        }                                                                                                    \
    } while (0)
// Condition check: a false condition is logged and LC_ASSERTION returned.
#define CHECK_CONDITION(condition)                                                                           \
    do {                                                                                                     \
        if (__builtin_expect(!(condition), 0)) {                                                             \
            (void)lc_check_condition(__func__, LC_FILE_NAME, __LINE__);                                      \
            return LC_ASSERTION;                                                                             \
        }                                                                                                    \
    } while (0)
// A failure of one's own making.
#define FAIL_WITH(status)                                                                                    \
    do {                                                                                                     \
        const lc_status forced_status_ = (status);                                                           \
        (void)lc_check_forced(forced_status_, __func__, LC_FILE_NAME, __LINE__);                             \
        return forced_status_;                                                                               \
    } while (0)
// The status check's line without the return, for callers that go on.
#define LOG_STATUS(status)                                                                                   \
    do {                                                                                                     \
        const lc_status log_status_ = (status);                                                              \
        if (__builtin_expect(log_status_ != 0, 0))                                                           \
            (void)lc_check_status(log_status_, __func__, LC_FILE_NAME, __LINE__);                            \
    } while (0)
