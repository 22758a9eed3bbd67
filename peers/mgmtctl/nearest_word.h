// Which known word somebody may have meant.
#pragma once

#include <string>
#include <vector>

// The nearest of `known`, null when none is near: one that begins with `word` (of two letters at least), else
// the one with the fewest letters to add, leave out or replace, which are at most `mistakes` and fewer than
// either word has.
const std::string *nearest_word(const std::string &word, const std::vector<std::string> &known,
                                size_t mistakes);
