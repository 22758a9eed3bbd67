// Fuzzer for the frame reader of a session. The first byte of an input determines the size of the reads and
// whether the session is already open; the rest is sent through a socket.
#include "fuzz/require.h"
#include "mgmt/gcl.h"
#include "mgmt/gcl_records.h"
#include "runtime/logging.h"
#include "runtime/tbuffer.h"
#include "tests/support/gcl_provider.h"

namespace {

gcl *instance;
fdic *interests;
int depth;
gcl_session *session;

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
    REQUIRE(fdic_init(&interests, ignore_changes, nullptr) == LC_OK);
    REQUIRE(gcl_init(&instance, nullptr, interests) == LC_OK);
    gcl_body_protocol recorder{};
    recorder.protocol = 3;
    recorder.enabled = 1;
    recorder.handlers[0] = {3, 0, handle_frame, nullptr};
    REQUIRE(gcl_register_body_protocol(instance, &recorder) == LC_OK);
}

void read_session() {
    (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, session, nullptr);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static gcl_provider provider;
    if (!instance)
        start_instance();
    if (provider.listener < 0)
        REQUIRE(provider.listen_as("fuzz"));
    if (size < 1 || size > 60000)
        return 0;
    REQUIRE(gcl_session_client_new(instance, "fuzz", nullptr, 0, &session) == LC_OK);
    REQUIRE(gcl_session_client_connect_by_provider(session, "fuzz", 0) == LC_OK && provider.accept_client());
    if (data[0] & 0x80) {
        (void)provider.put(greeting_bytes(UINT32_MAX, UINT32_MAX));
        read_session();
    }
    const size_t step = data[0] % 4 == 0 ? size : data[0] % 128u + 1u;
    for (size_t at = 1; at < size; at += step) {
        const size_t now = size - at < step ? size - at : step;
        (void)!send(provider.client, data + at, now, MSG_NOSIGNAL | MSG_DONTWAIT);
        read_session();
    }
    provider.close_client();
    read_session();
    int32_t state = 0; // the end of file must have been noticed
    REQUIRE(gcl_session_get_state(session, &state, nullptr) == LC_OK && state == GCL_SESSION_CLOSED);
    (void)gcl_session_free(&session);
    static unsigned runs;
    if (++runs % 1000 == 0) // the instance keeps freed records until it is freed itself
        REQUIRE(gcl_deinit(&instance) == LC_OK && fdic_deinit(&interests) == LC_OK);
    return 0;
}
