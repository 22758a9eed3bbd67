// Benchmarks of the engine: the table of the designated appliance, a tick of all groups, and the views of an
// I-See-You without changes. Each figure has a ratio to a floor, measured in the same run: work that no
// implementation could leave out.
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <vector>

#include <benchmark/benchmark.h>

#include "engine/wccp_assignment.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_view_utils.h"
#include "engine/wccp_wire.h"
#include "runtime/logging.h"
#include "runtime/md5.h"
#include "tests/support/reported_group.h"

namespace {

// Processor time of this thread, which does not depend on the load of the machine.
double thread_seconds() {
    timespec now;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

// Seconds per call, in the best of some rounds.
template <typename Work>
double measure_best(Work work) {
    double best = 1e9;
    for (int round = 0; round < 7; round++) {
        uint64_t calls = 0;
        const double begin = thread_seconds();
        do {
            // In blocks of 16, so that reading the clock costs little.
            for (int i = 0; i < 16; i++)
                work();
            calls += 16;
        } while ((thread_seconds() - begin) < 0.01);
        best = std::min(best, (thread_seconds() - begin) / static_cast<double>(calls));
    }
    return best;
}

// Runs the benchmark's loop and reports the ratio of its time to the floor.
template <typename Work>
void run_against(benchmark::State &state, double floor, Work work) {
    G_log_level = LC_LOG_EMERG;
    const double begin = thread_seconds();
    for (auto _ : state)
        work();
    const double each = (thread_seconds() - begin) / static_cast<double>(state.iterations());
    state.counters["floor_ns"] = floor * 1e9;
    state.counters["x_floor"] = each / floor;
}

wccp_service_group *group_with_appliances(const reported_group &shared, uint32_t method) {
    wccp_service_group *group = shared.group;
    group->assign_method = method;
    // With the two below, seven bits that are not adjacent.
    group->mask_dst_ip = 0x1741;
    group->mask_src_ip = 1;
    group->mask_src_port = 1;
    group->mask_bits = 7;
    return group;
}

// 32 appliances, one of which has just left. The floor: sorting the same entries and writing a table once.
void compute_table(benchmark::State &state, uint32_t method) {
    const reported_group shared(false);
    wccp_service_group *group = group_with_appliances(shared, method);
    std::vector<wccp_view_appliance> appliances(WCCP_MAX_APPLIANCES);
    for (uint32_t i = 0; i < WCCP_MAX_APPLIANCES; i++)
        // 7 has no factor in common with 32: all hosts, out of order. All weights differ.
        appliances[i] = {nullptr, nullptr,           host(i * 7 % 32 + 1), static_cast<uint16_t>(i * 13 + 1),
                         1,       WCCP_LISTED_BY_ALL};
    const auto add = [&](uint32_t count) {
        wccp_designated_appliance_assignment_start(group);
        for (uint32_t i = 0; i < count; i++)
            wccp_designated_appliance_assignment_add(group, &appliances[i]);
    };
    add(WCCP_MAX_APPLIANCES);
    wccp_designated_appliance_assignment_finish(group);
    wccp_dsg_appliance before[WCCP_MAX_APPLIANCES];
    memcpy(before, group->dsg_appliances, sizeof before);
    const uint32_t slots = group->bucket_count;

    const double floor = measure_best([&] {
        wccp_dsg_appliance entries[WCCP_MAX_APPLIANCES];
        memcpy(entries, before, sizeof entries);
        qsort(entries, WCCP_MAX_APPLIANCES, sizeof entries[0], [](const void *a, const void *b) {
            return static_cast<int>(*static_cast<const uint32_t *>(a) - *static_cast<const uint32_t *>(b));
        });
        for (uint32_t slot = 0; slot < slots; slot++)
            group->bucket_ipa[slot] = entries[slot / 8].ipa;
        benchmark::DoNotOptimize(group->bucket_ipa);
        benchmark::ClobberMemory();
    });
    run_against(state, floor, [&] {
        // Each computation starts from the table before the departure, not from its own result.
        memcpy(group->dsg_appliances, before, sizeof before);
        group->dsg_appliance_count = WCCP_MAX_APPLIANCES;
        add(WCCP_MAX_APPLIANCES - 1);
        wccp_designated_appliance_assignment_finish(group);
        benchmark::ClobberMemory();
    });
}
void table_of_256_hash_buckets(benchmark::State &state) {
    compute_table(state, WCCP_ASSIGN_HASH);
}
void table_of_128_mask_values(benchmark::State &state) {
    compute_table(state, WCCP_ASSIGN_MASK);
}
BENCHMARK(table_of_256_hash_buckets);
BENCHMARK(table_of_128_mask_values);

// Resident memory of this process, in kB.
double resident_kb() {
    unsigned long total = 0, resident = 0;
    if (FILE *file = fopen("/proc/self/statm", "re")) {
        if (fscanf(file, "%lu %lu", &total, &resident) != 2)
            resident = 0;
        fclose(file);
    }
    return static_cast<double>(resident) * 4;
}

// 256 groups of 32 routers; each tick builds some Here-I-Am messages, without sending them, and sweeps some
// groups. The floor: reading a field of each router.
void tick_of_256_groups(benchmark::State &state) {
    std::vector<std::unique_ptr<reported_group>> groups;
    std::vector<be32> routers;
    reported_appliances appliances;
    for (uint32_t i = 0; i < 32; i++) {
        routers.push_back(host(i + 200));
        appliances.push_back({host(i + 1), 100});
    }
    // Valid in the first call only: later ones reuse memory that it has freed.
    static const double before = resident_kb();
    static double with_1_group, with_256_groups;
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id++) {
        if (id == 1 && with_1_group == 0)
            with_1_group = resident_kb() - before;
        groups.push_back(std::make_unique<reported_group>(true, static_cast<uint8_t>(id)));
        // Timers due at different seconds, as in an appliance that has run for a while.
        groups.back()->group->hia_timer.countdown = id % 10 + 1;
        groups.back()->group->monitor_timer.countdown = id % 5 + 1;
        for (const be32 router : routers)
            groups.back()->see(router, routers, appliances);
    }
    if (with_256_groups == 0)
        with_256_groups = resident_kb() - before;
    state.counters["kB_with_1_group"] = with_1_group;
    state.counters["kB_with_256_groups"] = with_256_groups;
    G_log_level = LC_LOG_EMERG;
    pass_seconds(1); // the elections
    const double floor = measure_best([] {
        for (wccp_service_group *group = wccp_g.group_list; group; group = group->next)
            for (wccp_sending_router *router = group->sending_routers; router; router = router->next)
                benchmark::DoNotOptimize(router->last_icu_time);
    });
    run_against(state, floor, [] {
        wccp_tick();
        wccp_g.seconds--; // so that the routers don't time out
    });
}
BENCHMARK(tick_of_256_groups)->Unit(benchmark::kMicrosecond);

// Router view, web-cache elements and redirect status of 32 routers and 32 appliances, all unchanged. The
// floor: the MD5 of the message.
void views_of_an_unchanged_report(benchmark::State &state) {
    const reported_group shared(false);
    wccp_service_group *group = shared.group;
    std::vector<be32> routers;
    std::vector<wccp_wire_view_element_hash> elements(WCCP_MAX_APPLIANCES);
    for (uint32_t i = 0; i < 32; i++) {
        routers.push_back(host(i + 200));
        elements[i] = {
            .head = {host(i + 1), {}, {}}, .bucket_words = {}, .weight = to_be16(100), .status = {}};
        // Eight buckets for each appliance, none twice.
        elements[i].bucket_words[i / 4] = to_be32(0xffu << (i % 4 * 8));
    }
    const wccp_view_elements bytes = {reinterpret_cast<const uint8_t *>(elements.data()),
                                      static_cast<uint32_t>(elements.size() * sizeof elements[0])};
    wccp_sending_router *router = shared.router(ROUTER_A);
    wccp_rtr_view_appliance decoded[WCCP_MAX_APPLIANCES];
    const auto take = [&] {
        wccp_assign_summary hash, mask = {};
        memset(decoded, 0, sizeof decoded);
        if (wccp_update_router_view(group, router, 32, routers.data()) ||
            wccp_process_router_view_web_cache_id_elements(group, 32, bytes, decoded, &hash) ||
            wccp_update_appliance_view(group, router, 32, decoded) ||
            wccp_update_appliance_redirect_status(group, router, &hash, &mask))
            abort();
    };
    // The first report fills the views; what is measured changes nothing.
    take();
    // Header, Security Info, Service Info and so on: an I-See-You with 32 routers and 32 appliances of 44
    // bytes.
    std::vector<uint8_t> message(8 + 24 + 28 + 20 + 24 + 32 * 4 + 32 * 44, 0x5a);
    const double floor = measure_best([&] {
        md5_state md5;
        uint8_t digest[16];
        md5_init(&md5);
        md5_append(&md5, message.data(), message.size());
        md5_finish(&md5, digest);
        benchmark::DoNotOptimize(digest);
    });
    run_against(state, floor, take);
}
BENCHMARK(views_of_an_unchanged_report);

} // namespace

BENCHMARK_MAIN();
