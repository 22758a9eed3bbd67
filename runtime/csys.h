// Display buffers: text in memory of the caller that cannot overrun it. The descriptor takes the last 32
// bytes of that memory. A buffer has no lock: one thread uses it. There is nothing to free but the caller's
// memory.
#pragma once

#include <cstdint>

struct csys_display_buf;

// `size` in bytes, at least 33, else null; size - 33 bytes of text fit.
csys_display_buf *csys_create_safe_display_buf_desc(void *memory, uint32_t size);
int csys_chk_display_buf(const csys_display_buf *buffer); // 0 when the descriptor is intact, else 1
// Returns the number of bytes appended. 0 when the string was empty, or did not fit: the buffer is then full,
// and its text is cut and ends in a newline.
uint32_t csys_append_to_safe_display_buf(csys_display_buf *buffer, const char *string);
uint32_t csys_display_buf_bytes_used(const csys_display_buf *buffer); // without the terminating NUL
uint32_t csys_display_buf_bytes_max(const csys_display_buf *buffer);  // used and still free
const char *csys_display_buf_text(const csys_display_buf *buffer);    // "" for a damaged buffer
