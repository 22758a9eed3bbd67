// Frames: the output queue, and the reader that extracts frames from the received bytes. The loop calls
// gcl_session_fd_read_write_timeout_activity when a session's socket is ready; any thread may send.
//
// The reader is reentrant. The handler of a frame may wait for an answer by running the loop, which then
// reads further frames of the same session: meanwhile the read buffer may be moved, enlarged, emptied, or
// freed with the session. The position of the next frame is therefore kept in the session only, and is
// advanced before the frame is passed, as a copy, to its handler. Afterwards the framing loop checks that the
// session is still connected and uses nothing that it has read from it before.
//
// The length in a frame's header must be between GCL_HEADER_BYTES and GCL_FRAME_MAX, or the session is
// closed. The read buffer does not grow to that length at once, but with the bytes that have been received:
// when less than GCL_READ_ROOM is free, to four times its size, and by at most 8 MiB more than it then needs
// (tb_ensure_size).
//
// The output queue is limited in bytes. A frame that would exceed the limit is refused: the first one is
// logged, the others are counted, and their number is logged when the queue has drained to half of the limit.
// The sender gets LC_CANCELLED, which is not logged, and must not wait for an answer. If the frame was a
// response, a short refusal is queued instead, for which the queue has a reserve.
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "mgmt/gcl_io.h"
#include "mgmt/gcl_records.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

constexpr int64_t RATE_SLICE_MS = 100;

namespace {

void swap_u16(uint8_t *at) {
    const uint8_t first = at[0];
    at[0] = at[1];
    at[1] = first;
}
void swap_u32(uint8_t *at) {
    const uint8_t first = at[0], second = at[1];
    at[0] = at[3];
    at[1] = at[2];
    at[2] = second;
    at[3] = first;
}

} // namespace

void gcl_byte_swap_frame_header(void *header) {
    auto *bytes = static_cast<uint8_t *>(header);
    if constexpr (std::endian::native == std::endian::big)
        return;
    // The ident is a string and keeps its order.
    for (const uint32_t offset : {4u, 8u, 12u, 20u, 28u})
        swap_u32(bytes + offset);
    for (const uint32_t offset : {16u, 18u, 24u, 26u})
        swap_u16(bytes + offset);
}

// --- Sending

