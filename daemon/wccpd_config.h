// The configuration tree: read once at start, then followed change by change. Main thread only.
#pragma once

#include "runtime/common.h"

lc_status wccpd_config_query();
