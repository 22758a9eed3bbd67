// The daemon ignores its arguments, except for the two that ask for its help text or version.
#include <cstdio>
#include <cstring>

#include "daemon/wccpd_main.h"
#include "runtime/version.h"

namespace {

const char HELP[] =
    "Usage: wccpd\n"
    "Makes this appliance a member of WCCP version 2 service groups. wccpd has no options and no "
    "configuration\n"
    "file: it gets its configuration from mgmtd, which must be running, and logs to syslog.\n"
    "  --help      print this text\n"
    "  --version   print the version\n"
    "SIGTERM, SIGINT and SIGHUP make it exit cleanly. See wccpd(8), mgmtctl(1) and mgmtd.conf(5).\n";

} // namespace

int main(int argc, char **argv) {
    const char *question = argc == 2 ? argv[1] : "";
    if (strcmp(question, "--version") == 0)
        return printf("wccpd %s\n", wccp_version()) < 0 || fflush(stdout) != 0;
    if (strcmp(question, "--help") == 0)
        return fputs(HELP, stdout) < 0 || fflush(stdout) != 0;
    return wccpd_main();
}