namespace {

void fill_header(uint8_t *at, uint32_t sequence, uint16_t proto, uint16_t mtype, uint32_t total) {
    gcl_frame_header header = {
        {},    GCL_FRAME_MARKER,        GCL_FRAME_VERSION, total, GCL_HEADER_BYTES, 0, sequence, proto,
        mtype, total - GCL_HEADER_BYTES};
    memcpy(header.ident, GCL_FRAME_IDENT, sizeof header.ident);
    memcpy(at, &header, sizeof header);
}

lc_status check_sendable(const gcl_session *session) {
    if (session->state == GCL_SESSION_CONNECTED)
        return LC_OK;
    LC_LOG(LC_LOG_WARNING, "session %d: tried to send frame in state %d", session->id, session->state);
    return LC_GENERIC;
}

// Whether a frame of `total` bytes fits in the queue, whose limit is `queue_max`.
lc_status check_room(gcl_session *session, uint64_t total, uint64_t queue_max) {
    if (total > GCL_FRAME_MAX) {
        LC_LOG(LC_LOG_WARNING, "session %d: message of %llu bytes is larger than a frame", session->id,
               static_cast<unsigned long long>(total));
        return LC_NO_BUFFER_SPACE;
    }
    // An empty queue takes any frame, or one larger than the limit could never be sent.
    if (!session->queued_bytes || session->queued_bytes + total <= queue_max)
        return LC_OK;
    if (!session->frames_lost++)
        LC_LOG(LC_LOG_WARNING,
               "session %d: output queue is full (%llu bytes): peer %s is not reading, frames are dropped",
               session->id, static_cast<unsigned long long>(session->queued_bytes),
               gcl_admin_of(session) ? gcl_admin_of(session)->peer_name : "");
    return LC_CANCELLED;
}

void report_drained(gcl_session *session) {
    // At half of the limit, so that a queue which stays nearly full doesn't log a pair of lines per frame.
    if (!session->frames_lost || session->queued_bytes > GCL_QUEUE_MAX_BYTES / 2)
        return;
    LC_LOG(LC_LOG_NOTICE, "session %d: output queue has drained, %llu frames were dropped", session->id,
           static_cast<unsigned long long>(session->frames_lost));
    session->frames_lost = 0;
}

lc_status append_to_queue(gcl_session *session, tbuffer **inout_buffer, uint32_t sequence) {
    auto *frame = static_cast<gcl_frame *>(calloc(1, sizeof(gcl_frame)));
    CHECK_NULL(frame);
    const lc_status status = tb_detach(inout_buffer, &frame->bytes, &frame->length);
    if (status != LC_OK)
        free(frame);
    CHECK_STATUS(status);
    gcl_byte_swap_frame_header(frame->bytes);
    frame->session = session;
    frame->sequence = sequence;
    frame->time_queued_ms = lt_curr_time_ms();
    // From here on the queue owns the frame; if writing fails, gcl_session_free frees it.
    (session->queue_tail ? session->queue_tail->next : session->queue_head) = frame;
    session->queue_tail = frame;
    session->queued_bytes += frame->length;
    CHECK_STATUS(gcl_run_output_queue(session));
    return LC_OK;
}

// Writes the header to the start of the buffer, and queues the buffer.
lc_status send_buffer(gcl_session *session, uint16_t proto, uint16_t mtype, tbuffer **inout_buffer) {
    const auto total = static_cast<uint32_t>(tb_length(*inout_buffer));
    const uint32_t sequence = session->sequence++;
    fill_header(tb_buf(*inout_buffer), sequence, proto, mtype, total);
    CHECK_STATUS(append_to_queue(session, inout_buffer, sequence));
    return LC_OK;
}

} // namespace

lc_status gcl_session_send_frame_components(gcl_session *session, uint16_t proto, uint16_t mtype,
                                            uint32_t length, const void *body) {
    CHECK_NULL(session);
    CHECK_CONDITION(body || !length);
    const gcl_session_guard guard(session);
    CHECK_QUIET(check_sendable(session));
    CHECK_QUIET(check_room(session, uint64_t{GCL_HEADER_BYTES} + length, GCL_QUEUE_MAX_BYTES));
    gcl_owned_buffer buffer;
    // Cannot overflow: check_room has limited the sum.
    CHECK_STATUS(tb_new_size(&buffer.pointer, GCL_HEADER_BYTES + length));
    const uint8_t header[GCL_HEADER_BYTES] = {};
    CHECK_STATUS(tb_append_buf(buffer.pointer, header, sizeof header));
    if (length)
        CHECK_STATUS(tb_append_buf(buffer.pointer, body, length));
    CHECK_STATUS(send_buffer(session, proto, mtype, &buffer.pointer));
    return LC_OK;
}

lc_status gcl_session_send_frame_components_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                               uint32_t header_bytes, tbuffer **inout_buffer) {
    CHECK_NULL(inout_buffer);
    gcl_owned_buffer buffer(*inout_buffer);
    *inout_buffer = nullptr;
    CHECK_NULL(session);
    CHECK_NULL(buffer.pointer);
    const gcl_session_guard guard(session);
    CHECK_QUIET(check_sendable(session));
    if (header_bytes != GCL_HEADER_BYTES) {
        // The buffer has no room for a header; all of its bytes are taken as the body.
        LC_LOG(LC_LOG_ERR, "session %d: tried to send frame with tb put bad header", session->id);
        CHECK_STATUS(gcl_session_send_frame_components(
            session, proto, mtype, static_cast<uint32_t>(tb_length(buffer.pointer)), tb_buf(buffer.pointer)));
        return LC_OK;
    }
    CHECK_CONDITION(tb_length(buffer.pointer) >= static_cast<int32_t>(GCL_HEADER_BYTES));
    CHECK_QUIET(check_room(session, buffer.pointer->length, GCL_QUEUE_MAX_BYTES));
    CHECK_STATUS(send_buffer(session, proto, mtype, &buffer.pointer));
    return LC_OK;
}

