// Which appliance has each slot (hash bucket or mask value) of a group's table, and which had it before. A
// flow stays with the appliance whose proxy has accepted it, while its slot may have gone to another one.
//
// Pure functions over plain data. Times are seconds of the monotonic clock, which all processes since the
// machine's start share; addresses are in host order.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/view.h"

constexpr size_t SLOTS_MAX = 256, GROUP_MEMBERS_MAX = 32;
constexpr size_t FORMER_OWNERS_MAX = 4;   // of a slot; older ones are forgotten
constexpr size_t OWNERS_TEXT_MAX = 16384; // bytes of wccpd's text that are read

// At most 7 in what wccpd says.
uint32_t slot_mask_bits(const slot_mask &mask);
// What the masked fields of a packet are for it to belong to the slot. Bits of the number are those of the
// mask, the lowest first, in the order destination port, source port, destination, source.
slot_mask slot_value(const slot_mask &mask, uint32_t slot);

// What wccpd says of a group. Without slots nobody's are known; 0 is the owner of a slot that nobody has.
struct owners_report {
    bool by_mask = false;
    slot_mask mask;
    std::vector<uint32_t> members, owners;
};
// "hash members A B owners A*128 B*128", or "mask SRC_IP DST_IP SRC_PORT DST_PORT members ...". False for any
// other text; "" is one.
bool parse_owners(const std::string &text, owners_report *out);

struct former_owner {
    uint32_t owner;
    int64_t from_s, until_s;
    bool operator==(const former_owner &) const = default;
};
struct slot_history {
    uint32_t owner = 0; // 0: not known
    int64_t since_s = 0;
    std::vector<former_owner> former; // the latest first
    bool operator==(const slot_history &) const = default;
};
struct group_owners {
    bool by_mask = false;
    slot_mask mask;
    std::vector<uint32_t> members; // ascending
    std::vector<slot_history> slots;
    bool operator==(const group_owners &) const = default;
};
using owners_table = std::map<uint8_t, group_owners>;

// Takes in what wccpd has said. Owners that were replaced more than `keep_s` ago are forgotten. A table of
// another kind, or by another mask, begins without a history. True when anything has changed.
bool note_owners(owners_table *table, uint8_t group, const owners_report &report, int64_t now_s,
                 int64_t keep_s);

// For each slot the member that packets of unknown flows are passed on to, or 0. That is the owner, where it
// is another than `self`; otherwise of the former owners that are still members, and were replaced within
// `protection_s`, the one that most flows are likely to be left with: flows are taken to last for
// `protection_s` on average, and to begin at an even rate.
std::vector<uint32_t> slot_targets(const group_owners &group, uint32_t self, int64_t now_s,
                                   int64_t protection_s);

// The table as the lines of a file, and back. What cannot be read is left out; times ahead of `now_s` are
// taken for `now_s`.
std::string owners_file_text(const owners_table &table);
owners_table read_owners_file(const std::string &text, int64_t now_s);
