// The page as a whole: the headline, numbers at a glance, what needs attention and what to do about it,
// alarms, the groups, traffic, and the legend.
#include <algorithm>

#include "peers/mgmtctl/html_parts.h"

namespace {

constexpr size_t EACH_BUCKET_GROUPS = 16; // with more groups, a run of buckets has one title
constexpr size_t LISTED_REASONS = 24;     // above the groups, whose cards list all of them

// --- The headline

struct headline {
    style how;
    std::string title, detail;
};

bool is_running(const snapshot &shown) {
    return shown.wccpd == wccpd_condition::running;
}

std::vector<const snapshot_group *> groups_in_need(const html_view &view, bool wanted) {
    std::vector<const snapshot_group *> out;
    for (const snapshot_group &group : view.shown.groups)
        if (needs_attention(view, group) == wanted)
            out.push_back(&group);
    return out;
}

headline choose_headline(const html_view &view) {
    const snapshot &shown = view.shown;
    if (!shown.unreachable.empty())
        return {style::bad, "mgmtd does not answer",
                "Nothing is known of this appliance: " + shown.unreachable};
    if (!is_running(shown))
        return {style::bad,
                shown.wccpd == wccpd_condition::absent ? "wccpd is not running" : "wccpd does not answer",
                "The state of groups and routers is unknown; what is configured is shown."};
    const auto needing = groups_in_need(view, true);
    const auto first = std::find_if(view.reasons.begin(), view.reasons.end(),
                                    [](const reason &each) { return each.attention; });
    const bool known = first != view.reasons.end();
    const style how = shown.alarms_total > 0 ? style::bad : style::warn;
    std::string detail = known                    ? first->cause
                         : shown.alarms_total > 0 ? plural_text(shown.alarms_total, "alarm")
                                                  : "A router's table is not as wanted.";
    // One group, and the first reason is its own: the title names it.
    if (needing.size() == 1 && (!known || first->group == needing[0]->id))
        return {how, "Group " + std::to_string(needing[0]->id) + " needs attention", detail};
    // The title counts groups; the detail has to name its own.
    if (known && first->group >= 0)
        detail = "Group " + std::to_string(first->group) + ": " + detail;
    if (!needing.empty())
        return {how,
                std::to_string(needing.size()) + " of " + plural_text(shown.groups_total, "group") +
                    (needing.size() == 1 ? " needs attention" : " need attention"),
                detail};
    if (known || shown.alarms_total > 0)
        return {how, "The appliance needs attention", detail};
    if (shown.groups_total == 0)
        return {style::dim, "No group is configured", "Nothing is redirected to this appliance."};
    return {style::good, "Nothing needs attention", group_counts(shown)};
}

void add_head(std::string *out, const html_view &view, const headline &head) {
    const page_origin &origin = view.origin;
    add_html(out, "<p class=\"made\">WCCP appliance <b>", origin.host, "</b> \u00b7 ", origin.made,
             " \u00b7 mgmtctl ", origin.version);
    if (!view.shown.mode.empty())
        add_html(out, " \u00b7 mode ", view.shown.mode);
    const char *classes[] = {"plain", "plain", "plain", "good", "warn", "bad"};
    add_html(out, "</p>\n<header class=\"head ", classes[static_cast<size_t>(head.how)], "\">",
             symbol_of(head.how), "<div><h1>", head.title, "</h1><p>", head.detail, "</p></div></header>\n");
}

// --- Numbers at a glance

void add_tile(std::string *out, const char *name, const html_markup &value, const std::string &below) {
    add_html(out, "<div><dt>", name, "</dt><dd>", value);
    if (!below.empty())
        add_html(out, "<small>", below, "</small>");
    add_html(out, "</dd></div>\n");
}

std::string part_text(size_t part, size_t whole) {
    return std::to_string(part) + " of " + std::to_string(whole);
}

void add_group_tiles(std::string *out, const snapshot &shown) {
    size_t routers = 0, connected = 0;
    for (const snapshot_group &group : shown.groups) {
        routers += group.routers.size();
        connected += connected_routers(group);
    }
    const std::string counts = group_counts(shown);
    // The tile has its own title: only the part after "2 groups: " is shown.
    const size_t colon = counts.find(": ");
    add_tile(out, "Groups", html_of(shown.groups_total),
             colon == std::string::npos ? "" : counts.substr(colon + 2));
    add_tile(out, "Routers", is_running(shown) ? html_of(part_text(connected, routers)) : unknown_badge(),
             "two-way");
    add_tile(out, "Alarms",
             shown.alarms_total == 0 && !is_running(shown) ? unknown_badge()
             : shown.alarms_total == 0                     ? html_of("none")
                                       : html_of(symbol_of(style::bad), " ", shown.alarms_total),
             "");
}

void add_traffic_tiles(std::string *out, const traffic_state &traffic) {
    const bool running = traffic.tunneld == tunneld_condition::running;
    size_t up = 0;
    int64_t flows = 0;
    bool counted = running;
    for (const traffic_intercept &each : traffic.intercepts) {
        up += each.proxy == "up";
        flows += std::max<int64_t>(each.flows, 0);
        counted = counted && each.flows >= 0;
    }
    add_tile(out, "Proxies", running ? html_of(part_text(up, traffic.intercepts.size())) : unknown_badge(),
             "up");
    add_tile(out, "Flows", counted ? html_of(flows) : unknown_badge(), "of proxies");
    add_tile(out, "Tunnels", running ? html_of(traffic.tunnels.size()) : unknown_badge(),
             running ? traffic.plane + " plane" : "");
}

void add_tiles(std::string *out, const snapshot &shown) {
    const std::string wccpd = is_running(shown) ? shown.status.empty() ? "running" : shown.status
                              : shown.wccpd == wccpd_condition::absent ? "not running"
                                                                       : "no answer";
    const bool tunneld = shown.traffic.tunneld == tunneld_condition::running;
    add_html(out, "<dl class=\"tiles\">\n");
    add_tile(out, "wccpd", is_running(shown) ? html_of(wccpd) : html_of(symbol_of(style::bad), " ", wccpd),
             shown.version);
    add_tile(out, "tunneld",
             tunneld
                 ? html_of("running")
                 : html_of(symbol_of(style::bad), " ",
                           shown.traffic.tunneld == tunneld_condition::absent ? "no session" : "no answer"),
             "");
    add_group_tiles(out, shown);
    add_traffic_tiles(out, shown.traffic);
    add_html(out, "</dl>\n");
}

// --- Reasons and alarms

// Reasons of the appliance as a whole and, if several groups need attention, of all groups. A single group
// shows its own in its card.
void add_attention(std::string *out, const html_view &view) {
    const bool several = groups_in_need(view, true).size() > 1;
    size_t count = 0;
    for (const reason &each : view.reasons) {
        // The count goes on beyond the limit, for the line below.
        if (!each.attention || (each.group >= 0 && !several) || ++count > LISTED_REASONS)
            continue;
        if (count == 1)
            add_html(out, "<h2>What to do</h2>\n");
        add_reason(out, each, true);
    }
    if (count > LISTED_REASONS)
        add_html(out, "<p class=\"dim\">and ", count - LISTED_REASONS, " more, with their groups</p>\n");
}

void add_alarms(std::string *out, const html_view &view) {
    const snapshot &shown = view.shown;
    if (shown.alarms.empty())
        return;
    add_html(out, "<h2>Alarms</h2>\n<div class=\"card\">");
    open_table(out, "alarms");
    for (const snapshot_alarm &alarm : shown.alarms) {
        add_html(out, "<tr><td>",
                 make_badge(style::bad, alarm.name.empty() ? std::to_string(alarm.type) : alarm.name),
                 "</td><td>");
        if (alarm.group >= 0)
            add_html(out, "<a href=\"#group-", alarm.group, "\">", alarm.group, "</a>");
        else
            add_html(out, alarm.source);
        add_html(out, "</td><td>", known_or_unknown(alarm.since), "</td><td>",
                 alarm_cause(alarm, view.reasons), "</td><td>", known_or_unknown(alarm.reporter),
                 "</td></tr>\n");
    }
    close_table(out);
    if (shown.alarms.size() < shown.alarms_total)
        add_html(out, "<p class=\"dim\">and ", plural_text(shown.alarms_total - shown.alarms.size(), "alarm"),
                 " more</p>\n");
    add_html(out, "</div>\n");
}

// --- Groups and legend

void add_groups(std::string *out, const html_view &view) {
    const auto needing = groups_in_need(view, true), others = groups_in_need(view, false);
    if (!needing.empty())
        add_html(out, "<h2>", needing.size() == 1 ? "Group that needs" : "Groups that need",
                 " attention</h2>\n");
    for (const snapshot_group *group : needing)
        add_group(out, view, *group);
    if (!others.empty())
        add_html(out, "<h2>", needing.empty() ? "Groups" : "Other groups", "</h2>\n");
    for (const snapshot_group *group : others)
        add_group(out, view, *group);
    if (view.shown.groups.size() < view.shown.groups_total)
        add_html(
            out, "<p>",
            make_badge(style::warn, plural_text(view.shown.groups_total - view.shown.groups.size(), "group") +
                                        " not shown"),
            " gathering them would take too many queries</p>\n");
}

void add_legend(std::string *out) {
    const auto cell = [](const char *classes, const char *letter) {
        return html_of("<span class=\"cells\"><b class=\"", classes, "\"><i>", letter, "</i></b></span>");
    };
    add_html(out, "<h2>Legend</h2>\n<div class=\"card legend\">\n<p>", cell("o0", "A"), cell("o1", "B"),
             "<span>the bucket or mask value belongs to appliance A, B</span></p>\n<p>", cell("none", "-"),
             "<span>no owner: routers do not redirect it</span></p>\n<p>", cell("o1 other", "B"),
             "<span>framed and underlined: the router's owner is not the wanted one</span></p>\n<p>"
             "<span class=\"bar o0\" style=\"--has:40%;--wanted:60%\"></span>"
             "<span>the share that routers report; the mark is the wanted share</span></p>\n<p>",
             make_badge(style::good, "good"), make_badge(style::warn, "warning"),
             make_badge(style::bad, "fault"), unknown_badge(),
             "</p>\n<p><span>The wanted table is the one that the designated appliance has computed; wanted "
             "shares follow from it, or else from the weights. Each line begins with the number of its "
             "first bucket or value.</span></p></div>\n");
}

} // namespace

