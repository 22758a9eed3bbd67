// Fuzzer for the frame reader of a session. The first byte of an input determines the size of the reads and
// whether the session is already open; the rest is sent through a socket.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "mgmt/gcl.h"
#include "mgmt/gcl_records.h"
#include "runtime/logging.h"
#include "runtime/tbuffer.h"

namespace {

gcl *instance;
fdic *interests;
int listener = -1;
int depth;
gcl_session *session;
constexpr const char *PROVIDER = "/tmp/gcl-socks/uds-provider-fuzz";

lc_status ignore_changes(const fdic_event_array *, void *) {
    return LC_OK;
}

// For every third frame it reads further frames before it returns, as a handler that waits does.
lc_status handle_frame(gcl_session *of, gcl_body_protocol *, tbuffer **inout_frame, void *) {
    static unsigned count;
    const uint8_t last = tb_buf(*inout_frame)[tb_length(*inout_frame) - 1];
    tb_free(inout_frame);
    if (last == 'C')
        return gcl_session_close(of, 0);
    if (last == 'F')
        return LC_BAD_TYPE;
    if (++count % 3 == 0 && depth < 8) {
        depth++;
        (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, of, nullptr);
        depth--;
    }
    return LC_OK;
}

void start_instance() {
    G_daemon_log_level = -1;
    G_log_level = -1; // formats no log lines
    mkdir(GCL_SOCKET_DIRECTORY, 0777);
    unlink(PROVIDER);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof address.sun_path, "%s", PROVIDER);
    listener = socket(AF_UNIX, SOCK_STREAM, 0);
    if (bind(listener, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0 ||
        listen(listener, 8) != 0)
        abort();
    if (fdic_init(&interests, ignore_changes, nullptr) != LC_OK ||
        gcl_init(&instance, nullptr, interests) != LC_OK)
        abort();
    gcl_body_protocol recorder{};
    recorder.protocol = 3;
    recorder.enabled = 1;
    recorder.handlers[0] = {3, 0, handle_frame, nullptr};
    if (gcl_register_body_protocol(instance, &recorder) != LC_OK)
        abort();
}

void send_greeting(int peer) {
    gcl_wire_header header{};
    memcpy(header.ident, GCL_FRAME_IDENT, sizeof header.ident);
    header.version = to_be32(GCL_FRAME_VERSION);
    header.total_length = to_be32(sizeof header + sizeof(gcl_wire_greeting));
    header.header_length = to_be16(sizeof header);
    header.proto = to_be16(GCL_PROTO_ADMIN);
    header.mtype = to_be16(GCL_ADMIN_GREETING);
    gcl_wire_greeting body{};
    body.version = to_be16(GCL_ADMIN_VERSION);
    body.uid = body.gid = to_be32(UINT32_MAX);
    (void)!send(peer, &header, sizeof header, MSG_NOSIGNAL);
    (void)!send(peer, &body, sizeof body, MSG_NOSIGNAL);
    (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, session, nullptr);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (!instance)
        start_instance();
    if (size < 1 || size > 60000)
        return 0;
    if (gcl_session_client_new(instance, "fuzz", nullptr, 0, &session) != LC_OK ||
        gcl_session_client_connect_by_provider(session, "fuzz", 0) != LC_OK)
        abort();
    const int peer = accept(listener, nullptr, nullptr);
    if (data[0] & 0x80)
        send_greeting(peer);
    const size_t step = data[0] % 4 == 0 ? size : data[0] % 128u + 1u;
    for (size_t at = 1; at < size; at += step) {
        const size_t now = size - at < step ? size - at : step;
        (void)!send(peer, data + at, now, MSG_NOSIGNAL | MSG_DONTWAIT);
        (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, session, nullptr);
    }
    close(peer);
    (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, session, nullptr);
    int32_t state = 0;
    if (gcl_session_get_state(session, &state, nullptr) != LC_OK || state != GCL_SESSION_CLOSED)
        abort(); // the end of file must have been noticed
    (void)gcl_session_free(&session);
    static unsigned runs;
    if (++runs % 1000 == 0) { // the instance keeps freed records until it is freed itself
        if (gcl_deinit(&instance) != LC_OK || fdic_deinit(&interests) != LC_OK)
            abort();
        close(listener);
    }
    return 0;
}
