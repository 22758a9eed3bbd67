// "mgmtctl group" and "mgmtctl policy": their session, and their output for people and scripts.
#include <cstdio>
#include <map>

#include <termios.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/groups.h"
#include "peers/mgmtctl/render.h"
#include "peers/nodes/secrets.h"

namespace {
constexpr size_t SECRET_MAX = 256; // more than any password has; mgmtd refuses what is too long

ctl_json result_json(const group_result &result) {
    ctl_json out = {{result.kind == "group" ? "group" : "policy",
                     result.number < 0 ? ctl_json(nullptr) : ctl_json(result.number)},
                    {"done", result.done.empty() ? "nothing" : result.done},
                    {"commits", result.commits}};
    if (!result.wccpd.empty()) {
        out["wccpd"] = result.wccpd;
        out["running"] = result.runs;
        out["state"] = result.state.empty() ? ctl_json(nullptr) : ctl_json(result.state);
        out["designated"] = result.designated;
    }
    if (!result.note.empty())
        out["note"] = result.note;
    if (result.exit == CTL_OK)
        return out;
    out["error"] = result.error;
    out["code"] = result.code;
    out["exit"] = result.exit;
    return out;
}

std::string result_text(const group_result &result) {
    static const std::map<std::string, std::string> outcomes = {
        {"added", " added"},     {"changed", " changed"},       {"recreated", " deleted and created again"},
        {"deleted", " deleted"}, {"unchanged", " is as asked"},
    };
    std::string text = result.kind + " " + std::to_string(result.number) + outcomes.at(result.done);
    if (!result.note.empty())
        text += " (" + result.note + ")";
    if (result.wccpd == "absent")
        text += "; wccpd is not running";
    else if (result.wccpd == "silent")
        text += "; wccpd does not answer";
    else if (result.runs && result.done == "deleted")
        text += "; wccpd still has it";
    else if (result.runs)
        text += "; state " + result.state + (result.designated ? ", designated" : "");
    else if (!result.wccpd.empty() && result.done != "deleted")
        text += "; wccpd does not have it: its log has the reason";
    return text;
}

int report_result(const ctl_options &options, const group_result &result) {
    if (options.json)
        write_output(json_line(result_json(result)));
    else if (result.exit == CTL_OK)
        write_output(result_text(result) + "\n");
    else
        return tell_failure(
            options, {result.exit, result.number < 0 ? "" : result.kind + " " + std::to_string(result.number),
                      result.error, result.note, result.code});
    return result.exit;
}

int list_words(const ctl_options &options) {
    ctl_json all = ctl_json::array();
    for (const group_word &word : group_words()) {
        const char *fallback = group_word_fallback(word);
        if (!options.json)
            write_output(word.word + std::string(17 - std::string(word.word).size(), ' ') +
                         group_word_values(word) +
                         (fallback && *fallback ? std::string("; default ") + fallback : "") + "\n");
        all.push_back({{"word", word.word},
                       {"node", word.node},
                       {"values", group_word_values(word)},
                       {"default", fallback ? ctl_json(fallback) : ctl_json(nullptr)},
                       {"recreates", word.change == group_change::as_whole}});
    }
    if (options.json)
        write_output(json_line(all));
    return CTL_OK;
}

// Prints each group as the words that would add it.
void tell_list(const ctl_options &options, const std::vector<listed_group> &groups) {
    ctl_json all = ctl_json::array();
    for (const listed_group &group : groups) {
        const std::vector<std::string> routers = group_routers(group.nodes);
        std::string line = group.number;
        ctl_json one = {{"number", std::atol(group.number.c_str())}, {"routers", routers}};
        for (const std::string &router : routers)
            line += " router " + router;
        for (const auto &[name, value] : group.nodes) {
            if (name.starts_with("router/"))
                continue;
            const group_word *word = find_group_word(name);
            const bool hidden = name == "password" && !options.secrets;
            line += std::string(" ") + (word ? word->word : name.c_str()) + " " +
                    (hidden ? HIDDEN : shell_quoted(value));
            one[word ? word->word : name] = hidden ? HIDDEN : value;
        }
        if (!options.json)
            write_output(line + "\n");
        all.push_back(one);
    }
    if (options.json)
        write_output(json_line(all));
}

int run_words(const ctl_options &options, const std::vector<std::string> &words, const char *above,
              const char *kind,
              group_result (*command)(const ctl_link &link, const std::vector<std::string> &words)) {
    const ctl_link link = link_to_mgmtd(options);
    if (words.size() == 1 && words[0] == "list") {
        std::vector<listed_group> groups;
        group_result result = list_groups(link, above, &groups);
        result.kind = kind;
        if (result.exit != CTL_OK)
            return report_result(options, result);
        tell_list(options, groups);
        return CTL_OK;
    }
    return report_result(options, command(link, words));
}

// Reads the password from a line of standard input, because a command line can be read by everybody on the
// machine. On a terminal it is prompted for, and not echoed. False at the end of the input, or when a signal
// ends the program.
bool read_secret(std::string *out) {
    termios before = {};
    const bool terminal = tcgetattr(STDIN_FILENO, &before) == 0;
    if (terminal) {
        termios silent = before;
        silent.c_lflag &= ~static_cast<tcflag_t>(ECHO);
        fputs("password: ", stderr);
        (void)tcsetattr(STDIN_FILENO, TCSAFLUSH, &silent);
    }
    char byte = '\0';
    ssize_t got = 0;
    out->clear();
    // Byte by byte, so that nothing after the line is consumed. A signal ends read(), and the echo is
    // restored below.
    while (out->size() < SECRET_MAX && (got = read(STDIN_FILENO, &byte, 1)) == 1 && byte != '\n')
        *out += byte;
    if (terminal) {
        (void)tcsetattr(STDIN_FILENO, TCSAFLUSH, &before);
        fputc('\n', stderr);
    }
    return got == 1 || (got == 0 && !out->empty());
}
} // namespace

int ctl_group(const ctl_options &options, const std::vector<std::string> &words) {
    if (words.size() == 1 && words[0] == "words")
        return list_words(options);
    std::vector<std::string> filled = words;
    // Words are VERB NUMBER WORD VALUE WORD VALUE ...
    for (size_t i = 3; i < filled.size(); i += 2)
        if (filled[i - 1] == "password" && filled[i] == "-" && !read_secret(&filled[i]))
            return tell_failure(options, {CTL_USAGE, "", "there is no password on standard input", "", 0});
    return run_words(options, filled, NODE_GROUP_CONFIG, "group", group_command);
}

int ctl_policy(const ctl_options &options, const std::vector<std::string> &words) {
    return run_words(options, words, NODE_POLICY_CONFIG, "policy group", policy_command);
}
