// The socket on which clients reach mgmtd, the directory that it lies in, and the lock that keeps a second
// mgmtd off.
#pragma once

#include <functional>
#include <string>

#include <sys/types.h>

constexpr const char *VIEWERS_GROUP = "wccpd";                 // of the users who may look, but not change
constexpr const char *MGMTD_LOCK_FILE = "/var/run/mgmtd.lock"; // of root's mgmtd

struct listener {
    std::function<void(const std::string &line)> say;
    int lock = -1, directory = -1;
    int socket = -1; // non-blocking
    std::string path;
    std::string viewers_group = VIEWERS_GROUP;
    gid_t viewers = static_cast<gid_t>(-1); // may connect; -1: there is no such group
    gid_t group = 0;                        // of the socket's file
    dev_t device = 0;                       // of the socket's file
    ino_t inode = 0;
    std::string complaint; // the last one, which isn't repeated
};

// Makes the directory and the socket, with their owner and mode from the first moment. False with the reason,
// also when another mgmtd runs.
bool listener_open(listener *self, std::string *out_error);
// When clients no longer find the socket under its path, because it or the directory was removed or replaced,
// both are made again. Connections are not affected.
void listener_check(listener *self);
// Removes the sockets of clients that are gone.
void listener_tidy(const listener *self);
void listener_close(listener *self);
