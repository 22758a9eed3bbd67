// Groups and policy groups in the words of an operator: each word is a row that names its configuration node,
// and each command is one commit.
//
// What wccpd follows only with the group as a whole (its routers above all) takes two commits: the group is
// deleted and created again with everything else that was set. Before that, mgmtd is asked to try the whole
// change in a commit that cannot succeed, because its last node exists nowhere: a mistyped address is told
// while the group still runs. When the second commit is refused all the same, the old group is created again;
// when nothing more can be done, the command that would bring it back is told.
//
// A value that equals the default of its node is left out of the group that is created again, so that the
// configuration file goes on holding what was set and no defaults.
//
// Behind a change, wccpd's list of groups is looked at until it agrees, for some seconds at most. The list
// and not the group: a question for a group that wccpd doesn't have is an error line in its log.
#include "peers/mgmtctl/groups.h"

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <optional>
#include <thread>

#include <termios.h>
#include <unistd.h>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtctl/edit_distance.h"
#include "peers/mgmtctl/render.h"
#include "peers/nodes/schema.h"
#include "runtime/common.h"

static constexpr size_t SECRET_MAX = 256; // more than any password has; mgmtd says what is too long
static const char *const TRIAL_END = "/mgmtctl/this/is/only/a/trial";

const std::vector<group_word> &group_words() {
    static const std::vector<group_word> words = {
        {"interface", "interface", "NAME, or none", true, false},
        {"router", "router", "ADDRESS, once for each router; together they are the new list", true, false},
        {"weight", "weight", nullptr, false, false},
        {"password", "password", "up to 8 characters; \"\" for none, - to be asked for it", false, true},
        {"policy", "policy_grp", "1 to 65535, or none", false, false},
        {"admin", "admin", nullptr, false, false},
        {"priority", "priority", nullptr, true, false},
        {"protocol", "protocol", "a name, or 1 to 255", true, false},
        {"encap", "encap", nullptr, false, false},
        {"force_l2_return", "force_l2_return", nullptr, false, false},
        {"assign", "assign_method", nullptr, false, false},
        {"detail", "assign_detail", "a text", false, true},
        {"hash_src_ip", "hash_src_ip", nullptr, false, false},
        {"hash_dst_ip", "hash_dst_ip", nullptr, false, false},
        {"hash_src_port", "hash_src_port", nullptr, false, false},
        {"hash_dst_port", "hash_dst_port", nullptr, false, false},
        {"mask_src_ip", "mask_src_ip", nullptr, false, false},
        {"mask_dst_ip", "mask_dst_ip", nullptr, false, false},
        {"mask_src_port", "mask_src_port", nullptr, false, false},
        {"mask_dst_port", "mask_dst_port", nullptr, false, false},
        {"compatibility", "compatibility", nullptr, false, false},
    };
    return words;
}

static const schema_row *row_of(const group_word &word) {
    node_name name;
    return parse_node_name(std::string(NODE_GROUP_CONFIG) + "/0/" + word.node, &name) ? find_schema_row(name)
                                                                                      : nullptr;
}

// What mgmtd has in the place of a node that isn't set; null: the node is absent then.
static const char *fallback_of(const group_word &word) {
    const schema_row *row = row_of(word);
    return row ? row->fallback : nullptr;
}

static std::string values_of(const group_word &word) {
    const schema_row *row = row_of(word);
    if (word.hint || !row)
        return word.hint ? word.hint : "";
    if (bn_type_numeric(row->type))
        return std::to_string(row->min) + " to " + std::to_string(row->max) + ", also as 0x...";
    return row->words ? row->words : "true|false";
}

namespace {
// Nodes below the group's root, with the values that they are to have; none: back to the fallback.
using group_wish = std::map<std::string, std::optional<std::string>>;
using group_nodes = std::map<std::string, std::string>; // names below the root, in the order of creation

struct wanted_group {
    group_wish values;
    std::optional<std::vector<std::string>> routers;
};
} // namespace

static group_result failed(group_result result, int exit, const std::string &error, uint32_t code = 0) {
    result.exit = exit;
    result.error = error;
    result.code = code;
    return result;
}

// --- Words

static std::string unknown_word(const std::string &word, const std::vector<std::string> &known) {
    const std::string *nearest = nullptr;
    size_t best = 4;
    for (const std::string &candidate : known) {
        const bool begins = word.size() > 1 && candidate.starts_with(word);
        const size_t away = begins ? 0 : edit_distance(word.substr(0, 32), candidate);
        if (away < best && away < candidate.size()) {
            best = away;
            nearest = &candidate;
        }
    }
    std::string text = "unknown word \"" + word + "\"";
    if (nearest)
        return text + "; did you mean \"" + *nearest + "\"?";
    text += "; known are";
    for (const std::string &candidate : known)
        text += " " + candidate;
    return text;
}

