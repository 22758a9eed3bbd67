// Only wccpd's texts say which appliance has which bucket, what the designated appliance wants and allots,
// and the state of a group's interface.
//
// The texts are rows of a label and a value. Unknown rows are skipped, and of a truncated text the part
// before the cut is used. Lines, routers, appliances and buckets are bounded by what the engine can have.
//
// The words of a table that a router reports are printed as they were stored: in a hash table the first
// bucket is in the highest byte of each word, in a mask table in its lowest bit. In the designated
// appliance's own hash table the highest word comes first, and the first bucket is the lowest bit of the last
// word.
#include <algorithm>
#include <bit>
#include <cstdio>
#include <map>
#include <string_view>

#include "peers/mgmtctl/show_texts.h"

namespace {

constexpr size_t LINES_MAX = 8192;
constexpr size_t TABLES_MAX = 32; // of different routers
constexpr size_t BUCKETS = 256;

struct dump_row {
    std::string_view label, value;
};

std::string_view trim_line(std::string_view text) {
    const size_t first = text.find_first_not_of(" \t");
    if (first == std::string_view::npos)
        return {};
    return text.substr(first, text.find_last_not_of(" \t\r") - first + 1);
}

template <typename Take>
void each_row(std::string_view text, Take take) {
    for (size_t lines = 0; !text.empty() && lines < LINES_MAX; lines++) {
        const size_t end = text.find('\n');
        const std::string_view line = text.substr(0, end);
        text = end == std::string_view::npos ? std::string_view{} : text.substr(end + 1);
        const size_t colon = line.find(" : ");
        if (colon == std::string_view::npos)
            take(dump_row{trim_line(line), {}});
        else
            take(dump_row{trim_line(line.substr(0, colon)), trim_line(line.substr(colon + 3))});
    }
}

std::string address_in(std::string_view value) {
    return clean_text(std::string(value), 15);
}

bool words_in(std::string_view value, uint32_t *out) {
    const std::string text(value.substr(0, 64));
    return sscanf(text.c_str(), "0x%8x %8x %8x %8x", &out[0], &out[1], &out[2], &out[3]) == 4;
}

struct assignment_reader {
    snapshot_group *group;
    bool routers = false; // in the part of what they report
    std::string router;
    int place = -1;
    int words_at = -1;  // where the next line of words is put, -1: nowhere
    int wanted_at = -1; // the same in the designated appliance's table: 128 for the first line, then 0
    bool mask = false;
    std::map<std::string, snapshot_table> tables; // by router
};

void put_words(assignment_reader *in, const uint32_t *words) {
    if (in->place < 0 || (in->tables.size() >= TABLES_MAX && !in->tables.contains(in->router)))
        return;
    snapshot_table *table = &in->tables[in->router];
    table->mask = in->mask;
    table->owners.resize(BUCKETS, -1);
    for (size_t i = 0; i < 128; i++) {
        // The order of bits is described at the top of this file.
        const size_t shift = in->mask ? i % 32 : (3 - i / 8 % 4) * 8 + i % 8;
        if (words[i / 32] >> shift & 1)
            table->owners[static_cast<size_t>(in->words_at) * 32 + i] = in->place;
    }
}

void put_wanted_words(assignment_reader *in, const uint32_t *words) {
    in->group->wanted.owners.resize(BUCKETS, -1);
    for (size_t i = 0; i < 128; i++)
        // Here the words come in reverse.
        if (words[3 - i / 32] >> i % 32 & 1)
            in->group->wanted.owners[static_cast<size_t>(in->wanted_at) + i] = in->place;
}

// A value of the designated appliance's mask table, and its owner. The values come in their order.
bool take_wanted_value(assignment_reader *in, const dump_row &row) {
    snapshot_table *wanted = &in->group->wanted;
    char owner[16];
    if (in->routers || wanted->owners.size() >= BUCKETS ||
        row.label != std::to_string(wanted->owners.size()) ||
        sscanf(std::string(row.value.substr(0, 80)).c_str(), "0x%*8x 0x%*8x 0x%*4x 0x%*4x %15[0-9.]",
               owner) != 1)
        return false;
    wanted->mask = true;
    wanted->owners.push_back(std::string_view(owner) == "0.0.0.0" ? -1
                                                                  : place_of_appliance(in->group, owner));
    return true;
}

void take_row(assignment_reader *in, const dump_row &row) {
    uint32_t words[4];
    if (take_wanted_value(in, row))
        return;
    // A line without a label continues the table of the lines before it.
    if (in->wanted_at >= 0 && row.label.empty() && words_in(row.value, words)) {
        put_wanted_words(in, words);
        in->wanted_at -= 128;
    } else if (in->words_at >= 0 && row.label.empty() && words_in(row.value, words)) {
        put_words(in, words);
        in->words_at = -1;
    } else if (row.label == "Received router allocation") {
        in->routers = true;
        in->wanted_at = -1;
    } else if (row.label == "Router id") {
        in->router = address_in(row.value);
    } else if (row.label == "Appliance ip") {
        in->place = place_of_appliance(in->group, address_in(row.value));
    } else if (row.label == "Hash/mask allotment" && !in->routers && in->place >= 0) {
        in->group->appliances[static_cast<size_t>(in->place)].asked_percent =
            std::clamp(atoi(std::string(row.value.substr(0, 8)).c_str()), 0, 100);
        // The line with the upper 128 buckets comes next, then that with the lower ones.
        in->wanted_at = 128;
    } else if (row.label == "Rxed hash assignment" || row.label.starts_with("Rxed value buckets")) {
        in->mask = row.label.starts_with("Rxed value");
        in->words_at = 0;
        if (words_in(row.value, words))
            put_words(in, words);
        // 256 buckets take two lines of four words, 128 mask values one.
        in->words_at = in->mask ? -1 : 4;
    }
}

bool has_owner(const snapshot_table &table) {
    return std::any_of(table.owners.begin(), table.owners.end(), [](int owner) { return owner >= 0; });
}

// A mask table has as many values as the wanted one. Where that is unknown, it ends at the last value that
// has an owner, at a power of two.
void finish_table(const snapshot_table &wanted, snapshot_table *table) {
    if (!table->mask)
        return;
    if (wanted.mask && !wanted.owners.empty()) {
        table->owners.resize(wanted.owners.size());
        return;
    }
    size_t count = table->owners.size();
    while (count > 0 && table->owners[count - 1] < 0)
        count--;
    table->owners.resize(std::bit_ceil(count));
}

} // namespace

