// The directory is in /tmp, where anybody may have made it first. It has to be a real directory that belongs
// to the user of mgmtd and that nobody else can write to. As root, mgmtd moves anything else out of the way;
// in a /tmp with the sticky bit its owner cannot undo that. As another user, mgmtd reports it and ends.
//
// Two locks prevent a second mgmtd. The lock on the directory shows in addition that a socket found there was
// left by an mgmtd that was killed. It is lost with the directory, which programs that clean /tmp may remove.
// As root, mgmtd therefore locks a file in /var/run as well. Both locks are held until the process ends.
//
// A client also binds a name in the directory and removes it when it ends. Names that killed clients have
// left are removed when mgmtd starts and at each new session. The end of a session is too early: its process
// may still run, and all sessions of a process share one name. Removing a name of a running process would do
// no harm, because its sessions are connected already, or connect to the name of mgmtd and not to their own.
#include "peers/mgmtd/listener.h"

#include <cerrno>
#include <charconv>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string_view>

#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "mgmt/gcl_wire.h"
#include "peers/nodes/provider_path.h"
#include "runtime/common.h"

namespace {

constexpr int BACKLOG = 64;
constexpr int MOVES_MAX = 1000;     // names to try for something that is moved aside
constexpr int DIRECTORY_TRIES = 16; // in case somebody makes the directory again at the same time

bool fail_with_errno(std::string *out_error, const std::string &what) {
    *out_error = what + ": " + strerror(errno);
    return false;
}

void close_fd(int *fd) {
    if (*fd >= 0)
        close(*fd);
    *fd = -1;
}

bool lock_alone(int fd, const std::string &path, std::string *out_error) {
    if (flock(fd, LOCK_EX | LOCK_NB) == 0)
        return true;
    if (errno != EWOULDBLOCK)
        return fail_with_errno(out_error, path);
    *out_error = "another mgmtd runs";
    return false;
}

bool take_lock_file(listener *self, std::string *out_error) {
    if (geteuid() != 0)
        return true; // /var/run is root's
    // The file is never removed: an mgmtd that had just opened it would lock a file that the next one no
    // longer finds.
    self->lock = open(MGMTD_LOCK_FILE, O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (self->lock < 0)
        return fail_with_errno(out_error, MGMTD_LOCK_FILE);
    return lock_alone(self->lock, MGMTD_LOCK_FILE, out_error);
}

// --- The directory

bool move_aside(const listener *self, const std::string &path, uid_t owner, std::string *out_error) {
    for (int i = 1; i <= MOVES_MAX; i++) {
        const std::string aside = path + ".moved-" + std::to_string(i);
        // A plain rename could replace something that was moved aside earlier.
        if (renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, aside.c_str(), RENAME_NOREPLACE) == 0) {
            self->say(path + " belonged to user " + std::to_string(owner) + ", moved to " + aside);
            return true;
        }
        if (errno == ENOENT) // its owner has removed it meanwhile
            return true;
        if (errno != EEXIST)
            break;
    }
    return fail_with_errno(out_error,
                           path + ": belongs to user " + std::to_string(owner) + " and can't be moved aside");
}

// False with the reason; `out_again` is whether another attempt may succeed.
bool open_own_directory(const listener *self, const std::string &path, int *out_fd, bool *out_again,
                        std::string *out_error) {
    struct stat about;
    *out_again = false;
    if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST)
        return fail_with_errno(out_error, path);
    // lstat, so that a symbolic link is judged by its own owner, and is moved aside instead of followed.
    if (lstat(path.c_str(), &about) != 0) {
        *out_again = errno == ENOENT;
        return fail_with_errno(out_error, path);
    }
    if (about.st_uid != geteuid() && geteuid() == 0) {
        *out_again = move_aside(self, path, about.st_uid, out_error);
        return false;
    }
    *out_fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    // The name may have been given to something else since lstat. What counts is the owner of what was
    // opened.
    if (*out_fd < 0 || fstat(*out_fd, &about) != 0)
        return fail_with_errno(out_error, path);
    if (about.st_uid == geteuid())
        return true;
    *out_error = path + ": belongs to user " + std::to_string(about.st_uid) + ", not to us";
    return false;
}

bool open_directory(const listener *self, int *out_fd, std::string *out_error) {
    // Without the slash at the end, with which lstat and O_NOFOLLOW would follow a link.
    const std::string path(GCL_SOCKET_DIRECTORY, strlen(GCL_SOCKET_DIRECTORY) - 1);
    bool again = true;
    for (int i = 0; again && i < DIRECTORY_TRIES; i++) {
        close_fd(out_fd);
        if (!open_own_directory(self, path, out_fd, &again, out_error))
            continue;
        // mkdir applies the umask, and an old directory may be open to others.
        if (fchmod(*out_fd, 0755) != 0)
            return fail_with_errno(out_error, path);
        return lock_alone(*out_fd, path, out_error);
    }
    return false;
}

