// Configurations are compared by the values in force, not by what was set: a file that sets a default and one
// that leaves it out are the same configuration. Only differences are sent. A group that is in both is
// changed and never deleted and created again.
//
// A hidden password, as in an export without --secrets, keeps the present one.
#include "peers/mgmtctl/config_change.h"

#include <set>

#include "peers/nodes/secrets.h"

namespace {
ctl_binding shown_binding(const node_name &name, const node_value &value) {
    return {name.text(), type_name(value.type), value.text};
}

// --- Reading

bool parse_json_nodes(const std::string &content, ctl_json *out, std::string *out_reason) {
    if (!parse_json(content, out) || !out->is_object()) {
        *out_reason = "is not a JSON object of nodes and their values";
        return false;
    }
    std::set<std::string> names;
    for (const std::string &name : out->names)
        if (!names.insert(name).second)
            *out_reason = shown_text(name) + ": is given twice";
    return out_reason->empty();
}

bool take_json_node(node_tree *tree, const std::string &text, const ctl_json &value,
                    std::string *out_reason) {
    node_name name;
    const schema_row *row = parse_node_name(text, &name) ? find_schema_row(name) : nullptr;
    if (!row) {
        *out_reason = "there is no such node in the configuration";
        return false;
    }
    const std::string given = value.is_text() || value.is_null() ? value.text : json_text(value);
    std::string kept;
    if (value.is_array() || value.is_object() || (value.is_null() && !row->instance))
        *out_reason = "the value is neither a text nor a number nor true or false";
    else if (check_value(*row, name, given, &kept, out_reason)) {
        for (const node_name &instance : instances_of(name))
            tree->set[instance] = instance.parts.back();
        tree->set[name] = kept;
        return true;
    }
    return false;
}

bool read_json(const std::string &content, const std::string &file, node_tree *out, std::string *out_errors) {
    ctl_json nodes;
    std::string reason;
    if (!parse_json_nodes(content, &nodes, &reason)) {
        *out_errors = file + ": " + reason + "\n";
        return false;
    }
    for (size_t i = 0; i < nodes.items.size(); i++)
        if (reason.clear(); !take_json_node(out, nodes.names[i], nodes.items[i], &reason))
            out_errors->append(file)
                .append(": ")
                .append(shown_text(nodes.names[i]))
                .append(": ")
                .append(reason)
                .append("\n");
    return out_errors->empty();
}

bool keep_hidden(node_tree *tree, const node_tree &present, std::string *out_reason) {
    for (auto &[name, text] : tree->set) {
        if (!is_secret(name) || text != HIDDEN)
            continue;
        const auto found = present.set.find(name);
        if (found == present.set.end() || found->second.empty()) {
            *out_reason = name.text() +
                          ": the password is hidden, and there is none here that it could mean; "
                          "\"mgmtctl export --secrets\" writes it";
            return false;
        }
        text = found->second;
    }
    return true;
}
} // namespace

bool read_config(const std::string &content, const std::string &file, const node_tree &present, bool merge,
                 node_tree *out, std::string *out_errors) {
    const size_t first = content.find_first_not_of(" \t\r\n");
    config_text text;
    std::string reason;
    *out = {};
    out_errors->clear();
    if (first != std::string::npos && content[first] == '{') {
        if (!read_json(content, file, &text.tree, out_errors))
            return false;
    } else if (!config_parse_part(content, file, &text)) {
        *out_errors = text.errors;
        return false;
    }
    bool good = keep_hidden(&text.tree, present, &reason);
    if (merge)
        // insert() does not replace: values of the file have precedence.
        text.tree.set.insert(present.set.begin(), present.set.end());
    out->set = std::move(text.tree.set);
    tree_refresh(out);
    good = good && tree_check(*out, &reason);
    if (!good)
        *out_errors = config_complaint(file, text.lines, reason);
    return good;
}

// --- Differences

std::vector<node_change> config_changes(const node_tree &before, const node_tree &after) {
    std::vector<node_change> changes = tree_difference(before.nodes, after.nodes);
    std::erase_if(changes, [&](const node_change &change) {
        // A default that appears or disappears together with its group.
        return (!change.before && !after.set.contains(change.name)) ||
               (!change.after && !before.set.contains(change.name));
    });
    return changes;
}

std::vector<ctl_change_item> items_of(const std::vector<node_change> &changes, const node_tree &after) {
    std::vector<ctl_change_item> out;
    node_name gone; // the last group, or other instance, that is deleted as a whole
    for (const node_change &change : changes) {
        const std::string name = change.name.text();
        if (change.after && after.set.contains(change.name)) {
            out.push_back({ctl_change::create, {name, type_name(change.after->type), change.after->text}});
            continue;
        }
        // Deleted with the instance above it.
        if (!gone.parts.empty() && change.name.is_under(gone))
            continue;
        if (!change.after && find_schema_row(change.name)->instance)
            gone = change.name;
        out.push_back({ctl_change::remove, {name, "", ""}});
    }
    return out;
}

change_notes config_notes(const std::vector<ctl_change_item> &items, const node_tree &before) {
    groups_before known;
    const ctl_ask ask = [&](ctl_walk, const std::string &name, ctl_reply *out) {
        if (const auto found = before.nodes.find(parsed_name(name)); found != before.nodes.end())
            out->bindings.push_back(shown_binding(found->first, found->second));
        return true;
    };
    (void)look_before(ask, items, &known);
    return notes_of(items, known);
}

namespace {
const char *kind_of(const node_change &change) {
    return !change.before ? "add" : !change.after ? "delete" : "modify";
}
} // namespace

std::string text_change(const node_change &change, bool secrets) {
    std::string out = std::string(kind_of(change)) + (change.before ? " " : "    ") + change.name.text();
    if (change.after)
        out += " = " + shown_value(shown_binding(change.name, *change.after), secrets);
    if (change.before)
        out += " (was " + shown_value(shown_binding(change.name, *change.before), secrets) + ")";
    return out;
}

ctl_json json_change(const node_change &change, bool secrets) {
    const auto side = [&](const std::optional<node_value> &value) {
        return value ? json_node(shown_binding(change.name, *value), secrets)["value"] : ctl_json(nullptr);
    };
    return {{"name", change.name.text()},
            {"change", kind_of(change)},
            {"type", type_name((change.after ? change.after : change.before)->type)},
            {"before", side(change.before)},
            {"after", side(change.after)}};
}

// --- Writing

std::string export_text(const config_text &config, bool secrets) {
    node_tree tree = config.tree;
    if (!secrets)
        hide_secrets(&tree.set);
    return config_format(tree, config.comments);
}

ctl_json export_json(const node_tree &tree, bool secrets) {
    ctl_json out = ctl_json::object();
    for (const auto &[name, text] : tree.set)
        out[name.text()] =
            json_node(shown_binding(name, {find_schema_row(name)->type, text}), secrets)["value"];
    return out;
}
