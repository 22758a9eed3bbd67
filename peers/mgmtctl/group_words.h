// The words in which an operator names the settings of a group, and how a command line of them is read.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

struct group_word {
    const char *word;
    const char *node; // below the group's root; "router" means the list of its entries
    const char *hint; // of its values; null: as the schema has them
    bool whole;       // wccpd takes a change only with the group as a whole
    bool free_text;   // any text is a value, "default" too
};
const std::vector<group_word> &group_words();

// By its word or its node, in which "-" counts as "_"; null when there is none.
const group_word *find_group_word(std::string text);
// What mgmtd uses for a node that isn't set; null: the node is absent then.
const char *group_word_fallback(const group_word &word);
// The values that it takes, for a person.
std::string group_word_values(const group_word &word);

// What a command line asks for.
struct group_wish {
    std::map<std::string, std::optional<std::string>> values; // by node; none: back to the default
    std::optional<std::vector<std::string>> routers;          // the whole new list
};
// WORD VALUE [WORD VALUE ...] from the third word on. Empty, or what is wrong.
std::string parse_group_wish(const std::vector<std::string> &words, group_wish *out);

// What to say of a word that isn't one of these.
std::string unknown_word_text(const std::string &word, const std::vector<std::string> &known);
// The text as one word of a shell's command line.
std::string shell_quoted(const std::string &text);