static const group_word *find_word(std::string text) {
    std::replace(text.begin(), text.end(), '-', '_');
    for (const group_word &word : group_words())
        if (text == word.word || text == word.node)
            return &word;
    return nullptr;
}

static bool parse_number(const std::string &text, long *out) {
    if (text.empty() || text.size() > 6 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = std::stol(text);
    return true;
}

// WORD VALUE [WORD VALUE ...] from the third word on. Empty, or what is wrong.
static std::string parse_wish(const std::vector<std::string> &words, wanted_group *out) {
    for (size_t i = 2; i < words.size(); i += 2) {
        const group_word *word = find_word(words[i]);
        if (!word) {
            std::vector<std::string> known;
            for (const group_word &each : group_words())
                known.emplace_back(each.word);
            return unknown_word(words[i], known);
        }
        if (i + 1 == words.size())
            return std::string("\"") + word->word + "\" needs a value: " + values_of(*word);
        const std::string &value = words[i + 1];
        const bool nothing = !word->free_text && (value == "default" || value == "none");
        if (std::string(word->node) == "router") {
            if (!out->routers)
                out->routers.emplace();
            if (std::find(out->routers->begin(), out->routers->end(), value) != out->routers->end())
                return "router " + value + " is given twice";
            if (!nothing)
                out->routers->push_back(value);
        } else if (!out->values.emplace(word->node, nothing ? std::nullopt : std::optional(value)).second) {
            return std::string("\"") + word->word + "\" is given twice";
        }
    }
    return "";
}

// --- What stands

static std::string root_of(const char *above, long number) {
    return std::string(above) + "/" + std::to_string(number);
}

// False: there was no answer, or a refusal; `inout` tells.
static bool ask(const group_link &link, ctl_walk walk, const std::string &name, ctl_reply *out,
                group_result *inout) {
    std::string reason;
    if (!link.query(walk, name, out, &reason))
        *inout = failed(*inout, CTL_UNREACHABLE, reason);
    else if (out->code != 0)
        *inout = failed(*inout, CTL_REFUSED, out->message, out->code);
    return inout->exit == CTL_OK;
}

static bool stands(const group_link &link, const std::string &root, group_result *inout, bool *out_stands) {
    ctl_reply reply;
    if (!ask(link, ctl_walk::node, root, &reply, inout))
        return false;
    *out_stands = !reply.bindings.empty();
    return true;
}

// What was set of a group, as far as it can be told: a value that is the fallback counts as not set.
static bool read_group(const group_link &link, const std::string &root, group_nodes *out,
                       group_result *inout) {
    ctl_reply reply;
    if (!ask(link, ctl_walk::subtree, root, &reply, inout))
        return false;
    for (const ctl_binding &binding : reply.bindings) {
        if (!binding.name.starts_with(root + "/"))
            continue;
        const std::string name = binding.name.substr(root.size() + 1);
        const group_word *word = find_word(name);
        const char *fallback = word ? fallback_of(*word) : nullptr;
        if (!fallback || binding.value != fallback)
            (*out)[name] = binding.value;
    }
    return true;
}

static std::vector<std::string> routers_of(const group_nodes &nodes) {
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

static std::string quoted(const std::string &text) {
    if (!text.empty() &&
        text.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789"
                               "._-+:") == std::string::npos)
        return text;
    std::string out = "'";
    for (const char c : text)
        out += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return out + "'";
}

// The command that would create it.
static std::string as_command(long number, const group_nodes &nodes) {
    std::string text = "mgmtctl group add " + std::to_string(number);
    for (const std::string &router : routers_of(nodes))
        text += " router " + router;
    for (const auto &[name, value] : nodes)
        if (const group_word *word = find_word(name); word && std::string(word->node) != "router")
            text += std::string(" ") + word->word + " " + quoted(value);
    return text;
}

// --- Changes

static bool commit(const group_link &link, const std::vector<ctl_change_item> &items, group_result *inout) {
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

// Whether mgmtd would take these, as far as it looks at one node after the other.
static bool try_out(const group_link &link, std::vector<ctl_change_item> items, group_result *inout) {
    items.push_back({ctl_change::create, {TRIAL_END, "", "0"}});
    group_result trial = *inout;
    if (commit(link, items, &trial) || (trial.exit == CTL_REFUSED && trial.error.starts_with(TRIAL_END)))
        return true;
    *inout = trial;
    return false;
}

static void recreate(const group_link &link, const std::string &root, const group_nodes &before,
                     const group_nodes &after, group_result *inout) {
    const ctl_change_item away = {ctl_change::remove, {root, "", ""}};
    std::vector<ctl_change_item> all = {away};
    const std::vector<ctl_change_item> anew = creation(root, after);
    all.insert(all.end(), anew.begin(), anew.end());
    if (!try_out(link, all, inout) || !commit(link, {away}, inout))
        return;
    if (commit(link, anew, inout)) {
        inout->done = "recreated";
        return;
    }
    const group_result refused = *inout;
    inout->exit = CTL_OK;
    if (refused.exit == CTL_REFUSED && commit(link, creation(root, before), inout)) {
        inout->done = "restored";
        *inout = failed(*inout, CTL_REFUSED, refused.error, refused.code);
        inout->note = "it was put back as it was, after a moment without";
        return;
    }
    inout->done = "deleted";
    *inout = failed(*inout, CTL_PARTLY, refused.error, refused.code);
    inout->note = "it is deleted and could not be created again; this brings it back: " +
                  as_command(inout->number, before);
}

// Looks at what wccpd has, until it has the group or hasn't it any more.
static void settle(const group_link &link, bool wanted, group_result *inout) {
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
    return routers_of(nodes).empty() ? "without a router it takes no part" : "";
}

static void group_add(const group_link &link, const std::string &root, const wanted_group &wish,
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
static bool read_standing(const group_link &link, const std::string &root, group_nodes *out,
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

// For a group that doesn't run as it stands in the configuration, since it was changed node by node.
static void group_restart(const group_link &link, const std::string &root, group_result *inout) {
    group_nodes nodes;
    if (!read_standing(link, root, &nodes, inout))
        return;
    recreate(link, root, nodes, nodes, inout);
    if (inout->done == "recreated")
        inout->note = what_it_lacks(nodes);
    if (inout->done != "deleted" && !inout->done.empty())
        settle(link, true, inout);
}

static void group_set(const group_link &link, const std::string &root, const wanted_group &wish,
                      group_result *inout) {
    group_nodes before;
    if (!read_standing(link, root, &before, inout))
        return;
    group_nodes after = before;
    std::vector<ctl_change_item> in_place;
    std::string as_whole;
    if (wish.routers && *wish.routers != routers_of(before)) {
        put_routers(*wish.routers, &after);
        as_whole = "router";
    }
    for (const auto &[node, value] : wish.values) {
        const group_word *word = find_word(node);
        const char *fallback = fallback_of(*word);
        const auto otherwise = fallback ? std::optional<std::string>(fallback) : std::nullopt;
        const auto old = before.find(node);
        const auto stood = old != before.end() ? std::optional(old->second) : otherwise;
        const auto to = value ? value : otherwise;
        if (to == stood)
            continue;
        if (value)
            after[node] = *value;
        else
            after.erase(node);
        in_place.push_back({value ? ctl_change::modify : ctl_change::reset,
                            {std::string(root).append("/").append(node), "", value.value_or("")}});
        if (word->whole || (!value && !fallback))
            as_whole += std::string(as_whole.empty() ? "" : ", ") + word->word;
    }
    if (!as_whole.empty()) {
        recreate(link, root, before, after, inout);
        const std::string lack = what_it_lacks(after);
        if (inout->done == "recreated")
            inout->note = "wccpd takes a change of " + as_whole + " only with the group as a whole" +
                          (lack.empty() ? "" : "; " + lack);
    } else if (in_place.empty()) {
        inout->done = "unchanged";
    } else if (commit(link, in_place, inout)) {
        inout->done = "changed";
    }
    if (inout->done != "deleted" && !inout->done.empty())
        settle(link, true, inout);
}

static void remove_root(const group_link &link, const std::string &root, group_result *inout) {
    if (commit(link, {{ctl_change::remove, {root, "", ""}}}, inout))
        inout->done = "deleted";
    else if (inout->code == LC_NOT_FOUND)
        *inout = failed(*inout, CTL_NOT_FOUND,
                        "there is no " + inout->kind + " " + std::to_string(inout->number), inout->code);
}

static const char *const GROUP_USAGE =
    "group add N [WORD VALUE ...], group set N WORD VALUE ..., group restart "
    "N, group delete N; \"group words\" lists the words";

group_result group_command(const group_link &link, const std::vector<std::string> &words) {
    group_result result;
    result.kind = "group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "set" && verb != "restart" && verb != "delete")
        return failed(result, CTL_USAGE,
                      verb.empty()
                          ? GROUP_USAGE
                          : unknown_word(verb, {"add", "set", "restart", "delete", "list", "words"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) || (verb == "set" && words.size() < 3))
        return failed(result, CTL_USAGE, GROUP_USAGE);
    wanted_group wish;
    if ((verb == "delete" || verb == "restart") && words.size() > 2)
        return failed(result, CTL_USAGE, GROUP_USAGE);
    if (const std::string wrong = parse_wish(words, &wish); !wrong.empty())
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

// The service groups that name a policy group.
static std::string members_of(const group_link &link, long number) {
    ctl_reply reply;
    std::string reason, out;
    if (!link.query(ctl_walk::subtree, NODE_GROUP_CONFIG, &reply, &reason))
        return "";
    const size_t above = std::string(NODE_GROUP_CONFIG).size() + 1;
    for (const ctl_binding &binding : reply.bindings)
        if (binding.name.ends_with("/policy_grp") && binding.value == std::to_string(number))
            out += " " + binding.name.substr(above, binding.name.find('/', above) - above);
    return out;
}

group_result policy_command(const group_link &link, const std::vector<std::string> &words) {
    static const char *const USAGE = "policy add N [name NAME], policy delete N";
    group_result result;
    result.kind = "policy group";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "delete")
        return failed(result, CTL_USAGE,
                      verb.empty() ? USAGE : unknown_word(verb, {"add", "delete", "list"}));
    if (words.size() < 2 || !parse_number(words[1], &result.number) ||
        (words.size() != 2 && (verb == "delete" || words.size() != 4)))
        return failed(result, CTL_USAGE, USAGE);
    if (words.size() == 4 && words[2] != "name")
        return failed(result, CTL_USAGE, unknown_word(words[2], {"name"}));
    const std::string root = root_of(NODE_POLICY_CONFIG, result.number);
    if (verb == "delete") {
        remove_root(link, root, &result);
        if (const std::string members = members_of(link, result.number);
            result.exit == CTL_OK && !members.empty())
            result.note = "service groups that still name it:" + members +
                          "; wccpd keeps them in policy "
                          "group 300";
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

// --- Telling it

static ctl_json as_json(const group_result &result) {
    ctl_json out = {{result.kind == "group" ? "group" : "policy",
                     result.number < 0 ? ctl_json(nullptr) : ctl_json(result.number)},
                    {"done", result.done.empty() ? "nothing" : result.done},
                    {"commits", result.commits}};
    if (!result.wccpd.empty()) {
        out["wccpd"] = result.wccpd;
        out["running"] = result.runs;
        out["state"] = result.state.empty() ? ctl_json(nullptr) : ctl_json(result.state);
        out["designated"] = result.designated;
    }
    if (!result.note.empty())
        out["note"] = result.note;
    if (result.exit == CTL_OK)
        return out;
    out["error"] = result.error;
    out["code"] = result.code;
    out["exit"] = result.exit;
    return out;
}

static std::string as_text(const group_result &result) {
    static const std::map<std::string, std::string> outcomes = {
        {"added", " added"},     {"changed", " changed"},       {"recreated", " deleted and created again"},
        {"deleted", " deleted"}, {"unchanged", " is as asked"},
    };
    std::string text = result.kind + " " + std::to_string(result.number) + outcomes.at(result.done);
    if (!result.note.empty())
        text += " (" + result.note + ")";
    if (result.wccpd == "absent")
        text += "; wccpd is not running";
    else if (result.wccpd == "silent")
        text += "; wccpd does not answer";
    else if (result.runs && result.done == "deleted")
        text += "; wccpd still has it";
    else if (result.runs)
        text += "; state " + result.state + (result.designated ? ", designated" : "");
    else if (!result.wccpd.empty() && result.done != "deleted")
        text += "; wccpd does not have it, its log tells why";
    return text;
}

static int tell(const ctl_options &options, const group_result &result) {
    if (options.json)
        put(json_line(as_json(result)));
    else if (result.exit == CTL_OK)
        put(as_text(result) + "\n");
    else
        return tell_failure(
            options, {result.exit, result.number < 0 ? "" : result.kind + " " + std::to_string(result.number),
                      result.error, result.note, result.code});
    return result.exit;
}

static int list_words(const ctl_options &options) {
    ctl_json all = ctl_json::array();
    for (const group_word &word : group_words()) {
        const char *fallback = fallback_of(word);
        if (!options.json)
            put(word.word + std::string(17 - std::string(word.word).size(), ' ') + values_of(word) +
                (fallback && *fallback ? std::string("; default ") + fallback : "") + "\n");
        all.push_back({{"word", word.word},
                       {"node", word.node},
                       {"values", values_of(word)},
                       {"default", fallback ? ctl_json(fallback) : ctl_json(nullptr)},
                       {"recreates", word.whole}});
    }
    if (options.json)
        put(json_line(all));
    return CTL_OK;
}

// Each group with what was set of it; defaults are left out.
static group_result list_roots(const ctl_options &options, const group_link &link, const char *above,
                               const char *kind) {
    group_result result;
    result.kind = kind;
    ctl_reply reply;
    ctl_json all = ctl_json::array();
    if (!ask(link, ctl_walk::children, above, &reply, &result))
        return result;
    for (const ctl_binding &binding : reply.bindings) {
        const std::string number = binding.name.substr(binding.name.rfind('/') + 1);
        group_nodes nodes;
        if (!read_group(link, binding.name, &nodes, &result))
            return result;
        std::string line = number;
        ctl_json one = {{"number", std::atol(number.c_str())}, {"routers", routers_of(nodes)}};
        for (const std::string &router : routers_of(nodes))
            line += " router " + router;
        for (const auto &[name, value] : nodes) {
            if (name.starts_with("router/"))
                continue;
            const group_word *word = find_word(name);
            const bool hidden = name == "password" && !options.secrets;
            line += std::string(" ") + (word ? word->word : name.c_str()) + " " +
                    (hidden ? "********" : quoted(value));
            one[word ? word->word : name] = hidden ? "********" : value;
        }
        if (!options.json)
            put(line + "\n");
        all.push_back(one);
    }
    if (options.json)
        put(json_line(all));
    return result;
}

static int run(const ctl_options &options, const std::vector<std::string> &words, const char *above,
               const char *kind,
               group_result (*command)(const group_link &link, const std::vector<std::string> &words)) {
    // What is wrong with the words is told without mgmtd as well.
    struct closer {
        ctl_session *session = nullptr;
        ~closer() {
            if (session)
                ctl_close(session);
        }
    } held;
    group_link link;
    const auto open = [&](std::string *out_reason) {
        if (!held.session)
            held.session = ctl_open(options.timeout_ms, out_reason);
        return held.session != nullptr;
    };
    link.query = [&](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason) {
        return open(out_reason) && ctl_query(held.session, walk, name, out, out_reason);
    };
    link.set = [&](const std::vector<ctl_change_item> &items, ctl_reply *out, std::string *out_reason) {
        return open(out_reason) && ctl_set(held.session, items, out, out_reason);
    };
    if (words.size() == 1 && words[0] == "list") {
        const group_result result = list_roots(options, link, above, kind);
        return result.exit == CTL_OK ? CTL_OK : tell(options, result);
    }
    return tell(options, command(link, words));
}

// A line of standard input, which everybody on the machine could read in a command line. A terminal is asked,
// and doesn't show it. False at the end of the input, or when a signal ends the program.
static bool read_secret(std::string *out) {
    termios before = {};
    const bool terminal = tcgetattr(STDIN_FILENO, &before) == 0;
    if (terminal) {
        termios silent = before;
        silent.c_lflag &= ~static_cast<tcflag_t>(ECHO);
        fputs("password: ", stderr);
        (void)tcsetattr(STDIN_FILENO, TCSAFLUSH, &silent);
    }
    char byte = '\0';
    ssize_t got = 0;
    out->clear();
    while (out->size() < SECRET_MAX && (got = read(STDIN_FILENO, &byte, 1)) == 1 && byte != '\n')
        *out += byte;
    if (terminal) {
        (void)tcsetattr(STDIN_FILENO, TCSAFLUSH, &before);
        fputc('\n', stderr);
    }
    return got == 1 || (got == 0 && !out->empty());
}

int ctl_group(const ctl_options &options, const std::vector<std::string> &words) {
    if (words.size() == 1 && words[0] == "words")
        return list_words(options);
    std::vector<std::string> filled = words;
    for (size_t i = 3; i < filled.size(); i += 2)
        if (filled[i - 1] == "password" && filled[i] == "-" && !read_secret(&filled[i]))
            return tell_failure(options, {CTL_USAGE, "", "there is no password on standard input", "", 0});
    return run(options, filled, NODE_GROUP_CONFIG, "group", group_command);
}

int ctl_policy(const ctl_options &options, const std::vector<std::string> &words) {
    return run(options, words, NODE_POLICY_CONFIG, "policy group", policy_command);
}
