// The session of a command that can do nothing without mgmtd.
#pragma once

#include <memory>
#include <string>

#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/render.h"

struct ctl_session_closer {
    void operator()(ctl_session *session) const { ctl_close(session); }
};
using ctl_held_session = std::unique_ptr<ctl_session, ctl_session_closer>;

// A session; or null and the exit code of the failure, which has been printed.
struct connection {
    const ctl_options &options;
    ctl_held_session session;
    std::string reason;
    int code = CTL_OK;

    explicit connection(const ctl_options &wanted) : options(wanted) {
        session.reset(ctl_open(options.timeout_ms, &reason));
        if (!session)
            code = lost();
    }
    int lost() const { return tell_failure(options, {CTL_UNREACHABLE, "", reason, "", 0}); }
    bool ask(ctl_walk walk, const std::string &name, ctl_reply *out) {
        return ctl_query(session.get(), walk, name, out, &reason);
    }
    ctl_ask asker() {
        return
            [this](ctl_walk walk, const std::string &name, ctl_reply *out) { return ask(walk, name, out); };
    }
};
