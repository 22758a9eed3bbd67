// Display buffers: text that cannot outgrow the memory it was given. The descriptor lies in the last 32 bytes
// of the caller's memory and belongs to the one caller that made it.
#pragma once

#include <cstdint>

struct csys_display_buf;

csys_display_buf *csys_create_safe_display_buf_desc(void *memory, uint32_t size); // null below 33 bytes
int csys_chk_display_buf(const csys_display_buf *buffer);                         // 0 intact, else 1
// Bytes appended. 0: the buffer is full (the text then ends in a newline), or the string was empty.
uint32_t csys_append_to_safe_display_buf(csys_display_buf *buffer, const char *string);
uint32_t csys_display_buf_bytes_used(const csys_display_buf *buffer);
uint32_t csys_display_buf_bytes_max(const csys_display_buf *buffer);
const char *csys_display_buf_text(const csys_display_buf *buffer);
