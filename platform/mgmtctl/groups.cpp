#include "platform/mgmtctl/commands.h"

int ctl_group(const ctl_options &, const std::vector<std::string> &) {
    return CTL_USAGE;
}
int ctl_policy(const ctl_options &, const std::vector<std::string> &) {
    return CTL_USAGE;
}
