// Names of the IP protocols as the configuration spells them: mgmtd refuses what wccpd would not understand.
#pragma once

// The number of a protocol by its name (0 to 255), or -1 for a text that is not a name.
int ip_protocol_by_name(const char *name);
