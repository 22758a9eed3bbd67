// Benchmarks of bindings: looking up nodes in an array of 10,000, and writing an attribute to the wire and
// reading it. The floor of a look-up is the hash of the name, that of the attribute a copy of its bytes.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "mgmt/bnode.h"
#include "runtime/hash_table.h"

namespace {

struct configuration {
    bn_binding_array *array = nullptr;
    std::vector<std::string> names;

    explicit configuration(bool sorted) {
        (void)bn_binding_array_new(&array);
        for (int i = 0; i < 10000; i++)
            names.push_back("/qv/wccpd/wccp/srv_grp/config/" + std::to_string(i / 40) + "/field/" +
                            std::to_string(i % 40));
        // Appended out of order, but in the same order in each run.
        std::shuffle(names.begin(), names.end(), std::mt19937(1));
        for (const std::string &name : names) {
            bn_binding *binding = nullptr;
            (void)bn_binding_new_uint32(&binding, name.c_str(), bn_attrib_value, 0, 1);
            (void)bn_binding_array_append_takeover(array, &binding);
        }
        if (sorted)
            (void)bn_binding_array_sort(array);
    }
    ~configuration() { (void)bn_binding_array_free(&array); }
};

void look_up_by_name(benchmark::State &state) {
    const configuration all(state.range(0) != 0);
    size_t i = 0;
    for (auto _ : state) {
        const bn_binding *found = nullptr;
        (void)bn_binding_array_get_binding_by_name(all.array, all.names[i++ % all.names.size()].c_str(),
                                                   &found);
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(look_up_by_name)->ArgName("sorted")->Arg(0)->Arg(1);

void floor_hash_of_name(benchmark::State &state) {
    const configuration all(false);
    size_t i = 0;
    for (auto _ : state) {
        const std::string &name = all.names[i++ % all.names.size()];
        benchmark::DoNotOptimize(ht_hash_string_func(name.data(), static_cast<uint32_t>(name.size())));
    }
}
BENCHMARK(floor_hash_of_name);

void look_up_by_pattern(benchmark::State &state) {
    const configuration all(state.range(0) != 0);
    for (auto _ : state) {
        tstr_array *parts = nullptr;
        (void)bn_binding_array_get_name_part_tstr_array(all.array, "/qv/wccpd/wccp/srv_grp/config/77/field/*",
                                                        7, &parts);
        benchmark::DoNotOptimize(parts);
        (void)tstr_array_free(&parts);
    }
}
BENCHMARK(look_up_by_pattern)->ArgName("sorted")->Arg(0)->Arg(1);

void split_name(benchmark::State &state) {
    for (auto _ : state) {
        tstr_array *parts = nullptr;
        int absolute = 0;
        (void)bn_binding_name_to_parts("/qv/wccpd/wccp/srv_grp/config/51/router/1/ipaddr", &parts, &absolute);
        benchmark::DoNotOptimize(parts);
        (void)tstr_array_free(&parts);
    }
}
BENCHMARK(split_name);

void write_and_read_attribute(benchmark::State &state) {
    bn_attrib *attrib = nullptr;
    tbuffer *buffer = nullptr;
    (void)bn_attrib_new_str(&attrib, bn_attrib_value, bn_type_str, 0, "a value of some length");
    (void)tb_new(&buffer);
    for (auto _ : state) {
        bn_attrib *back = nullptr;
        (void)tb_clear(buffer);
        (void)bn_attrib_append_wire(attrib, buffer);
        (void)bn_attrib_read_wire(buffer, 0, &back, nullptr);
        benchmark::DoNotOptimize(back);
        (void)bn_attrib_free(&back);
    }
    (void)bn_attrib_free(&attrib);
    (void)tb_free(&buffer);
}
BENCHMARK(write_and_read_attribute);

void floor_copy_of_its_bytes(benchmark::State &state) {
    char from[42] = {}, to[42];
    for (auto _ : state) {
        benchmark::DoNotOptimize(from);
        memcpy(to, from, sizeof to);
        benchmark::DoNotOptimize(to);
    }
}
BENCHMARK(floor_copy_of_its_bytes);

} // namespace

BENCHMARK_MAIN();
