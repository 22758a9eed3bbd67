// The plane that carries nothing.
#pragma once

#include <cstdint>

// Index of the next link, rising from there; 0xFFFFFFFF gives none to any.
extern uint32_t table_plane_next_index;
