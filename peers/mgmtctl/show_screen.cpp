// A snapshot on a terminal, or as plain lines in a file.
//
// Colour adds nothing that a letter or a word doesn't say. Each appliance has a letter and a colour within
// its group. The strip shows which appliance has which bucket of a table, two halves in a cell where the
// terminal can; a bar compares the share that the routers report with the share asked for.
//
// What doesn't fit is shortened in steps: fewer routers and appliances of each group, those in trouble first;
// then one line for a group; then the groups that fit, and the number of those not shown.
#include <algorithm>
#include <cinttypes>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_words.h"

namespace {

constexpr int STRIP_CELLS = 64;
constexpr int BAR_CELLS = 20;

// A line that ends at its last column, whatever is added.
struct pen {
    const screen_form &form;
    std::string out;
    int used = 0;
};

void set_style(pen *line, const std::string &codes) {
    if (line->form.colour)
        line->out += "\033[" + codes + "m";
}

// One column wide each; `text` is ASCII.
void add_cells(pen *line, const std::string &text, style how = style::plain) {
    static const char *const codes[] = {"", "1", "2", "32", "33", "1;31"};
    const char *code = codes[static_cast<int>(how)];
    const auto room = static_cast<size_t>(std::max(line->form.columns - line->used, 0));
    const std::string shown = text.substr(0, room);
    const bool styled = *code && !shown.empty();
    if (styled)
        set_style(line, code);
    line->out += shown;
    line->used += static_cast<int>(shown.size());
    if (styled)
        set_style(line, "0");
}

void add_glyph(pen *line, const char *utf8, char ascii) {
    if (line->used >= line->form.columns)
        return;
    if (line->form.utf8)
        line->out += utf8;
    else
        line->out += ascii;
    line->used++;
}

std::string format_text(const char *text, ...) __attribute__((format(printf, 1, 2)));
std::string format_text(const char *text, ...) {
    char buffer[256];
    va_list list;
    va_start(list, text);
    vsnprintf(buffer, sizeof buffer, text, list);
    va_end(list);
    return buffer;
}

int colour_of(int place) {
    static const int palette[] = {33, 214, 70, 170, 44, 203, 142, 105, 37, 208, 28, 161};
    return place < 0 ? 236 : palette[static_cast<size_t>(place) % std::size(palette)];
}

// --- One line

std::string alarm_words(const snapshot_alarm &alarm, const std::vector<reason> &reasons) {
    const std::string about = alarm.group >= 0 ? "group " + std::to_string(alarm.group) + ": "
                              // A cause without a group names its subject.
                              : alarm_reason(reasons, alarm.group, alarm.name, alarm.source)
                                  ? ""
                                  : alarm.source + ": ";
    const std::string text = about + alarm_cause(alarm, reasons);
    char today[16] = "";
    const time_t now = time(nullptr);
    tm parts;
    strftime(today, sizeof today, "%Y/%m/%d ", localtime_r(&now, &parts));
    // The date is shown only if it is not today's.
    const std::string since =
        alarm.since.starts_with(today) ? alarm.since.substr(strlen(today)) : alarm.since;
    return since.empty() ? text : text + ", since " + since;
}

std::string one_line(const snapshot_group &group, bool brief) {
    const size_t reached = brief ? group.routers_heard : connected_routers(group);
    const size_t all = brief ? std::max(group.routers_configured, reached) : group.routers.size();
    std::string text = "  routers " + std::to_string(reached) + "/" + std::to_string(all);
    if (const snapshot_appliance *self = own_appliance(group)) {
        text += "  share " + share_words(*self);
        if (self->asked_percent >= 0)
            text += " of " + std::to_string(self->asked_percent) + "%";
    }
    if (!group.address.empty() && group.address != "0.0.0.0")
        text += "  " + group.address;
    return text;
}

std::string traffic_head(const traffic_state &traffic) {
    if (traffic.tunneld != tunneld_condition::running)
        return traffic.tunneld == tunneld_condition::absent ? "tunneld: no session" : "tunneld: no answer";
    return "traffic  data plane " + traffic.plane + "  " + plural_text(traffic.tunnels.size(), "tunnel");
}

} // namespace

