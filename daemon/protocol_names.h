// Names of the IP protocols as configuration spells them.
#pragma once

// The number of a protocol name, or -1 for a text that is no name.
int wccpd_protocol_by_name(const char *name);
