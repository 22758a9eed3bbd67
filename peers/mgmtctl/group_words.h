// The words in which an operator names the settings of a group, and how a command line of them is read.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

// How a running group follows a change.
enum class group_change {
    at_once,
    at_start, // after a restart: it keeps what it has agreed with its routers, or computed for them
    as_whole, // wccpd deletes the group and creates it again
};
struct group_word {
    const char *word;
    const char *node; // below the group's root; "router" means the list of its entries
    const char *hint; // of its values; null: as the schema has them
    group_change change;
    bool free_text; // any text is a value, "default" too
};
const std::vector<group_word> &group_words();

// By its word or its node, in which "-" counts as "_"; null when there is none.
const group_word *find_group_word(std::string text);
// mgmtd's default for a node that is not set; null: there is none, and the node is absent.
const char *group_word_fallback(const group_word &word);
// A description of the values that it accepts.
std::string group_word_values(const group_word &word);

// The changes that a command line asks for.
struct group_wish {
    std::map<std::string, std::optional<std::string>> values; // by node; none: back to the default
    std::optional<std::vector<std::string>> routers;          // the whole new list
};
// Reads WORD VALUE [WORD VALUE ...] from the third word on. Returns "", or the error.
std::string parse_group_wish(const std::vector<std::string> &words, group_wish *out);

// The error for a word that is not one of these.
std::string unknown_word_text(const std::string &word, const std::vector<std::string> &known);
// The text as one word of a shell's command line.
std::string shell_quoted(const std::string &text);
