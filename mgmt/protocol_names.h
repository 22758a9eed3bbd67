// The names of IP protocols in the configuration, for mgmtd, which checks them, and for wccpd, which uses
// them.
#pragma once

// The number of a protocol, 0 to 255, by its name; -1 for an unknown name.
int ip_protocol_by_name(const char *name);