std::vector<std::string> draw_lines(const snapshot &shown) {
    if (!shown.unreachable.empty())
        return {"mgmtd: " + shown.unreachable};
    std::vector<std::string> out;
    if (shown.wccpd != wccpd_condition::running)
        out.emplace_back(shown.wccpd == wccpd_condition::absent ? "wccpd is not running"
                                                                : "wccpd does not answer");
    const std::vector<reason> reasons = reasons_of(shown);
    for (const snapshot_alarm &alarm : shown.alarms)
        out.push_back("alarm  " + alarm_words(alarm, reasons));
    for (const snapshot_group &group : shown.groups) {
        out.push_back("group " + std::to_string(group.id) + "  " + group_state_words(shown, group).first +
                      one_line(group, shown.brief));
        if (const reason *cause = main_reason(reasons, group.id))
            out.back() += "  " + cause->code;
    }
    out.push_back(traffic_head(shown.traffic));
    for (const traffic_intercept &intercept : shown.traffic.intercepts)
        out.push_back("proxy of group " + std::to_string(intercept.group) + "  " + intercept.proxy);
    for (const traffic_reason &reason : traffic_reasons(shown.traffic))
        out.push_back("note  " + reason.text);
    return out;
}

namespace {

// --- The screen

struct screen {
    const snapshot &shown;
    const screen_form &form;
    std::vector<std::string> lines;
    std::vector<reason> reasons;

