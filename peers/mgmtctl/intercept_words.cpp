// A clause is a word and its values. A list ends at the first word that does not begin with a digit, since
// clauses begin with a letter.
#include "peers/mgmtctl/intercept_words.h"

#include <algorithm>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/nodes/schema.h"

namespace {
const char *const PORT_AND_ALL = "\"port\" and \"all\" exclude each other";

bool is_nothing(const std::string &value) {
    return value == "default" || value == "none";
}

std::string needs_value(const intercept_word &row) {
    return std::string("\"") + row.word + "\" needs a value: " + row.values;
}

std::string take_one(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                     intercept_wish *inout) {
    if (*inout_at == words.size())
        return needs_value(row);
    const std::string &value = words[(*inout_at)++];
    if (is_nothing(value) && !intercept_word_fallback(row))
        return needs_value(row);
    const auto wanted = is_nothing(value) ? std::nullopt : std::optional(value);
    return inout->emplace(row.node, wanted).second ? "" : std::string("\"") + row.word + "\" is given twice";
}

// A clause that is given again adds to the list.
std::string take_list(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                      intercept_wish *inout) {
    std::string list;
    while (*inout_at < words.size() && words[*inout_at][0] >= '0' && words[*inout_at][0] <= '9')
        list += (list.empty() ? "" : " ") + words[(*inout_at)++];
    if (list.empty())
        return needs_value(row);
    const auto [at, fresh] = inout->emplace(row.node, list);
    // "port" and "all" set the same node.
    if (!fresh && at->second == "all")
        return PORT_AND_ALL;
    if (!fresh && !at->second)
        return std::string("\"") + row.word + "\" is given twice";
    if (!fresh)
        *at->second += " " + list;
    return "";
}

std::string take_ports(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                       intercept_wish *inout) {
    if (*inout_at < words.size() && words[*inout_at] == "all")
        return ""; // "all" is a clause of its own
    return take_list(row, words, inout_at, inout);
}

std::string take_all_ports(const intercept_word &row, const std::vector<std::string> &, size_t *,
                           intercept_wish *inout) {
    const auto [at, fresh] = inout->emplace(row.node, "all");
    return fresh ? "" : at->second == "all" ? "\"all\" is given twice" : PORT_AND_ALL;
}

std::string take_prefixes(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                          intercept_wish *inout) {
    const bool nothing = *inout_at < words.size() && is_nothing(words[*inout_at]);
    return nothing ? take_one(row, words, inout_at, inout) : take_list(row, words, inout_at, inout);
}

std::string take_check(const intercept_word &row, const std::vector<std::string> &words, size_t *inout_at,
                       intercept_wish *inout) {
    if (std::string wrong = take_one(row, words, inout_at, inout); !wrong.empty())
        return wrong;
    const std::string kind = inout->at(row.node).value_or("tcp");
    std::optional<std::string> argument;
    if (kind == "http" || kind == "command") {
        if (*inout_at == words.size() || words[*inout_at][0] != '/')
            return "\"check " + kind + "\" needs " +
                   (kind == "http" ? "the path of a page" : "the file of a command") +
                   ", which begins with \"/\"";
        argument = words[(*inout_at)++];
    } else if (kind != "tcp") {
        return unknown_word_text(kind, {"tcp", "http", "command"});
    }
    inout->emplace("check_argument", argument);
    return "";
}
} // namespace

const std::vector<intercept_word> &intercept_words() {
    static const std::vector<intercept_word> words = {
        {"protocol", "protocol", "tcp or udp", take_one},
        {"port", "ports", "ports and ranges of ports that the proxy wants: 80 443 8000-8080", take_ports},
        {"all", "ports", "instead of \"port\": every port", take_all_ports},
        {"to", "to", "the port that the proxy listens on", take_one},
        {"bypass", "bypass", "prefixes of clients or servers whose packets are returned: 10.0.0.0/8; or none",
         take_prefixes},
        {"rest", "rest", "all other packets: return to the router, forward by the routing table, or drop",
         take_one},
        {"down", "down", "wanted flows while the proxy is down: return to the router, or drop", take_one},
        {"check", "check", "how the proxy is checked: tcp, http PATH, or command FILE", take_check},
        {"interval", "interval", "seconds from one check to the next, 1 to 3600", take_one},
        {"rise", "rise", "successful checks in a row until the proxy counts as up, 1 to 100", take_one},
        {"fall", "fall", "failed checks in a row until it counts as down, 1 to 100", take_one},
        {"leave", "leave_after",
         "seconds that the proxy is down before the group leaves its routers; 0: never", take_one},
        {"limit", "limit", "flows of the proxy above which new ones are returned; 0: no limit", take_one},
        {"slow_start", "slow_start", "seconds from a start of the proxy until the full weight is announced",
         take_one},
    };
    return words;
}

namespace {
const char *fallback_of(const std::string &node) {
    const schema_row *row = find_schema_row(parsed_name(NODE_INTERCEPT_CONFIG "/0/" + node));
    return row ? row->fallback : nullptr;
}
} // namespace

const char *intercept_word_fallback(const intercept_word &word) {
    const char *fallback = fallback_of(word.node);
    // The default of ports is none: an intercept without ports is useless, and they have to be given.
    return std::string(word.node) == "ports" ? nullptr : fallback;
}

std::string parse_intercept_wish(const std::vector<std::string> &words, intercept_wish *out) {
    const std::vector<intercept_word> &rows = intercept_words();
    for (size_t at = 2; at < words.size();) {
        const std::string &word = words[at++];
        const auto row = std::find_if(rows.begin(), rows.end(),
                                      [&](const intercept_word &each) { return word == each.word; });
        if (row == rows.end()) {
            std::vector<std::string> known;
            for (const intercept_word &each : rows)
                known.emplace_back(each.word);
            return unknown_word_text(word, known);
        }
        if (std::string wrong = row->take(*row, words, &at, out); !wrong.empty())
            return wrong;
    }
    return "";
}

std::string intercept_clauses(const std::map<std::string, std::string> &nodes) {
    std::string out;
    for (const intercept_word &row : intercept_words()) {
        const auto found = nodes.find(row.node);
        const char *fallback = fallback_of(row.node);
        // The node "ports" has two clauses, of which only the one that fits its value is printed.
        const bool all = std::string(row.word) == "all";
        if (found == nodes.end() || found->second.empty() || (fallback && found->second == fallback) ||
            (std::string(row.node) == "ports" && all != (found->second == "all")))
            continue;
        out += (out.empty() ? "" : " ") + std::string(row.word) + (all ? "" : " " + found->second);
        const auto argument = nodes.find("check_argument");
        if (row.take == take_check && argument != nodes.end() && !argument->second.empty())
            out += " " + shell_quoted(argument->second);
    }
    return out;
}
