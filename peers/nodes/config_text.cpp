//   # a comment, which is kept when the file is written again
//   [/qv/wccpd/wccp/srv_grp/config/51]       the following lines are relative to this node
//   interface = eth0
//   router/1/ipaddr = 10.0.0.1
//   password = "with  blanks"
//   /qv/wccpd/system/config/mcast_ttl = 4    a name from the root
//
// The section of an instance makes the instance, even without lines, and the instances that it belongs to.
// Blanks around a value are not part of it. In quotes, \" and \\ are the escaped characters. Only values that
// were set are written, never defaults.
#include "peers/nodes/config_text.h"

#include <algorithm>

namespace {

std::string trim_blanks(const std::string &text) {
    const size_t from = text.find_first_not_of(" \t\r");
    // A carriage return counts as blank, so that a file with DOS line ends can be read.
    return from == std::string::npos ? "" : text.substr(from, text.find_last_not_of(" \t\r") + 1 - from);
}

bool strip_quotes(const std::string &text, std::string *out, std::string *out_reason) {
    // Quotes in the middle of a value are ordinary characters.
    *out = text;
    if (text.empty() || text[0] != '"')
        return true;
    out->clear();
    for (size_t i = 1; i < text.size(); i++) {
        if (text[i] == '"') {
            if (i + 1 == text.size())
                return true;
            *out_reason = "text after the closing quote";
            return false;
        }
        // A backslash protects any character, also those that add_quotes() leaves alone.
        if (text[i] == '\\' && i + 1 < text.size())
            i++;
        *out += text[i];
    }
    *out_reason = "the closing quote is missing";
    return false;
}

std::string add_quotes(const std::string &text) {
    // Only values that would be read differently without quotes get them.
    if (!text.empty() && trim_blanks(text) == text && text[0] != '"')
        return text;
    std::string out = "\"";
    for (const char c : text) {
        if (c == '"' || c == '\\')
            out += '\\';
        out += c;
    }
    return out + '"';
}

struct parser {
    config_text *text;
    int line = 0;
    std::string section = {}; // "" or an absolute name
    bool skipping = false;    // the section was refused; its lines are skipped
    std::string pending = {}; // comment lines of the next node or section
    std::string heading = {}; // comment lines of the current section, which has had no node yet
};

// The section in which a node is written: its outermost instance, or else its parent.
node_name find_section_of(const node_name &name) {
    node_name above;
    for (const std::string &part : name.parts) {
        above.parts.push_back(part);
        const schema_row *row = find_schema_row(above);
        if (row && row->instance)
            return above;
    }
    above.parts.pop_back();
    return above;
}

// The file may have other sections than those that are written. The comments of a section go to the section
// in which its first node is written.
void place_heading(parser *state, const node_name &name) {
    if (!state->heading.empty())
        state->text->comments.before["[" + find_section_of(name).text() + "]"] += state->heading;
    state->heading.clear();
}

void make_instances(parser *state, const node_name &name) {
    for (const node_name &instance : instances_of(name))
        state->text->tree.set[instance] = instance.parts.back();
}

bool take_section(parser *state, const std::string &line, std::string *out_reason) {
    // For the line "[" the length wraps around, which substr allows. The check below refuses the line.
    const std::string name_text = trim_blanks(line.substr(1, line.size() - 2));
    node_name name;
    if (line.back() != ']' || !parse_node_name(name_text, &name)) {
        *out_reason = "a section is [/name]";
        return false;
    }
    const schema_row *row = find_schema_row(name);
    std::string text;
    if (row && row->instance) {
        // An instance's own value follows from its name.
        if (!check_value(*row, name, "", &text, out_reason))
            return false;
        make_instances(state, name);
        state->text->lines.emplace(name, state->line);
    }
    bool known = false;
    // The name is good if it is the beginning of the pattern of some row, or all of it.
    for (const schema_row &candidate : schema_rows()) {
        node_name above = candidate.parts;
        if (above.parts.size() < name.parts.size())
            continue;
        above.parts.resize(name.parts.size());
        known = known || matches_pattern(above, name);
    }
    if (!known) {
        *out_reason = "nothing can be set below " + shown_text(name.text());
        return false;
    }
    state->section = name.text();
    // A section that has had no node passes its comments on to the next one.
    state->heading += state->pending;
    state->pending.clear();
    // An instance is written even without lines; therefore its comments have their place already.
    if (row && row->instance)
        place_heading(state, name);
    return true;
}

bool take_value(parser *state, const std::string &line, std::string *out_reason) {
    const size_t equals = line.find('=');
    if (equals == std::string::npos) {
        *out_reason = "expected [section] or name = value";
        return false;
    }
    std::string name_text = trim_blanks(line.substr(0, equals)), value;
    if (name_text.empty() || (name_text[0] != '/' && state->section.empty())) {
        *out_reason =
            "\"" + shown_text(name_text) + "\" is not a name from the root, and it is in no section";
        return false;
    }
    if (name_text[0] != '/')
        name_text = state->section + "/" + name_text;
    node_name name;
    const schema_row *row = parse_node_name(name_text, &name) ? find_schema_row(name) : nullptr;
    if (!row) {
        *out_reason = shown_text(name_text) + ": there is no such node in the configuration";
        return false;
    }
    std::string text;
    if (!strip_quotes(trim_blanks(line.substr(equals + 1)), &value, out_reason) ||
        !check_value(*row, name, value, &text, out_reason)) {
        *out_reason = shown_text(name.text()) + ": " + *out_reason;
        return false;
    }
    // An instance may be given twice, by its section and by a line of its own; a value may not.
    if (const auto [earlier, fresh] = state->text->lines.emplace(name, state->line);
        !fresh && !row->instance) {
        *out_reason = name.text() + ": was given in line " + std::to_string(earlier->second) + " already";
        return false;
    }
    make_instances(state, name);
    state->text->tree.set[name] = text;
    place_heading(state, name);
    if (!state->pending.empty())
        state->text->comments.before[name.text()] += state->pending;
    state->pending.clear();
    return true;
}

} // namespace

