#include "peers/tunneld/slot_owners.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <sstream>

#include "peers/tunneld/link_names.h"
#include "peers/tunneld/session_config.h"

// --- The text of wccpd

namespace {

bool parse_hexadecimal(const std::string &word, uint64_t max, uint32_t *out) {
    if (word.empty() || word.size() > 8 || word.find_first_not_of("0123456789abcdef") != std::string::npos)
        return false;
    // Eight digits cannot overflow.
    const unsigned long value = std::stoul(word, nullptr, 16);
    *out = static_cast<uint32_t>(value);
    return value <= max;
}

bool parse_count(const std::string &word, size_t min, size_t max, size_t *out) {
    if (word.empty() || word.size() > 3 || word.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = std::stoul(word);
    return *out >= min && *out <= max;
}

bool take_mask(std::istringstream *words, slot_mask *out) {
    uint32_t src_port = 0, dst_port = 0;
    const std::pair<uint32_t *, uint64_t> fields[] = {{&out->src_ip, UINT32_MAX},
                                                      {&out->dst_ip, UINT32_MAX},
                                                      {&src_port, UINT16_MAX},
                                                      {&dst_port, UINT16_MAX}};
    std::string word;
    for (const auto &[field, max] : fields)
        if (!(*words >> word) || !parse_hexadecimal(word, max, field))
            return false;
    out->src_port = static_cast<uint16_t>(src_port);
    out->dst_port = static_cast<uint16_t>(dst_port);
    return slot_mask_bits(*out) <= 7;
}

bool take_owner_run(const std::string &word, std::vector<uint32_t> *out) {
    const size_t star = word.find('*');
    uint32_t owner = 0;
    size_t count = 0;
    if (star == std::string::npos || !parse_address(word.substr(0, star), &owner) ||
        !parse_count(word.substr(star + 1), 1, SLOTS_MAX - out->size(), &count))
        return false;
    out->insert(out->end(), count, owner);
    return true;
}

} // namespace

uint32_t slot_mask_bits(const slot_mask &mask) {
    return static_cast<uint32_t>(std::popcount(mask.src_ip) + std::popcount(mask.dst_ip) +
                                 std::popcount(mask.src_port) + std::popcount(mask.dst_port));
}

slot_mask slot_value(const slot_mask &mask, uint32_t slot) {
    const auto spread = [&slot](uint32_t bits) {
        uint32_t value = 0;
        // Each bit of the mask, from the lowest on, takes the next bit of the slot's number.
        for (; bits; bits &= bits - 1, slot >>= 1)
            value |= slot & 1 ? bits & (~bits + 1) : 0;
        return value;
    };
    slot_mask value;
    // The order of the calls matters: each leaves the rest of the number to the next one.
    value.dst_port = static_cast<uint16_t>(spread(mask.dst_port));
    value.src_port = static_cast<uint16_t>(spread(mask.src_port));
    value.dst_ip = spread(mask.dst_ip);
    value.src_ip = spread(mask.src_ip);
    return value;
}

bool parse_owners(const std::string &text, owners_report *out) {
    *out = {};
    std::istringstream words(text.substr(0, OWNERS_TEXT_MAX));
    std::string word;
    words >> word;
    out->by_mask = word == "mask";
    if ((word != "hash" && !out->by_mask) || (out->by_mask && !take_mask(&words, &out->mask)) ||
        !(words >> word) || word != "members")
        return false;
    bool in_owners = false;
    while (words >> word) {
        uint32_t member = 0;
        if (word == "owners" && !in_owners) {
            in_owners = true;
            continue;
        }
        if (in_owners ? !take_owner_run(word, &out->owners)
                      : out->members.size() == GROUP_MEMBERS_MAX || !parse_address(word, &member) || !member)
            return false;
        if (!in_owners)
            out->members.push_back(member);
    }
    std::sort(out->members.begin(), out->members.end());
    const size_t slots = out->by_mask ? size_t{1} << slot_mask_bits(out->mask) : SLOTS_MAX;
    // Without "owners" in the text they are unknown. With it, none may be missing.
    return !in_owners || out->owners.size() == slots;
}

// --- The history

namespace {

void replace_owner(slot_history *slot, uint32_t owner, int64_t now_s) {
    if (owner == 0 || owner == slot->owner) // 0: the flows are still with the appliance that had the slot
        return;
    // An owner in the first report counts as having always been the owner: nothing is known about the time
    // before.
    if (slot->owner != 0 && slot->since_s < now_s)
        slot->former.insert(slot->former.begin(), {slot->owner, slot->since_s, now_s});
    slot->since_s = slot->owner == 0 ? 0 : now_s;
    slot->owner = owner;
}

} // namespace

bool note_owners(owners_table *table, uint8_t group, const owners_report &report, int64_t now_s,
                 int64_t keep_s) {
    if (report.members.empty()) // wccpd has just been started
        return false;
    const auto found = table->find(group);
    group_owners next = found == table->end() ? group_owners{} : found->second;
    // Slots of another kind or mask have nothing in common with the old ones.
    if (next.by_mask != report.by_mask || !(next.mask == report.mask))
        next = {report.by_mask, report.mask, {}, {}};
    next.members = report.members;
    if (!report.owners.empty())
        next.slots.resize(report.owners.size());
    for (size_t i = 0; i < report.owners.size(); i++)
        replace_owner(&next.slots[i], report.owners[i], now_s);
    for (slot_history &slot : next.slots) {
        std::erase_if(slot.former, [&](const former_owner &one) { return now_s - one.until_s > keep_s; });
        // The oldest ones are at the end.
        if (slot.former.size() > FORMER_OWNERS_MAX)
            slot.former.resize(FORMER_OWNERS_MAX);
    }
    if (found != table->end() && found->second == next)
        return false;
    (*table)[group] = std::move(next);
    return true;
}

std::vector<uint32_t> slot_targets(const group_owners &group, uint32_t self, int64_t now_s,
                                   int64_t protection_s) {
    std::vector<uint32_t> targets;
    const auto is_other = [&](uint32_t owner) {
        return owner != self && std::binary_search(group.members.begin(), group.members.end(), owner);
    };
    for (const slot_history &slot : group.slots) {
        targets.push_back(0);
        // Such packets arrive only while a router still uses another table.
        if (is_other(slot.owner)) {
            targets.back() = slot.owner;
            continue;
        }
        const auto left = [&](int64_t time_s) { // share of the flows that began at this time
            return std::exp(-static_cast<double>(now_s - time_s) / static_cast<double>(protection_s));
        };
        std::map<uint32_t, double> flows;
        // The flows that began while it was the owner and still last: an integral, up to a factor that all
        // share.
        for (const former_owner &one : slot.former)
            if (is_other(one.owner) && now_s - one.until_s < protection_s)
                flows[one.owner] += left(one.until_s) - left(one.from_s);
        double most = 0;
        for (const auto &[owner, share] : flows)
            if (share > most) {
                most = share;
                targets.back() = owner;
            }
    }
    return targets;
}

// --- The file
//
// A line for each group: its number, the kind, mask and members as in wccpd's text, "slots", and for each run
// of slots with the same history COUNT*OWNER,SINCE;FORMER,FROM,UNTIL;...

namespace {

std::string history_text(const slot_history &slot) {
    std::string text = address_text(slot.owner) + "," + std::to_string(slot.since_s);
    for (const former_owner &one : slot.former)
        text += ";" + address_text(one.owner) + "," + std::to_string(one.from_s) + "," +
                std::to_string(one.until_s);
    return text;
}

bool take_time(std::istringstream *from, int64_t now_s, int64_t *out) {
    std::string word;
    if (!std::getline(*from, word, ',') || word.empty() || word.size() > 12 ||
        word.find_first_not_of("0123456789") != std::string::npos)
        return false;
    // At most 12 digits, which std::stoll() can always read.
    *out = std::min<int64_t>(std::stoll(word), now_s);
    return true;
}

bool take_history(const std::string &text, int64_t now_s, slot_history *out) {
    std::istringstream parts(text);
    std::string part, owner;
    for (bool first = true; std::getline(parts, part, ';'); first = false) {
        std::istringstream words(part);
        former_owner one{};
        if (!std::getline(words, owner, ',') || !parse_address(owner, &one.owner) ||
            !take_time(&words, now_s, &one.from_s) || (!first && !take_time(&words, now_s, &one.until_s)) ||
            out->former.size() == FORMER_OWNERS_MAX)
            return false;
        // The present owner comes first and has no end time.
        if (first) {
            out->owner = one.owner;
            out->since_s = one.from_s;
        } else if (one.from_s <= one.until_s) {
            out->former.push_back(one);
        }
    }
    return true;
}

bool take_owners_line(const std::string &line, int64_t now_s, uint8_t *out_number, group_owners *out) {
    // Between the number and "slots", the line has the form of wccpd's text without owners.
    const size_t blank = line.find(' '), slots = line.find(" slots");
    size_t number = 0;
    owners_report head;
    if (blank == std::string::npos || slots == std::string::npos || slots < blank ||
        !parse_count(line.substr(0, blank), 0, 255, &number) ||
        !parse_owners(line.substr(blank + 1, slots - blank - 1), &head))
        return false;
    *out_number = static_cast<uint8_t>(number);
    *out = {head.by_mask, head.mask, head.members, {}};
    std::istringstream words(line.substr(slots + 6));
    for (std::string word; words >> word;) {
        const size_t star = word.find('*');
        size_t count = 0;
        slot_history slot;
        if (star == std::string::npos ||
            !parse_count(word.substr(0, star), 1, SLOTS_MAX - out->slots.size(), &count) ||
            !take_history(word.substr(star + 1), now_s, &slot))
            return false;
        out->slots.insert(out->slots.end(), count, slot);
    }
    const size_t wanted = out->by_mask ? size_t{1} << slot_mask_bits(out->mask) : SLOTS_MAX;
    return out->slots.empty() || out->slots.size() == wanted;
}

} // namespace

std::string owners_file_text(const owners_table &table) {
    std::ostringstream text;
    for (const auto &[number, group] : table) {
        text << unsigned{number};
        if (group.by_mask)
            text << " mask " << std::hex << group.mask.src_ip << " " << group.mask.dst_ip << " "
                 << group.mask.src_port << " " << group.mask.dst_port << std::dec;
        else
            text << " hash";
        text << " members";
        for (const uint32_t member : group.members)
            text << " " << address_text(member);
        text << " slots";
        for (size_t first = 0, next; first < group.slots.size(); first = next) {
            for (next = first + 1; next < group.slots.size() && group.slots[next] == group.slots[first];)
                next++;
            text << " " << next - first << "*" << history_text(group.slots[first]);
        }
        text << "\n";
    }
    return text.str();
}

owners_table read_owners_file(const std::string &text, int64_t now_s) {
    owners_table table;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        uint8_t number = 0;
        group_owners group;
        if (take_owners_line(line, now_s, &number, &group))
            table[number] = std::move(group);
    }
    return table;
}
