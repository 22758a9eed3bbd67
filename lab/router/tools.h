// Two small programs that a lab needs inside its namespaces, as subcommands, so that no package has to be
// installed.
#pragma once

#include <string>

namespace lab {

// Takes over /dev/log and writes each line to the file ("-": standard output) until SIGTERM. As the first
// process of a process namespace it collects the dead as well.
int run_logd(const std::string &file);
// One command to the control socket of a router; its answer goes to standard output. 0, or 1 when
// the answer is an error, 2 when nobody answers.
int run_ctl(const std::string &socket, const std::string &command);
// A listening stream socket under that path, or -1 with errno.
int listen_at(const std::string &path);

} // namespace lab
