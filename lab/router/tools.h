// Small programs that a lab needs inside its namespaces, as subcommands of wccp_router.
#pragma once

#include <string>

namespace lab {

// A log daemon: binds /dev/log and writes each line to the file ("-": standard output) until SIGTERM. It can
// be the first process of a process namespace: zombies are reaped.
int run_logd(const std::string &file);
// Sends a command to the control socket of a router and prints the answer. The exit status: 0; 1 if the
// answer is an error; 2 if there is no answer.
int run_ctl(const std::string &socket, const std::string &command);
// Opens a listening stream socket at that path; -1 with errno on failure.
int listen_at(const std::string &path);

} // namespace lab
