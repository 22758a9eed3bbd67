// Two file operations that are safe whatever already exists at the path.
//
// A file is written under a temporary name in the same directory and then renamed, so that a reader sees
// either the old or the new bytes, and a failed write, on a full disk for example, loses nothing. What is at
// the path is checked first; a link that is created there after the check is replaced by the rename, and
// never followed.
//
// errno has the reason of a failure when they return, although logging may have changed it meanwhile.
// Cancellation is disabled in both: they are short and hold descriptors.

#include "platform/file_utils.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>

#include "runtime/guards.h"

namespace {

struct owned_fd {
    explicit owned_fd(int opened) : fd(opened) {}
    ~owned_fd() { release(); }
    owned_fd(const owned_fd &) = delete;
    owned_fd &operator=(const owned_fd &) = delete;
    void replace(int opened) {
        release();
        fd = opened;
    }
    void release() {
        if (fd >= 0) {
            const int kept = errno;
            close(fd);
            errno = kept;
        }
        fd = -1;
    }
    int fd;
};

// The name of a temporary file, which is deleted unless the name is cleared after the rename.
struct temporary_name {
    ~temporary_name() {
        if (text[0]) {
            const int kept = errno;
            unlink(text);
            errno = kept;
        }
    }
    char text[PATH_MAX];
};

lc_status status_of_errno() {
    switch (errno) {
    case ENOENT:
        return LC_FILE_NOT_FOUND;
    case EEXIST:
        return LC_IO_FILE_EXISTS;
    case ENOSPC:
    case EDQUOT:
        return LC_NO_SPACE;
    case ENOTDIR:
    case ELOOP:
    case ENAMETOOLONG:
        return LC_BAD_PATH;
    default:
        return LC_IO_ERROR;
    }
}

lc_status refuse_with(lc_status status, int reason) {
    errno = reason;
    return status;
}

lc_status ensure_dir_of_file(const char *path, mode_t mode) {
    char name[PATH_MAX];
    if (strlcpy(name, path, sizeof name) >= sizeof name)
        return refuse_with(LC_BAD_PATH, ENAMETOOLONG);
    // O_PATH needs no permission to read the directory.
    owned_fd dir(open(name[0] == '/' ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
    char *part = name;
    for (;;) {
        part += strspn(part, "/");
        char *end = strchr(part, '/');
        if (!end)
            return dir.fd >= 0 ? LC_OK : status_of_errno(); // the last part is the file's name
        *end = '\0';
        // Relative to the directory just opened: a path that is changed meanwhile can't redirect this.
        const bool made = mkdirat(dir.fd, part, mode) == 0;
        if (!made && errno != EEXIST)
            return status_of_errno();
        dir.replace(openat(dir.fd, part, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (dir.fd < 0)
            return status_of_errno();
        if (made && fchmod(dir.fd, mode) != 0) // mkdirat has applied the umask
            return status_of_errno();
        part = end + 1;
    }
}

lc_status write_all(int fd, const char *bytes, uint32_t count) {
    for (uint32_t done = 0; done < count;) {
        const ssize_t wrote = write(fd, bytes + done, count - done);
        if (wrote < 0 && errno == EINTR)
            continue;
        if (wrote < 0)
            return status_of_errno();
        done += static_cast<uint32_t>(wrote);
    }
    return LC_OK;
}

lc_status write_and_rename(const char *path, mode_t mode, const char *bytes, int overwrite, uint32_t count) {
    struct stat there;
    if (lstat(path, &there) == 0) {
        if (!S_ISREG(there.st_mode))
            return refuse_with(LC_BAD_FILE, S_ISLNK(there.st_mode)   ? ELOOP
                                            : S_ISDIR(there.st_mode) ? EISDIR
                                                                     : EINVAL);
        // The other names of the file would keep the old bytes.
        if (there.st_nlink != 1)
            return refuse_with(LC_BAD_FILE, EMLINK);
        if (!overwrite)
            return refuse_with(LC_IO_FILE_EXISTS, EEXIST);
    } else if (errno != ENOENT) {
        return status_of_errno();
    }
    temporary_name temporary;
    const int length = snprintf(temporary.text, sizeof temporary.text, "%s.XXXXXX", path);
    if (length < 0 || static_cast<size_t>(length) >= sizeof temporary.text) {
        temporary.text[0] = '\0';
        return refuse_with(LC_BAD_PATH, ENAMETOOLONG);
    }
    owned_fd file(mkostemp(temporary.text, O_CLOEXEC));
    if (file.fd < 0) {
        // mkostemp has not created it; it must not be deleted.
        temporary.text[0] = '\0';
        return status_of_errno();
    }
    const lc_status written = write_all(file.fd, bytes, count);
    if (written)
        return written;
    // Until here the mode is 0600, from mkostemp. Unlike open, fchmod ignores the umask.
    if (fchmod(file.fd, mode) != 0)
        return status_of_errno();
    // RENAME_NOREPLACE: a file that has been created since the check is not replaced.
    if (renameat2(AT_FDCWD, temporary.text, AT_FDCWD, path, overwrite ? 0 : RENAME_NOREPLACE) != 0)
        return status_of_errno();
    temporary.text[0] = '\0';
    return LC_OK;
}

} // namespace

lc_status lf_ensure_dir_of_file(const char *path, mode_t mode) {
    CHECK_NULL(path);
    const cancel_off_guard whole;
    const lc_status status = ensure_dir_of_file(path, mode);
    const int reason = errno;
    LOG_STATUS(status);
    errno = reason;
    return status;
}

lc_status lf_write_file(const char *path, mode_t mode, const char *bytes, int overwrite, uint32_t count) {
    CHECK_NULL(path);
    if (count > 0)
        CHECK_NULL(bytes);
    const cancel_off_guard whole;
    const lc_status status = write_and_rename(path, mode, bytes, overwrite, count);
    const int reason = errno;
    LOG_STATUS(status);
    errno = reason;
    return status;
}
