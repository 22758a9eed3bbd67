#include "runtime/capabilities.h"

#include <sys/syscall.h>
#include <unistd.h>

bool lc_has_capability(int capability) {
    // Process id 0 is the calling thread. Version 3 has 64 capabilities in two words of each set.
    __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct sets[_LINUX_CAPABILITY_U32S_3] = {};
    if (syscall(SYS_capget, &header, sets) != 0)
        return false;
    return (sets[CAP_TO_INDEX(capability)].effective & CAP_TO_MASK(capability)) != 0;
}
