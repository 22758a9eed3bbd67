#include "peers/tunneld/protection.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>

#include "peers/tunneld/passing.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {

constexpr size_t FILE_MAX = 4 << 20; // bytes

int64_t now_s() {
    return lt_monotonic_ms() / 1000;
}

// Replaces the file in one step: a reader finds either the old file or the new one.
void write_kept_file(const char *path, const std::string &text) {
    const std::string fresh = std::string(path) + ".new";
    (void)mkdir("/run/tunneld", 0755);
    std::ofstream file(fresh, std::ios::trunc);
    file << text;
    file.close();
    // After close(), the state of the stream covers all earlier failures.
    if (!file || rename(fresh.c_str(), path) != 0)
        LC_LOG(LC_LOG_WARNING, "%s: %s", path, strerror(errno));
}

std::string read_kept_file(const char *path) {
    // The rest of a longer file is ignored, and the line that is cut is left out like a damaged one.
    std::ifstream file(path);
    std::string text(FILE_MAX, '\0');
    file.read(text.data(), static_cast<std::streamsize>(text.size()));
    text.resize(static_cast<size_t>(file.gcount()));
    return text;
}

} // namespace

owners_table load_owners() {
    return read_owners_file(read_kept_file(OWNERS_FILE), now_s());
}

passing_table load_passing() {
    return read_passing_file(read_kept_file(PASSING_FILE));
}

void save_passing(const passing_table &table) {
    write_kept_file(PASSING_FILE, passing_file_text(table));
}

bool take_owners(owners_table *owners, uint8_t group, const std::string &text, uint32_t protection_s) {
    owners_report report;
    if (text.empty()) // wccpd does not know the owners yet
        return false;
    if (!parse_owners(text, &report)) {
        LC_LOG(LC_LOG_WARNING, "Group %d: the owners of its slots cannot be read", group);
        return false;
    }
    if (!note_owners(owners, group, report, now_s(), protection_s))
        return false;
    write_kept_file(OWNERS_FILE, owners_file_text(*owners));
    return true;
}

void keep_owners_of(owners_table *owners, const std::map<uint8_t, group_view> &groups) {
    if (std::erase_if(*owners, [&](const auto &each) { return !groups.contains(each.first); }) > 0)
        write_kept_file(OWNERS_FILE, owners_file_text(*owners));
}

std::map<uint8_t, group_protection> find_protections(const owners_table &owners,
                                                     const std::map<uint8_t, group_view> &groups,
                                                     uint32_t protection_s) {
    std::map<uint8_t, group_protection> out;
    if (protection_s == 0)
        return out;
    for (const auto &[number, group] : owners) {
        const auto view = groups.find(number);
        if (view == groups.end() || view->second.local == 0)
            continue;
        group_protection &made = out[number];
        made.by_mask = group.by_mask;
        made.mask = group.mask;
        // wccpd's list of members includes this appliance.
        for (const uint32_t member : group.members)
            if (member != view->second.local)
                made.members.push_back(member);
        made.targets = slot_targets(group, view->second.local, now_s(), protection_s);
    }
    return out;
}

std::map<uint8_t, group_cover> find_covers(const appliance_view &view, bool user_space, bool enabled,
                                           bool has_redirect_headers) {
    std::map<uint8_t, group_cover> out;
    for (const auto &[number, group] : view.groups) {
        const auto protection = view.protections.find(number);
        const bool by_l2 = std::any_of(group.routers.begin(), group.routers.end(),
                                       [](const auto &router) { return router.forward == travel::l2; });
        if (!view.intercepts.contains(number) && protection == view.protections.end())
            continue;
        group_cover &cover = out[number];
        // Only the most general reason is shown.
        if (!enabled)
            cover.reason = "switched off";
        else if (protection == view.protections.end() || protection->second.targets.empty())
            cover.reason = "the owners of its table are not known";
        else if (!protection->second.by_mask && by_l2)
            cover.reason = "hash assignment over L2: packets carry no bucket";
        else if (!protection->second.by_mask && !user_space)
            cover.reason = "hash assignment: the kernel plane does not see the bucket";
        else if (!protection->second.by_mask && !has_redirect_headers)
            cover.reason = "hash assignment: packets carry no redirect header";
        if (cover.reason.empty())
            for (const uint32_t target : protection->second.targets)
                cover.slots += target != 0;
    }
    return out;
}
