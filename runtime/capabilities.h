// Capabilities of the process (capabilities(7)).
#pragma once

#include <linux/capability.h>

// Whether a capability, CAP_NET_ADMIN for example, is in the effective set.
bool lc_has_capability(int capability);
