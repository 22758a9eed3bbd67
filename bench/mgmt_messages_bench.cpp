// Benchmarks of management messages, in messages and bindings per second: writing, reading, a query with its
// answer over a socket pair, and a burst of small messages. The floor of each is sending and receiving the
// same number of bytes over a socket pair, measured alternately with it; `x_floor` is the ratio to the floor.
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "mgmt/bnode_proto.h"
#include "mgmt/owners.h"
#include "tests/support/hand_session.h"

namespace {

// Processor time of this thread, including the kernel, which does not depend on the load of the machine.
using seconds = double;
seconds thread_time() {
    timespec time{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}
template <typename Step>
seconds time_of(Step step) {
    const seconds start = thread_time();
    step();
    return thread_time() - start;
}
void require_true(bool condition, const char *what) {
    if (condition)
        return;
    fprintf(stderr, "%s\n", what);
    exit(1);
}

struct socket_pair {
    int ends[2] = {-1, -1};
    std::string taken = std::string(1 << 18, '\0');
    socket_pair() { require_true(socketpair(AF_UNIX, SOCK_STREAM, 0, ends) == 0, "socketpair"); }
    ~socket_pair() {
        close(ends[0]);
        close(ends[1]);
    }
    // Sends the bytes in pieces that fit into the socket, and receives them.
    void transfer(int from, const void *bytes, size_t length) {
        const auto *at = static_cast<const char *>(bytes);
        while (length) {
            // One thread does both: a piece that doesn't fit into the socket would block it for ever.
            const size_t piece = length < 65536 ? length : 65536;
            require_true(send(ends[from], at, piece, 0) == static_cast<ssize_t>(piece), "send");
            for (size_t got = 0; got < piece;)
                got += static_cast<size_t>(recv(ends[1 - from], taken.data(), piece - got, 0));
            at += piece;
            length -= piece;
        }
    }
};

void fill_response(bn_response_msg **out, int64_t bindings) {
    require_true(bn_query_response_msg_create(out, 1, 0, nullptr) == LC_OK, "create");
    (*out)->service_id = 2;
    for (int64_t i = 0; i < bindings; i++) {
        bn_binding *binding = nullptr;
        const std::string name =
            "/qv/wccpd/wccp/srv_grp/config/" + std::to_string(i / 40) + "/field/" + std::to_string(i % 40);
        require_true(bn_binding_new_str(&binding, name.c_str(), bn_attrib_value, bn_type_str, 0, "a value") ==
                             LC_OK &&
                         bn_query_response_msg_append_binding_takeover(*out, &binding, 1000) == LC_OK,
                     "binding");
    }
}

// Measures `step` alternately with its floor: sending `sent` bytes and `back` bytes in the other direction.
template <typename Step>
void measure_with_floor(benchmark::State &state, int64_t messages, int64_t bindings, size_t sent, size_t back,
                        Step step) {
    socket_pair pair;
    const std::string bytes(sent > back ? sent : back, 'b');
    seconds own = 0, floor = 0;
    for (auto _ : state) {
        // Both in each iteration, so that they share the state of the caches and of the clock.
        const seconds mine = time_of(step);
        floor += time_of([&] {
            pair.transfer(0, bytes.data(), sent);
            pair.transfer(1, bytes.data(), back);
        });
        own += mine;
        state.SetIterationTime(mine);
    }
    const auto rate = [&](int64_t each) {
        return benchmark::Counter(static_cast<double>(each * state.iterations()),
                                  benchmark::Counter::kIsRate);
    };
    state.counters["messages"] = rate(messages);
    state.counters["bindings"] = rate(bindings);
    state.counters["x_floor"] = own / floor;
}

void write_message(benchmark::State &state) {
    owned_response msg;
    owned_tbuffer first;
    fill_response(&msg.pointer, state.range(0));
    require_true(bn_response_msg_serialize(msg.pointer, BN_FRAME_HEADER_BYTES, &first.pointer) == LC_OK,
                 "write");
    measure_with_floor(state, 1, state.range(0), first.pointer->length, 0, [&] {
        owned_tbuffer buffer;
        (void)bn_response_msg_serialize(msg.pointer, BN_FRAME_HEADER_BYTES, &buffer.pointer);
        benchmark::DoNotOptimize(buffer.pointer);
    });
}

void read_message(benchmark::State &state) {
    owned_response msg;
    owned_tbuffer bytes;
    fill_response(&msg.pointer, state.range(0));
    require_true(bn_response_msg_serialize(msg.pointer, BN_FRAME_HEADER_BYTES, &bytes.pointer) == LC_OK,
                 "write");
    measure_with_floor(state, 1, state.range(0), bytes.pointer->length, 0, [&] {
        owned_response read;
        (void)bn_response_msg_deserialize(bytes.pointer, BN_FRAME_HEADER_BYTES, &read.pointer);
        benchmark::DoNotOptimize(read.pointer);
    });
}

struct answered_session : hand_session {
    int64_t answers = 0;

    static lc_status take_answer(gcl_session *, bn_response_msg *msg, void *data) {
        owned_bindings bindings;
        CHECK_STATUS(bn_response_get_takeover(msg, nullptr, nullptr, 0, &bindings.pointer, nullptr));
        static_cast<answered_session *>(data)->answers++;
        return LC_OK;
    }
    answered_session() {
        require_true(bn_set_global_callback_query_response_msg(instance, take_answer, this) == LC_OK &&
                         open(),
                     "open");
    }
    void answer(const std::string &frames, int64_t messages) {
        answers = 0;
        int idle = 0;
        // Sends what fits and lets the session read, in turn. Gives up when nothing arrives after the last
        // byte has been sent.
        for (size_t at = 0; at < frames.size() || (answers < messages && idle < 100);) {
            const ssize_t sent =
                send(provider.client, frames.data() + at, frames.size() - at, MSG_DONTWAIT | MSG_NOSIGNAL);
            at += sent > 0 ? static_cast<size_t>(sent) : 0;
            idle += at == frames.size();
            read();
        }
        require_true(answers == messages, "an answer is missing");
    }
    static std::string frame_of(bn_response_msg *msg) {
        owned_tbuffer bytes;
        require_true(bn_response_msg_serialize(msg, 0, &bytes.pointer) == LC_OK, "write");
        return frame_bytes(
            BN_PROTO, msg->msg_type,
            std::string(reinterpret_cast<const char *>(tb_buf(bytes.pointer)), bytes.pointer->length));
    }
};

void query_and_answer(benchmark::State &state) {
    answered_session with;
    owned_response msg;
    fill_response(&msg.pointer, state.range(0));
    const std::string answer = answered_session::frame_of(msg.pointer);
    std::string question(1024, '\0');
    size_t sent = 0;
    const auto ask = [&] {
        owned_request request;
        (void)bn_query_request_msg_create(&request.pointer, 0, nullptr);
        (void)bn_query_request_msg_append_str(request.pointer, bn_query_iterate, bn_qf_subtree,
                                              "/qv/wccpd/wccp", nullptr);
        (void)bn_request_msg_send(with.session, request.pointer);
        sent = static_cast<size_t>(recv(with.provider.client, question.data(), question.size(), 0));
        with.answer(answer, 1);
    };
    // The first question, outside the measurement, gives the size of the request.
    ask();
    measure_with_floor(state, 2, state.range(0), sent, answer.size(), ask);
}

// Many small messages that arrive with one read.
void run_burst(benchmark::State &state) {
    answered_session with;
    owned_response msg;
    fill_response(&msg.pointer, 1);
    std::string frames;
    for (int64_t i = 0; i < state.range(0); i++)
        frames += answered_session::frame_of(msg.pointer);
    measure_with_floor(state, state.range(0), state.range(0), 0, frames.size(),
                       [&] { with.answer(frames, state.range(0)); });
}

#define SIZES ->ArgName("bindings")->Arg(1)->Arg(40)->Arg(1000)->UseManualTime()
BENCHMARK(write_message) SIZES;
BENCHMARK(read_message) SIZES;
BENCHMARK(query_and_answer) SIZES->Arg(10000);
BENCHMARK(run_burst)->ArgName("messages")->Arg(10)->Arg(1000)->UseManualTime();

} // namespace

BENCHMARK_MAIN();
