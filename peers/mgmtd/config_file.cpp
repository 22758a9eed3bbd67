// Reading and writing the configuration file.
//
//   # a comment, kept when the file is written again
//   [/qv/wccpd/wccp/srv_grp/config/51]      what follows stands below this node
//   interface = eth0
//   router/1/ipaddr = 10.0.0.1
//   password = "with  blanks"
//   /qv/wccpd/system/config/mcast_ttl = 4    a name from the root
//
// A section of an instance makes the instance, also without lines of its own. Values are taken from the first
// character to the last that is no blank; in quotes \" and \\ stand for the characters themselves. Only what
// was set is written, never a default.
//
// The file is written beside the old one, synced and renamed over it, so that whoever reads it, or a loss of
// power, finds the old one or the new one. A file that is a link stays a link: its target is replaced.
#include "peers/mgmtd/config_file.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include <fcntl.h>
#include <libgen.h>
#include <sys/stat.h>
#include <unistd.h>

static constexpr size_t FILE_MAX_BYTES = 16u << 20;

static std::string trimmed(const std::string &text) {
    const size_t from = text.find_first_not_of(" \t\r");
    return from == std::string::npos ? "" : text.substr(from, text.find_last_not_of(" \t\r") + 1 - from);
}

static bool unquoted(const std::string &text, std::string *out, std::string *out_reason) {
    *out = text;
    if (text.empty() || text[0] != '"')
        return true;
    out->clear();
    for (size_t i = 1; i < text.size(); i++) {
        if (text[i] == '"') {
            if (i + 1 == text.size())
                return true;
            *out_reason = "text behind the closing quote";
            return false;
        }
        if (text[i] == '\\' && i + 1 < text.size())
            i++;
        *out += text[i];
    }
    *out_reason = "the closing quote is missing";
    return false;
}

static std::string quoted(const std::string &text) {
    if (!text.empty() && trimmed(text) == text && text[0] != '"')
        return text;
    std::string out = "\"";
    for (const char c : text) {
        if (c == '"' || c == '\\')
            out += '\\';
        out += c;
    }
    return out + '"';
}

namespace {
struct parser {
    node_tree *tree;
    config_comments *comments;
    std::string section; // "" or an absolute name
    bool skipping;       // the section was refused, and its lines with it
    std::string pending; // comment lines that wait for what they belong to
    std::string heading; // those in front of a section of which nothing has come yet
    std::map<node_name, int> line_of;
};
} // namespace

