// The version of this build, the same for every program of the appliance.
#pragma once

// "1.0.0": major, minor, patch. Static storage.
const char *wccp_version();
