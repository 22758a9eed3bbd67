#include "mgmt/gcl_io.h"

#include <cerrno>
#include <cstring>

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include "runtime/logging.h"

int64_t lf_read_bytes_closed(int fd, void *buffer, uint64_t count, int *out_closed) {
    *out_closed = 0;
    uint64_t taken = 0;
    while (taken < count) {
        const ssize_t got = read(fd, static_cast<char *>(buffer) + taken, count - taken);
        if (got > 0) {
            taken += static_cast<uint64_t>(got);
            continue;
        }
        if (got < 0 && errno == EINTR)
            continue;
        // Everything that has arrived so far has been read.
        if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            break;
        // ECONNRESET: the peer has closed the connection without reading everything that was sent to it.
        if (got == 0 || errno == ECONNRESET || errno == EBADF) {
            *out_closed = 1;
            break;
        }
        return -1;
    }
    return static_cast<int64_t>(taken);
}

lc_status lf_write_bytes(int fd, const void *bytes, int64_t count, uint64_t *out_written) {
    CHECK_NULL(out_written);
    *out_written = 0;
    CHECK_NULL(bytes);
    const uint64_t total =
        count < 0 ? strlen(static_cast<const char *>(bytes)) : static_cast<uint64_t>(count);
    while (*out_written < total) {
        const ssize_t put = write(fd, static_cast<const char *>(bytes) + *out_written, total - *out_written);
        if (put >= 0)
            *out_written += static_cast<uint64_t>(put);
        else if (errno == EAGAIN || errno == EWOULDBLOCK)
            return LC_IO_WOULD_BLOCK;
        else if (errno == EPIPE)
            return LC_IO_CLOSED;
        else if (errno != EINTR)
            return LC_IO_ERROR;
    }
    return LC_OK;
}

int lf_is_writable(int fd) {
    pollfd watched = {fd, POLLOUT, 0};
    // Also true for an error or a hangup, which the write that follows then reports.
    return poll(&watched, 1, 0) > 0;
}

lc_status lf_set_nonblocking(int fd, int on) {
    const int flags = fcntl(fd, F_GETFL);
    if (flags < 0 || fcntl(fd, F_SETFL, on ? flags | O_NONBLOCK : flags & ~O_NONBLOCK) < 0) {
        LC_LOG(LC_LOG_ERR, "fcntl: %m");
        return LC_GENERIC;
    }
    return LC_OK;
}

lc_status lf_get_file_owner(const char *path, uid_t *out_uid, gid_t *out_gid) {
    CHECK_NULL(path);
    struct stat found {};
    if (stat(path, &found) != 0)
        return LC_FILE_NOT_FOUND;
    if (out_uid)
        *out_uid = found.st_uid;
    if (out_gid)
        *out_gid = found.st_gid;
    return LC_OK;
}