lc_status gcl_session_send_refusal_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                      tbuffer **inout_buffer) {
    CHECK_NULL(inout_buffer);
    gcl_owned_buffer buffer(*inout_buffer);
    *inout_buffer = nullptr;
    CHECK_NULL(session);
    CHECK_CONDITION(tb_length(buffer.pointer) >= static_cast<int32_t>(GCL_HEADER_BYTES));
    const gcl_session_guard guard(session);
    CHECK_QUIET(check_sendable(session));
    CHECK_QUIET(check_room(session, buffer.pointer->length, GCL_QUEUE_MAX_BYTES + GCL_QUEUE_RESERVE_BYTES));
    CHECK_STATUS(send_buffer(session, proto, mtype, &buffer.pointer));
    return LC_OK;
}

void gcl_free_queue(gcl_session *session) {
    while (gcl_frame *frame = session->queue_head) {
        session->queue_head = frame->next;
        free(frame->bytes);
        free(frame);
    }
    session->queue_tail = nullptr;
    session->queued_bytes = 0;
}

namespace {

void finish_frame(gcl_session *session) {
    gcl_frame *frame = session->queue_head;
    session->counters.frames_sent++;
    LC_LOG(LC_LOG_DEBUG, "session %d: finished sending frame %d on fd %d of %d bytes", session->id,
           frame->sequence, session->fd, frame->length);
    session->queue_head = frame->next;
    if (!frame->next)
        session->queue_tail = nullptr;
    free(frame->bytes);
    free(frame);
}

// The number of bytes that one run of the queue may send; no limit without a rate limit.
uint64_t slice_bytes(const gcl_session *session) {
    return session->rate_limit ? session->rate_limit * 1024ull * RATE_SLICE_MS / 1000 : UINT64_MAX;
}

lc_status wait_for_slice(gcl_session *session) {
    // The timer of an earlier run of the queue hasn't fired yet.
    if (session->rate_timer >= 0)
        return LC_OK;
    CHECK_STATUS(fdic_event_add_timer(session->instance->interests, RATE_SLICE_MS, session,
                                      gcl_session_fd_read_write_timeout_activity, reinterpret_cast<void *>(3),
                                      &session->rate_timer));
    return LC_OK;
}

// Writes until the queue is empty or the socket is full (`out_blocked`). With a rate limit the rest of the
// queue waits for a timer.
lc_status write_queue(gcl_session *session, bool *out_blocked) {
    uint64_t slice = slice_bytes(session);
    while (gcl_frame *frame = session->queue_head) {
        if (!slice)
            return wait_for_slice(session);
        // After a partial write the loop gets here again and finds the socket full.
        if (!lf_is_writable(session->fd)) {
            LC_LOG(LC_LOG_DEBUG, "session %d: not writable: %d", session->id, session->fd);
            *out_blocked = true;
            return LC_OK;
        }
        uint64_t now = frame->length - frame->written, written = 0;
        now = now < slice ? now : slice;
        const lc_status status =
            lf_write_bytes(session->fd, frame->bytes + frame->written, static_cast<int64_t>(now), &written);
        // What was written is counted also if the write was cut short by an error.
        frame->written += written;
        session->queued_bytes -= written;
        session->counters.bytes_sent += written;
        // The slice is used up only under a rate limit; otherwise it stays without a limit.
        if (session->rate_limit)
            slice -= written;
        if (status == LC_IO_CLOSED) {
            LC_LOG(LC_LOG_INFO, "session %d: session peer closed connection", session->id);
            return status;
        }
        if (status != LC_OK && status != LC_IO_WOULD_BLOCK)
            CHECK_STATUS(status);
        LC_LOG(LC_LOG_DEBUG, "session %d: sent %d bytes on fd %d of for %d", session->id,
               static_cast<int>(written), session->fd, frame->length);
        if (frame->written == frame->length)
            finish_frame(session);
    }
    return LC_OK;
}

} // namespace

