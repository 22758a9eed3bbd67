// In a file of its own, so that a new version number recompiles nothing else.
#include "runtime/version.h"

const char *wccp_version() {
    return WCCPD_VERSION;
}
