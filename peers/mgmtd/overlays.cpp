// While an operational state lasts, wccpd is given other values of a group than the configured ones: "down"
// for the admin of a group that is out of its routers, and a part of the weight of one that is drained or
// starts slowly. The configuration file and the answers to other clients have the configured values.
#include <algorithm>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"

namespace {

const node_name &configured_groups() {
    static const node_name root = parsed_name(NODE_GROUP_CONFIG);
    return root;
}

} // namespace

group_overlay server_overlay_of(const server *self, uint8_t group) {
    group_overlay out;
    out.down = self->left.contains(group);
    if (const auto slowed = self->slowed.find(group); slowed != self->slowed.end())
        out.weight_percent = slowed->second.percent;
    if (const auto drain = self->drains.find(group); drain != self->drains.end()) {
        // A drain takes precedence over a slow start.
        out.weight_percent = 0;
        out.down = out.down || drain->second.left;
    }
    return out;
}

namespace {

// At least 1, because a weight of 0 would take the group's whole share away; 0 percent does so on purpose.
std::string take_part_of_weight(const std::string &text, uint32_t percent) {
    const uint64_t weight = std::stoull(text);
    if (percent == 0 || weight == 0)
        return "0";
    return std::to_string(std::max<uint64_t>(weight * percent / 100, 1));
}

node_value lay_over(const group_overlay &overlay, const std::string &leaf, const node_value &value) {
    if (overlay.down && leaf == "admin")
        return {value.type, "down"};
    if (overlay.weight_percent != 100 && leaf == "weight")
        return {value.type, take_part_of_weight(value.text, overlay.weight_percent)};
    return value;
}

// The overlay that applies to the node. False: it is not a direct child of a group.
bool find_overlay(const server *self, const node_name &name, group_overlay *out) {
    const size_t depth = configured_groups().parts.size();
    if (name.parts.size() != depth + 2 || !name.is_under(configured_groups()))
        return false;
    // The schema has checked the part: it is a number up to 255.
    *out = server_overlay_of(self, static_cast<uint8_t>(std::stoi(name.parts[depth])));
    return true;
}

} // namespace

node_value server_value_for_wccpd(const server *self, const node_name &name, const node_value &value) {
    group_overlay overlay;
    return find_overlay(self, name, &overlay) ? lay_over(overlay, name.parts.back(), value) : value;
}

void server_adapt_for_wccpd(const server *self, std::vector<node_change> *inout) {
    // Both values are replaced, because wccpd has the old one under the overlay as well. Changes that the
    // overlay hides are left out and take effect when it ends.
    std::erase_if(*inout, [&](node_change &change) {
        group_overlay overlay;
        if (!find_overlay(self, change.name, &overlay))
            return false;
        for (std::optional<node_value> *value : {&change.before, &change.after})
            if (*value)
                **value = lay_over(overlay, change.name.parts.back(), **value);
        return change.before == change.after;
    });
}

// The weight is sent before the admin, so that a group joins its routers again with the right weight.
void server_send_overlay(server *self, uint8_t group, const group_overlay &before) {
    const group_overlay now = server_overlay_of(self, group);
    std::vector<node_change> changes;
    for (const char *leaf : {"weight", "admin"}) {
        const node_name name = configured_groups().below(std::to_string(group)).below(leaf);
        const auto found = self->tree.nodes.find(name);
        // The group may have been deleted.
        if (found == self->tree.nodes.end())
            continue;
        const node_value was = lay_over(before, leaf, found->second), is = lay_over(now, leaf, found->second);
        if (was != is)
            changes.push_back({name, was, is});
    }
    if (!changes.empty())
        server_send_to_wccpd(self, changes);
}
