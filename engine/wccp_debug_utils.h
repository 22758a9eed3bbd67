// The text dumps of the engine's state, written to display buffers of the caller. Each function takes the
// engine lock while it reads, so that a dump is a consistent snapshot. 0, or 1 when the text did not fit or
// there is no such group; what fitted is then in the buffer.
#pragma once

#include "engine/wccp_records.h"
#include "runtime/csys.h"

// Sizes of the display buffers.
constexpr uint32_t WCCP_DUMP_GLOBAL_BYTES = 1024;
constexpr uint32_t WCCP_DUMP_GROUP_BYTES = 16384;
constexpr uint32_t WCCP_DUMP_ASSIGNMENT_BYTES = 65536;
constexpr uint32_t WCCP_DUMP_ALL_BYTES = 65536;

// The log level for a dump that did not fit. Main thread only, like the functions below.
extern int32_t wccp_dump_failure_level;

int wccp_print_global(csys_display_buf *buffer);
int wccp_print_all_wccp_info(csys_display_buf *buffer);
int wccp_print_service_grp(csys_display_buf *buffer, int id);
int wccp_print_service_grp_assignment_details(int id, csys_display_buf *buffer);
