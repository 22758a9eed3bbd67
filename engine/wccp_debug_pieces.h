// The parts of a diagnostic dump. A piece of text is formatted into a scratch buffer, truncated to its size,
// and then appended to the caller's display buffer. A row is a label, its value and a newline. The scratch
// buffers are shared by all dumps; therefore the lock must be held throughout.
#pragma once

#include "engine/wccp_records.h"
#include "runtime/csys.h"

// A piece that is being formatted.
struct wccp_piece {
    csys_display_buf *buffer; // that it will be appended to
    char *text;               // the scratch buffer
    uint32_t size;            // bytes of the scratch buffer
    uint32_t used;
};
wccp_piece wccp_group_piece(csys_display_buf *buffer);      // for global and group text
wccp_piece wccp_assignment_piece(csys_display_buf *buffer); // for assignment text and other long lines

void wccp_piece_add(wccp_piece *piece, const char *format, ...) __attribute__((format(printf, 2, 3)));
// Appends the piece to the display buffer and empties it. 0, or 1 when the display buffer is full or the
// piece was empty.
int wccp_piece_flush(wccp_piece *piece);

template <typename Record>
struct wccp_dump_row {
    const char *label;
    void (*value)(wccp_piece *piece, const Record *record);
};
template <typename Record, size_t Count>
int wccp_print_rows(wccp_piece *piece, const wccp_dump_row<Record> (&rows)[Count], const Record *record) {
    for (const wccp_dump_row<Record> &row : rows) {
        wccp_piece_add(piece, "    %-32s : ", row.label);
        row.value(piece, record);
        wccp_piece_add(piece, "\n");
        if (wccp_piece_flush(piece))
            return 1;
    }
    return 0;
}

// Returns 1 from a dump whose display buffer is full.
#define WCCP_BAIL_ON_ZERO(failed)                                                                            \
    do {                                                                                                     \
        if (failed) {                                                                                        \
            QV_LOG(LC_LOG_INFO, "WCCP bail on zero : %s %d", __func__, __LINE__);                            \
            return 1;                                                                                        \
        }                                                                                                    \
    } while (0)

int wccp_print_service_grp_assignment_details_by_grp_ptr(wccp_service_group *group, csys_display_buf *buffer);
