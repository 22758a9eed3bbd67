// The data plane `table`, which carries nothing.
#pragma once

#include <cstdint>

// The index of the next link, counting up; with 0xFFFFFFFF no link gets an index.
extern uint32_t table_plane_next_index;