lc_status gcl_run_output_queue(gcl_session *session) {
    LC_LOG(LC_LOG_DEBUG, "session %d: running output queue", session->id);
    bool blocked = false;
    // A closed peer is an ordinary event for the sender: the close handler reports it.
    const lc_status status = write_queue(session, &blocked);
    if (status != LC_OK) {
        LOG_STATUS(gcl_session_close(session, 0));
        return status == LC_IO_CLOSED ? LC_OK : status;
    }
    report_drained(session);
    // The interest in writing lasts only while the socket is full, or the loop would be woken all the time.
    if (blocked != (session->want_write != 0)) {
        session->want_write = blocked;
        CHECK_STATUS(
            fdic_event_update_fd(session->instance->interests, session->fd_interest, 1, session->want_write));
    }
    return LC_OK;
}

// --- Passing frames to their handlers

namespace {

lc_status check_header(const gcl_session *session, const gcl_frame_header *header, uint32_t received) {
    if (memcmp(header->ident, GCL_FRAME_IDENT, sizeof header->ident) != 0) {
        // Logged as a number, since the bytes need not be printable.
        uint32_t ident;
        memcpy(&ident, header->ident, sizeof ident);
        LC_LOG(LC_LOG_ERR, "session %d: invalid frame ident: %x", session->id, ident);
        return LC_GENERIC;
    }
    if (header->version != GCL_FRAME_VERSION) {
        LC_LOG(LC_LOG_ERR, "session %d: invalid frame version: %d", session->id, header->version);
        return LC_GENERIC;
    }
    if (header->total_length != received) {
        LC_LOG(LC_LOG_ERR, "session %d: invalid frame length: %d vs %d", session->id, header->total_length,
               received);
        return LC_GENERIC;
    }
    if (header->header_length != GCL_HEADER_BYTES) {
        LC_LOG(LC_LOG_ERR, "session %d: invalid frame header len: %d vs %s", session->id,
               header->header_length, "32");
        return LC_GENERIC;
    }
    return LC_OK;
}

const gcl_message_handler *find_handler(const gcl_body_protocol *protocol, uint16_t mtype) {
    if (mtype < GCL_HANDLERS_MAX && protocol->handlers[mtype].function)
        return &protocol->handlers[mtype];
    return protocol->handlers[0].function ? &protocol->handlers[0] : nullptr;
}

lc_status deliver_frame(gcl_session *session, tbuffer **inout_frame) {
    const auto length = static_cast<uint32_t>(tb_length(*inout_frame));
    gcl_byte_swap_frame_header(tb_buf(*inout_frame));
    // Handlers get the header in host order, in the frame itself; the copy is for this function.
    gcl_frame_header header;
    memcpy(&header, tb_buf(*inout_frame), sizeof header);
    CHECK_QUIET(check_header(session, &header, length));
    LC_LOG(LC_LOG_DEBUG, "session %d: upper layer handoff of %d len %d", session->id, header.sequence,
           length);
    gcl_body_protocol *protocol = gcl_get_body_protocol(session->instance, header.proto);
    if (!protocol || !protocol->enabled) {
        LC_LOG(LC_LOG_WARNING, "session %d: DISCARDED frame %d (%d) proto %d ", session->id, header.sequence,
               length, header.proto);
        return LC_OK;
    }
    const gcl_message_handler *handler = find_handler(protocol, header.mtype);
    if (!handler) {
        LC_LOG(LC_LOG_WARNING, "session %d: DISCARDED frame %d (%d) proto %d mtype %d", session->id,
               header.sequence, length, header.proto, header.mtype);
        return LC_OK;
    }
    CHECK_CONDITION(handler->protocol == header.proto);
    // Handler 0 is for all types; its own type need not agree.
    CHECK_CONDITION(handler->mtype == header.mtype || handler->mtype == 0);
    session->counters.frames_delivered++;
    session->counters.bytes_delivered += length;
    CHECK_STATUS(handler->function(session, protocol, inout_frame, handler->user_data));
    return LC_OK;
}

// --- Reading

uint32_t bytes_unread(const gcl_session *session) {
    return static_cast<uint32_t>(tb_length(session->read_buffer)) - session->read_position;
}

// Empties the buffer; one that a large frame has enlarged is replaced by one of the first size.
lc_status reset_buffer(gcl_session *session) {
    session->read_position = 0;
    if (tb_size(session->read_buffer) > GCL_READ_BUFFER_KEEP) {
        // If there is no memory for a new one, the session is closed and never reads again.
        tb_free(&session->read_buffer);
        CHECK_STATUS(tb_new_size(&session->read_buffer, GCL_READ_BUFFER_BYTES));
        return LC_OK;
    }
    CHECK_STATUS(tb_set_length(session->read_buffer, 0));
    return LC_OK;
}

// A copy of the next complete frame; null if more bytes have to be received first.
lc_status next_frame(gcl_session *session, tbuffer **out_frame) {
    const uint32_t unread = bytes_unread(session);
    if (unread < GCL_HEADER_BYTES) {
        LC_LOG(LC_LOG_DEBUG, "session %d: bu: not enough for header", session->id);
        return LC_OK;
    }
    // The header stays in network byte order in the read buffer; deliver_frame converts the copy.
    gcl_wire_header header;
    memcpy(&header, tb_buf(session->read_buffer) + session->read_position, sizeof header);
    const uint32_t total = to_host(header.total_length);
    // The only field that is checked before the frame is complete, since it decides how much is read.
    if (total < GCL_HEADER_BYTES || total > GCL_FRAME_MAX) {
        LC_LOG(LC_LOG_ERR, "session %d: invalid frame total length: %u not in %u to %u", session->id, total,
               GCL_HEADER_BYTES, GCL_FRAME_MAX);
        return LC_GENERIC;
    }
    session->in_frame = 1;
    session->frame_length = total;
    if (unread < total) {
        LC_LOG(LC_LOG_DEBUG, "session %d: bu: not enough for body", session->id);
        return LC_OK;
    }
    CHECK_STATUS(tb_new_buf(out_frame, tb_buf(session->read_buffer) + session->read_position,
                            static_cast<int32_t>(total)));
    session->in_frame = session->frame_length = 0;
    session->counters.frames_received++;
    session->counters.bytes_received += total;
    LC_LOG(LC_LOG_DEBUG, "session %d: received full frame seq %d len %d", session->id,
           to_host(header.sequence), total);
    // Before the frame is handled: the handler may read further frames from this buffer.
    session->read_position += total;
    if (!bytes_unread(session))
        CHECK_STATUS(reset_buffer(session));
    return LC_OK;
}

lc_status deliver_frames(gcl_session *session) {
    while (session->state == GCL_SESSION_CONNECTED) {
        gcl_owned_buffer frame;
        CHECK_QUIET(next_frame(session, &frame.pointer));
        if (!frame.pointer)
            return LC_OK;
        CHECK_QUIET(deliver_frame(session, &frame.pointer));
    }
    return LC_OK;
}

// Makes room for a read. Frames that have been delivered are deleted from the front of the buffer only here,
// once per read; deleting each frame would move all the others each time.
lc_status make_read_room(gcl_session *session) {
    tbuffer *buffer = session->read_buffer;
    if (tb_avail(buffer) >= GCL_READ_ROOM)
        return LC_OK;
    CHECK_STATUS(tb_delete_bytes(buffer, 0, session->read_position));
    session->read_position = 0;
    if (tb_avail(buffer) < GCL_READ_ROOM)
        CHECK_STATUS(tb_ensure_size(buffer, tb_size(buffer) + GCL_READ_ROOM));
    return LC_OK;
}

lc_status read_activity(gcl_session *session) {
    tbuffer *buffer = session->read_buffer;
    CHECK_STATUS(make_read_room(session));
    const auto length = static_cast<uint32_t>(tb_length(buffer));
    uint32_t room = static_cast<uint32_t>(tb_avail(buffer));
    room = room < GCL_READ_MAX ? room : GCL_READ_MAX;
    int closed = 0;
    // At most `room` bytes per call: the loop calls again while there is more, and other sessions get their
    // turn.
    const int64_t got = lf_read_bytes_closed(session->fd, tb_buf(buffer) + length, room, &closed);
    LC_LOG(LC_LOG_DEBUG, "session %d: did read = %d", session->id, static_cast<int>(got));
    if (got < 0) {
        const int failure = errno;
        LC_LOG(LC_LOG_WARNING, "session %d: read returned %d: %m", session->id, static_cast<int>(got));
        if (failure != EINVAL && failure != EBADF)
            return LC_IO_ERROR;
        LOG_STATUS(gcl_session_close(session, 0));
        return LC_IO_CLOSED;
    }
    CHECK_STATUS(tb_set_length(buffer, length + static_cast<uint32_t>(got)));
    // All frames that were received before the peer closed are delivered first.
    CHECK_QUIET(deliver_frames(session));
    if (closed && session->state == GCL_SESSION_CONNECTED) {
        LC_LOG(LC_LOG_DEBUG, "session %d: detected socket close on fd %d", session->id, session->fd);
        CHECK_STATUS(gcl_session_close(session, 0));
    }
    return LC_OK;
}

lc_status write_activity(gcl_session *session) {
    LC_LOG(LC_LOG_DEBUG, "session %d: write activity", session->id);
    return gcl_run_output_queue(session);
}

lc_status timer_activity(gcl_session *session) {
    LC_LOG(LC_LOG_DEBUG, "session %d: rate limit timer fired", session->id);
    // A session that is closed before its timer fires has deleted it already.
    const int32_t timer = session->rate_timer;
    session->rate_timer = -1;
    if (timer >= 0)
        // A timer that has fired stays in the interest list until it is deleted.
        CHECK_STATUS(fdic_event_delete_timer(session->instance->interests, timer));
    return gcl_run_output_queue(session);
}

} // namespace

