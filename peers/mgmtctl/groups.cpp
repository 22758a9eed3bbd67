// Groups and policy groups are changed in the words of an operator. Each command is one commit.
//
// When a running group cannot follow a change, mgmtd has wccpd delete the group and create it again, within
// the same commit. "restart" causes the same by a commit that deletes the group and creates it as it was set.
// Values that equal their default are left out then, because the configuration file holds no defaults.
//
// After a change, wccpd's list of groups is read until it agrees, for a few seconds at most. The list is read
// and not the group, because a query for a group that wccpd does not have is an error in wccpd's log.
#include "peers/mgmtctl/groups.h"

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <optional>
#include <thread>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/nodes.h"
#include "runtime/common.h"

namespace {
group_result with_failure(group_result result, int exit, const std::string &error, uint32_t code = 0) {
    result.exit = exit;
    result.error = error;
    result.code = code;
    return result;
}
bool parse_number(const std::string &text, long *out) {
    if (text.empty() || text.size() > 6 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = std::stol(text);
    return true;
}

// --- Existing groups

std::string numbered_root(const char *above, long number) {
    return std::string(above) + "/" + std::to_string(number);
}

// False: there was no answer, or a refusal; `inout` holds it.
bool ask_mgmtd(const ctl_link &link, ctl_walk walk, const std::string &name, ctl_reply *out,
               group_result *inout) {
    std::string reason;
    if (!link.query(walk, name, out, &reason))
        *inout = with_failure(*inout, CTL_UNREACHABLE, reason);
    else if (out->code != 0)
        *inout = with_failure(*inout, CTL_REFUSED, out->message, out->code);
    return inout->exit == CTL_OK;
}

bool find_root(const ctl_link &link, const std::string &root, group_result *inout, bool *out_stands) {
    ctl_reply reply;
    if (!ask_mgmtd(link, ctl_walk::node, root, &reply, inout))
        return false;
    *out_stands = !reply.bindings.empty();
    return true;
}

// Reads the nodes of a group that were set, without those that have their default.
bool read_group(const ctl_link &link, const std::string &root, group_nodes *out, group_result *inout) {
    ctl_reply reply;
    if (!ask_mgmtd(link, ctl_walk::subtree, root, &reply, inout))
        return false;
    for (const ctl_binding &binding : reply.bindings) {
        if (!binding.name.starts_with(root + "/"))
            continue;
        const std::string name = binding.name.substr(root.size() + 1);
        const group_word *word = find_group_word(name);
        const char *fallback = word ? group_word_fallback(*word) : nullptr;
        if (!fallback || binding.value != fallback)
            (*out)[name] = binding.value;
    }
    return true;
}
} // namespace

std::vector<std::string> group_routers(const group_nodes &nodes) {
    // As text, router 10 would come before router 2.
    std::map<long, std::string> numbered;
    for (const auto &[name, value] : nodes)
        if (name.starts_with("router/") && name.ends_with("/ipaddr"))
            numbered[std::atol(name.c_str() + 7)] = value;
    std::vector<std::string> out;
    out.reserve(numbered.size());
    for (const auto &[number, address] : numbered)
        out.push_back(address);
    return out;
}

namespace {
void store_routers(const std::vector<std::string> &routers, group_nodes *inout) {
    std::erase_if(*inout, [](const auto &node) { return node.first.starts_with("router/"); });
    for (size_t i = 0; i < routers.size(); i++)
        (*inout)["router/" + std::to_string(i + 1) + "/ipaddr"] = routers[i];
}

std::vector<ctl_change_item> creation_items(const std::string &root, const group_nodes &nodes) {
    std::vector<ctl_change_item> items = {{ctl_change::create, {root, "", root.substr(root.rfind('/') + 1)}}};
    for (const auto &[name, value] : nodes)
        if (!name.starts_with("router/") ||
            name.ends_with("/ipaddr")) // the entry itself is created with its address
            items.push_back({ctl_change::create, {std::string(root).append("/").append(name), "", value}});
    return items;
}

// --- Changes

bool commit_items(const ctl_link &link, const std::vector<ctl_change_item> &items, group_result *inout) {
    ctl_reply reply;
    std::string reason;
    if (!link.set(items, &reply, &reason)) {
        *inout = with_failure(*inout, CTL_UNREACHABLE, reason);
        return false;
    }
    if (reply.code != 0) {
        *inout = with_failure(*inout, CTL_REFUSED, reply.message, reply.code);
        return false;
    }
    inout->commits++;
    return true;
}

// Waits until wccpd has the group, or no longer has it, and reads its state.
void wait_for_wccpd(const ctl_link &link, bool wanted, group_result *inout) {
    using clock = std::chrono::steady_clock;
    const auto until = clock::now() + std::chrono::milliseconds(link.settle_ms);
    const std::string root = numbered_root(NODE_GROUP_STATE, inout->number);
    std::string reason;
    ctl_reply reply;
    for (;;) {
        reply = {};
        if (!link.query(ctl_walk::children, NODE_GROUP_STATE, &reply, &reason)) {
            inout->note = reason;
            return;
        }
        if (reply.code != 0) {
            // The commit has been made; wccpd follows when it is back.
            inout->wccpd = reply.code == LC_IO_CLOSED ? "absent" : "silent";
            return;
        }
        inout->wccpd = "running";
        inout->runs = std::any_of(reply.bindings.begin(), reply.bindings.end(),
                                  [&](const ctl_binding &binding) { return binding.name == root; });
        if (inout->runs == wanted || clock::now() >= until)
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    reply = {};
    if (!inout->runs || !link.query(ctl_walk::node, root + "/oper", &reply, &reason) ||
        reply.bindings.empty())
        return;
    const std::string &oper = reply.bindings[0].value;
    inout->state = oper.substr(0, oper.find(','));
    inout->designated = oper.ends_with(", DESIGNATED");
}

// mgmtd accepts a group without these, but such a group does nothing.
std::string missing_part_note(const group_nodes &nodes) {
    if (!nodes.contains("interface"))
        return "without an interface it is inactive";
    return group_routers(nodes).empty() ? "without a router it is inactive" : "";
}

void add_group(const ctl_link &link, const std::string &root, const group_wish &wish, group_result *inout) {
    bool there = false;
    if (!find_root(link, root, inout, &there))
        return;
    if (there) {
        *inout = with_failure(*inout, CTL_REFUSED,
                              "there is a group " + std::to_string(inout->number) +
                                  "; \"mgmtctl group set\" changes it");
        return;
    }
    group_nodes nodes;
    for (const auto &[node, value] : wish.values)
        if (value)
            nodes[node] = *value;
    store_routers(wish.routers.value_or(std::vector<std::string>{}), &nodes);
    if (commit_items(link, creation_items(root, nodes), inout)) {
        inout->done = "added";
        inout->note = missing_part_note(nodes);
        wait_for_wccpd(link, true, inout);
    }
}

// The same, of a group that has to exist.
bool read_existing_group(const ctl_link &link, const std::string &root, group_nodes *out,
                         group_result *inout) {
    bool there = false;
    if (!find_root(link, root, inout, &there))
        return false;
    if (!there) {
        *inout = with_failure(*inout, CTL_NOT_FOUND, "there is no group " + std::to_string(inout->number));
        return false;
    }
    return read_group(link, root, out, inout);
}

void restart_group(const ctl_link &link, const std::string &root, group_result *inout) {
    group_nodes nodes;
    if (!read_existing_group(link, root, &nodes, inout))
        return;
    std::vector<ctl_change_item> items = creation_items(root, nodes);
    // Deletion and creation in one commit: if mgmtd refuses, the group stays as it is.
    items.insert(items.begin(), {ctl_change::remove, {root, "", ""}});
    if (!commit_items(link, items, inout))
        return;
    inout->done = "recreated";
    inout->note = missing_part_note(nodes);
    wait_for_wccpd(link, true, inout);
}

// The new list reuses the entries of the old one, from the first.
std::vector<ctl_change_item> router_changes(const std::string &root, const std::vector<std::string> &before,
                                            const std::vector<std::string> &after) {
    std::vector<ctl_change_item> items;
    for (size_t i = 0; i < std::max(before.size(), after.size()); i++) {
        // mgmtd's entries are numbered from 1 without a gap: a place in the list gives the number.
        const std::string entry = root + "/router/" + std::to_string(i + 1);
        if (i >= after.size())
            items.push_back({ctl_change::remove, {entry, "", ""}});
        else if (i >= before.size() || before[i] != after[i])
            items.push_back({ctl_change::create, {entry + "/ipaddr", "", after[i]}});
    }
    return items;
}

void change_group(const ctl_link &link, const std::string &root, const group_wish &wish,
                  group_result *inout) {
    group_nodes before;
    if (!read_existing_group(link, root, &before, inout))
        return;
    group_nodes after = before;
    std::vector<ctl_change_item> items;
    std::string as_whole, at_start;
    if (wish.routers) {
        items = router_changes(root, group_routers(before), *wish.routers);
        store_routers(*wish.routers, &after);
        as_whole = items.empty() ? "" : "router";
    }
    for (const auto &[node, value] : wish.values) {
        const group_word *word = find_group_word(node);
        const char *fallback = group_word_fallback(*word);
        // Both sides as mgmtd keeps them: the default where nothing is set, and 0x0a as 10.
        const auto otherwise = fallback ? std::optional<std::string>(fallback) : std::nullopt;
        const auto old = before.find(node);
        const auto present_value = old != before.end() ? std::optional(old->second) : otherwise;
        const std::string name = root + "/" + node;
        const auto to = value ? std::optional(kept_value(name, *value)) : otherwise;
        if (to == present_value)
            continue;
        if (value)
            after[node] = *to;
        else
            after.erase(node);
        // Back to the default by a reset, so that the file holds no default.
        items.push_back({value ? ctl_change::modify : ctl_change::reset, {name, "", value ? *to : ""}});
        if (word->change == group_change::at_start)
            at_start += std::string(at_start.empty() ? "" : ", ") + word->word;
        // Without a default a running group cannot lose the value without being recreated.
        if (word->change == group_change::as_whole || (!value && !fallback))
            as_whole += std::string(as_whole.empty() ? "" : ", ") + word->word;
    }
    if (items.empty()) {
        inout->done = "unchanged";
    } else if (!commit_items(link, items, inout)) {
        return;
    } else if (as_whole.empty()) {
        inout->done = "changed";
        if (!at_start.empty())
            inout->note = at_start_note(at_start, std::to_string(inout->number));
    } else {
        const std::string lack = missing_part_note(after);
        inout->done = "recreated";
        inout->note = "wccpd applies a change of " + as_whole + " only by recreating the group" +
                      (lack.empty() ? "" : "; " + lack);
    }
    wait_for_wccpd(link, true, inout);
}

void delete_root(const ctl_link &link, const std::string &root, group_result *inout) {
    if (commit_items(link, {{ctl_change::remove, {root, "", ""}}}, inout))
        inout->done = "deleted";
    else if (inout->code == LC_NOT_FOUND)
        *inout =
            with_failure(*inout, CTL_NOT_FOUND,
                         "there is no " + inout->kind + " " + std::to_string(inout->number), inout->code);
}

const char *const GROUP_USAGE = "group add N [WORD VALUE ...], group set N WORD VALUE ..., group restart "
                                "N, group delete N; \"group words\" lists the words";
} // namespace

group_result group_command(const ctl_link &link, const std::vector<std::string> &words) {
    group_result result;
    result.kind = "group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "set" && verb != "restart" && verb != "delete")
        return with_failure(
            result, CTL_USAGE,
            verb.empty() ? GROUP_USAGE
                         : unknown_word_text(verb, {"add", "set", "restart", "delete", "list", "words"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) || (verb == "set" && words.size() < 3))
        return with_failure(result, CTL_USAGE, GROUP_USAGE);
    group_wish wish;
    if ((verb == "delete" || verb == "restart") && words.size() > 2)
        return with_failure(result, CTL_USAGE, GROUP_USAGE);
    if (const std::string wrong = parse_group_wish(words, &wish); !wrong.empty())
        return with_failure(result, CTL_USAGE, wrong);
    const std::string root = numbered_root(NODE_GROUP_CONFIG, result.number);
    if (verb == "add") {
        add_group(link, root, wish, &result);
    } else if (verb == "set") {
        change_group(link, root, wish, &result);
    } else if (verb == "restart") {
        restart_group(link, root, &result);
    } else {
        delete_root(link, root, &result);
        if (result.exit == CTL_OK)
            wait_for_wccpd(link, false, &result);
    }
    return result;
}

group_result policy_command(const ctl_link &link, const std::vector<std::string> &words) {
    static const char *const USAGE = "policy add N [name NAME], policy delete N";
    group_result result;
    result.kind = "policy group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "delete")
        return with_failure(result, CTL_USAGE,
                            verb.empty() ? USAGE : unknown_word_text(verb, {"add", "delete", "list"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) ||
        (words.size() != 2 && (verb == "delete" || words.size() != 4)))
        return with_failure(result, CTL_USAGE, USAGE);
    if (words.size() == 4 && words[2] != "name")
        return with_failure(result, CTL_USAGE, unknown_word_text(words[2], {"name"}));
    const std::string root = numbered_root(NODE_POLICY_CONFIG, result.number);
    if (verb == "delete") {
        delete_root(link, root, &result);
        return result;
    }
    bool there = false;
    if (!find_root(link, root, &result, &there))
        return result;
    if (there)
        return with_failure(result, CTL_REFUSED, "there is a policy group " + std::to_string(result.number));
    group_nodes nodes;
    if (words.size() == 4)
        nodes["name"] = words[3];
    if (commit_items(link, creation_items(root, nodes), &result))
        result.done = "added";
    return result;
}

group_result list_groups(const ctl_link &link, const std::string &above, std::vector<listed_group> *out) {
    group_result result;
    ctl_reply reply;
    if (!ask_mgmtd(link, ctl_walk::children, above, &reply, &result))
        return result;
    for (const ctl_binding &binding : reply.bindings) {
        out->push_back({binding.name.substr(binding.name.rfind('/') + 1), {}});
        if (!read_group(link, binding.name, &out->back().nodes, &result))
            break;
    }
    return result;
}
