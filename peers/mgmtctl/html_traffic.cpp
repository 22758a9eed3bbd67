// Redirected traffic on the page: what became of the packets of each intercept, tunnels, packets that were
// refused, and flows that other appliances have.
#include "peers/mgmtctl/html_parts.h"

namespace {

html_markup count_cell(uint64_t count) {
    return html_of("<td class=\"num", count == 0 ? " zero" : "", "\">", count_text(count), "</td>");
}

html_markup count_cell(const traffic_count &count) {
    if (count.packets == 0)
        return count_cell(0);
    return html_of("<td class=\"num\" title=\"", count.packets, " packets, ", count.bytes, " bytes\">",
                   count_text(count.packets), "</td>");
}

void add_intercept(std::string *out, const traffic_intercept &one) {
    const style how = one.proxy == "up" ? style::good : one.proxy == "down" ? style::bad : style::warn;
    add_html(out, "<tr><td><a href=\"#group-", one.group, "\">Group ", one.group, "</a></td><td>",
             make_badge(how, one.proxy.empty() ? "unknown" : one.proxy));
    if (one.proxy_ms > 0)
        add_html(out, " <span class=\"dim\">for ", duration_text(one.proxy_ms), "</span>");
    if (one.proxy == "down" && !one.proxy_reason.empty())
        add_html(out, " ", one.proxy_reason);
    for (const auto &[holds, words] :
         {std::pair(!one.active, "standing by"), std::pair(one.left, "left its routers"),
          std::pair(one.overloaded, "overloaded")})
        if (holds)
            add_html(out, " ", make_badge(style::warn, words));
    if (one.weight_percent < 100)
        add_html(out, " ", make_badge(style::plain, std::to_string(one.weight_percent) + "% of its weight"));
    add_html(out, "</td><td class=\"num\">", one.flows < 0 ? unknown_badge() : html_of(one.flows), "</td>");
    for (const sorted_way &way : sorted_ways()) {
        const auto found = one.sorted.find(way.word);
        add_html(out, count_cell(found == one.sorted.end() ? traffic_count{} : found->second));
    }
    add_html(out, "</tr>\n");
}

std::string refused_text(const refused_counts &refused) {
    std::string out;
    for (const auto &[why, packets] : refused)
        if (packets > 0)
            out += (out.empty() ? "" : ", ") + why + " " + count_text(packets);
    return out;
}

std::string bytes_text(uint64_t bytes) {
    const std::string count = count_text(bytes);
    // "512 B", but "12kB".
    return count + (count.back() >= '0' && count.back() <= '9' ? " B" : "B");
}

void add_tunnel(std::string *out, const traffic_tunnel &one) {
    const std::string refused = refused_text(one.refused);
    const auto amount = [](const traffic_count &count) {
        return html_of("<td title=\"", count.packets, " packets, ", count.bytes, " bytes\">",
                       count_text(count.packets), " <span class=\"dim\">", bytes_text(count.bytes),
                       "</span></td>");
    };
    add_html(out, "<tr><td>", one.id, "</td><td>", known_or_unknown(one.remote), "</td><td>",
             known_or_unknown(one.local), "</td><td>", known_or_unknown(one.interface), "</td>",
             amount(one.in), amount(one.out), count_cell(one.fragments), "<td",
             refused.empty() ? html_of(" class=\"zero\">0") : html_of(">", refused), "</td></tr>\n");
}

void add_refused(std::string *out, const traffic_state &traffic) {
    const std::string refused = refused_text(traffic.refused);
    if (refused.empty() && traffic.refused_sources.empty() && traffic.accepted.empty())
        return;
    add_html(out, "<div class=\"card\"><h3>Packets of no tunnel</h3>");
    if (!refused.empty())
        add_html(out, "<p>Refused: ", refused, "</p>\n");
    if (!traffic.refused_sources.empty() || !traffic.accepted.empty()) {
        open_table(out, "refused");
        // The counters keep packets that came before their source was accepted.
        for (const auto &[address, packets] : traffic.refused_sources)
            add_html(out, "<tr><td>", address, "</td><td>", count_text(packets), "</td><td>",
                     traffic.accepted.contains(address)
                         ? make_badge(style::good, "accepted since")
                         : html_of(make_badge(style::warn, "refused"), " <code>mgmtctl tunnel accept ",
                                   address, "</code>"),
                     "</td></tr>\n");
        for (const auto &[address, router] : traffic.accepted)
            if (!traffic.refused_sources.contains(address))
                add_html(out, "<tr><td>", address, "</td><td class=\"zero\">0</td><td>",
                         make_badge(style::good, "accepted"), router.empty() ? "" : " beside router ", router,
                         "</td></tr>\n");
        close_table(out);
    }
    add_html(out, "</div>\n");
}

void add_protection(std::string *out, const protection_state &state) {
    add_html(out, "<div class=\"card\"><h3>Protection of flows</h3><p>");
    if (state.time == 0)
        add_html(out, "switched off");
    else
        add_html(out, "for ", state.time, " s \u00b7 packets ", separate_by_dots(protection_text(state.sum)));
    add_html(out, "</p>\n");
    for (const protected_group &each : state.groups)
        if (!each.covered && state.time != 0)
            add_html(out, "<p>",
                     make_badge(style::plain, "group " + std::to_string(each.group) + " not covered"), " ",
                     each.reason, "</p>\n");
    if (!state.members.empty()) {
        open_table(out, "members");
        for (const auto &[address, counts] : state.members)
            add_html(out, "<tr><td>", address, "</td>", count_cell(counts.passed),
                     count_cell(counts.received), count_cell(counts.delivered), count_cell(counts.returned),
                     "</tr>\n");
        close_table(out);
    }
    add_html(out, "</div>\n");
}

} // namespace

