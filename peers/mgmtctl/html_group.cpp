// One group of the page: a summary line, which remains when the group is folded; then its reasons, routers,
// appliances, and the table of each router beside the wanted one.
#include "peers/mgmtctl/html_parts.h"

#include <algorithm>
#include <numeric>

#include "peers/mgmtctl/reasons.h"

namespace {

constexpr size_t CELLS = 32;        // in each line of a strip
constexpr size_t FEW_GROUPS = 4;    // with so few, none is folded
constexpr size_t NAMED_ROUTERS = 4; // in the caption of a strip; the others are counted

// --- Tables of the routers, compared with the wanted one

int owner_at(const snapshot_table &table, size_t bucket) {
    return bucket < table.owners.size() ? table.owners[bucket] : -1;
}

} // namespace

size_t differing_buckets(const snapshot_table &wanted, const snapshot_table &found) {
    size_t count = 0;
    for (size_t i = 0; i < std::max(wanted.owners.size(), found.owners.size()); i++)
        count += owner_at(wanted, i) != owner_at(found, i);
    return count;
}

namespace {

bool table_differs(const snapshot_group &group) {
    return !group.wanted.owners.empty() &&
           std::any_of(group.tables.begin(), group.tables.end(), [&](const snapshot_table &table) {
               return differing_buckets(group.wanted, table) > 0;
           });
}

} // namespace

bool needs_attention(const html_view &view, const snapshot_group &group) {
    return main_reason(view.reasons, group.id) || is_in_alarm(view.shown, group) || table_differs(group);
}

namespace {

const char *bucket_word(const snapshot_table &table) {
    return table.mask ? "value" : "bucket";
}

// --- A strip

std::string owner_words(const snapshot_group &group, int owner) {
    return owner < 0 ? "nobody"
                     : std::string(1, appliance_letter(owner)) + " " +
                           group.appliances[static_cast<size_t>(owner)].address;
}

// "A 64, B 188, nobody 4": also read aloud to those who cannot see the cells.
std::string counts_text(const snapshot_table &table) {
    std::string out;
    const auto add = [&](int owner, const std::string &name) {
        if (const auto count = std::count(table.owners.begin(), table.owners.end(), owner); count > 0)
            out += (out.empty() ? "" : ", ") + name + " " + std::to_string(count);
    };
    // A table without any owner has been dropped, and is not empty here.
    const int most = *std::max_element(table.owners.begin(), table.owners.end());
    for (int owner = 0; owner <= most; owner++)
        add(owner, std::string(1, appliance_letter(owner)));
    add(-1, "nobody");
    return out;
}

} // namespace

void add_strip(std::string *out, const html_view &view, const snapshot_group &group,
               const snapshot_table &table) {
    // Where the wanted table is unknown nothing differs.
    const auto wanted = [&](size_t bucket) {
        return group.wanted.owners.empty() ? owner_at(table, bucket) : owner_at(group.wanted, bucket);
    };
    const size_t count = table.owners.size();
    add_html(out, "<div class=\"cells\" role=\"img\" aria-label=\"", counts_text(table), "\">");
    for (size_t first = 0, end; first < count; first = end) {
        const int owner = table.owners[first];
        const bool other = owner != wanted(first);
        // Cells with the same owner and the same wanted owner share an element, up to the end of the line.
        for (end = first + 1; end < count && !view.each_bucket && end % CELLS != 0 &&
                              table.owners[end] == owner && wanted(end) == wanted(first);)
            end++;
        if (first % CELLS == 0)
            add_html(out, "<small>", first, "</small>");
        add_html(out, "<b class=\"");
        if (owner < 0)
            add_html(out, "none");
        else
            add_html(out, "o", static_cast<size_t>(owner) % PAGE_COLOURS);
        add_html(out, other ? " other" : "", "\" title=\"", bucket_word(table));
        if (end > first + 1)
            add_html(out, "s ", first, " to ", end - 1);
        else
            add_html(out, " ", first);
        add_html(out, ": ", owner_words(group, owner));
        if (other)
            add_html(out, ", wanted: ", owner_words(group, wanted(first)));
        add_html(out, "\">");
        for (size_t i = first; i < end; i++)
            add_html(out, "<i>", appliance_letter(owner), "</i>");
        add_html(out, "</b>");
    }
    add_html(out, "</div>");
}

