#include "platform/mgmtctl/commands.h"

int ctl_show(const ctl_options &) {
    return CTL_USAGE;
}
