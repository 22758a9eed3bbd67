// The two scratch buffers of the dumps. The engine lock is held throughout; a piece that does not fit is
// truncated.
#include "engine/wccp_debug_pieces.h"

#include <cstdarg>
#include <cstdio>

namespace {

char group_scratch[1024];
char assignment_scratch[6399];

} // namespace

wccp_piece wccp_group_piece(csys_display_buf *buffer) {
    return {buffer, group_scratch, sizeof group_scratch, 0};
}
wccp_piece wccp_assignment_piece(csys_display_buf *buffer) {
    return {buffer, assignment_scratch, sizeof assignment_scratch, 0};
}

void wccp_piece_add(wccp_piece *piece, const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    const int length = vsnprintf(piece->text + piece->used, piece->size - piece->used, format, arguments);
    va_end(arguments);
    // When it truncates, vsnprintf returns the length of the whole text.
    if (length > 0) {
        const uint32_t room = piece->size - piece->used - 1;
        piece->used += static_cast<uint32_t>(length) < room ? static_cast<uint32_t>(length) : room;
    }
}

int wccp_piece_flush(wccp_piece *piece) {
    piece->used = 0;
    return csys_append_to_safe_display_buf(piece->buffer, piece->text) == 0;
}