namespace {

std::string routers_text(const std::vector<std::string> &routers, size_t most) {
    std::string out;
    for (size_t i = 0; i < std::min(routers.size(), most); i++)
        out += (i == 0 ? "" : ", ") + routers[i];
    return routers.size() <= most ? out : out + " and " + std::to_string(routers.size() - most) + " more";
}

// Tables that differ most come first, beside the wanted one.
std::vector<size_t> order_of_tables(const snapshot_group &group) {
    std::vector<size_t> out(group.tables.size());
    std::iota(out.begin(), out.end(), size_t{0});
    if (!group.wanted.owners.empty())
        std::stable_sort(out.begin(), out.end(), [&](size_t a, size_t b) {
            return differing_buckets(group.wanted, group.tables[a]) >
                   differing_buckets(group.wanted, group.tables[b]);
        });
    return out;
}

html_markup table_state(const snapshot_group &group, size_t place) {
    if (group.wanted.owners.empty())
        return group.tables.size() == 1 ? html_of("reported")
                                        : make_badge(style::warn, "table " + std::to_string(place + 1));
    const size_t differing = differing_buckets(group.wanted, group.tables[place]);
    return differing == 0 ? make_badge(style::good, "as wanted")
                          : make_badge(style::bad, plural_text(differing, bucket_word(group.tables[place])) +
                                                       " not as wanted");
}

void add_wanted_strip(std::string *out, const html_view &view, const snapshot_group &group) {
    add_html(out, "<figure><figcaption><b>Wanted</b> ");
    if (!group.wanted.owners.empty()) {
        add_html(out, "by this appliance, the designated one <small>", counts_text(group.wanted),
                 "</small></figcaption>\n");
        add_strip(out, view, group, group.wanted);
    } else if (!group.running) {
        add_html(out, unknown_badge(), "</figcaption>");
    } else {
        add_html(out, unknown_badge(), "<small>",
                 group.designated ? "this appliance, the designated one, has computed no table yet"
                                  : "only the designated appliance knows it; see its page",
                 "</small></figcaption>");
    }
    add_html(out, "</figure>\n");
}

void add_strips(std::string *out, const html_view &view, const snapshot_group &group) {
    const snapshot_table *any = !group.wanted.owners.empty() ? &group.wanted
                                : !group.tables.empty()      ? &group.tables[0]
                                                             : nullptr;
    add_html(out, "<h3>",
             !any        ? "Buckets"
             : any->mask ? "Mask values"
                         : "Hash buckets",
             "</h3><div class=\"strips\">\n");
    add_wanted_strip(out, view, group);
    for (const size_t place : order_of_tables(group)) {
        const snapshot_table &table = group.tables[place];
        add_html(out, "<figure><figcaption title=\"", routers_text(table.routers, SIZE_MAX), "\"><b>",
                 table.routers.size() == 1 ? "Router " : "Routers ", "</b>",
                 routers_text(table.routers, NAMED_ROUTERS), " ", table_state(group, place), " <small>",
                 counts_text(table), "</small></figcaption>\n");
        add_strip(out, view, group, table);
        add_html(out, "</figure>\n");
    }
    if (group.tables.empty())
        add_html(out, "<figure><figcaption><b>Routers</b> ",
                 group.running ? html_of("<span class=\"dim\">none has reported a table</span>")
                               : unknown_badge(),
                 "</figcaption></figure>\n");
    add_html(out, "</div>\n");
}

// --- Routers and appliances

html_markup connection_badge(const snapshot &shown, const snapshot_group &group,
                             const snapshot_router &router) {
    if (router.connection == "two-way")
        return make_badge(style::good, "two-way");
    if (router.connection == "one-way")
        return make_badge(style::warn, "one-way");
    if (router.connection != "none")
        return unknown_badge();
    if (group.admin == "down" || is_out_of_its_routers(shown, group))
        return make_badge(style::plain, "not asked");
    const snapshot_reason *noted = router_reason(shown, group, router);
    return make_badge(style::bad, noted ? noted->code : "nothing heard");
}

html_markup table_badge(const snapshot_group &group, const snapshot_router &router) {
    const auto table =
        std::find_if(group.tables.begin(), group.tables.end(), [&](const snapshot_table &each) {
            return std::find(each.routers.begin(), each.routers.end(), router.id) != each.routers.end();
        });
    // Such a table has been dropped by drop_misread_tables().
    const bool misread = std::any_of(group.reasons.begin(), group.reasons.end(), [&](const auto &each) {
        return each.code == "method-differs" && (each.sender == router.id || each.sender == router.address);
    });
    if (table == group.tables.end() && misread)
        return make_badge(style::warn, "by another method");
    if (table == group.tables.end())
        return router.connection == "none" ? html_of("<span class=\"dim\">-</span>")
               : group.running && router.connection != "unknown"
                   ? html_of("<span class=\"dim\">none reported</span>")
                   : unknown_badge();
    return table_state(group, static_cast<size_t>(table - group.tables.begin()));
}

void add_router(std::string *out, const snapshot &shown, const snapshot_group &group,
                const snapshot_router &router) {
    const bool heard = router.connection == "two-way" || router.connection == "one-way";
    const auto method = [&](const std::string &word) {
        return !word.empty() ? html_of(word)
               : heard       ? html_of("<span class=\"dim\">none agreed</span>")
                             : html_of("<span class=\"dim\">-</span>");
    };
    const auto own = std::find_if(router.loads.begin(), router.loads.end(),
                                  [&](const auto &load) { return load.appliance == group.address; });
    add_html(out, "<tr><td>", router.address);
    if (router.id != router.address)
        add_html(out, " <span class=\"dim\">id ", router.id, "</span>");
    if (!router.configured)
        add_html(out, " <span class=\"dim\">not configured</span>");
    add_html(out, "</td><td>", connection_badge(shown, group, router), "</td><td>",
             heard ? duration_text(router.connected_ms) : "-", "</td><td>", method(router.forward),
             "</td><td>", method(router.assign), "</td><td>", method(router.back), "</td><td>",
             own == router.loads.end() ? html_of("<span class=\"dim\">-</span>") : html_of(own->percent, "%"),
             "</td><td>", table_badge(group, router), "</td></tr>\n");
}

void add_appliance(std::string *out, const snapshot_group &group, size_t place) {
    const snapshot_appliance &one = group.appliances[place];
    const size_t colour = place % PAGE_COLOURS;
    const bool wanted = one.asked_percent >= 0;
    // A difference of 1 % is rounding.
    const bool short_of =
        wanted && one.reported && std::abs(static_cast<int>(one.least_percent) - one.asked_percent) > 1;
    add_html(out, "<tr><td><span class=\"cells key\"><b class=\"o", colour, "\"><i>",
             appliance_letter(static_cast<int>(place)), "</i></b></span> ", one.address);
    if (one.self)
        add_html(out, " <b>this appliance</b>");
    if (one.self && group.designated)
        add_html(out, " <span class=\"dim\">designated</span>");
    add_html(out, "</td><td>", one.weight < 0 ? unknown_badge() : html_of(one.weight), "</td><td>",
             wanted ? html_of(one.asked_percent, "%") : unknown_badge(), "</td><td>");
    if (!one.reported)
        add_html(out, "<span class=\"dim\">not reported</span>");
    else if (short_of)
        add_html(out, make_badge(style::warn, share_words(one)));
    else
        add_html(out, share_words(one));
    add_html(out, "</td><td><span class=\"bar o", colour, "\" role=\"img\" aria-label=\"has ",
             share_words(one), "\" title=\"has ", share_words(one));
    if (wanted)
        add_html(out, ", wanted ", one.asked_percent, "%");
    // -10 % puts the mark of an unknown share outside of the bar.
    add_html(out, "\" style=\"--has:", one.reported ? one.least_percent : 0,
             "%;--wanted:", wanted ? one.asked_percent : -10, "%\"></span></td></tr>\n");
}

// --- The whole

void add_facts(std::string *out, const snapshot_group &group) {
    const auto fact = [&](const char *name, const std::string &value) {
        if (!value.empty())
            add_html(out, "<li><span class=\"dim\">", name, "</span> ", value, "</li>");
    };
    const auto number = [](int64_t value) { return value < 0 ? "" : std::to_string(value); };
    add_html(out, "<ul class=\"facts\">");
    fact("address", group.address == "0.0.0.0" ? "none" : group.address);
    fact("interface", group.interface);
    fact("link", group.link);
    fact("protocol", group.protocol);
    fact("priority", number(group.priority));
    fact("weight", number(group.weight));
    fact("forwarding", group.encap);
    fact("assignment", group.assign_method);
    fact("policy group", number(group.policy));
    if (group.configured)
        fact("password", group.authenticated ? "set" : "none");
    else
        fact("configuration", "none");
    add_html(out, "</ul>\n");
}

const traffic_intercept *intercept_of(const html_view &view, int group) {
    for (const traffic_intercept &each : view.shown.traffic.intercepts)
        if (each.group == group)
            return &each;
    return nullptr;
}

style proxy_style(const traffic_intercept &intercept) {
    return intercept.proxy == "up" ? style::good : intercept.proxy == "down" ? style::bad : style::warn;
}

void add_summary(std::string *out, const html_view &view, const snapshot_group &group) {
    const reason *cause = main_reason(view.reasons, group.id);
    const auto [words, how] = group_state_words(view.shown, group, cause != nullptr);
    // Without an answer of wccpd only a disabled group has a known state.
    const bool silent =
        !group.running && view.shown.wccpd != wccpd_condition::running && group.admin != "down";
    add_html(out, "<summary><span class=\"id\">Group ", group.id, "</span> ",
             silent ? html_of("<span class=\"badge unknown\"><span>?</span> state unknown</span>")
                    : make_badge(how, words));
    if (cause)
        add_html(out, " <code>", cause->code, "</code>");
    else if (is_in_alarm(view.shown, group))
        add_html(out, " ", make_badge(style::bad, "in alarm"));
    else if (table_differs(group))
        add_html(out, " ", make_badge(style::bad, "table not as wanted"));
    if (const traffic_intercept *intercept = intercept_of(view, group.id))
        add_html(out, " ", make_badge(proxy_style(*intercept), "proxy " + intercept->proxy));
    add_html(out, "<span class=\"sum\">");
    if (!silent) {
        add_html(out, "routers ", connected_routers(group), "/", group.routers.size());
        if (const snapshot_appliance *self = own_appliance(group); self && self->reported)
            add_html(out, " \u00b7 share ", share_words(*self));
        if (group.uptime_ms)
            add_html(out, " \u00b7 up ", duration_text(group.uptime_ms));
    }
    add_html(out, "</span></summary>\n");
}

void add_group_traffic(std::string *out, const html_view &view, const snapshot_group &group) {
    const traffic_state &traffic = view.shown.traffic;
    add_html(out, "<h3>Traffic</h3>");
    const traffic_intercept *intercept = intercept_of(view, group.id);
    if (traffic.tunneld != tunneld_condition::running)
        add_html(out, "<p>", unknown_badge(), "</p>\n");
    else if (!intercept)
        add_html(out, "<p class=\"dim\">no intercept</p>\n");
    else
        add_html(out, "<p>", proxy_text(*intercept), " \u00b7 ",
                 separate_by_dots(sorted_text(intercept->sorted)), "</p>\n");
    for (const protected_group &each : traffic.protection.groups)
        if (each.group == group.id && each.covered)
            add_html(out, "<p class=\"dim\">Flows of other appliances are protected; packets of ", each.slots,
                     " buckets or values are passed on.</p>\n");
}

} // namespace

