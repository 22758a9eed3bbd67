#include "peers/mgmtctl/html_file.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

// The new file, until it is renamed to the name of the old one.
struct unfinished_page {
    std::string path;
    int fd;
    explicit unfinished_page(const std::string &target)
        : path(target + ".XXXXXX"), fd(mkostemp(path.data(), O_CLOEXEC)) {}
    unfinished_page(const unfinished_page &) = delete;
    unfinished_page &operator=(const unfinished_page &) = delete;
    ~unfinished_page() {
        if (fd < 0)
            return;
        close(fd);
        unlink(path.c_str()); // fails after the rename
    }
};

bool write_content(int fd, const std::string &content) {
    for (size_t done = 0; done < content.size();) {
        const ssize_t wrote = write(fd, content.data() + done, content.size() - done);
        // A short write is continued; a full disk is an error of the next one.
        if (wrote < 0 && errno != EINTR)
            return false;
        done += wrote > 0 ? static_cast<size_t>(wrote) : 0;
    }
    // Before the rename: after a crash the name must not lead to an empty file.
    return fsync(fd) == 0;
}

mode_t mode_of_new_file() {
    // umask() reports the mask only by setting another one.
    const mode_t mask = umask(0);
    umask(mask);
    return 0666 & ~mask;
}

} // namespace

bool write_page_file(const std::string &path, const std::string &content, std::string *out_reason) {
    // A rename would replace a symbolic link; the file that it leads to is replaced instead.
    const std::unique_ptr<char, decltype(&free)> found(realpath(path.c_str(), nullptr), free);
    const std::string target = found ? found.get() : path;
    struct stat old;
    const bool exists = stat(target.c_str(), &old) == 0;
    if (exists && !S_ISREG(old.st_mode)) {
        *out_reason = "is not a regular file; - writes to standard output";
        return false;
    }
    const unfinished_page fresh(target);
    // mkostemp() creates the file for its owner only.
    if (fresh.fd < 0 || fchmod(fresh.fd, exists ? old.st_mode & 07777 : mode_of_new_file()) != 0 ||
        !write_content(fresh.fd, content) || rename(fresh.path.c_str(), target.c_str()) != 0) {
        *out_reason = strerror(errno);
        return false;
    }
    return true;
}
