// The words of "mgmtctl group": one row for each configuration node of a group, and the list of its routers.
#include "peers/mgmtctl/group_words.h"

#include <algorithm>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtctl/nearest_word.h"
#include "peers/nodes/schema.h"

const std::vector<group_word> &group_words() {
    static const std::vector<group_word> words = {
        {"interface", "interface", "NAME, or none", group_change::as_whole, false},
        {"router", "router", "ADDRESS, once for each router; together they are the new list",
         group_change::as_whole, false},
        {"weight", "weight", nullptr, group_change::at_once, false},
        {"password", "password", "up to 8 characters; \"\" for none, - for a prompt", group_change::at_once,
         true},
        {"policy", "policy_grp", "1 to 65535, or none", group_change::at_once, false},
        {"admin", "admin", nullptr, group_change::at_once, false},
        {"priority", "priority", nullptr, group_change::as_whole, false},
        {"protocol", "protocol", "a name, or 1 to 255", group_change::as_whole, false},
        {"encap", "encap", nullptr, group_change::at_start, false},
        {"force_l2_return", "force_l2_return", nullptr, group_change::at_start, false},
        {"assign", "assign_method", nullptr, group_change::at_start, false},
        {"detail", "assign_detail", "a text", group_change::at_once, true},
        {"hash_src_ip", "hash_src_ip", nullptr, group_change::at_once, false},
        {"hash_dst_ip", "hash_dst_ip", nullptr, group_change::at_once, false},
        {"hash_src_port", "hash_src_port", nullptr, group_change::at_once, false},
        {"hash_dst_port", "hash_dst_port", nullptr, group_change::at_once, false},
        {"mask_src_ip", "mask_src_ip", nullptr, group_change::at_start, false},
        {"mask_dst_ip", "mask_dst_ip", nullptr, group_change::at_start, false},
        {"mask_src_port", "mask_src_port", nullptr, group_change::at_start, false},
        {"mask_dst_port", "mask_dst_port", nullptr, group_change::at_start, false},
        {"compatibility", "compatibility", nullptr, group_change::at_once, false},
    };
    return words;
}

namespace {
const schema_row *row_of(const group_word &word) {
    node_name name;
    return parse_node_name(std::string(NODE_GROUP_CONFIG) + "/0/" + word.node, &name) ? find_schema_row(name)
                                                                                      : nullptr;
}
} // namespace

const char *group_word_fallback(const group_word &word) {
    const schema_row *row = row_of(word);
    return row ? row->fallback : nullptr;
}

std::string group_word_values(const group_word &word) {
    const schema_row *row = row_of(word);
    if (word.hint || !row)
        return word.hint ? word.hint : "";
    if (bn_type_numeric(row->type))
        return std::to_string(row->min) + " to " + std::to_string(row->max) + ", also as 0x...";
    return row->words ? row->words : "true|false";
}

std::string unknown_word_text(const std::string &word, const std::vector<std::string> &known) {
    const std::string *nearest = nearest_word(word, known, 3);
    std::string text = "unknown word \"" + word + "\"";
    if (nearest)
        return text + "; did you mean \"" + *nearest + "\"?";
    text += "; known are";
    for (const std::string &candidate : known)
        text += " " + candidate;
    return text;
}

const group_word *find_group_word(std::string text) {
    std::replace(text.begin(), text.end(), '-', '_');
    for (const group_word &word : group_words())
        if (text == word.word || text == word.node)
            return &word;
    return nullptr;
}

std::string parse_group_wish(const std::vector<std::string> &words, group_wish *out) {
    for (size_t i = 2; i < words.size(); i += 2) {
        const group_word *word = find_group_word(words[i]);
        if (!word) {
            std::vector<std::string> known;
            for (const group_word &each : group_words())
                known.emplace_back(each.word);
            return unknown_word_text(words[i], known);
        }
        if (i + 1 == words.size())
            return std::string("\"") + word->word + "\" needs a value: " + group_word_values(*word);
        const std::string &value = words[i + 1];
        const bool nothing = !word->free_text && (value == "default" || value == "none");
        if (std::string(word->node) == "router") {
            // "router none" alone makes the list exist and leaves it empty.
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

std::string shell_quoted(const std::string &text) {
    if (!text.empty() &&
        text.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789"
                               "._-+:/") == std::string::npos)
        return text;
    std::string out = "'";
    for (const char c : text)
        // Ends the quotes, adds an escaped quote, and begins them again.
        out += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return out + "'";
}
