// Names as a person types them: their completion, their correction, and the effect of a change of the node.
//
// The schema lists the names that can exist, without mgmtd. mgmtd is queried only where a part of a name can
// be chosen freely (a group's number, a file). The upper parts therefore complete at once, and completion
// stays fast with hundreds of groups.
//
// Some changes of a running group make wccpd delete the group and create it again. The commit is made as it
// was asked for, and a note names these groups.
#include "peers/mgmtctl/nodes.h"

#include <algorithm>
#include <map>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/nearest_word.h"
#include "runtime/common.h"

namespace {
// The root of the service group that a configuration node belongs to, "" for others.
std::string group_of(const std::string &text) {
    static const node_name groups = parsed_name(NODE_GROUP_CONFIG);
    node_name name = parsed_name(text);
    if (!name.is_under(groups))
        return "";
    name.parts.resize(groups.parts.size() + 1);
    return name.text();
}

std::string instance_number(const std::string &root) {
    return root.substr(root.rfind('/') + 1);
}

// --- Names that can exist

const std::vector<node_name> &known_patterns() {
    static const std::vector<node_name> all = [] {
        std::vector<node_name> made;
        made.reserve(schema_rows().size() + wccpd_state_nodes().size() + tunneld_state_nodes().size());
        for (const schema_row &row : schema_rows())
            made.push_back(row.parts);
        for (const auto *states : {&wccpd_state_nodes(), &tunneld_state_nodes()})
            for (const char *pattern : *states)
                made.push_back(parsed_name(pattern));
        for (const char *pattern :
             {NODE_ALARMS_RAISED "/*/*/name", NODE_ALARMS_RAISED "/*/*/since",
              NODE_ALARMS_RAISED "/*/*/reporter", NODE_ROLES "/*/code", NODE_ROLES "/*/since",
              NODE_LEFT_GROUPS "/*", NODE_CONFIG_TEXT, NODE_COMMITS "/*/text", NODE_PROCESSES "/*"})
            made.push_back(parsed_name(pattern));
        return made;
    }();
    return all;
}

// The parts that can follow a name: fixed ones of the schema and of the states, and existing ones where the
// next part can be chosen freely. Sorted.
std::vector<std::string> names_below(const ctl_ask &ask, const node_name &above) {
    std::set<std::string> found;
    const size_t depth = above.parts.size();
    bool choice = false;
    for (node_name pattern : known_patterns()) {
        if (pattern.parts.size() <= depth)
            continue;
        // Cut to the depth of `above`, the pattern shows whether a longer name can begin with `above`.
        const std::string next = pattern.parts[depth];
        pattern.parts.resize(depth);
        if (!matches_pattern(pattern, above))
            continue;
        if (next == "*")
            choice = true;
        else
            found.insert(next);
    }
    // Only the children where these are nodes, otherwise everything below.
    for (const ctl_walk walk : {ctl_walk::children, ctl_walk::subtree}) {
        ctl_reply reply;
        if (!choice || !ask(walk, above.text(), &reply))
            break;
        for (const ctl_binding &binding : reply.bindings)
            if (const node_name name = parsed_name(binding.name); name.is_under(above)) {
                found.insert(name.parts[depth]);
                choice = false;
            }
    }
    std::vector<std::string> out(found.begin(), found.end());
    std::sort(out.begin(), out.end(), [](const std::string &a, const std::string &b) {
        return node_name{{a}} < node_name{{b}}; // numbers as numbers
    });
    return out;
}
} // namespace

// --- Names that were meant

std::string hint_for_missing(const ctl_ask &ask, const std::string &text) {
    if (text == "/")
        return "\"mgmtctl walk /\" lists what there is";
    node_name name;
    if (!parse_node_name(text, &name))
        return text.starts_with('/') ? "a name has no empty part" : "a name begins with \"/\"";
    // A wrong group number comes first: the rest of such a name is usually right.
    if (const std::string group = group_of(text); !group.empty()) {
        ctl_reply reply;
        if (ask(ctl_walk::node, group, &reply) && reply.bindings.empty())
            return "there is no group " + instance_number(group);
    }
    // A name that exists, but only as the beginning of longer ones.
    ctl_reply below;
    if (ask(ctl_walk::subtree, text, &below) && !below.bindings.empty())
        return "it has no value of its own; \"mgmtctl walk " + text + "\" lists what is below";
    if (const schema_row *row = find_schema_row(name))
        return row->instance ? "" : "it can be set, and has no default";
    // From the top down to the first part that cannot exist.
    node_name good;
    for (const std::string &part : name.parts) {
        const std::vector<std::string> known = names_below(ask, good);
        if (std::find(known.begin(), known.end(), part) == known.end()) {
            if (const std::string *meant = nearest_word(part, known, 2))
                return "did you mean " + good.below(*meant).text() + "?";
            return known.empty() ? ""
                                 : "\"mgmtctl walk " + (good.parts.empty() ? "/" : good.text()) +
                                       "\" lists what there is";
        }
        good.parts.push_back(part);
    }
    return "";
}

