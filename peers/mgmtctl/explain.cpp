// "mgmtctl explain": each reason with its cause, its time and the next step.
#include <algorithm>

#include "peers/mgmtctl/link.h"
#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_gather.h"
#include "peers/mgmtctl/show_json.h"

// The exit codes are explain's own: scripts ask whether anything needs attention.
enum explain_exit : int { EXPLAIN_FINE = 0, EXPLAIN_ATTENTION = 1, EXPLAIN_FAILED = 2 };

namespace {
std::string heading_of(const snapshot &shown, int id) {
    if (id < 0)
        return "appliance\n";
    std::string text = "group " + std::to_string(id);
    for (const snapshot_group &group : shown.groups)
        if (group.id == id && group.running)
            text += "  " + group.state + (group.designated ? ", designated" : "");
    return text + "\n";
}

std::string reason_words(const reason &one) {
    const std::string times = reason_times(one);
    return "  " + one.code + ": " + one.cause + "\n" + (times.empty() ? "" : "    " + times + "\n") +
           "    next: " + one.next + "\n";
}

void print_reasons(const snapshot &shown, const std::vector<reason> &reasons) {
    std::vector<int> ids;
    if (std::any_of(reasons.begin(), reasons.end(), [](const reason &each) { return each.group < 0; }))
        ids.push_back(-1);
    for (const snapshot_group &group : shown.groups)
        ids.push_back(group.id);
    for (const int id : ids) {
        write_output(heading_of(shown, id));
        if (!main_reason(reasons, id))
            write_output(id < 0 || shown.wccpd == wccpd_condition::running ? "  nothing needs attention\n"
                                                                           : "  unknown without wccpd\n");
        for (const reason &each : reasons)
            if (each.group == id)
                write_output(reason_words(each));
    }
    if (ids.empty())
        write_output("no group is configured\n");
}
} // namespace

int tell_reasons(const ctl_options &options, const snapshot &shown, int group) {
    std::vector<reason> reasons = reasons_of(shown);
    // Reasons of the whole appliance stay: they can keep any group from working.
    std::erase_if(reasons,
                  [&](const reason &each) { return group >= 0 && each.group >= 0 && each.group != group; });
    const bool failed = !shown.unreachable.empty() || (group >= 0 && shown.groups.empty());
    const bool attention =
        std::any_of(reasons.begin(), reasons.end(), [](const reason &each) { return each.attention; });
    const int exit = failed ? EXPLAIN_FAILED : attention ? EXPLAIN_ATTENTION : EXPLAIN_FINE;
    if (failed && shown.unreachable.empty())
        return tell_failure(options, {exit, "", "there is no group " + std::to_string(group), "", 0});
    if (options.json) {
        ctl_json all = ctl_json::array();
        for (const reason &each : reasons)
            all.push_back(reason_json(each));
        write_output(json_line({{"attention", attention}, {"reasons", all}, {"exit", exit}}));
    } else {
        print_reasons(shown, reasons);
    }
    return exit;
}

int ctl_explain(const ctl_options &options, int group) {
    const ctl_link link = link_to_mgmtd(options);
    snapshot_limits limits;
    limits.only = group;
    return tell_reasons(options, gather_snapshot(link.query, limits), group);
}

int ctl_list_reasons(const ctl_options &options) {
    ctl_json all = ctl_json::array();
    for (const reason_text &row : reason_texts())
        all.push_back(
            {{"reason", row.code}, {"attention", row.attention}, {"cause", row.cause}, {"next", row.next}});
    write_output(options.json ? json_line(all) : reason_table_markdown());
    return EXPLAIN_FINE;
}
