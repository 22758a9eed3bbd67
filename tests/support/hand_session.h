// A client session without a loop, on the same thread as its provider: the test reads the session's output
// from the provider, and deliver() passes the provider's output to it.
#pragma once

#include <thread>

#include "mgmt/gcl_records.h"
#include "tests/support/gcl_provider.h"

struct hand_session {
    gcl_provider provider;
    fdic *interests = nullptr;
    gcl *instance = nullptr;
    gcl_session *session = nullptr;

    static lc_status ignore_changes(const fdic_event_array *, void *) { return LC_OK; }
    hand_session() {
        if (fdic_init(&interests, ignore_changes, nullptr) == LC_OK)
            (void)gcl_init(&instance, nullptr, interests);
    }
    ~hand_session() {
        (void)gcl_deinit(&instance);
        (void)fdic_deinit(&interests);
    }
    // Call it after the callbacks are set: a session copies them when it is created.
    bool open() {
        if (!provider.listen_as("hand") ||
            gcl_session_client_new(instance, "hand", nullptr, 0, &session) != LC_OK ||
            gcl_session_client_connect_by_provider(session, "hand", 0) != LC_OK)
            return false;
        std::thread other([this] { (void)provider.open_session(); });
        const lc_status status = gcl_session_client_open_service_blocking(session, 2, 2, nullptr, 0, 3000);
        other.join();
        return status == LC_OK;
    }
    void read() { (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_READABLE, session, nullptr); }
    bool deliver(const wire &bytes) {
        const bool sent = provider.put(bytes);
        read();
        return sent && session->state == GCL_SESSION_CONNECTED;
    }
};