namespace {
bool is_state(const node_name &name) {
    for (const char *root : {NODE_WCCPD_STATE, NODE_GROUP_STATE, NODE_PLANE_STATE, NODE_TUNNEL_STATE,
                             NODE_INTERCEPT_STATE, NODE_ALARM_STATE, NODE_CONFIG_STATE})
        if (name == parsed_name(root) || name.is_under(parsed_name(root)))
            return true;
    return false;
}
} // namespace

std::string hint_for_unchangeable(const ctl_ask &ask, const std::string &text) {
    node_name name;
    if (parse_node_name(text, &name) && find_schema_row(name))
        return "";
    if (is_state(name))
        return "it is a state: it can only be read";
    return hint_for_missing(ask, text);
}

// --- Completion

namespace {
std::vector<std::string> value_completions(const std::string &name_text, const std::string &begin) {
    const schema_row *row = find_schema_row(parsed_name(name_text));
    std::string words = row && row->words ? row->words : row && row->type == bn_type_bool ? "true|false" : "";
    std::vector<std::string> out;
    while (!words.empty()) {
        const std::string word = words.substr(0, words.find('|'));
        words.erase(0, word.size() + 1);
        if (word.starts_with(begin))
            out.push_back(std::string(name_text).append("=").append(word));
    }
    return out;
}
} // namespace

std::vector<std::string> complete_node_name(const ctl_ask &ask, const std::string &word) {
    if (const size_t equals = word.find('='); equals != std::string::npos)
        return value_completions(word.substr(0, equals), word.substr(equals + 1));
    size_t slash = word.rfind('/');
    // An escaped slash belongs to a part and does not end it.
    while (slash != std::string::npos && slash > 0 && word[slash - 1] == '\\')
        slash = word.rfind('/', slash - 1);
    if (slash == std::string::npos)
        return word.empty() ? std::vector<std::string>{"/"} : std::vector<std::string>{};
    node_name above;
    if (slash > 0 && !parse_node_name(word.substr(0, slash), &above))
        return {};
    std::vector<std::string> out;
    for (const std::string &part : names_below(ask, above))
        if (const std::string whole = above.below(part).text(); whole.starts_with(word))
            out.push_back(whole);
    return out;
}

// --- Walks

bool query_walk(const ctl_ask &ask, ctl_walk how, const node_name &root, ctl_reply *out) {
    ctl_reply whole;
    if (!ask(how, root.text(), out))
        return false;
    // Only an answer that is too large for a message is asked for in pieces. The recursion ends, because
    // each name is longer than the one before.
    const std::vector<std::string> parts =
        out->code == LC_NO_BUFFER_SPACE ? names_below(ask, root) : std::vector<std::string>{};
    if (parts.empty())
        return true;
    // The pieces begin below the root, whose own value a subtree includes.
    if (how == ctl_walk::subtree && !ask(ctl_walk::node, root.text(), &whole))
        return false;
    for (const std::string &part : parts) {
        ctl_reply piece;
        if (!query_walk(ask, how, root.below(part), &piece))
            return false;
        if ((piece.code == LC_IO_CLOSED || piece.code == LC_IO_TIMED_OUT) && !is_state(root))
            continue; // a walk that begins above the states leaves them out
        if (piece.code != LC_OK) {
            *out = piece;
            return true;
        }
        whole.bindings.insert(whole.bindings.end(), piece.bindings.begin(), piece.bindings.end());
    }
    *out = std::move(whole);
    return true;
}

bool query_appliances(const ctl_ask &ask, const std::string &list, unsigned long count,
                      std::vector<ctl_binding> *inout) {
    for (unsigned long i = 1; i <= std::min(count, APPLIANCES_MAX); i++)
        for (const char *leaf : {"/ipaddr", "/weight"}) {
            ctl_reply reply;
            if (!ask(ctl_walk::node, std::string(list).append("/").append(std::to_string(i)).append(leaf),
                     &reply))
                return false;
            inout->insert(inout->end(), reply.bindings.begin(), reply.bindings.end());
        }
    return true;
}

bool add_appliances(const ctl_ask &ask, const std::string &root_text, std::vector<ctl_binding> *inout) {
    static const node_name counts = parsed_name(NODE_GROUP_STATE "/*/num_appliances");
    const node_name root = parsed_name(root_text);
    node_name list = counts;
    list.parts.back() = "appliance";
    std::vector<ctl_binding> counted;
    for (const ctl_binding &binding : *inout)
        if (matches_pattern(counts, parsed_name(binding.name)))
            counted.push_back(binding);
    // A walk that begins at the list itself does not contain the count.
    if (matches_pattern(list, root)) {
        node_name count = root;
        count.parts.back() = counts.parts.back();
        ctl_reply reply;
        if (!ask(ctl_walk::node, count.text(), &reply))
            return false;
        counted = reply.bindings;
    }
    for (const ctl_binding &count : counted) {
        node_name one = parsed_name(count.name);
        one.parts.back() = "appliance";
        std::vector<ctl_binding> added;
        if (!query_appliances(ask, one.text(), strtoul(count.value.c_str(), nullptr, 10), &added))
            return false;
        const auto at = std::find_if(inout->begin(), inout->end(),
                                     [&](const ctl_binding &binding) { return binding.name == count.name; });
        inout->insert(at == inout->end() ? at : at + 1, added.begin(), added.end());
    }
    return true;
}