    pen begin() const { return {form, "", 0}; }
    void end(pen *line) { lines.push_back(std::move(line->out)); }
    void text(const std::string &words, style how = style::plain) {
        pen line = begin();
        add_cells(&line, words, how);
        end(&line);
    }
    // One more part of a line, or of the next one when it doesn't fit.
    void add_part(pen *line, const std::string &words, style how = style::plain) {
        if (line->used + 2 + static_cast<int>(words.size()) > form.columns) {
            end(line);
            line->out.clear();
            line->used = 0;
            add_cells(line, "    ");
        }
        // No gap after the first four columns, which are a number or an indentation.
        add_cells(line, line->used > 4 ? "  " : "");
        add_cells(line, words, how);
    }
    // Over as many lines as it takes; those after the first are indented further.
    void paragraph(std::string words, style how = style::plain) {
        const auto room = static_cast<size_t>(form.columns);
        while (words.size() > room) {
            const size_t blank = words.rfind(' ', room);
            // A break at column 8 or later removes more than the indentation adds: the loop ends.
            if (blank == std::string::npos || blank < 8)
                break;
            text(words.substr(0, blank), how);
            words = "    " + words.substr(blank + 1);
        }
        text(words, how);
    }
};

void draw_head(screen *on, size_t alarms_most) {
    const snapshot &shown = on->shown;
    pen line = on->begin();
    if (!shown.unreachable.empty()) {
        add_cells(&line, "mgmtd: " + shown.unreachable, style::bad);
        add_cells(&line, on->form.corner, style::dim);
        on->end(&line);
        return;
    }
    const bool running = shown.wccpd == wccpd_condition::running;
    const std::string status = running ? "wccpd " + (shown.status.empty() ? "runs" : shown.status)
                               : shown.wccpd == wccpd_condition::absent ? "wccpd is not running"
                                                                        : "wccpd does not answer";
    const std::string counts =
        (shown.mode.empty() ? "" : "   mode " + shown.mode) + "   " + group_counts(shown) + "   ";
    const std::string alarms = shown.alarms_total ? plural_text(shown.alarms_total, "alarm")
                               : running          ? "no alarm"
                                                  : "alarms unknown";
    const std::string version = shown.version.empty() ? "" : " (" + shown.version + ")";
    add_cells(&line, status, running ? style::bold : style::bad);
    // The version is the first to go when the line is too short.
    if ((status + version + counts + alarms + on->form.corner).size() <=
        static_cast<size_t>(on->form.columns))
        add_cells(&line, version);
    add_cells(&line, counts);
    add_cells(&line, alarms, shown.alarms_total || !running ? style::bad : style::plain);
    add_cells(&line, on->form.corner, style::dim);
    on->end(&line);
    const size_t listed = std::min(shown.alarms.size(), alarms_most);
    for (size_t i = 0; i < listed; i++)
        on->paragraph("! " + alarm_words(shown.alarms[i], on->reasons), style::bad);
    if (listed < shown.alarms_total)
        on->text("! " + plural_text(shown.alarms_total - listed, "alarm") + (listed ? " more" : ""),
                 style::bad);
}

void draw_group_head(screen *on, const snapshot_group &group) {
    pen line = on->begin();
    add_cells(&line, format_text("%-4d", group.id), style::bold);
    const reason *cause = main_reason(on->reasons, group.id);
    const auto [words, how] = group_state_words(on->shown, group, cause != nullptr);
    add_cells(&line, words, how);
    if (cause || is_in_alarm(on->shown, group))
        add_cells(&line, " !", style::bad);
    const bool addressed = !group.address.empty() && group.address != "0.0.0.0";
    const std::string place = (addressed ? group.address : "") +
                              (addressed && !group.interface.empty() ? " " : "") +
                              (group.interface.empty() ? "" : "on " + group.interface);
    for (const std::string &part :
         {group.uptime_ms ? "up " + duration_text(group.uptime_ms) : "", place, group.protocol,
          group.weight >= 0 ? format_text("weight %" PRId64, group.weight) : "",
          std::string(group.authenticated ? "md5" : ""),
          group.policy >= 0 ? format_text("policy %" PRId64, group.policy) : ""})
        if (!part.empty())
            on->add_part(&line, part);
    on->end(&line);
    if (!cause)
        return;
    const std::string times = reason_times(*cause);
    on->paragraph("  " + cause->cause + (times.empty() ? "" : ", " + times), style::warn);
    on->paragraph("  > " + cause->next);
}

void draw_router(screen *on, const snapshot_group &group, const snapshot_router &router) {
    const auto method = [](const std::string &word) { return word.empty() ? "-" : word.c_str(); };
    pen line = on->begin();
    add_cells(&line, format_text("  router %-15s ", router.address.c_str()));
    if (router.connection == "none" || on->shown.wccpd != wccpd_condition::running) {
        const snapshot_reason *noted = router_reason(on->shown, group, router);
        if (on->shown.wccpd != wccpd_condition::running)
            add_cells(&line, "unknown", style::dim);
        else if (group.admin == "down" || is_out_of_its_routers(on->shown, group))
            add_cells(&line, "not asked", style::dim);
        else
            add_cells(&line, noted ? noted->code : "nothing heard", style::bad);
    } else {
        add_cells(&line, format_text("%-7s", router.connection.c_str()),
                  router.connection == "two-way" ? style::good : style::warn);
        add_cells(&line, format_text("  %8s", duration_text(router.connected_ms).c_str()));
        on->add_part(&line, format_text("fwd %-3s  assign %-4s  return %s", method(router.forward),
                                        method(router.assign), method(router.back)));
        if (router.id != router.address)
            on->add_part(&line, "id " + router.id, style::dim);
    }
    on->end(&line);
}

void draw_bar(pen *line, const snapshot_appliance &one, int place) {
    const int cells = std::clamp(line->form.columns - line->used, 0, BAR_CELLS);
    // In hundredths of a cell.
    const int has = static_cast<int>(std::min<uint32_t>(one.least_percent, 100)) * cells;
    const int asked = std::clamp(one.asked_percent, 0, 100) * cells;
    set_style(line, "38;5;" + std::to_string(colour_of(place)));
    for (int i = 0; i < cells; i++) {
        const int middle = i * 100 + 50; // of the cell, in hundredths
        // Solid up to the smaller of the two shares; then the surplus, or what is missing.
        if (middle <= has && (middle <= asked || one.asked_percent < 0))
            add_glyph(line, "█", '#');
        else if (middle <= has)
            add_glyph(line, "▓", '+');
        else if (middle <= asked)
            add_glyph(line, "░", '.');
        else
            break;
    }
    set_style(line, "0");
}

void draw_appliance(screen *on, const snapshot_appliance &one, int place) {
    pen line = on->begin();
    add_cells(&line, "  ");
    set_style(&line, "1;38;5;" + std::to_string(colour_of(place)));
    add_cells(&line, std::string(1, appliance_letter(place)));
    set_style(&line, "0");
    add_cells(&line, format_text(" %-15s %-4s ", one.address.c_str(), one.self ? "this" : ""));
    add_cells(&line,
              one.weight < 0 ? format_text("%-13s", "") : format_text("weight %-6" PRId64, one.weight));
    add_cells(&line, one.asked_percent < 0 ? format_text("%-11s", "")
                                           : format_text("asked %3d%% ", one.asked_percent));
    // A difference of 1 % is rounding.
    const bool short_of = one.reported && one.asked_percent >= 0 &&
                          std::abs(static_cast<int>(one.least_percent) - one.asked_percent) > 1;
    add_cells(&line, format_text("has %-7s ", share_words(one).c_str()),
              short_of ? style::warn : style::plain);
    draw_bar(&line, one, place);
    on->end(&line);
}

void draw_strip(screen *on, const snapshot_group &group, const snapshot_table &table) {
    std::string label = table.mask ? "mask" : "hash";
    if (group.tables.size() > 1) // which of them
        label = table.routers[0] + (table.routers.size() > 1 ? " .." : "");
    pen line = on->begin();
    add_cells(&line, "  " + label + " ");
    const int cells = std::clamp(on->form.columns - line.used, 0, STRIP_CELLS);
    // Scales the table to the half cells of the line; a table has up to 256 places, the line up to 128.
    const auto owner_at = [&](int half) {
        return table.owners[static_cast<size_t>(half) * table.owners.size() / static_cast<size_t>(2 * cells)];
    };
    std::string before;
    for (int i = 0; i < cells; i++) {
        const int left = owner_at(2 * i), right = owner_at(2 * i + 1);
        // The half block paints the left owner in the foreground; the right one is the background. Without
        // UTF-8 the cell has one owner's colour and letter.
        const std::string codes = (on->form.utf8 ? "38;5;" + std::to_string(colour_of(left)) : "30") +
                                  ";48;5;" + std::to_string(colour_of(on->form.utf8 ? right : left));
        if (codes != before)
            set_style(&line, codes);
        before = codes;
        if (on->form.colour && on->form.utf8)
            add_glyph(&line, "▌", ' ');
        else
            add_cells(&line, std::string(1, appliance_letter(left)));
    }
    set_style(&line, "0");
    on->end(&line);
}

// The places of up to `most` entries, those for which `first` holds before the others.
template <typename Entry, typename First>
std::vector<size_t> choose_rows(const std::vector<Entry> &all, size_t most, First first) {
    std::vector<size_t> out;
    for (const bool wanted : {true, false})
        for (size_t i = 0; i < all.size() && out.size() < most; i++)
            if (first(all[i]) == wanted)
                out.push_back(i);
    // All fit: their own order is easier to follow.
    if (out.size() == all.size())
        std::sort(out.begin(), out.end());
    return out;
}

void draw_more(screen *on, size_t all, size_t most, const char *what) {
    if (all > most)
        on->text("  and " + plural_text(all - most, what) + " more", style::dim);
}

void draw_group(screen *on, const snapshot_group &group, size_t most) {
    draw_group_head(on, group);
    for (const size_t i :
         choose_rows(group.routers, most, [](const auto &r) { return r.connection != "two-way"; }))
        draw_router(on, group, group.routers[i]);
    draw_more(on, group.routers.size(), most, "router");
    for (const size_t i : choose_rows(group.appliances, most, [](const auto &one) { return one.self; }))
        draw_appliance(on, group.appliances[i], static_cast<int>(i));
    draw_more(on, group.appliances.size(), most, "appliance");
    for (size_t i = 0; i < std::min(group.tables.size(), most); i++)
        draw_strip(on, group, group.tables[i]);
    draw_more(on, group.tables.size(), most, "table");
}

void draw_reasons(screen *on, const std::vector<traffic_reason> &reasons, size_t most) {
    for (size_t i = 0; i < std::min(reasons.size(), most); i++)
        on->paragraph("  " + reasons[i].text, style::warn);
    draw_more(on, reasons.size(), most, "note");
}

void draw_traffic(screen *on, size_t most) {
    const traffic_state &traffic = on->shown.traffic;
    on->text(traffic_head(traffic), style::bold);
    for (const size_t i :
         choose_rows(traffic.intercepts, most, [](const auto &one) { return one.proxy == "down"; })) {
        const traffic_intercept &one = traffic.intercepts[i];
        pen line = on->begin();
        add_cells(&line, format_text("  %-4d", one.group));
        add_cells(&line, proxy_text(one),
                  one.proxy == "up"     ? style::good
                  : one.proxy == "down" ? style::bad
                                        : style::warn);
        on->add_part(&line, sorted_text(one.sorted));
        on->end(&line);
    }
    draw_more(on, traffic.intercepts.size(), most, "intercept");
    draw_reasons(on, traffic_reasons(traffic), most);
}

std::vector<std::string> draw_whole(const snapshot &shown, const screen_form &form, size_t most) {
    screen on = {shown, form, {}, reasons_of(shown)};
    draw_head(&on, most);
    for (const snapshot_group &group : shown.groups) {
        on.text("");
        draw_group(&on, group, most);
    }
    if (shown.unreachable.empty()) {
        on.text("");
        draw_traffic(&on, most);
    }
    if (shown.groups.size() < shown.groups_total)
        on.text("and " + plural_text(shown.groups_total - shown.groups.size(), "group") + " not shown",
                style::dim);
    return std::move(on.lines);
}

std::vector<std::string> draw_briefly(const snapshot &shown, const screen_form &form) {
    screen on = {shown, form, {}, reasons_of(shown)};
    draw_head(&on, 3);
    if (shown.unreachable.empty() && shown.traffic.tunneld != tunneld_condition::running)
        on.text(traffic_head(shown.traffic));
    draw_reasons(&on, traffic_reasons(shown.traffic), 3);
    size_t drawn = 0;
    for (const snapshot_group &group : shown.groups) {
        const size_t last = drawn + 1 < shown.groups_total ? 1 : 0; // the line that counts the others
        if (form.rows > 0 && on.lines.size() + 1 + last > static_cast<size_t>(form.rows))
            break;
        pen line = on.begin();
        add_cells(&line, format_text("%-4d", group.id), style::bold);
        const reason *cause = main_reason(on.reasons, group.id);
        const auto [words, how] = group_state_words(shown, group, cause != nullptr);
        add_cells(&line, format_text("%-20s", words.c_str()), how);
        add_cells(&line, cause || is_in_alarm(shown, group) ? " !" : "  ", style::bad);
        add_cells(&line, cause ? "  " + cause->code : "", style::warn);
        add_cells(&line,
                  group.uptime_ms ? format_text("  up %-11s", duration_text(group.uptime_ms).c_str()) : "");
        add_cells(&line, one_line(group, shown.brief));
        on.end(&line);
        drawn++;
    }
    if (drawn < shown.groups_total)
        on.text("and " + plural_text(shown.groups_total - drawn, "group") + " not shown", style::dim);
    return std::move(on.lines);
}

} // namespace

std::vector<std::string> draw_screen(const snapshot &shown, const screen_form &form) {
    if (!shown.brief)
        // Fewer and fewer rows of each list, until the screen fits.
        for (const size_t most : {size_t{256}, size_t{16}, size_t{8}, size_t{4}, size_t{2}, size_t{1}}) {
            std::vector<std::string> lines = draw_whole(shown, form, most);
            if (form.rows <= 0 || lines.size() <= static_cast<size_t>(form.rows))
                return lines;
        }
    std::vector<std::string> lines = draw_briefly(shown, form);
    if (form.rows > 0 && lines.size() > static_cast<size_t>(form.rows))
        lines.resize(static_cast<size_t>(form.rows));
    return lines;
}
