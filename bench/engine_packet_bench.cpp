// Benchmarks of packets: processing an I-See-You of 32 routers and 32 appliances without changes, and
// building the two messages of an appliance, at their largest. Each figure has a ratio to a floor, the least
// work that the same bytes require. Both are measured alternately, and the ratio is that of the fastest
// rounds, so that it does not depend on the load of the machine.
//
// Then the most expensive I-See-You: all of its weights have changed, and therefore the designated appliance
// computes its table 32 times, in a group with nearly a thousand appliances that only one router lists. Log
// lines go to a log daemon.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <memory>
#include <thread>

#include "engine/wccp_mgr.h"
#include "engine/wccp_pkt_load.h"
#include "engine/wccp_pkt_mgr.h"
#include "runtime/logging.h"
#include "runtime/md5.h"
#include "tests/support/log_daemon.h"
#include "tests/support/reported_group.h"
#include "tests/support/router_messages.h"

namespace {

constexpr int ROUND = 256;

template <typename Work>
double seconds_of_round(Work work) {
    const auto begin = std::chrono::steady_clock::now();
    for (int i = 0; i < ROUND; i++)
        work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

// Each iteration is a round of the work and a round of the floor. The reported time is that of one call.
template <typename Work, typename Floor>
void measure_with_floor(benchmark::State &state, Work work, Floor floor) {
    double best = 1e9, best_floor = 1e9;
    for (auto _ : state) {
        const double time = seconds_of_round(work), floor_time = seconds_of_round(floor);
        best = std::min(best, time);
        best_floor = std::min(best_floor, floor_time);
        state.SetIterationTime(time / ROUND);
    }
    state.counters["best_ns"] = best / ROUND * 1e9;
    state.counters["floor_ns"] = best_floor / ROUND * 1e9;
    state.counters["ratio"] = best / best_floor;
}

uint64_t read_once(const uint8_t *bytes, size_t count) {
    uint64_t sum = 0;
    for (size_t i = 0; i < count; i++)
        sum += bytes[i];
    return sum;
}

struct full_group {
    explicit full_group(bool digested, uint32_t assign_method) {
        wccp_service_group *group = reported.group;
        group->security_option = digested ? 1 : 0;
        if (digested)
            memcpy(group->password, "password", 8);
        for (uint32_t i = 0; i < 32; i++) {
            routers.push_back(host(201 + i));
            appliances.push_back({host(1 + i), 100});
        }
        for (const be32 router : routers)
            reported.see(router, routers, appliances);
        group->assign_method = assign_method;
    }
    reported_group reported{true};
    std::vector<be32> routers;
    reported_appliances appliances;
};

// The I-See-You of the last router, with the hash buckets of 32 appliances, 10.0.<third>.1 and so on.
std::vector<uint8_t> make_i_see_you(bool digested, uint32_t third, uint32_t weight) {
    std::vector<be32> routers;
    std::vector<hash_element> elements;
    for (uint32_t i = 0; i < 32; i++) {
        routers.push_back(host(201 + i));
        elements.push_back({host((i == 0 ? 0 : third) << 8 | (1 + i)), weight,
                            wire_bytes().zeros(i).u8(0xff).zeros(31 - i)});
    }
    return wire_message(11, {security_info(digested), service_info(51), router_identity(host(232), US, 1),
                             router_view(routers, elements, US, 1), capability_info(2, 1, 2)});
}

std::unique_ptr<wccp_pkt> make_packet(const std::vector<uint8_t> &message) {
    auto pkt = std::make_unique<wccp_pkt>();
    memcpy(pkt->data, message.data(), message.size());
    pkt->length = static_cast<uint32_t>(message.size());
    return pkt;
}

void i_see_you(benchmark::State &state, bool digested) {
    const full_group full(digested, WCCP_ASSIGN_HASH);
    const wccp_service_group *group = full.reported.group;
    const std::vector<uint8_t> message = make_i_see_you(digested, 0, 100);
    const auto pkt = make_packet(message);
    uint8_t digest[MD5_DIGEST_BYTES];
    wccp_pkt_digest(group, pkt.get(), digest);
    const auto process = [&] {
        pkt->offset = 0;
        pkt->cursor = pkt->data;
        if (digested)
            // The check of the digest zeroes it in the packet.
            memcpy(pkt->data + 16, digest, sizeof digest);
        wccp_process_received_packet(pkt.get());
    };
    // The first message settles the views.
    process();
    const uint32_t settled = group->change_number, before = group->rx_icus;
    if (digested)
        measure_with_floor(state, process, [&] {
            uint8_t out[MD5_DIGEST_BYTES];
            md5_state md5;
            md5_init(&md5);
            md5_append(&md5, message.data(), message.size());
            md5_finish(&md5, out);
            benchmark::DoNotOptimize(out);
        });
    else
        measure_with_floor(state, process,
                           [&] { benchmark::DoNotOptimize(read_once(message.data(), message.size())); });
    state.counters["bytes"] = static_cast<double>(message.size());
    // A message that is refused early would look fast.
    if (group->rx_icus == before || group->rx_icu_failures || wccp_g.rx_failures ||
        group->change_number != settled)
        state.SkipWithError("the message was not processed");
}

void build(benchmark::State &state, int (*builder)(wccp_service_group *, wccp_pkt *), uint32_t assign_method,
           bool digested) {
    const full_group full(digested, assign_method);
    wccp_service_group *group = full.reported.group;
    group->mask_dst_ip = 0x7f; // 128 values
    group->mask_bits = 7;
    wccp_tick(); // elects, and computes the table
    const auto pkt = std::make_unique<wccp_pkt>();
    int failures = 0;
    const auto write = [&] {
        // The engine clears its packet before each message, too.
        memset(pkt.get(), 0, sizeof *pkt);
        pkt->cursor = pkt->data;
        failures += builder(group, pkt.get());
    };
    const auto copy = std::make_unique<wccp_pkt>();
    if (digested)
        measure_with_floor(state, write, [&] {
            uint8_t out[MD5_DIGEST_BYTES];
            wccp_pkt_digest(group, pkt.get(), out);
            benchmark::DoNotOptimize(out);
        });
    else
        measure_with_floor(state, write, [&] {
            memset(copy.get(), 0, sizeof *copy);
            memcpy(copy.get(), pkt.get(), pkt->length);
            benchmark::DoNotOptimize(copy->data);
        });
    state.counters["bytes"] = pkt->length;
    if (failures)
        state.SkipWithError("the message was not built");
}

// Binds /dev/log and counts lines.
struct reading_log_daemon {
    explicit reading_log_daemon(int32_t level) {
        lc_log_init("wccpd", "wccpd", 0, 0x1060000, LC_LOG_INFO, 128, 1);
        lc_log_set_daemon_log_level(level);
    }
    ~reading_log_daemon() {
        // What is still logged while the group is freed doesn't count.
        lc_log_set_daemon_log_level(LC_LOG_EMERG);
        lc_log_close();
        ended = true;
        reader.join();
    }
    void read() {
        pollfd watched = {daemon.listener, POLLIN, 0};
        char line[4096];
        while (!ended)
            if (poll(&watched, 1, 10) > 0)
                // As fast as possible: a full socket would slow the engine down.
                while (recv(daemon.listener, line, sizeof line, MSG_DONTWAIT) > 0)
                    lines++;
    }
    log_daemon daemon;
    std::atomic<bool> ended = false;
    std::atomic<uint64_t> lines = 0;
    std::thread reader{[this] { read(); }};
};

void i_see_you_with_32_changed_weights(benchmark::State &state, int32_t level) {
    const reported_group reported(true);
    wccp_service_group *group = reported.group;
    std::vector<be32> routers;
    for (uint32_t i = 0; i < 32; i++)
        routers.push_back(host(201 + i));
    for (uint32_t i = 0; i < 32; i++) {
        reported_appliances appliances = {{US, 100}};
        for (uint32_t k = 1; k < 32; k++)
            // Each router lists 31 appliances of its own, 10.0.(i + 1).x.
            appliances.push_back({host((i + 1) << 8 | (k + 1)), 100});
        reported.see(routers[i], routers, appliances);
    }
    group->assign_method = WCCP_ASSIGN_HASH;
    const reading_log_daemon log(level);
    wccp_tick(); // elects
    std::vector<std::unique_ptr<wccp_pkt>> messages;
    // In turn, so that each message changes all weights.
    for (const uint32_t weight : {101u, 100u})
        messages.push_back(make_packet(make_i_see_you(false, 32, weight)));
    const uint32_t key = group->dsg_key_change;
    const uint64_t lines = log.lines;
    std::vector<double> times;
    for (auto _ : state) {
        wccp_pkt *pkt = messages[times.size() % 2].get();
        pkt->offset = 0;
        pkt->cursor = pkt->data;
        const auto begin = std::chrono::steady_clock::now();
        wccp_process_received_packet(pkt);
        times.push_back(std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count());
        state.SetIterationTime(times.back());
    }
    std::sort(times.begin(), times.end());
    const auto count = static_cast<double>(times.size());
    state.counters["bytes"] = messages[0]->length;
    state.counters["best_ms"] = times.front() * 1e3;
    state.counters["median_ms"] = times[times.size() / 2] * 1e3;
    state.counters["lines"] = static_cast<double>(log.lines - lines) / count;
    // This appliance and 32 times 31 others; a new table for each changed weight.
    if (group->rx_icu_failures || group->appliance_view_count != 993 ||
        group->dsg_key_change != key + 32 * times.size())
        state.SkipWithError("the message was not processed");
}

void set_rounds(benchmark::internal::Benchmark *each) {
    each->UseManualTime()->Iterations(300);
}
void set_messages(benchmark::internal::Benchmark *each) {
    each->UseManualTime()->Iterations(200)->Unit(benchmark::kMillisecond);
}

} // namespace

BENCHMARK_CAPTURE(i_see_you, md5_floor_md5_of_the_bytes, true)->Apply(set_rounds);
BENCHMARK_CAPTURE(i_see_you, plain_floor_reading_once, false)->Apply(set_rounds);
BENCHMARK_CAPTURE(build, here_i_am_md5_floor_md5, wccp_pkt_build_here_i_am, WCCP_ASSIGN_HASH, true)
    ->Apply(set_rounds);
BENCHMARK_CAPTURE(build, here_i_am_floor_copying, wccp_pkt_build_here_i_am, WCCP_ASSIGN_HASH, false)
    ->Apply(set_rounds);
BENCHMARK_CAPTURE(build, redirect_assign_hash_floor_copying, wccp_pkt_build_redirect_assign, WCCP_ASSIGN_HASH,
                  false)
    ->Apply(set_rounds);
BENCHMARK_CAPTURE(build, redirect_assign_mask_floor_copying, wccp_pkt_build_redirect_assign, WCCP_ASSIGN_MASK,
                  false)
    ->Apply(set_rounds);
BENCHMARK_CAPTURE(build, redirect_assign_mask_md5_floor_md5, wccp_pkt_build_redirect_assign, WCCP_ASSIGN_MASK,
                  true)
    ->Apply(set_rounds);
BENCHMARK_CAPTURE(i_see_you_with_32_changed_weights, notice, LC_LOG_NOTICE)->Apply(set_messages);
BENCHMARK_CAPTURE(i_see_you_with_32_changed_weights, info, LC_LOG_INFO)->Apply(set_messages);

BENCHMARK_MAIN();
