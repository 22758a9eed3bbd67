// The new content is written to a file beside the old one, synced, read back, and renamed over the old one.
// The name of the new file is fixed, so that the next start finds what an interrupted replacement has left.
// Only one process may replace a file at a time.
#include "peers/mgmtd/file_replace.h"

#include <cerrno>
#include <climits>
#include <cstring>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr size_t FILE_MAX_BYTES = 16u << 20;
constexpr int LINKS_MAX = 40; // symbolic links that are followed, the same as in the kernel

struct owned_fd {
    int fd;
    explicit owned_fd(int opened) : fd(opened) {}
    owned_fd(const owned_fd &) = delete;
    owned_fd &operator=(const owned_fd &) = delete;
    ~owned_fd() {
        if (fd >= 0)
            close(fd);
    }
};

// The new file, which is removed unless it has been renamed.
struct unfinished_file {
    std::string path;
    bool renamed = false;
    explicit unfinished_file(const std::string &target) : path(target + ".unfinished") {
        // A leftover of a killed process would make O_EXCL fail.
        unlink(path.c_str());
    }
    unfinished_file(const unfinished_file &) = delete;
    unfinished_file &operator=(const unfinished_file &) = delete;
    ~unfinished_file() {
        if (!renamed)
            unlink(path.c_str());
    }
};

bool fail_with_errno(std::string *out_reason) {
    *out_reason = strerror(errno);
    return false;
}

std::string find_directory_of(const std::string &path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

// The path after all symbolic links are followed. The last one may point to a file that does not exist yet.
bool follow_links(const std::string &path, std::string *out, std::string *out_reason) {
    *out = path;
    for (int i = 0; i < LINKS_MAX; i++) {
        // Only the last component: the kernel follows links in the directories before it.
        char bytes[PATH_MAX];
        const ssize_t length = readlink(out->c_str(), bytes, sizeof bytes);
        if (length < 0)
            // EINVAL: it is not a link. ENOENT: it doesn't exist yet.
            return errno == EINVAL || errno == ENOENT || fail_with_errno(out_reason);
        // readlink adds no NUL.
        const std::string target(bytes, static_cast<size_t>(length));
        *out = target[0] == '/' ? target : find_directory_of(*out) + "/" + target;
    }
    errno = ELOOP;
    return fail_with_errno(out_reason);
}

bool read_all(int fd, std::string *out) {
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

} // namespace

bool read_whole_file(const std::string &path, std::optional<std::string> *out, std::string *out_reason) {
    out->reset();
    // Without O_NONBLOCK, opening a pipe would block. Devices are refused because a commit would replace
    // them.
    const owned_fd file(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
    if (file.fd < 0)
        return errno == ENOENT || fail_with_errno(out_reason);
    struct stat about;
    if (fstat(file.fd, &about) != 0)
        return fail_with_errno(out_reason);
    if (!S_ISREG(about.st_mode)) {
        *out_reason = "is not a regular file";
        return false;
    }
    return read_all(file.fd, &out->emplace()) || fail_with_errno(out_reason);
}

namespace {

bool write_all(int fd, const std::string &content) {
    for (size_t done = 0; done < content.size();) {
        const ssize_t wrote = write(fd, content.data() + done, content.size() - done);
        if (wrote < 0 && errno != EINTR)
            return false;
        if (wrote > 0)
            done += static_cast<size_t>(wrote);
    }
    // Before the rename, or a loss of power could leave the new name with an empty file.
    return fsync(fd) == 0;
}

void sync_directory(const std::string &file) {
    const owned_fd directory(open(find_directory_of(file).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directory.fd >= 0)
        // A failure can't be acted upon: the rename has happened, and some file systems don't sync
        // directories.
        (void)fsync(directory.fd);
}

} // namespace

bool rename_file(const std::string &from, const std::string &to) {
    if (rename(from.c_str(), to.c_str()) != 0)
        return false;
    sync_directory(to);
    return true;
}

bool replace_file(const std::string &path, const std::string &content, mode_t mode, const accept_file &accept,
                  std::string *out_reason) {
    std::string target, written;
    if (!follow_links(path, &target, out_reason))
        return false;
    unfinished_file fresh(target);
    const owned_fd file(
        open(fresh.path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
    // fchmod makes the mode independent of the umask. The content is read back from the same descriptor.
    if (file.fd < 0 || fchmod(file.fd, mode) != 0 || !write_all(file.fd, content) ||
        lseek(file.fd, 0, SEEK_SET) != 0 || !read_all(file.fd, &written))
        return fail_with_errno(out_reason);
    if (accept && !accept(written, out_reason))
        return false;
    if (!rename_file(fresh.path, target))
        return fail_with_errno(out_reason);
    fresh.renamed = true;
    return true;
}

bool remove_unfinished_file(const std::string &path) {
    std::string target, reason;
    return follow_links(path, &target, &reason) && unlink((target + ".unfinished").c_str()) == 0;
}
