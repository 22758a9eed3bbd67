#include "peers/mgmtctl/link.h"

namespace {
struct held_session {
    int64_t timeout_ms;
    ctl_session *session = nullptr;

    explicit held_session(int64_t limit_ms) : timeout_ms(limit_ms) {}
    held_session(const held_session &) = delete;
    held_session &operator=(const held_session &) = delete;
    ~held_session() {
        if (session)
            ctl_close(session);
    }
    bool open(std::string *out_reason) {
        if (!session)
            session = ctl_open(timeout_ms, out_reason);
        return session != nullptr;
    }
};
} // namespace

ctl_link link_to_mgmtd(const ctl_options &options) {
    // Shared by the functions below and their copies. The last of them closes it.
    const auto held = std::make_shared<held_session>(options.timeout_ms);
    ctl_link link;
    link.query = [held](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason) {
        return held->open(out_reason) && ctl_query(held->session, walk, name, out, out_reason);
    };
    link.query_all = [held](ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out,
                            std::string *out_reason) {
        return held->open(out_reason) && ctl_query_all(held->session, walk, names, out, out_reason);
    };
    const ctl_order order = {options.cause};
    link.set = [held, order](const std::vector<ctl_change_item> &items, ctl_reply *out,
                             std::string *out_reason) {
        return held->open(out_reason) && ctl_set(held->session, items, order, out, out_reason);
    };
    link.action = [held](const std::string &name, const std::vector<ctl_binding> &bindings, ctl_reply *out,
                         std::string *out_reason) {
        return held->open(out_reason) && ctl_action(held->session, name, bindings, out, out_reason);
    };
    return link;
}