std::string draw_page(const snapshot &shown, const page_origin &origin) {
    const std::vector<reason> reasons = reasons_of(shown);
    const html_view view = {shown, reasons, origin, shown.groups.size() <= EACH_BUCKET_GROUPS};
    const headline head = choose_headline(view);
    std::string out;
    // The policy forbids whatever is not in the file, should an escape ever be missing.
    add_html(
        &out,
        "<!DOCTYPE html>\n<html lang=\"en\"><head><meta charset=\"utf-8\">\n"
        "<meta http-equiv=\"Content-Security-Policy\" content=\"default-src 'none'; style-src "
        "'unsafe-inline'; img-src data:\">\n"
        "<meta name=\"viewport\" content=\"width=device-width, initial-scale=1\">\n"
        "<meta name=\"color-scheme\" content=\"light dark\">\n<link rel=\"icon\" href=\"data:,\">\n<title>",
        origin.host, ": ", head.title, " (WCCP)</title>\n<style>", html_markup{html_style()},
        "</style></head>\n<body><main>\n");
    add_head(&out, view, head);
    if (shown.unreachable.empty())
        add_tiles(&out, shown);
    add_attention(&out, view);
    add_alarms(&out, view);
    if (shown.unreachable.empty()) {
        add_groups(&out, view);
        add_traffic(&out, view);
    }
    if (!shown.groups.empty())
        add_legend(&out);
    add_html(&out, "</main>\n<footer>One snapshot, made on ", origin.host, " at ", origin.made,
             " by mgmtctl ", origin.version, "; wccpd ", shown.version.empty() ? "unknown" : shown.version,
             ". Durations end at that time.</footer>\n</body></html>\n");
    return out;
}