// --- Changes

std::string parse_assignments(const std::vector<std::string> &words, ctl_change change,
                              std::vector<ctl_change_item> *out) {
    if (words.size() == 2 && words[0].find('=') == std::string::npos) {
        out->push_back({change, {words[0], "", words[1]}});
        return "";
    }
    for (const std::string &word : words) {
        const size_t equals = word.find('=');
        if (equals == std::string::npos || equals == 0)
            return "expected NAME VALUE or NAME=VALUE, not \"" + word + "\"";
        out->push_back({change, {word.substr(0, equals), "", word.substr(equals + 1)}});
    }
    return "";
}

std::string kept_value(const std::string &name_text, const std::string &value) {
    const node_name name = parsed_name(name_text);
    const schema_row *row = find_schema_row(name);
    std::string kept, reason;
    return row && check_value(*row, name, value, &kept, &reason) ? kept : value;
}

bool look_before(const ctl_ask &ask, const std::vector<ctl_change_item> &items, groups_before *out) {
    for (const ctl_change_item &item : items) {
        const std::string root = group_of(item.binding.name);
        if (root.empty())
            continue;
        // The group's root tells whether the group exists, the node its present value.
        for (const std::string &name : {root, item.binding.name}) {
            ctl_reply reply;
            if (!ask(ctl_walk::node, name, &reply))
                return false;
            if (!reply.bindings.empty() && name == root)
                out->roots.insert(root);
            out->bindings.insert(out->bindings.end(), reply.bindings.begin(), reply.bindings.end());
        }
    }
    return true;
}

namespace {
const ctl_binding *find_binding(const std::vector<ctl_binding> &bindings, const std::string &name) {
    for (const ctl_binding &binding : bindings)
        if (binding.name == name)
            return &binding;
    return nullptr;
}

// The part of the name after its group when a running group takes changes of that node in this way, else "".
std::string changed_word(const std::string &name, const std::string &root, group_change change) {
    const std::string rest = name.size() > root.size() ? name.substr(root.size() + 1) : "";
    for (const group_word &word : group_words())
        if (word.change == change && rest.substr(0, rest.find('/')) == word.node)
            return word.node;
    return "";
}
} // namespace

std::string at_start_note(const std::string &words, const std::string &group) {
    return "a running group applies a change of " + words +
           " only when it is restarted: mgmtctl group restart " + group;
}

namespace {
std::string join_words(const std::set<std::string> &words) {
    std::string out;
    for (const std::string &word : words)
        out += (out.empty() ? "" : ", ") + word;
    return out;
}
} // namespace

change_notes notes_of(const std::vector<ctl_change_item> &items, const groups_before &before) {
    change_notes out;
    std::set<std::string> ended;                                  // roots
    std::map<std::string, std::set<std::string>> whole, at_start; // words by root
    for (const ctl_change_item &item : items) {
        const std::string &name = item.binding.name;
        const std::string root = group_of(name);
        if (root.empty())
            continue;
        const bool removed = item.change == ctl_change::remove || item.change == ctl_change::reset;
        const bool existed = before.roots.contains(root);
        const ctl_binding *old = find_binding(before.bindings, name);
        if (!existed && !removed &&
            std::find(out.created.begin(), out.created.end(), root) == out.created.end())
            out.created.push_back(root);
        if (removed && existed && name == root)
            ended.insert(root);
        if (!existed || name == root)
            continue;
        const schema_row *row = find_schema_row(parsed_name(name));
        const std::string after = !removed               ? kept_value(name, item.binding.value)
                                  : row && row->fallback ? row->fallback
                                                         : "";
        // There is no default to fall back to: a running group cannot lose the value without being recreated.
        if (removed && old && row && !row->fallback)
            whole[root].insert(name.substr(root.size() + 1));
        // Setting the present value again changes nothing and needs no note.
        else if (!old || old->value != after)
            for (auto *words : {&whole, &at_start})
                if (const std::string word = changed_word(
                        name, root, words == &whole ? group_change::as_whole : group_change::at_start);
                    !word.empty())
                    (*words)[root].insert(word);
    }
    for (const auto &[root, words] : whole)
        if (!ended.contains(root))
            out.notes.push_back("group " + instance_number(root) + ": wccpd applies a change of " +
                                join_words(words) + " only by recreating the group");
    for (const auto &[root, words] : at_start)
        // A group that is recreated anyway applies these changes as well.
        if (!ended.contains(root) && !whole.contains(root))
            out.notes.push_back("group " + instance_number(root) + ": " +
                                at_start_note(join_words(words), instance_number(root)));
    return out;
}
