// What the kernel lets this process do.
#pragma once

#include <linux/capability.h>

// Whether the process has the capability, CAP_NET_ADMIN for example, in effect.
bool lc_has_capability(int capability);
