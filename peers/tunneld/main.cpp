// tunneld [--plane auto|kernel|user|table] [--return-redirect] [--json] [--roles] [--slow MS] [--refuse]
//         [--silent] [--index N]
#include <CLI/CLI.hpp>

#include "peers/tunneld/tunneld.h"
#include "runtime/version.h"

// NOLINTNEXTLINE(bugprone-exception-escape): memory that runs out ends this program
int main(int argc, char **argv) {
    tunneld_options options;
    CLI::App app{"The tunnel daemon: carries redirected packets to local proxies and back to the routers."};
    app.set_version_flag("--version", std::string("tunneld ") + wccp_version());
    app.add_option("--plane", options.plane,
                   "the data plane: kernel (GRE of the kernel), user (user space), table (none: a table of "
                   "tunnels, for tests), or auto: the first of kernel and user that works here")
        ->check(CLI::IsMember({"auto", "kernel", "user", "table"}))
        ->capture_default_str();
    app.add_flag("--return-redirect", user_plane_settings.redirect_header,
                 "return packets to the routers with their redirect header; user-space data plane only");
    app.add_flag("--json", options.commands.json, "one JSON object for each command");
    app.add_flag("--roles", options.commands.roles, "print changes of policy group roles as well");
    app.add_option("--slow", options.commands.slow_ms, "delay each command by this many milliseconds");
    app.add_flag("--refuse", options.commands.refuse, "answer every command with a failure");
    app.add_flag("--silent", options.commands.silent, "don't answer commands");
    app.add_option("--index", options.commands.first_index,
                   "index of the first tunnel with --plane table; 4294967295 gives none, which makes an add "
                   "fail");
    CLI11_PARSE(app, argc, argv);
    // The kernel's GRE links cannot send redirect headers.
    if (user_plane_settings.redirect_header && options.plane == "auto")
        options.plane = "user";
    return run_tunneld(options);
}
