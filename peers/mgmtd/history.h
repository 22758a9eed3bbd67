// The commits that are kept: each whole, in a file of its own in a directory beside the configuration file.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

constexpr size_t HISTORY_MAX = 50;

struct history_entry {
    uint32_t number = 0; // the revision of the configuration that the commit made
    int64_t time_s = 0;  // since 1970
    std::string user, cause;
    uint32_t changes = 0; // nodes that it changed
    std::string what;     // which: the first of them
    // Of a commit that waits to be confirmed; 0 otherwise.
    uint32_t returns_to = 0;  // the commit that takes its place when nobody does
    int64_t confirm_by_s = 0; // since 1970
};

struct history {
    std::string directory;              // "" keeps nothing
    std::vector<history_entry> entries; // the oldest first
};

// Reads what is kept. A commit that was cut short counts when `content`, the configuration file, is what it
// was to be, and is removed otherwise. `say` gets what there is to report, line by line.
void history_open(history *self, const std::string &content,
                  const std::function<void(const std::string &line)> &say);
// A commit in two steps: written and synced under a name that doesn't count yet, so that a disk that is full
// refuses it; then, once the configuration file is replaced, renamed. False with the reason. What is beyond
// the last HISTORY_MAX is removed with the second.
bool history_prepare(const history &self, const history_entry &entry, const std::string &text,
                     std::string *out_reason);
void history_abandon(const history &self);
bool history_finish(history *self, const history_entry &entry, std::string *out_reason);
// The last commit has been confirmed.
bool history_confirm(history *self, std::string *out_reason);

const history_entry *history_find(const history &self, uint32_t number);
// The configuration of a commit that is kept, as the file had it.
bool history_text(const history &self, uint32_t number, std::string *out_text, std::string *out_reason);
