// The history: the last commits, each with its whole configuration in a file of its own, in a directory
// beside the configuration file.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

constexpr size_t HISTORY_MAX = 50;

struct history_entry {
    uint32_t number = 0; // the revision of the configuration after the commit
    int64_t time_s = 0;  // since 1970
    std::string user, cause;
    uint32_t changes = 0; // how many nodes it changed
    std::string what;     // the first of them
    // For a commit that waits to be confirmed; 0 otherwise.
    uint32_t returns_to = 0;  // the commit that is restored without a confirmation
    int64_t confirm_by_s = 0; // since 1970
};

struct history {
    std::string directory;              // "": nothing is kept
    std::vector<history_entry> entries; // the oldest first
};

// Reads the directory. An interrupted commit counts if `content`, that of the configuration file, is its
// configuration, and is removed otherwise. `say` gets lines for the log.
void history_open(history *self, const std::string &content,
                  const std::function<void(const std::string &line)> &say);
// A commit is added in two steps. Before the configuration file is replaced, the commit is written and synced
// under a name that does not count yet; on a full disk this fails. After it, the file is renamed, and commits
// beyond the last HISTORY_MAX are removed. False with the reason.
bool history_prepare(const history &self, const history_entry &entry, const std::string &text,
                     std::string *out_reason);
void history_abandon(const history &self); // instead of the second step
bool history_finish(history *self, const history_entry &entry, std::string *out_reason);
// Records that the last commit has been confirmed.
bool history_confirm(history *self, std::string *out_reason);

const history_entry *history_find(const history &self, uint32_t number);
// The text of the configuration after a commit.
bool history_text(const history &self, uint32_t number, std::string *out_text, std::string *out_reason);
