// A client session on an event loop, as in the daemon, with a body protocol that records frames.
#pragma once

#include <functional>
#include <vector>

#include <gtest/gtest.h>

#include "mgmt/gcl.h"
#include "runtime/event_fdintrcb.h"
#include "runtime/loop_host.h"
#include "runtime/tbuffer.h"
#include "tests/support/gcl_provider.h"

struct gcl_client {
    static constexpr uint16_t proto = 3;
    lew *wrapper = nullptr;
    fdic_libevent *bridge = nullptr;
    fdic *interests = nullptr;
    gcl *instance = nullptr;
    gcl_session *session = nullptr;
    int closes = 0;
    std::vector<wire> frames; // mtype (2 bytes) and body of each
    std::function<lc_status(const wire &)> on_frame;
    std::function<void()> on_close = [] {};

    static lc_status closed(int, uint32_t kind, void *, void *data) {
        auto *self = static_cast<gcl_client *>(data);
        EXPECT_EQ(kind, FDIC_FD_CLOSED);
        self->closes++;
        self->on_close();
        return LC_OK;
    }
    static lc_status take(gcl_session *, gcl_body_protocol *, tbuffer **inout_frame, void *data) {
        auto *self = static_cast<gcl_client *>(data);
        const wire whole(reinterpret_cast<const char *>(tb_buf(*inout_frame)),
                         static_cast<size_t>(tb_length(*inout_frame)));
        tb_free(inout_frame);
        uint16_t mtype;
        memcpy(&mtype, whole.data() + 26, sizeof mtype); // host order by now
        self->frames.push_back(be(mtype, 2) + whole.substr(32));
        return self->on_frame ? self->on_frame(self->frames.back()) : LC_OK;
    }
    void start() {
        loop_context *loop = nullptr;
        ASSERT_EQ(lew_init(&wrapper), LC_OK);
        ASSERT_EQ(lew_get_event_context(wrapper, &loop), LC_OK);
        ASSERT_EQ(fdic_libevent_init(loop, &bridge), LC_OK);
        ASSERT_EQ(fdic_init(&interests, fdic_libevent_callback, bridge), LC_OK);
        ASSERT_EQ(fdic_libevent_set_fd_close_handler(bridge, closed, this), LC_OK);
        ASSERT_EQ(gcl_init(&instance, nullptr, interests), LC_OK);
        gcl_body_protocol recorder{};
        recorder.protocol = proto;
        recorder.enabled = 1;
        recorder.handlers[0] = {proto, 0, take, this};
        ASSERT_EQ(gcl_register_body_protocol(instance, &recorder), LC_OK);
    }
    lc_status make(const char *name = "wccpd") {
        return gcl_session_client_new(instance, name, nullptr, 0, &session);
    }
    lc_status open(int64_t timeout_ms = 5000) {
        return gcl_session_client_open_service_blocking(session, 2, 2, nullptr, 0, timeout_ms);
    }
    lc_status send(uint16_t mtype, const wire &body) {
        return gcl_session_send_frame_components(session, proto, mtype, static_cast<uint32_t>(body.size()),
                                                 body.data());
    }
    int32_t state(bool of_the_opening = false) {
        int32_t state = -1, admin_state = -1;
        EXPECT_EQ(gcl_session_get_state(session, &state, &admin_state), LC_OK);
        return of_the_opening ? admin_state : state;
    }
    void finish() {
        EXPECT_EQ(gcl_deinit(&instance), LC_OK);
        session = nullptr;
        EXPECT_EQ(fdic_libevent_deinit(&bridge), LC_OK);
        EXPECT_EQ(fdic_deinit(&interests), LC_OK);
        EXPECT_EQ(lew_deinit(&wrapper), LC_OK);
    }
};
