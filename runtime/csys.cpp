#include "runtime/csys.h"

#include <cstring>

constexpr uint32_t MAGIC = 0xDEADBEEF;

// The last 32 bytes of the caller's memory.
struct csys_display_buf {
    uint32_t magic;
    uint32_t left;
    char *start;
    char *position;
    uint64_t reserved;
};
static_assert(sizeof(csys_display_buf) == 32);
constexpr uint32_t OVERHEAD = sizeof(csys_display_buf) + 1; // descriptor and terminator

namespace {

// The caller's memory may end at any address. The descriptor can therefore be unaligned: it is copied in and
// out.
csys_display_buf load_descriptor(const csys_display_buf *buffer) {
    csys_display_buf copy;
    memcpy(&copy, static_cast<const void *>(buffer), sizeof copy);
    return copy;
}
void save_descriptor(csys_display_buf *buffer, const csys_display_buf *copy) {
    memcpy(static_cast<void *>(buffer), copy, sizeof *copy);
}

} // namespace

csys_display_buf *csys_create_safe_display_buf_desc(void *memory, uint32_t size) {
    if (!memory || size < OVERHEAD)
        return nullptr;
    char *text = static_cast<char *>(memory);
    void *place = text + size - sizeof(csys_display_buf);
    const csys_display_buf fresh = {MAGIC, size - OVERHEAD, text, text, 0};
    memcpy(place, &fresh, sizeof fresh);
    *text = '\0';
    return static_cast<csys_display_buf *>(place);
}

int csys_chk_display_buf(const csys_display_buf *buffer) {
    return !buffer || load_descriptor(buffer).magic != MAGIC;
}

uint32_t csys_append_to_safe_display_buf(csys_display_buf *buffer, const char *string) {
    if (csys_chk_display_buf(buffer) || !string)
        return 0;
    csys_display_buf state = load_descriptor(buffer);
    const size_t length = strlen(string);
    if (state.left == 0 || length == 0)
        return 0;
    const bool fits = length <= state.left;
    const uint32_t copied = fits ? static_cast<uint32_t>(length) : state.left;
    memcpy(state.position, string, copied);
    state.position += copied;
    state.left -= copied;
    // A newline at the end shows, also in the output itself, that the text was truncated.
    if (!fits)
        state.position[-1] = '\n';
    *state.position = '\0';
    save_descriptor(buffer, &state);
    return fits ? copied : 0;
}

uint32_t csys_display_buf_bytes_used(const csys_display_buf *buffer) {
    if (csys_chk_display_buf(buffer))
        return 0;
    const csys_display_buf state = load_descriptor(buffer);
    return static_cast<uint32_t>(state.position - state.start);
}

uint32_t csys_display_buf_bytes_max(const csys_display_buf *buffer) {
    return csys_chk_display_buf(buffer) ? 0
                                        : csys_display_buf_bytes_used(buffer) + load_descriptor(buffer).left;
}

const char *csys_display_buf_text(const csys_display_buf *buffer) {
    return csys_chk_display_buf(buffer) ? "" : load_descriptor(buffer).start;
}
