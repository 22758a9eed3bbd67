// The owner of each slot (hash bucket or mask value) of a group's table, and its former owners. A flow stays
// with the appliance whose proxy has accepted it, even if its slot has moved to another appliance.
//
// All functions are without side effects. Times are seconds of the monotonic clock, which stay valid for the
// next process until the machine restarts; addresses are in host order.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/view.h"

constexpr size_t SLOTS_MAX = 256, GROUP_MEMBERS_MAX = 32;
constexpr size_t FORMER_OWNERS_MAX = 4;   // of a slot; older ones are forgotten
constexpr size_t OWNERS_TEXT_MAX = 16384; // bytes of wccpd's text that are read

// The number of bits that are set. parse_owners() accepts at most 7.
uint32_t slot_mask_bits(const slot_mask &mask);
// The values of the masked fields that select the slot. The bits of the slot's number, from the lowest on,
// are those of the mask in the order destination port, source port, destination address, source address.
slot_mask slot_value(const slot_mask &mask, uint32_t slot);

// wccpd's report about a group.
struct owners_report {
    bool by_mask = false;
    slot_mask mask;
    std::vector<uint32_t> members; // ascending
    std::vector<uint32_t> owners;  // by slot, 0: nobody; empty: unknown
};
// "hash members A B owners A*128 B*128", or "mask SRC_IP DST_IP SRC_PORT DST_PORT members ...", the mask in
// hexadecimal. False for any other text, also for an empty one.
bool parse_owners(const std::string &text, owners_report *out);

struct former_owner {
    uint32_t owner;
    int64_t from_s, until_s;
    bool operator==(const former_owner &) const = default;
};
struct slot_history {
    uint32_t owner = 0; // 0: unknown
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

// Updates the table with a report. Owners that were replaced more than `keep_s` ago are forgotten, and all of
// the history when the report is of the other kind or has another mask. True when anything has changed.
bool note_owners(owners_table *table, uint8_t group, const owners_report &report, int64_t now_s,
                 int64_t keep_s);

// For each slot, the member to which packets of unknown flows are passed on, or 0. This is the owner if it is
// not `self`. Otherwise it is the former owner that is likely to have most of the remaining flows, among
// those that are still members and were replaced within `protection_s`. For the estimate, flows begin at a
// constant rate and last `protection_s` on average.
std::vector<uint32_t> slot_targets(const group_owners &group, uint32_t self, int64_t now_s,
                                   int64_t protection_s);

// Between the table and the lines of a file. Lines that cannot be read are left out; times after `now_s` are
// read as `now_s`.
std::string owners_file_text(const owners_table &table);
owners_table read_owners_file(const std::string &text, int64_t now_s);
