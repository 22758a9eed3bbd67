// The clauses of "mgmtctl intercept", and how a command line of them is read.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

// The changes that a command line asks for: values by nodes below the intercept's root; none: back to the
// default.
using intercept_wish = std::map<std::string, std::optional<std::string>>;

struct intercept_word {
    const char *word;
    const char *node;   // below the intercept's root
    const char *values; // for a person
    // Reads the values after the word, from `*inout_at`. Returns "", or the error.
    std::string (*take)(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                        intercept_wish *inout);
};
const std::vector<intercept_word> &intercept_words();
const char *intercept_word_fallback(const intercept_word &word); // null: it has to be given

// Reads clauses in any order, from the third word on. Returns "", or the error.
std::string parse_intercept_wish(const std::vector<std::string> &words, intercept_wish *out);
// The clauses that would add an intercept with these values, without those that have their default.
std::string intercept_clauses(const std::map<std::string, std::string> &nodes);
