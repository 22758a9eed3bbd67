#include "peers/mgmtd/config_file.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "peers/mgmtd/file_replace.h"

bool config_load(config_file *file, config_text *out) {
    std::string reason;
    // `seen` changes only if the content is accepted: what was not understood must not be overwritten.
    if (std::optional<std::string> content; !read_whole_file(file->path, &content, &reason)) {
        out->errors = file->path + ": " + reason + "\n";
    } else if (config_parse(content.value_or(""), file->path, out)) {
        file->seen = std::move(content);
        return true;
    }
    return false;
}

namespace {

// False when replacing the file would lose an edit. A file that was removed has none.
bool is_as_seen(const config_file &file, std::string *out_reason) {
    std::optional<std::string> now;
    if (!read_whole_file(file.path, &now, out_reason))
        return false;
    if (!now || now == file.seen)
        return true;
    *out_reason =
        "it was changed since mgmtd read it; have mgmtd read it (SIGHUP), or move it away, and commit "
        "again";
    return false;
}

bool reads_the_same(const std::string &written, const node_tree &tree, std::string *out_reason) {
    config_text again;
    // A name or value that the format can't express would otherwise be lost, and the next start would fail.
    if (config_parse(written, "what was written", &again) && again.tree.set == tree.set)
        return true;
    *out_reason = "the written text would not be read as the same configuration";
    if (!again.errors.empty())
        *out_reason += ": " + again.errors.substr(0, again.errors.find('\n'));
    return false;
}

} // namespace

bool config_save(config_file *file, const node_tree &tree, const config_comments &comments,
                 std::string *out_reason) {
    const std::string content = config_format(tree, comments);
    // The edit check runs last, just before the rename, to keep the time in which an edit could be lost
    // short.
    const bool saved = replace_file(
        file->path, content, S_IRUSR | S_IWUSR,
        [&](const std::string &written, std::string *out) {
            return reads_the_same(written, tree, out) && is_as_seen(*file, out);
        },
        out_reason);
    if (saved)
        file->seen = content;
    else
        *out_reason = file->path + ": " + *out_reason;
    return saved;
}

std::string config_protect(const std::string &path) {
    // By a descriptor, because the path may name another file by the time the mode is changed.
    // O_NONBLOCK because the open of a pipe would wait for a writer.
    const int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    struct stat about;
    std::string out;
    if (fd >= 0 && fstat(fd, &about) == 0 && S_ISREG(about.st_mode) &&
        (about.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
        char mode[8];
        snprintf(mode, sizeof mode, "%04o", about.st_mode & 07777u);
        out = "the configuration file " + path + " was open to others (mode " + mode + "), ";
        out += fchmod(fd, about.st_mode & S_IRWXU) == 0
                   ? "and is no longer; change the passwords in it if others may have read them"
                   : std::string("and its mode can't be changed (") + strerror(errno) + "): make it 0600";
    }
    if (fd >= 0)
        close(fd);
    return out;
}
