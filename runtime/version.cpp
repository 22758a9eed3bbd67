// Alone in its file, so that a new number compiles nothing else again.
#include "runtime/version.h"

const char *wccp_version() {
    return WCCPD_VERSION;
}