// The section that a node is written in: its outermost instance, or what stands above it.
static node_name section_of(const node_name &name) {
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

// A section as somebody divides the file need not be one that is written: its comment goes with its first
// node.
static void place_heading(parser *state, const node_name &name) {
    if (!state->heading.empty())
        state->comments->before["[" + section_of(name).text() + "]"] += state->heading;
    state->heading.clear();
}

static bool take_section(parser *state, const std::string &line, std::string *out_reason) {
    const std::string name_text = trimmed(line.substr(1, line.size() - 2));
    node_name name;
    if (line.back() != ']' || !parse_node_name(name_text, &name)) {
        *out_reason = "a section is [/name]";
        return false;
    }
    const schema_row *row = find_schema_row(name);
    std::string text;
    if (row && row->instance) {
        if (!check_value(*row, name, "", &text, out_reason))
            return false;
        state->tree->set[name] = text;
    }
    bool known = false;
    for (const schema_row &candidate : schema()) {
        node_name above = candidate.parts;
        if (above.parts.size() < name.parts.size())
            continue;
        above.parts.resize(name.parts.size());
        known = known || matches(above, name);
    }
    if (!known) {
        *out_reason = "nothing stands below " + name.text();
        return false;
    }
    state->section = name.text();
    state->heading += state->pending;
    state->pending.clear();
    if (row && row->instance)
        place_heading(state, name);
    return true;
}

static bool take_value(parser *state, const std::string &line, int number, std::string *out_reason) {
    const size_t equals = line.find('=');
    if (equals == std::string::npos) {
        *out_reason = "expected [section] or name = value";
        return false;
    }
    std::string name_text = trimmed(line.substr(0, equals)), value;
    if (name_text.empty() || (name_text[0] != '/' && state->section.empty())) {
        *out_reason = "\"" + name_text + "\" is no name from the root and stands in no section";
        return false;
    }
    if (name_text[0] != '/')
        name_text = state->section + "/" + name_text;
    node_name name;
    const schema_row *row = parse_node_name(name_text, &name) ? find_schema_row(name) : nullptr;
    if (!row) {
        *out_reason = name_text + ": there is no such node in the configuration";
        return false;
    }
    std::string text;
    if (!unquoted(trimmed(line.substr(equals + 1)), &value, out_reason) ||
        !check_value(*row, name, value, &text, out_reason)) {
        *out_reason = name.text() + ": " + *out_reason;
        return false;
    }
    if (const auto [earlier, fresh] = state->line_of.emplace(name, number); !fresh) {
        *out_reason = name.text() + ": was given in line " + std::to_string(earlier->second) + " already";
        return false;
    }
    state->tree->set[name] = text;
    node_name above = name;
    while (above.parts.size() > 1) {
        above.parts.pop_back();
        const schema_row *parent = find_schema_row(above);
        if (parent && parent->instance)
            state->tree->set[above] = above.parts.back();
    }
    place_heading(state, name);
    if (!state->pending.empty())
        state->comments->before[name.text()] += state->pending;
    state->pending.clear();
    return true;
}

bool config_parse(const std::string &content, const std::string &file, node_tree *out_tree,
                  config_comments *out_comments, std::string *out_errors) {
    out_tree->set.clear();
    out_comments->before.clear();
    out_errors->clear();
    parser state{out_tree, out_comments, "", false, "", "", {}};
    int number = 0;
    for (size_t at = 0; at < content.size();) {
        const size_t end = std::min(content.find('\n', at), content.size());
        const std::string line = trimmed(content.substr(at, end - at));
        at = end + 1;
        number++;
        std::string reason;
        if (line.empty())
            continue;
        if (line[0] == '#') {
            state.pending += line + "\n";
            continue;
        }
        bool good = true;
        if (line[0] == '[') {
            good = take_section(&state, line, &reason);
            state.skipping = !good;
        } else if (!state.skipping) {
            good = take_value(&state, line, number, &reason);
        }
        if (!good)
            out_errors->append(file).append(":" + std::to_string(number) + ": ").append(reason + "\n");
    }
    if (const std::string last = state.heading + state.pending; !last.empty())
        out_comments->before[""] = last;
    tree_refresh(out_tree);
    std::string reason;
    if (out_errors->empty() && !tree_check(*out_tree, &reason)) {
        // The line of the node that the reason begins with, or of the last one below it.
        node_name about;
        int line = 0;
        (void)parse_node_name(reason.substr(0, reason.find(": ")), &about);
        for (const auto &[name, given] : state.line_of)
            if (name == about || name.is_under(about))
                line = std::max(line, given);
        *out_errors = file + ":" + (line ? std::to_string(line) + ": " : " ") + reason + "\n";
    }
    return out_errors->empty();
}

std::string config_format(const node_tree &tree, const config_comments &comments) {
    std::string out;
    node_name section;
    const auto comment = [&](const std::string &key) {
        const auto found = comments.before.find(key);
        return found == comments.before.end() ? std::string() : found->second;
    };
    for (const auto &[name, text] : tree.set) {
        if (const node_name here = section_of(name); here != section) {
            section = here;
            out += std::string(out.empty() ? "" : "\n") + comment("[" + section.text() + "]") + "[" +
                   section.text() + "]\n";
        }
        if (find_schema_row(name)->instance)
            continue;
        out += comment(name.text()) + name.text().substr(section.text().size() + 1) + " = " + quoted(text) +
               "\n";
    }
    const std::string last = comment("");
    return last.empty() ? out : out + (out.empty() ? "" : "\n") + last;
}

// --- Files

static bool read_all(int fd, std::string *out) {
    char bytes[65536];
    ssize_t got;
    while ((got = read(fd, bytes, sizeof bytes)) != 0) {
        if (got < 0 && errno != EINTR)
            return false;
        if (got > 0)
            out->append(bytes, static_cast<size_t>(got));
        if (out->size() > FILE_MAX_BYTES) {
            errno = EFBIG;
            return false;
        }
    }
    return true;
}

bool config_load(const std::string &file, node_tree *out_tree, config_comments *out_comments,
                 std::string *out_errors) {
    std::string content;
    const int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
    const bool missing = fd < 0 && errno == ENOENT;
    const bool read_whole = fd >= 0 && read_all(fd, &content);
    const std::string failure = strerror(errno);
    if (fd >= 0)
        close(fd);
    if (!missing && !read_whole) {
        *out_errors = file + ": " + failure + "\n";
        return false;
    }
    return config_parse(content, file, out_tree, out_comments, out_errors);
}

static bool write_whole(int fd, const std::string &content) {
    for (size_t done = 0; done < content.size();) {
        const ssize_t wrote = write(fd, content.data() + done, content.size() - done);
        if (wrote < 0 && errno != EINTR)
            return false;
        if (wrote > 0)
            done += static_cast<size_t>(wrote);
    }
    return fsync(fd) == 0;
}

static void sync_directory(const std::string &file) {
    std::string copy = file;
    const int fd = open(dirname(copy.data()), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd >= 0) {
        (void)fsync(fd);
        close(fd);
    }
}

bool config_save(const std::string &file, const node_tree &tree, const config_comments &comments,
                 std::string *out_error) {
    char resolved[PATH_MAX];
    const std::string target = realpath(file.c_str(), resolved) ? resolved : file;
    std::string fresh = target + ".XXXXXX";
    const int fd = mkostemp(fresh.data(), O_CLOEXEC); // mode 0600
    bool saved = fd >= 0 && write_whole(fd, config_format(tree, comments));
    std::string failure = strerror(errno);
    if (fd >= 0 && close(fd) != 0 && saved) {
        saved = false;
        failure = strerror(errno);
    }
    if (saved && rename(fresh.c_str(), target.c_str()) != 0) {
        saved = false;
        failure = strerror(errno);
    }
    if (saved) {
        sync_directory(target);
        return true;
    }
    if (fd >= 0)
        unlink(fresh.c_str());
    *out_error = file + ": " + failure;
    return false;
}
