// How a dump is written: a piece of text is formatted into a scratch buffer, within its bounds, and appended
// to the display buffer; a row is a label, a writer of its value, and a newline. Lock held: the scratch
// buffers are shared.
#pragma once

#include "engine/wccp_records.h"
#include "runtime/csys.h"

// One piece in the making.
struct wccp_piece {
    csys_display_buf *buffer; // where it goes
    char *text;               // scratch
    uint32_t size;
    uint32_t used;
};
wccp_piece wccp_group_piece(csys_display_buf *buffer);      // global and group text
wccp_piece wccp_assignment_piece(csys_display_buf *buffer); // assignment text

void wccp_piece_add(wccp_piece *piece, const char *format, ...) __attribute__((format(printf, 2, 3)));
// Appends the piece and empties it: 1 when the display buffer had no room for it, or there was nothing to
// append.
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

// Leaves a dump whose buffer is full.
#define WCCP_BAIL_ON_ZERO(failed)                                                                            \
    do {                                                                                                     \
        if (failed) {                                                                                        \
            QV_LOG(LC_LOG_INFO, "WCCP bail on zero : %s %d", __func__, __LINE__);                            \
            return 1;                                                                                        \
        }                                                                                                    \
    } while (0)

int wccp_print_service_grp_assignment_details_by_grp_ptr(wccp_service_group *group, csys_display_buf *buffer);
