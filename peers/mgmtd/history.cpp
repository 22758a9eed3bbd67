// The file of a commit is the text of the configuration file, after some lines that are comments there. A
// copy of it is therefore a configuration file:
//
//   #% commit 17
//   #% time 1764086301
//   #% user alice
//   #% cause apply
//   #% changes 2
//   #% what /qv/wccpd/wccp/srv_grp/config/51/weight
//   #% returns-to 16               only until it is confirmed
//   #% confirm-by 1764086601
//
// The configuration file decides whether a commit was made. The commit is written as "pending" before that
// file is replaced, and renamed to "commit-17" after it; the rename needs no space on the disk. If mgmtd is
// killed in between, the next start compares "pending" with the configuration file.
#include "peers/mgmtd/history.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <filesystem>
#include <map>
#include <sstream>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "peers/mgmtd/file_replace.h"
#include "peers/nodes/config_text.h"
#include "peers/nodes/schema.h"

namespace {

const std::string FILE_PREFIX = "commit-";

std::string pending_path(const history &self) {
    return self.directory + "/pending";
}
std::string entry_path(const history &self, uint32_t number) {
    return self.directory + "/" + FILE_PREFIX + std::to_string(number);
}

template <typename Number>
bool parse_number(const std::string &text, Number *out) {
    // from_chars stops at the first other character; the whole text has to be a number.
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *out);
    return error == std::errc() && end == text.data() + text.size() && !text.empty();
}

// --- The format of an entry

std::string format_entry(const history_entry &entry, const std::string &text) {
    std::vector<std::pair<const char *, std::string>> lines = {
        {"commit", std::to_string(entry.number)},   {"time", std::to_string(entry.time_s)},
        {"user", shown_text(entry.user)},           {"cause", shown_text(entry.cause)},
        {"changes", std::to_string(entry.changes)}, {"what", shown_text(entry.what)},
    };
    if (entry.returns_to) {
        lines.emplace_back("returns-to", std::to_string(entry.returns_to));
        lines.emplace_back("confirm-by", std::to_string(entry.confirm_by_s));
    }
    std::string out;
    for (const auto &[word, value] : lines)
        out += std::string(CONFIG_NOTE) + " " + word + " " + value + "\n";
    return out + "\n" + text;
}

// False if the content was not written by format_entry.
bool parse_entry(const std::string &content, history_entry *out, std::string *out_text) {
    std::map<std::string, std::string> words;
    size_t at = 0;
    // An empty line ends the description. A file that doesn't begin with a note has none.
    for (size_t end; content.starts_with(CONFIG_NOTE) && (end = content.find('\n', at)) != std::string::npos;
         at = end + 1) {
        std::istringstream line(content.substr(at, end - at));
        std::string mark, word, value;
        if (end == at)
            break;
        line >> mark >> word;
        std::getline(line >> std::ws, value);
        if (mark != CONFIG_NOTE)
            return false;
        words[word] = value;
    }
    *out = {};
    // A word that is missing is an empty text here, and an error below if it has to be a number.
    out->user = words["user"];
    out->cause = words["cause"];
    out->what = words["what"];
    // Files of confirmed commits don't have the two lines.
    const bool waits = words.contains("returns-to");
    if (!parse_number(words["commit"], &out->number) || !parse_number(words["time"], &out->time_s) ||
        !parse_number(words["changes"], &out->changes) ||
        (waits && (!parse_number(words["returns-to"], &out->returns_to) ||
                   !parse_number(words["confirm-by"], &out->confirm_by_s))) ||
        at >= content.size())
        return false;
    // `at` is the newline of the empty line.
    *out_text = content.substr(at + 1);
    return true;
}

bool read_entry(const std::string &path, history_entry *out, std::string *out_text, std::string *out_reason) {
    std::optional<std::string> content;
    if (!read_whole_file(path, &content, out_reason))
        return false;
    if (content && parse_entry(*content, out, out_text))
        return true;
    *out_reason = content ? "is not a commit that mgmtd has written" : "there is no such file";
    return false;
}

// --- The directory

void forget_old(history *self) {
    while (self->entries.size() > HISTORY_MAX) {
        unlink(entry_path(*self, self->entries.front().number).c_str());
        self->entries.erase(self->entries.begin());
    }
}