void add_traffic(std::string *out, const html_view &view) {
    const traffic_state &traffic = view.shown.traffic;
    add_html(out, "<h2>Traffic</h2>\n");
    for (const traffic_drain &each : traffic.drains)
        add_html(out, "<p>", make_badge(style::warn, "group " + std::to_string(each.group)), " ",
                 drain_text(each, view.origin.now), "</p>\n");
    if (traffic.tunneld != tunneld_condition::running) {
        add_html(out, "<div class=\"card\"><p>", unknown_badge(), " tunneld ",
                 traffic.tunneld == tunneld_condition::absent ? "has no session" : "does not answer",
                 ": intercepts, proxies, flows and tunnels</p></div>\n");
        return;
    }
    add_html(out, "<div class=\"card\"><h3>Intercepts, in packets</h3>");
    if (traffic.intercepts.empty())
        add_html(out, "<p class=\"dim\">none: all redirected packets are returned</p>");
    else {
        open_table(out, "intercepts");
        for (const traffic_intercept &each : traffic.intercepts)
            add_intercept(out, each);
        close_table(out);
    }
    add_html(out, "</div>\n<div class=\"card\"><h3>Tunnels</h3><p>Data plane <b>", traffic.plane, "</b>");
    if (!traffic.plane_reason.empty())
        add_html(out, " <span class=\"dim\">(", traffic.plane_reason, ")</span>");
    if (traffic.clamped > 0)
        add_html(out, " \u00b7 MSS clamped in ", count_text(traffic.clamped), " SYN-ACKs");
    if (traffic.own > 0)
        add_html(out, " \u00b7 ", count_text(traffic.own),
                 " packets of this appliance's own were redirected");
    add_html(out, "</p>\n");
    for (const std::string &wrong : {traffic.lack, traffic.failure})
        if (!wrong.empty())
            add_html(out, "<p>", make_badge(style::bad, "kernel"), " ", wrong, "</p>\n");
    if (traffic.tunnels.empty())
        add_html(out, "<p class=\"dim\">none</p>");
    else {
        open_table(out, "tunnels");
        for (const traffic_tunnel &each : traffic.tunnels)
            add_tunnel(out, each);
        close_table(out);
    }
    add_html(out, "</div>\n");
    add_refused(out, traffic);
    add_protection(out, traffic.protection);
}
