// mgmtd and wccpd as far as the queries of mgmtctl go: they have these nodes.
#pragma once

#include <cstring>
#include <sstream>

#include "peers/mgmtctl/session.h"
#include "runtime/common.h"

// Bindings from "NAME TYPE VALUE|NAME TYPE VALUE|" and so on. A "%" at the beginning of a name stands for
// `root`.
inline std::vector<ctl_binding> bindings_of(const std::string &root, const std::string &text) {
    std::vector<ctl_binding> out;
    std::istringstream in(text);
    for (ctl_binding one; in >> one.name >> one.type && std::getline(in.ignore(), one.value, '|');)
        out.push_back({one.name[0] == '%' ? root + one.name.substr(1) : one.name, one.type, one.value});
    return out;
}

struct canned_nodes {
    std::vector<ctl_binding> nodes;
    size_t asked = 0;
    size_t most = SIZE_MAX;       // of nodes in an answer
    size_t lost_after = SIZE_MAX; // so many queries
    uint32_t wccpd_code = 0;      // of its answers

    void add(const std::string &name, const std::string &value) { nodes.push_back({name, "string", value}); }
    bool operator()(ctl_walk walk, const std::string &name, ctl_reply *out,
                    std::string *out_reason = nullptr) {
        if (out_reason)
            *out_reason = "mgmtd closed the session";
        if (asked++ >= lost_after)
            return false;
        if (name.find("/state") != std::string::npos && name.starts_with("/qv/wccpd"))
            out->code = wccpd_code;
        const std::string above = name.ends_with('/') ? name : name + "/";
        for (const ctl_binding &node : nodes) {
            // Most of these 10 million comparisons end here, without functions that are not optimised.
            if (node.name.size() < name.size() || memcmp(node.name.data(), name.data(), name.size()) != 0)
                continue;
            const bool below = node.name.starts_with(above);
            if (out->code == 0 &&
                (walk == ctl_walk::children ? below && node.name.find('/', above.size()) == std::string::npos
                                            : node.name == name || (walk == ctl_walk::subtree && below)))
                out->bindings.push_back(node);
        }
        if (out->bindings.size() > most)
            *out = {LC_NO_BUFFER_SPACE, "ask for less", {}};
        return true;
    }
};