void read_entries(history *self, const std::function<void(const std::string &line)> &say) {
    std::error_code error;
    for (std::filesystem::directory_iterator at(self->directory, error), end; !error && at != end;
         at.increment(error)) {
        const std::string name = at->path().filename();
        history_entry entry;
        uint32_t number = 0;
        std::string text, reason;
        if (!name.starts_with(FILE_PREFIX) || !parse_number(name.substr(FILE_PREFIX.size()), &number))
            continue;
        // A copy under another number would let a rollback restore the wrong configuration.
        if (read_entry(at->path(), &entry, &text, &reason) && entry.number == number)
            self->entries.push_back(std::move(entry));
        else
            say("commit " + std::to_string(number) + " can't be read: " + at->path().string() + ": " +
                (reason.empty() ? "is another commit" : reason));
    }
    std::ranges::sort(self->entries, {}, &history_entry::number);
}

void settle_pending(history *self, const std::string &content,
                    const std::function<void(const std::string &line)> &say) {
    const std::string pending = pending_path(*self);
    // Of a commit that was interrupted while "pending" was being written: it was never made.
    (void)remove_unfinished_file(pending);
    history_entry entry;
    std::string text, reason;
    if (access(pending.c_str(), F_OK) != 0)
        return;
    // The texts differ if the configuration file was not replaced, or was edited afterwards. An edit becomes
    // a commit of its own.
    if (read_entry(pending, &entry, &text, &reason) && text == content &&
        (self->entries.empty() || entry.number > self->entries.back().number)) {
        if (history_finish(self, entry, &reason))
            return;
        say("commit " + std::to_string(entry.number) + " can't be kept: " + reason);
    }
    unlink(pending.c_str());
}

} // namespace

void history_open(history *self, const std::string &content,
                  const std::function<void(const std::string &line)> &say) {
    self->entries.clear();
    if (self->directory.empty())
        return;
    read_entries(self, say);
    settle_pending(self, content, say);
    forget_old(self);
}

// --- Commits

namespace {

bool fail_in_directory(const history &self, std::string *out_reason) {
    *out_reason = self.directory + ": " + strerror(errno);
    return false;
}

} // namespace

bool history_prepare(const history &self, const history_entry &entry, const std::string &text,
                     std::string *out_reason) {
    if (self.directory.empty())
        return true;
    // Commits contain passwords; therefore the directory is mgmtd's alone.
    if (mkdir(self.directory.c_str(), S_IRWXU) != 0 && errno != EEXIST)
        return fail_in_directory(self, out_reason);
    if (replace_file(pending_path(self), format_entry(entry, text), S_IRUSR | S_IWUSR, nullptr, out_reason))
        return true;
    *out_reason = self.directory + ": " + *out_reason;
    return false;
}

void history_abandon(const history &self) {
    if (!self.directory.empty())
        unlink(pending_path(self).c_str());
}

bool history_finish(history *self, const history_entry &entry, std::string *out_reason) {
    if (self->directory.empty())
        return true;
    if (!rename_file(pending_path(*self), entry_path(*self, entry.number)))
        return fail_in_directory(*self, out_reason);
    self->entries.push_back(entry);
    forget_old(self);
    return true;
}

bool history_confirm(history *self, std::string *out_reason) {
    history_entry entry;
    std::string text;
    if (self->entries.empty())
        return true;
    const std::string path = entry_path(*self, self->entries.back().number);
    if (!read_entry(path, &entry, &text, out_reason))
        return false;
    entry.returns_to = 0;
    entry.confirm_by_s = 0;
    if (!replace_file(path, format_entry(entry, text), S_IRUSR | S_IWUSR, nullptr, out_reason))
        return false;
    self->entries.back() = entry;
    return true;
}

const history_entry *history_find(const history &self, uint32_t number) {
    const auto found = std::ranges::find(self.entries, number, &history_entry::number);
    return found == self.entries.end() ? nullptr : &*found;
}

bool history_text(const history &self, uint32_t number, std::string *out_text, std::string *out_reason) {
    history_entry entry;
    if (!history_find(self, number)) {
        *out_reason = "commit " + std::to_string(number) + " is not kept";
        return false;
    }
    return read_entry(entry_path(self, number), &entry, out_text, out_reason);
}
