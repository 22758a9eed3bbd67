// The map between the data plane `user` and its program in the kernel: the links whose packets may take the
// shortcut, and what has taken it. C and C++ include it.
#pragma once

#include <linux/types.h>

#define SHORTCUT_LINKS_MAX 1024

struct shortcut_ends {
    __be32 local, remote;
};
struct shortcut_link {
    __u64 packets, bytes; // without outer headers
    __u64 redirect_headers;
    __u32 index; // of the tunnel's interface
    __u32 padding;
};
