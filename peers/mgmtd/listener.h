// The socket on which clients reach mgmtd, its directory, and the lock that prevents a second mgmtd.
#pragma once

#include <functional>
#include <string>

#include <sys/types.h>

constexpr const char *VIEWERS_GROUP = "wccpd";                 // users with read-only access
constexpr const char *MGMTD_LOCK_FILE = "/var/run/mgmtd.lock"; // when mgmtd runs as root

struct listener {
    std::function<void(const std::string &line)> say;
    int lock = -1, directory = -1;
    int socket = -1; // non-blocking
    std::string path;
    std::string viewers_group = VIEWERS_GROUP;
    gid_t viewers = static_cast<gid_t>(-1); // the members may connect; -1: the group does not exist
    gid_t group = 0;                        // of the socket's file, as its device and inode
    dev_t device = 0;
    ino_t inode = 0;
    std::string complaint; // that was logged last, so that it is not repeated
};

// Makes the directory and the socket. At no moment do they have another owner or a wider mode. False with the
// reason, for example when another mgmtd runs.
bool listener_open(listener *self, std::string *out_error);
// Call it from time to time. If the socket or its directory was removed or replaced, clients no longer find
// mgmtd; both are then made again. Open connections are not affected.
void listener_check(listener *self);
// Removes sockets whose clients no longer exist.
void listener_tidy(const listener *self);
void listener_close(listener *self);