std::string config_complaint(const std::string &file, const std::map<node_name, int> &lines,
                             const std::string &reason) {
    // The last line that sets the node or a node below it.
    const node_name about = parsed_name(reason.substr(0, reason.find(": ")));
    int last = 0;
    for (const auto &[name, line] : lines)
        if (name == about || name.is_under(about))
            last = std::max(last, line);
    return file + ":" + (last ? std::to_string(last) + ": " : " ") + reason + "\n";
}

namespace {

bool take_line(parser *state, const std::string &line, std::string *out_reason) {
    if (line[0] == '[') {
        const bool good = take_section(state, line, out_reason);
        state->skipping = !good;
        return good;
    }
    // The lines of a refused section would otherwise be read as lines of the section before it.
    return state->skipping || take_value(state, line, out_reason);
}

} // namespace

bool config_parse_part(const std::string &content, const std::string &file, config_text *out) {
    *out = {};
    parser state{out};
    for (size_t at = 0; at < content.size();) {
        const size_t end = std::min(content.find('\n', at), content.size());
        const std::string line = trim_blanks(content.substr(at, end - at));
        std::string reason;
        at = end + 1;
        state.line++;
        // Not a comment of the operator, and not to be written again: a copy of a kept commit must not keep
        // its description.
        if (line.starts_with(CONFIG_NOTE))
            continue;
        if (!line.empty() && line[0] == '#')
            state.pending += line + "\n";
        else if (!line.empty() && !take_line(&state, line, &reason))
            out->errors.append(file).append(":" + std::to_string(state.line) + ": ").append(reason + "\n");
    }
    // Comments after the last node have nothing to belong to and stay at the end.
    if (const std::string last = state.heading + state.pending; !last.empty())
        out->comments.before[""] = last;
    tree_refresh(&out->tree);
    return out->errors.empty();
}

bool config_parse(const std::string &content, const std::string &file, config_text *out) {
    std::string reason;
    // The checks of the whole would report nodes as missing whose lines have errors.
    if (config_parse_part(content, file, out) && !tree_check(out->tree, &reason))
        out->errors = config_complaint(file, out->lines, reason);
    return out->errors.empty();
}

std::string config_format(const node_tree &tree, const config_comments &comments) {
    std::string out;
    node_name section;
    const auto comment = [&](const std::string &key) {
        const auto found = comments.before.find(key);
        return found == comments.before.end() ? std::string() : found->second;
    };
    // In the order of the tree, the nodes of a section are adjacent.
    for (const auto &[name, text] : tree.set) {
        if (const node_name here = find_section_of(name); here != section) {
            section = here;
            out += std::string(out.empty() ? "" : "\n") + comment("[" + section.text() + "]") + "[" +
                   section.text() + "]\n";
        }
        // Instances have no line: the section or the children of a nested one create them.
        if (find_schema_row(name)->instance)
            continue;
        out += comment(name.text()) + name.text().substr(section.text().size() + 1) + " = " +
               add_quotes(text) + "\n";
    }
    const std::string last = comment("");
    return last.empty() ? out : out + (out.empty() ? "" : "\n") + last;
}
