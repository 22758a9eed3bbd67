// Groups and policy groups are changed in the words of an operator, each command in one commit.
//
// mgmtd has wccpd delete and create a running group that cannot follow a change, within the one commit.
// "restart" asks for that by deleting and creating the group in its commit, with what was set. A value that
// equals the default of its node is left out then: the configuration file holds no defaults.
//
// After a change, wccpd's list of groups is read until it agrees, for some seconds at most. It is the list
// and not the group, because a query for a group that wccpd doesn't have is an error line in its log.
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

static group_result failed(group_result result, int exit, const std::string &error, uint32_t code = 0) {
    result.exit = exit;
    result.error = error;
    result.code = code;
    return result;
}
static bool parse_number(const std::string &text, long *out) {
    if (text.empty() || text.size() > 6 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = std::stol(text);
    return true;
}

// --- The groups that there are

static std::string root_of(const char *above, long number) {
    return std::string(above) + "/" + std::to_string(number);
}

// False: there was no answer, or a refusal, which `inout` has.
static bool ask(const ctl_link &link, ctl_walk walk, const std::string &name, ctl_reply *out,
                group_result *inout) {
    std::string reason;
    if (!link.query(walk, name, out, &reason))
        *inout = failed(*inout, CTL_UNREACHABLE, reason);
    else if (out->code != 0)
        *inout = failed(*inout, CTL_REFUSED, out->message, out->code);
    return inout->exit == CTL_OK;
}

static bool stands(const ctl_link &link, const std::string &root, group_result *inout, bool *out_stands) {
    ctl_reply reply;
    if (!ask(link, ctl_walk::node, root, &reply, inout))
        return false;
    *out_stands = !reply.bindings.empty();
    return true;
}

// What was set of a group, except for values that are the default.
static bool read_group(const ctl_link &link, const std::string &root, group_nodes *out, group_result *inout) {
    ctl_reply reply;
    if (!ask(link, ctl_walk::subtree, root, &reply, inout))
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

std::vector<std::string> group_routers(const group_nodes &nodes) {
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

static void put_routers(const std::vector<std::string> &routers, group_nodes *inout) {
    std::erase_if(*inout, [](const auto &node) { return node.first.starts_with("router/"); });
    for (size_t i = 0; i < routers.size(); i++)
        (*inout)["router/" + std::to_string(i + 1) + "/ipaddr"] = routers[i];
}

static std::vector<ctl_change_item> creation(const std::string &root, const group_nodes &nodes) {
    std::vector<ctl_change_item> items = {{ctl_change::create, {root, "", root.substr(root.rfind('/') + 1)}}};
    for (const auto &[name, value] : nodes)
        if (!name.starts_with("router/") || name.ends_with("/ipaddr")) // an entry comes with its address
            items.push_back({ctl_change::create, {std::string(root).append("/").append(name), "", value}});
    return items;
}

// --- Changes

static bool commit(const ctl_link &link, const std::vector<ctl_change_item> &items, group_result *inout) {
    ctl_reply reply;
    std::string reason;
    if (!link.set(items, &reply, &reason)) {
        *inout = failed(*inout, CTL_UNREACHABLE, reason);
        return false;
    }
    if (reply.code != 0) {
        *inout = failed(*inout, CTL_REFUSED, reply.message, reply.code);
        return false;
    }
    inout->commits++;
    return true;
}

// Looks at what wccpd has, until it has the group or hasn't it any more.
static void settle(const ctl_link &link, bool wanted, group_result *inout) {
    using clock = std::chrono::steady_clock;
    const auto until = clock::now() + std::chrono::milliseconds(link.settle_ms);
    const std::string root = root_of(NODE_GROUP_STATE, inout->number);
    std::string reason;
    ctl_reply reply;
    for (;;) {
        reply = {};
        if (!link.query(ctl_walk::children, NODE_GROUP_STATE, &reply, &reason)) {
            inout->note = reason;
            return;
        }
        if (reply.code != 0) {
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

// What mgmtd takes, and what is of no use all the same.
static std::string what_it_lacks(const group_nodes &nodes) {
    if (!nodes.contains("interface"))
        return "without an interface it takes no part";
    return group_routers(nodes).empty() ? "without a router it takes no part" : "";
}

static void group_add(const ctl_link &link, const std::string &root, const group_wish &wish,
                      group_result *inout) {
    bool there = false;
    if (!stands(link, root, inout, &there))
        return;
    if (there) {
        *inout = failed(*inout, CTL_REFUSED,
                        "there is a group " + std::to_string(inout->number) +
                            "; \"mgmtctl group set\" changes it");
        return;
    }
    group_nodes nodes;
    for (const auto &[node, value] : wish.values)
        if (value)
            nodes[node] = *value;
    put_routers(wish.routers.value_or(std::vector<std::string>{}), &nodes);
    if (commit(link, creation(root, nodes), inout)) {
        inout->done = "added";
        inout->note = what_it_lacks(nodes);
        settle(link, true, inout);
    }
}

// Of a group that has to be there, what was set.
static bool read_standing(const ctl_link &link, const std::string &root, group_nodes *out,
                          group_result *inout) {
    bool there = false;
    if (!stands(link, root, inout, &there))
        return false;
    if (!there) {
        *inout = failed(*inout, CTL_NOT_FOUND, "there is no group " + std::to_string(inout->number));
        return false;
    }
    return read_group(link, root, out, inout);
}

static void group_restart(const ctl_link &link, const std::string &root, group_result *inout) {
    group_nodes nodes;
    if (!read_standing(link, root, &nodes, inout))
        return;
    std::vector<ctl_change_item> items = creation(root, nodes);
    items.insert(items.begin(), {ctl_change::remove, {root, "", ""}});
    if (!commit(link, items, inout))
        return;
    inout->done = "recreated";
    inout->note = what_it_lacks(nodes);
    settle(link, true, inout);
}

// The new list takes over the entries of the old one, from the first.
static std::vector<ctl_change_item> router_changes(const std::string &root,
                                                   const std::vector<std::string> &before,
                                                   const std::vector<std::string> &after) {
    std::vector<ctl_change_item> items;
    for (size_t i = 0; i < std::max(before.size(), after.size()); i++) {
        const std::string entry = root + "/router/" + std::to_string(i + 1);
        if (i >= after.size())
            items.push_back({ctl_change::remove, {entry, "", ""}});
        else if (i >= before.size() || before[i] != after[i])
            items.push_back({ctl_change::create, {entry + "/ipaddr", "", after[i]}});
    }
    return items;
}

// What a group agrees with its routers, or computes for them, once and keeps.
static const std::string taken_at_start[] = {"encap",       "assign_method", "force_l2_return", "mask_src_ip",
                                             "mask_dst_ip", "mask_src_port", "mask_dst_port"};

static void group_set(const ctl_link &link, const std::string &root, const group_wish &wish,
                      group_result *inout) {
    group_nodes before;
    if (!read_standing(link, root, &before, inout))
        return;
    group_nodes after = before;
    std::vector<ctl_change_item> items;
    std::string as_whole, at_start;
    if (wish.routers) {
        items = router_changes(root, group_routers(before), *wish.routers);
        put_routers(*wish.routers, &after);
        as_whole = items.empty() ? "" : "router";
    }
    for (const auto &[node, value] : wish.values) {
        const group_word *word = find_group_word(node);
        const char *fallback = group_word_fallback(*word);
        const auto otherwise = fallback ? std::optional<std::string>(fallback) : std::nullopt;
        const auto old = before.find(node);
        const auto stood = old != before.end() ? std::optional(old->second) : otherwise;
        const std::string name = root + "/" + node;
        const auto to = value ? std::optional(kept_value(name, *value)) : otherwise;
        if (to == stood)
            continue;
        if (value)
            after[node] = *to;
        else
            after.erase(node);
        items.push_back({value ? ctl_change::modify : ctl_change::reset, {name, "", value ? *to : ""}});
        if (std::count(std::begin(taken_at_start), std::end(taken_at_start), node) > 0)
            at_start += std::string(at_start.empty() ? "" : ", ") + word->word;
        if (word->whole || (!value && !fallback))
            as_whole += std::string(as_whole.empty() ? "" : ", ") + word->word;
    }
    if (items.empty()) {
        inout->done = "unchanged";
    } else if (!commit(link, items, inout)) {
        return;
    } else if (as_whole.empty()) {
        inout->done = "changed";
        if (!at_start.empty())
            inout->note = "a group that runs follows a change of " + at_start +
                          " when it is started again: mgmtctl group restart " + std::to_string(inout->number);
    } else {
        const std::string lack = what_it_lacks(after);
        inout->done = "recreated";
        inout->note = "wccpd takes a change of " + as_whole + " only with the group as a whole" +
                      (lack.empty() ? "" : "; " + lack);
    }
    settle(link, true, inout);
}

static void remove_root(const ctl_link &link, const std::string &root, group_result *inout) {
    if (commit(link, {{ctl_change::remove, {root, "", ""}}}, inout))
        inout->done = "deleted";
    else if (inout->code == LC_NOT_FOUND)
        *inout = failed(*inout, CTL_NOT_FOUND,
                        "there is no " + inout->kind + " " + std::to_string(inout->number), inout->code);
}

static const char *const GROUP_USAGE =
    "group add N [WORD VALUE ...], group set N WORD VALUE ..., group restart "
    "N, group delete N; \"group words\" lists the words";

group_result group_command(const ctl_link &link, const std::vector<std::string> &words) {
    group_result result;
    result.kind = "group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "set" && verb != "restart" && verb != "delete")
        return failed(result, CTL_USAGE,
                      verb.empty()
                          ? GROUP_USAGE
                          : unknown_word_text(verb, {"add", "set", "restart", "delete", "list", "words"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) || (verb == "set" && words.size() < 3))
        return failed(result, CTL_USAGE, GROUP_USAGE);
    group_wish wish;
    if ((verb == "delete" || verb == "restart") && words.size() > 2)
        return failed(result, CTL_USAGE, GROUP_USAGE);
    if (const std::string wrong = parse_group_wish(words, &wish); !wrong.empty())
        return failed(result, CTL_USAGE, wrong);
    const std::string root = root_of(NODE_GROUP_CONFIG, result.number);
    if (verb == "add") {
        group_add(link, root, wish, &result);
    } else if (verb == "set") {
        group_set(link, root, wish, &result);
    } else if (verb == "restart") {
        group_restart(link, root, &result);
    } else {
        remove_root(link, root, &result);
        if (result.exit == CTL_OK)
            settle(link, false, &result);
    }
    return result;
}

group_result policy_command(const ctl_link &link, const std::vector<std::string> &words) {
    static const char *const USAGE = "policy add N [name NAME], policy delete N";
    group_result result;
    result.kind = "policy group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "delete")
        return failed(result, CTL_USAGE,
                      verb.empty() ? USAGE : unknown_word_text(verb, {"add", "delete", "list"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) ||
        (words.size() != 2 && (verb == "delete" || words.size() != 4)))
        return failed(result, CTL_USAGE, USAGE);
    if (words.size() == 4 && words[2] != "name")
        return failed(result, CTL_USAGE, unknown_word_text(words[2], {"name"}));
    const std::string root = root_of(NODE_POLICY_CONFIG, result.number);
    if (verb == "delete") {
        remove_root(link, root, &result);
        return result;
    }
    bool there = false;
    if (!stands(link, root, &result, &there))
        return result;
    if (there)
        return failed(result, CTL_REFUSED, "there is a policy group " + std::to_string(result.number));
    group_nodes nodes;
    if (words.size() == 4)
        nodes["name"] = words[3];
    if (commit(link, creation(root, nodes), &result))
        result.done = "added";
    return result;
}

group_result list_groups(const ctl_link &link, const std::string &above, std::vector<listed_group> *out) {
    group_result result;
    ctl_reply reply;
    if (!ask(link, ctl_walk::children, above, &reply, &result))
        return result;
    for (const ctl_binding &binding : reply.bindings) {
        out->push_back({binding.name.substr(binding.name.rfind('/') + 1), {}});
        if (!read_group(link, binding.name, &out->back().nodes, &result))
            break;
    }
    return result;
}
