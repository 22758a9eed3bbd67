// The requests that a command makes, as functions, so that a test can answer them.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "peers/mgmtctl/commands.h"

struct ctl_link {
    std::function<bool(ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason)>
        query;
    std::function<bool(ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out,
                       std::string *out_reason)>
        query_all;
    std::function<bool(const std::vector<ctl_change_item> &items, ctl_reply *out, std::string *out_reason)>
        set;
    std::function<bool(const std::string &name, const std::vector<ctl_binding> &bindings, ctl_reply *out,
                       std::string *out_reason)>
        action;
    int64_t settle_ms = 5000;  // how long wccpd may take to follow
    int64_t session_ms = 3000; // how long tunneld may take to open its session
};

// A link that opens its session at the first request, so that a wrong command line is reported without mgmtd
// as well, and closes it with the last copy of the link.
ctl_link link_to_mgmtd(const ctl_options &options);