// The process of a client, from the name of its socket, "uds-client-NAME-PID"; 0 for other files.
pid_t find_client_of(std::string_view file) {
    pid_t pid = 0;
    const size_t dash = file.rfind('-');
    if (!file.starts_with("uds-client-") || dash == std::string_view::npos)
        return 0;
    const char *end = file.data() + file.size();
    const auto [last, error] = std::from_chars(file.data() + dash + 1, end, pid);
    return error == std::errc() && last == end && pid > 0 ? pid : 0;
}

} // namespace

void listener_tidy(const listener *self) {
    // closedir closes its descriptor, and a duplicate would share the read position with the original.
    const int fd = openat(self->directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    DIR *opened = fd < 0 ? nullptr : fdopendir(fd);
    if (!opened) {
        if (fd >= 0)
            close(fd);
        return;
    }
    const std::unique_ptr<DIR, int (*)(DIR *)> files(opened, closedir);
    while (const dirent *file = readdir(files.get())) {
        const pid_t pid = find_client_of(file->d_name);
        struct stat about;
        // Signal 0 only asks. EPERM means that the process exists and belongs to another user.
        if (pid > 0 && kill(pid, 0) != 0 && errno == ESRCH &&
            fstatat(self->directory, file->d_name, &about, AT_SYMLINK_NOFOLLOW) == 0 &&
            S_ISSOCK(about.st_mode))
            unlinkat(self->directory, file->d_name, 0);
    }
}

// --- The socket

namespace {

// If mgmtd runs with that group as its own, the socket has the group already, and no privilege is needed.
void admit_viewers(listener *self) {
    struct stat about;
    if (self->viewers == static_cast<gid_t>(-1))
        return;
    // The group first: with the wider mode, the former group would have access for a moment.
    if (lstat(self->path.c_str(), &about) == 0 &&
        (about.st_gid == self->viewers ||
         chown(self->path.c_str(), static_cast<uid_t>(-1), self->viewers) == 0) &&
        chmod(self->path.c_str(), 0660) == 0)
        return;
    self->say("group " + self->viewers_group + " can't be let in: " + strerror(errno));
    self->viewers = static_cast<gid_t>(-1);
}

bool open_socket(listener *self, std::string *out_error) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    strlcpy(address.sun_path, self->path.c_str(), sizeof address.sun_path);
    struct stat about;
    // A socket was left by a killed mgmtd, because this one holds the lock. A directory can't be unlinked.
    if (unlink(address.sun_path) != 0 && errno == EISDIR && lstat(address.sun_path, &about) == 0 &&
        !move_aside(self, self->path, about.st_uid, out_error))
        return false;
    self->socket = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (self->socket < 0)
        return fail_with_errno(out_error, "socket");
    // Clients may connect with a shorter address length. The kernel compares the path only, up to its zero
    // byte.
    // A chmod after bind would be too late: others could connect in between.
    const mode_t before = umask(0177);
    const int bound = bind(self->socket, reinterpret_cast<sockaddr *>(&address), sizeof address);
    umask(before);
    if (bound == 0)
        admit_viewers(self);
    if (bound != 0 || listen(self->socket, BACKLOG) != 0 || lstat(address.sun_path, &about) != 0)
        return fail_with_errno(out_error, self->path);
    self->group = about.st_gid;
    self->device = about.st_dev;
    self->inode = about.st_ino;
    return true;
}

bool open_place(listener *self, std::string *out_error) {
    if (!open_directory(self, &self->directory, out_error))
        return false;
    listener_tidy(self);
    return open_socket(self, out_error);
}

void close_place(listener *self) {
    close_fd(&self->socket);
    close_fd(&self->directory);
}

} // namespace

bool listener_open(listener *self, std::string *out_error) {
    self->path = provider_path();
    if (const group *viewers = getgrnam(self->viewers_group.c_str()))
        self->viewers = viewers->gr_gid;
    return take_lock_file(self, out_error) && open_place(self, out_error);
}

namespace {

bool is_in_place(const listener &self) {
    struct stat about;
    return self.socket >= 0 && lstat(self.path.c_str(), &about) == 0 && about.st_dev == self.device &&
           about.st_ino == self.inode;
}

} // namespace

void listener_check(listener *self) {
    if (is_in_place(*self))
        return;
    // Nobody can connect to the old socket any more, which has lost its name.
    close_place(self);
    std::string error;
    if (open_place(self, &error)) {
        self->say(self->path + " was removed and has been made again");
        self->complaint.clear();
        return;
    }
    // Closes what was opened before the failure. The next check tries again.
    close_place(self);
    if (error != self->complaint)
        self->say(self->path + " was removed and can't be made again: " + error);
    self->complaint = error;
}

void listener_close(listener *self) {
    // Another program's socket may have the name by now.
    if (is_in_place(*self))
        unlink(self->path.c_str());
    close_place(self);
    close_fd(&self->lock);
}
