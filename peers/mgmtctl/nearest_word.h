// The known word that somebody may have meant.
#pragma once

#include <string>
#include <vector>

// The nearest of `known`, null when none is near: one that begins with `word` (two letters at least), or else
// the one that needs the fewest letters added, removed or replaced: at most `mistakes`, and fewer than either
// word has.
const std::string *nearest_word(const std::string &word, const std::vector<std::string> &known,
                                size_t mistakes);