// Called by the loop that drives the session. Another thread may have closed the session in the meantime, and
// its descriptor may have been reused since. Only the session's state, under its lock, is relevant, not the
// descriptor that the loop passes.
lc_status gcl_session_fd_read_write_timeout_activity(int, uint32_t kind, void *data, void *) {
    CHECK_NULL(data);
    auto *session = static_cast<gcl_session *>(data);
    const gcl_session_guard guard(session);
    LC_LOG(LC_LOG_DEBUG, "session %d: socket activity", session->id);
    if (session->state != GCL_SESSION_CONNECTED)
        return LC_OK;
    lc_status status = LC_OK;
    if (kind == FDIC_WRITABLE)
        status = write_activity(session);
    else if (kind == FDIC_TIMER_EXPIRED)
        status = timer_activity(session);
    else if (kind == FDIC_READABLE) {
        LC_LOG(LC_LOG_DEBUG, "session %d: read activity", session->id);
        status = read_activity(session);
    }
    if (status == LC_OK)
        return LC_OK;
    // The function that failed may have closed the session already.
    if (session->state != GCL_SESSION_CLOSED) {
        LC_LOG(LC_LOG_WARNING, "session %d: closing after error condition", session->id);
        LOG_STATUS(gcl_session_close(session, 0));
    }
    return status == LC_IO_CLOSED ? LC_OK : status;
}
