// Redirected traffic for scripts. The keys are documented (docs/mgmtctl.md) and stay; what isn't known is
// null.
#pragma once

#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/traffic.h"

ctl_json traffic_json(const traffic_state &state);
ctl_json drains_json(const std::vector<traffic_drain> &drains);
// tunneld's answer about one intercept; null: it has none.
ctl_json intercept_state_json(const traffic_intercept *intercept);
ctl_json protection_json(const protection_state &state);
