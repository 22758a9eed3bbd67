// The limits of the appliance.
//
// The file is read once, by the first call in any thread: tunnel ids and the size of the interface table
// depend on these numbers, which therefore must not change in a running daemon.
//
// Tunnel ids have 16 bits. max_user_tunnels is limited so that the last reserved encapsulation entry
// (max_user_tunnels + 22 + 84) has one; a larger number is a bad line, as is a max_interfaces of 0.

#include "platform/limits.h"

#include <pthread.h>

#include <cctype>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/logging.h"

namespace {

constexpr uint32_t TUNNELS_OF_THE_SYSTEM = 22;

constexpr platform_limits defaults = {.max_user_tunnels = 200, .max_interfaces = 128};

const struct {
    const char *name;
    size_t offset;
    uint32_t least, most;
} known_limits[] = {
    {"max_user_tunnels", offsetof(platform_limits, max_user_tunnels), 0, 65000},
    {"max_interfaces", offsetof(platform_limits, max_interfaces), 1, 65535},
};

const char *skip_blanks(const char *text) {
    while (*text == ' ' || *text == '\t')
        text++;
    return text;
}

// Applies one line to the limits; false for a bad line.
bool apply_line(const char *line, platform_limits *limits) {
    const char *at = skip_blanks(line);
    if (*at == '\0' || *at == '#')
        return true;
    for (const auto &limit : known_limits) {
        // A name must be followed by a blank; otherwise it is the beginning of a longer one.
        const size_t length = strlen(limit.name);
        if (strncmp(at, limit.name, length) != 0 || (at[length] != ' ' && at[length] != '\t'))
            continue;
        at = skip_blanks(at + length);
        // A sign, which strtoul would accept, is refused.
        if (!isdigit(static_cast<unsigned char>(*at)))
            return false;
        char *end = nullptr;
        errno = 0;
        const unsigned long value = strtoul(at, &end, 10);
        if (errno != 0 || *skip_blanks(end) != '\0' || value < limit.least || value > limit.most)
            return false;
        const uint32_t number = static_cast<uint32_t>(value);
        memcpy(reinterpret_cast<char *>(limits) + limit.offset, &number, sizeof number);
        return true;
    }
    return false;
}

} // namespace

platform_limits platform_limits_read(const char *path, uint32_t *out_bad_line) {
    const cancel_off_guard whole; // the file must be closed
    platform_limits limits = defaults;
    if (out_bad_line)
        *out_bad_line = 0;
    // The e in the mode sets O_CLOEXEC.
    FILE *file = fopen(path, "re");
    if (!file) {
        // A file that does not exist is normal: it only replaces the defaults.
        if (errno != ENOENT && !out_bad_line)
            QV_LOG(LC_LOG_WARNING, "%s cannot be read (%m): using the defaults", path);
        return limits;
    }
    bool more = true;
    for (unsigned number = 1; more; number++) {
        // By character, because fgets() would not show a NUL, nor that a line continues.
        char line[128];
        size_t length = 0;
        bool good = true; // fits in the buffer and contains no NUL
        int c;
        while ((c = fgetc(file)) != EOF && c != '\n') {
            good = good && c != '\0' && length + 1 < sizeof line;
            if (good)
                line[length++] = static_cast<char>(c);
        }
        more = c != EOF;
        line[length] = '\0';
        // Lines may end with CR LF.
        line[strcspn(line, "\r")] = '\0';
        // A comment may be of any length.
        if ((good || *skip_blanks(line) == '#') && apply_line(line, &limits))
            continue;
        if (out_bad_line)
            *out_bad_line = *out_bad_line ? *out_bad_line : number;
        else
            QV_LOG(LC_LOG_WARNING, "%s: ignoring bad line %u: %s", path, number, line);
    }
    fclose(file);
    return limits;
}

namespace {

platform_limits current;
pthread_once_t current_once = PTHREAD_ONCE_INIT;

const platform_limits *limits_of_this_run() {
    pthread_once(&current_once, [] { current = platform_limits_read(PLATFORM_CONF_PATH); });
    return &current;
}

} // namespace

uint32_t get_max_user_tunnel_number() {
    return limits_of_this_run()->max_user_tunnels;
}
uint32_t get_max_tunnel_number() {
    return get_max_user_tunnel_number() + TUNNELS_OF_THE_SYSTEM;
}
uint32_t qv_max_interfaces() {
    return limits_of_this_run()->max_interfaces;
}
