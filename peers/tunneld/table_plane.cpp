#include "peers/tunneld/table_plane.h"

#include <map>

#include "peers/tunneld/plane.h"

uint32_t table_plane_next_index = 1;

namespace {

constexpr uint32_t NO_INDEX = 0xFFFFFFFF;

struct table_link {
    link_wish wish;
    uint32_t index;
};
std::map<std::string, table_link> links;

uint32_t take_table_index() {
    const uint32_t index = table_plane_next_index;
    // NO_INDEX itself stays: a test that sets it wants every add to fail.
    if (index != NO_INDEX && ++table_plane_next_index == NO_INDEX)
        table_plane_next_index = 1;
    return index;
}

bool succeed_always(std::string *) {
    return true;
}

bool make_table_link(const std::string &name, const link_wish &wish, uint32_t *out_index, std::string *) {
    const auto known = links.find(name);
    *out_index =
        known != links.end() && known->second.wish == wish ? known->second.index : take_table_index();
    links[name] = {wish, *out_index};
    return true;
}

bool drop_table_link(const std::string &name, std::string *) {
    links.erase(name);
    return true;
}

void read_table_counters(plane_counters *inout) {
    for (const auto &[name, link] : links)
        inout->links[name] = {};
}

} // namespace

const data_plane table_plane = {"table",         succeed_always,  succeed_always,      [] { links.clear(); },
                                make_table_link, drop_table_link, read_table_counters, nullptr};
