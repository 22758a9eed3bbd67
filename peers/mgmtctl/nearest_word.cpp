#include "peers/mgmtctl/nearest_word.h"

#include <algorithm>

namespace {
constexpr size_t LETTERS_MAX = 64; // that are compared

size_t edit_distance(const std::string &a, const std::string &b) {
    // The Levenshtein distance, with one row of its table: row[j] is the distance of a's first i letters from
    // b's first j.
    std::vector<size_t> row(b.size() + 1);
    for (size_t j = 0; j <= b.size(); j++)
        row[j] = j;
    for (size_t i = 1; i <= a.size(); i++) {
        size_t diagonal = row[0];
        row[0] = i;
        for (size_t j = 1; j <= b.size(); j++) {
            const size_t above = row[j];
            row[j] = std::min({row[j] + 1, row[j - 1] + 1, diagonal + (a[i - 1] == b[j - 1] ? 0 : 1)});
            diagonal = above;
        }
    }
    return row[b.size()];
}
} // namespace

const std::string *nearest_word(const std::string &word, const std::vector<std::string> &known,
                                size_t mistakes) {
    const std::string *best = nullptr;
    size_t least = mistakes + 1;
    for (const std::string &each : known) {
        const bool begins = word.size() > 1 && each.starts_with(word);
        const size_t away = begins ? 0 : edit_distance(word.substr(0, LETTERS_MAX), each);
        // With as many mistakes as letters, any short word would be near.
        if (away < least && away < std::min(word.size(), each.size())) {
            least = away;
            best = &each;
        }
    }
    return best;
}