void take_assignment_text(const std::string &text, snapshot_group *inout) {
    assignment_reader in = {.group = inout, .router = {}, .tables = {}};
    each_row(text, [&](const dump_row &row) { take_row(&in, row); });
    if (!has_owner(inout->wanted))
        inout->wanted = {};
    for (auto &reported : in.tables) {
        const std::string &router = reported.first;
        snapshot_table &table = reported.second; // named, because clang 14 can't capture structured bindings
        finish_table(inout->wanted, &table);
        if (!has_owner(table))
            continue;
        // Routers with equal tables share an entry.
        auto same = std::find_if(inout->tables.begin(), inout->tables.end(), [&](const snapshot_table &t) {
            return t.mask == table.mask && t.owners == table.owners;
        });
        if (same == inout->tables.end())
            same = inout->tables.insert(same, std::move(table));
        same->routers.push_back(router);
    }
}

void take_group_text(const std::string &text, snapshot_group *inout) {
    bool first = true;
    each_row(text, [&](const dump_row &row) {
        if (!first)
            return;
        const std::string value(row.value.substr(0, 64));
        // The configuration has precedence; wccpd's text fills in for a group that is not configured.
        if (row.label == "WCCP interfaces" && inout->interface.empty()) {
            const size_t name = value.rfind(' ');
            if (name != std::string::npos && name > 2) // "# 1 eth0"; without a name there is none
                inout->interface = clean_text(value.substr(name + 1), 15);
        } else if (row.label == "WCCP interface ipa and link") {
            inout->link = value.ends_with(" up") ? "up" : value.ends_with(" down") ? "down" : "";
            first = false;
        }
    });
}
