// "mgmtctl drain": groups are emptied before they leave their routers. mgmtd keeps the request and its time.
// Waiting here only reads the progress, and can be interrupted without consequence.
#include <algorithm>
#include <charconv>
#include <ctime>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/intercepts.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_model.h"
#include "peers/mgmtctl/traffic_json.h"
#include "runtime/common.h"

namespace {
constexpr timespec LOOK_AGAIN = {0, 500'000'000};

struct drain_wish {
    enum { begin, cancel, show } verb = begin;
    std::string group;   // "": all
    std::string seconds; // "": as configured
    bool wait = false;
};

// Returns "", or the error.
std::string parse_wish(const std::vector<std::string> &words, drain_wish *out) {
    static const char *const USAGE = "drain [GROUP] [for SECONDS] [wait], drain cancel [GROUP], drain show";
    size_t at = 0;
    if (!words.empty() && (words[0] == "cancel" || words[0] == "show")) {
        out->verb = words[0] == "cancel" ? drain_wish::cancel : drain_wish::show;
        at = 1;
    }
    if (at < words.size() && out->verb != drain_wish::show && parse_group_number(words[at], &out->group))
        at++;
    for (; at < words.size(); at++) {
        if (out->verb != drain_wish::begin)
            return USAGE;
        if (words[at] == "wait" && !out->wait)
            out->wait = true;
        else if (words[at] != "for" || !out->seconds.empty())
            return words[at] == "for" || words[at] == "wait"
                       ? USAGE
                       : unknown_word_text(words[at], {"for", "wait", "cancel", "show"});
        else if (++at == words.size() || !parse_group_number(words[at], &out->seconds))
            return "\"for\" needs a number of seconds";
    }
    return "";
}

bool ask_drains(const ctl_link &link, std::vector<traffic_drain> *out, ctl_failure *out_failure) {
    ctl_reply reply;
    out->clear();
    if (!link.query(ctl_walk::subtree, NODE_DRAINS, &reply, &out_failure->error)) {
        out_failure->exit = CTL_UNREACHABLE;
        return false;
    }
    for (const ctl_binding &binding : reply.bindings)
        if (const auto parts = parts_below(NODE_DRAINS, binding.name); !parts.empty())
            take_drain(parts, binding.value, out);
    return true;
}

void put_drain(const traffic_drain &drain) {
    write_output("group " + std::to_string(drain.group) + ": " + drain_text(drain, time(nullptr)) + "\n");
}

// Prints the drains that have changed.
void put_progress(const std::vector<traffic_drain> &before, const std::vector<traffic_drain> &now) {
    for (const traffic_drain &drain : now)
        if (std::none_of(before.begin(), before.end(), [&](const traffic_drain &each) {
                return each.group == drain.group && each.state == drain.state && each.flows == drain.flows;
            }))
            put_drain(drain);
}

void leave_out_others(const std::string &group, std::vector<traffic_drain> *inout) {
    std::erase_if(*inout, [&](const traffic_drain &each) {
        return !group.empty() && std::to_string(each.group) != group;
    });
}

int tell_end(const ctl_options &options, const std::vector<traffic_drain> &drains, size_t expected) {
    const bool cancelled = drains.size() < expected;
    // "over": the group has left although flows were open.
    const bool over =
        std::any_of(drains.begin(), drains.end(), [](const auto &each) { return each.state != "drained"; });
    if (options.json)
        write_output(json_line({{"drains", drains_json(drains)},
                                {"done", cancelled ? "cancelled"
                                         : over    ? "over"
                                                   : "drained"}}));
    else if (cancelled)
        write_output("cancelled\n");
    else if (expected == 0)
        write_output("no group is up\n");
    return cancelled || over ? CTL_REFUSED : CTL_OK;
}

int wait_for_end(const ctl_options &options, const ctl_link &link, const std::string &group) {
    std::vector<traffic_drain> before, drains;
    ctl_failure failure = {CTL_OK, "", "", "", 0};
    size_t expected = 0;
    for (;;) {
        if (!ask_drains(link, &drains, &failure))
            return tell_failure(options, failure);
        leave_out_others(group, &drains);
        // A drain that was seen and is missing later has been cancelled.
        expected = std::max(expected, drains.size());
        if (!options.json)
            put_progress(before, drains);
        (void)fflush(stdout);
        if (drains.size() < expected || std::none_of(drains.begin(), drains.end(), [](const auto &each) {
                return each.state == "draining";
            }))
            return tell_end(options, drains, expected);
        before = drains;
        // After a signal the next query fails, which ends the loop.
        if (!ctl_stop_signal)
            nanosleep(&LOOK_AGAIN, nullptr);
    }
}

int tell_drains(const ctl_options &options, const ctl_link &link, const std::string &group) {
    std::vector<traffic_drain> drains;
    ctl_failure failure = {CTL_OK, "", "", "", 0};
    if (!ask_drains(link, &drains, &failure))
        return tell_failure(options, failure);
    leave_out_others(group, &drains);
    if (options.json)
        write_output(json_line({{"drains", drains_json(drains)}}));
    else
        for (const traffic_drain &drain : drains)
            put_drain(drain);
    return CTL_OK;
}
} // namespace

int run_drain(const ctl_options &options, const ctl_link &link, const std::vector<std::string> &words) {
    drain_wish wish;
    if (const std::string wrong = parse_wish(words, &wish); !wrong.empty())
        return tell_failure(options, {CTL_USAGE, "", wrong, "", 0});
    if (wish.verb == drain_wish::show)
        return tell_drains(options, link, "");
    std::vector<ctl_binding> bindings;
    if (!wish.group.empty())
        bindings.push_back({"group", "string", wish.group});
    if (!wish.seconds.empty())
        bindings.push_back({"seconds", "string", wish.seconds});
    ctl_reply reply;
    std::string reason;
    if (!link.action(wish.verb == drain_wish::cancel ? ACTION_DRAIN_CANCEL : ACTION_DRAIN, bindings, &reply,
                     &reason))
        return tell_failure(options, {CTL_UNREACHABLE, "", reason, "", 0});
    if (reply.code != 0)
        return tell_failure(options, {reply.code == LC_NOT_FOUND ? CTL_NOT_FOUND : CTL_REFUSED, "",
                                      reply.message, "", reply.code});
    if (wish.wait)
        return wait_for_end(options, link, wish.group);
    if (wish.verb == drain_wish::cancel && !options.json) {
        write_output("cancelled\n");
        return CTL_OK;
    }
    return tell_drains(options, link, wish.group);
}

int ctl_drain(const ctl_options &options, const std::vector<std::string> &words) {
    return run_drain(options, link_to_mgmtd(options), words);
}