void add_group(std::string *out, const html_view &view, const snapshot_group &group) {
    const bool open = needs_attention(view, group) || view.shown.groups.size() <= FEW_GROUPS;
    add_html(out, "<details", open ? " open" : "", ">");
    add_summary(out, view, group);
    // The name is inside: a link to it unfolds the group.
    add_html(out, "<div class=\"body\" id=\"group-", group.id, "\">\n");
    // Reasons that need attention come before the facts, the others after them.
    for (const reason &each : view.reasons)
        if (each.group == group.id && each.attention)
            add_reason(out, each, false);
    add_facts(out, group);
    for (const reason &each : view.reasons)
        if (each.group == group.id && !each.attention)
            add_reason(out, each, false);
    if (!group.routers.empty()) {
        add_html(out, "<h3>Routers</h3>");
        open_table(out, "routers");
        for (const snapshot_router &router : group.routers)
            add_router(out, view.shown, group, router);
        close_table(out);
    }
    add_html(out, "<h3>Appliances</h3>");
    if (group.appliances.empty()) {
        add_html(out, "<p>",
                 group.running ? html_of("<span class=\"dim\">none in the view yet</span>") : unknown_badge(),
                 "</p>\n");
    } else {
        open_table(out, "appliances");
        for (size_t i = 0; i < group.appliances.size(); i++)
            add_appliance(out, group, i);
        close_table(out);
    }
    add_strips(out, view, group);
    add_group_traffic(out, view, group);
    add_html(out, "</div></details>\n");
}
