// Reads the counters of the sorting rules.
#include <arpa/inet.h>

#include <sstream>

#include "peers/tunneld/nft_commands.h"
#include "peers/tunneld/sorting_rules.h"
#include "peers/tunneld/sorting_text.h"

namespace {

bool read_json_address(const nlohmann::json &value, uint32_t *out) {
    const std::string text = value.is_string() ? value.get<std::string>() : "";
    in_addr address{};
    if (inet_pton(AF_INET, text.c_str(), &address) != 1)
        return false;
    *out = ntohl(address.s_addr);
    return true;
}

packet_count read_count(const nlohmann::json &counter) {
    return {counter.value("packets", uint64_t{0}), counter.value("bytes", uint64_t{0})};
}

packet_count *find_way(packet_count (&ways)[SORTED_WAYS], const std::string &word) {
    for (size_t way = 0; way < SORTED_WAYS; way++)
        if (word == sorted_words[way])
            return &ways[way];
    return nullptr;
}

// The name says which counter it is: see sorting_text.h.
void take_counter(sorting_counters *out, const std::string &name, const packet_count &count) {
    if (name == CLAMPED_COUNTER)
        out->clamped = count.packets;
    std::istringstream parts(name);
    std::string kind, of, what;
    if (!std::getline(parts, kind, '/') || !std::getline(parts, of, '/') || !std::getline(parts, what, '/'))
        return;
    if (kind == "interface") {
        if (packet_count *way = find_way(out->interfaces[of], what))
            *way = count;
    } else if (kind == "group") {
        // A group has no counter for `in`: it is the sum of the others.
        packet_count(&ways)[SORTED_WAYS] =
            out->groups[static_cast<uint8_t>(strtoul(of.c_str(), nullptr, 10))];
        if (packet_count *way = find_way(ways, what))
            *way = count;
        ways[SORTED_IN].packets += count.packets;
        ways[SORTED_IN].bytes += count.bytes;
    } else if (kind == "fragments") {
        tunnel_ends ends;
        if (read_json_address(of, &ends.local) && read_json_address(what, &ends.remote))
            out->fragments[ends] = count.packets;
    }
}

// Lists the elements of a set of pairs, source and destination, each with its count, or 0 if it has none.
bool list_pairs(const char *set, std::map<std::pair<uint32_t, uint32_t>, uint64_t> *out,
                std::string *out_error) {
    nlohmann::json objects;
    if (!list_nft(std::string("list set ip ") + RULES_TABLE + " " + set, &objects, out_error))
        return false;
    for (const nlohmann::json &object : objects) {
        if (!object.contains("set") || !object["set"].contains("elem"))
            continue;
        for (const nlohmann::json &element : object["set"]["elem"]) {
            // nftables lists an element with a counter as an object around the value, and others as the
            // value.
            const bool counts = element.contains("elem");
            const nlohmann::json &value = counts ? element["elem"].value("val", nlohmann::json()) : element;
            uint32_t source = 0, destination = 0;
            if (!value.is_object() || !value.contains("concat") || value["concat"].size() != 2 ||
                !read_json_address(value["concat"][0], &source) ||
                !read_json_address(value["concat"][1], &destination))
                continue;
            (*out)[{source, destination}] = counts && element["elem"].contains("counter")
                                                ? read_count(element["elem"]["counter"]).packets
                                                : 0;
        }
    }
    return true;
}

} // namespace

bool read_sorting_counters(sorting_counters *out, std::string *out_error) {
    *out = {};
    nlohmann::json objects;
    if (!list_nft("list counters ip", &objects, out_error))
        return false;
    bool found = false;
    for (const nlohmann::json &object : objects) {
        if (!object.contains("counter") || object["counter"].value("table", "") != RULES_TABLE)
            continue;
        found = true;
        take_counter(out, object["counter"].value("name", ""), read_count(object["counter"]));
    }
    if (!found)
        return true; // no table
    std::map<std::pair<uint32_t, uint32_t>, uint64_t> refused, ends;
    if (!list_pairs(REFUSED_SET, &refused, out_error) || !list_pairs(ENDS_SET, &ends, out_error))
        return false;
    for (const auto &[pair, packets] : refused)
        if (!ends.contains(pair)) // otherwise it has been accepted since
            out->refused_sources[pair.first] += packets;
    return true;
}
