// "mgmtctl show": one snapshot, or a live one.
//
// A live snapshot is drawn again each second and at each event of mgmtd, at most ten times a second. After
// one that took long to gather, mgmtd and wccpd are left alone for longer than it took. On a terminal it uses
// the alternate screen and is rewritten in one piece; the terminal is restored when a signal ends or stops
// the program. Below rows that belong to another program it takes no screen, hides no cursor, and addresses
// the beginning of each snapshot, because the other program may have moved the cursor in between. In a file
// or a pipe it is a line, with the time, for whatever has changed, and as JSON one snapshot a line. When
// mgmtd is lost, a live snapshot reports that and tries to reach it once a second.
//
// How a snapshot is drawn is a row of the table of renderers.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include <langinfo.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/commands.h"
#include "peers/mgmtctl/html_file.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_gather.h"
#include "runtime/ttime.h"
#include "runtime/version.h"

namespace {

constexpr int64_t PERIOD_MS = 1000;
constexpr int64_t BURST_MS = 100; // events within it are one
constexpr int FILE_COLUMNS = 80;
constexpr size_t SCREEN_BYTES = 1 << 16; // a large screen with its colours
constexpr int GROUP_ROWS = 5;            // of the smallest drawing of a group that is more than a line
constexpr size_t PAGE_QUERIES = 32768;   // 256 groups with 32 appliances each are 18,000

volatile std::sig_atomic_t pause_wanted;

struct viewer;
struct renderer {
    bool (*is_wanted)(const viewer &self);
    void (*show)(viewer *self, const snapshot &shown);
    bool is_screen; // bounded by the terminal's size, and empty without mgmtd
    size_t queries; // that one snapshot may take
};
struct viewer {
    const ctl_options &options;
    const renderer *how = nullptr;
    bool terminal = false, on_screen = false;
    std::vector<std::string> before; // lines as they were last printed
    bool broken = false;             // nobody reads the output
    bool unwritten = false;          // the page could not be written
};

bool write_out(viewer *self, const std::string &text) {
    if (fwrite(text.data(), 1, text.size(), stdout) != text.size() || fflush(stdout) != 0)
        self->broken = true;
    return !self->broken;
}

// --- The terminal

screen_form form_of(const viewer &self) {
    screen_form form;
    form.columns = FILE_COLUMNS;
    winsize size = {};
    if (self.terminal) {
        // The last column and, beside a prompt, the last row stay free.
        const bool known = ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 && size.ws_row > 0;
        form.columns = std::max((known ? size.ws_col : 80) - 1, 20);
        form.rows = std::max((known ? size.ws_row : 24) - (self.options.watch ? self.options.below : 1), 2);
    }
    const char *no_colour = getenv("NO_COLOR");
    form.colour = self.options.colour == 1 ||
                  (self.options.colour == -1 && self.terminal && !(no_colour && *no_colour));
    form.utf8 = strcmp(nl_langinfo(CODESET), "UTF-8") == 0;
    return form;
}

snapshot_limits limits_of(const viewer &self) {
    snapshot_limits limits;
    limits.queries = self.how->queries;
    if (self.terminal && self.how->is_screen) {
        const auto rows = static_cast<size_t>(form_of(self).rows);
        limits.detailed = std::max<size_t>(rows / GROUP_ROWS, 1);
        limits.listed = rows;
        limits.alarms = rows;
    }
    return limits;
}

void take_screen(viewer *self, bool take) {
    if (self->on_screen == take || self->options.below > 0)
        return;
    self->on_screen = take;
    // 1049 is the alternate screen, 25 the cursor.
    write_out(self, take ? "\033[?1049h\033[?25l" : "\033[0m\033[?25h\033[?1049l");
}

// --- One snapshot

std::string clock_text() {
    char text[16];
    const time_t now = time(nullptr);
    tm parts;
    localtime_r(&now, &parts);
    strftime(text, sizeof text, "%H:%M:%S", &parts);
    return text;
}

// Identifies a line that can disappear, whatever its text: a group or its proxy, an alarm or a note.
std::string line_key(const std::string &line) {
    // A subject that remains while its state changes: the key ends before the state.
    for (const char *kind : {"group ", "proxy of "})
        if (line.starts_with(kind))
            return line.substr(0, line.find("  "));
    return line.starts_with("alarm ") || line.starts_with("note ") ? line : "";
}

void print_changes(viewer *self, const snapshot &shown) {
    const std::vector<std::string> now = draw_lines(shown);
    const auto missing = [](const std::vector<std::string> &from, const std::string &line) {
        return std::find(from.begin(), from.end(), line) == from.end();
    };
    std::vector<std::string> keys = {""};
    for (const std::string &line : now)
        keys.push_back(line_key(line));
    std::string text;
    for (const std::string &line : self->before)
        // Without mgmtd nothing is known to be gone. Lines without a key never are: "" is among the keys.
        if (shown.unreachable.empty() && missing(keys, line_key(line)))
            text += clock_text() + "  gone: " + line_key(line) + "\n";
    for (const std::string &line : now)
        if (missing(self->before, line))
            text += clock_text() + "  " + line + "\n";
    self->before = now;
    write_out(self, text);
}

void show_json(viewer *self, const snapshot &shown) {
    write_out(self, draw_json(shown) + "\n");
}

void show_page(viewer *self, const snapshot &shown) {
    char made[32], host[HOST_NAME_MAX + 1] = "";
    page_origin origin;
    origin.now = time(nullptr);
    tm parts;
    localtime_r(&origin.now, &parts);
    strftime(made, sizeof made, "%Y-%m-%d %H:%M:%S %z", &parts);
    if (gethostname(host, sizeof host - 1) != 0)
        strcpy(host, "unknown");
    origin.host = host;
    origin.made = made;
    origin.version = wccp_version();
    const std::string page = draw_page(shown, origin), &file = self->options.html;
    std::string reason;
    if (file == "-") {
        write_out(self, page);
    } else if (!write_page_file(file, page, &reason)) {
        fprintf(stderr, "mgmtctl: %s: %s\n", file.c_str(), reason.c_str());
        self->unwritten = true;
    }
}

void show_screen(viewer *self, const snapshot &shown) {
    screen_form form = form_of(*self);
    if (self->options.watch)
        form.corner = "   " + clock_text();
    const std::vector<std::string> lines = draw_screen(shown, form);
    std::string text = self->options.watch ? "\033[" + std::to_string(self->options.below + 1) + "H" : "";
    for (size_t i = 0; i < lines.size(); i++) {
        text += lines[i];
        if (!self->options.watch)
            text += "\n";
        else
            // Each line clears the rest of the old one, and the last one clears all below. It has no newline,
            // which could scroll the screen.
            text += i + 1 < lines.size() ? "\033[K\r\n" : "\033[K\033[J";
    }
    write_out(self, text);
}

// The first one whose condition holds is used.
const renderer renderers[] = {
    {[](const viewer &self) { return !self.options.html.empty(); }, show_page, false, PAGE_QUERIES},
    {[](const viewer &self) { return self.options.json; }, show_json, false, snapshot_limits{}.queries},
    {[](const viewer &self) { return self.options.watch && !self.terminal; }, print_changes, false,
     snapshot_limits{}.queries},
    {[](const viewer &) { return true; }, show_screen, true, snapshot_limits{}.queries},
};

snapshot view_snapshot(const viewer &self, ctl_session *session) {
    return gather_snapshot(
        [&](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason) {
            return ctl_query(session, walk, name, out, out_reason);
        },
        limits_of(self));
}

// --- Staying live

void take_signal(int number) {
    if (number == SIGTSTP)
        pause_wanted = 1;
    else if (number != SIGWINCH)
        ctl_stop_signal = number;
}

// The signals after which the terminal has to be restored or redrawn, except those that main handles. An
// ignored signal stays ignored.
void take_signals() {
    struct sigaction action = {}, before;
    action.sa_handler = take_signal; // without SA_RESTART: it ends a wait
    for (const int number : {SIGQUIT, SIGTSTP, SIGWINCH})
        if (sigaction(number, nullptr, &before) == 0 && before.sa_handler != SIG_IGN)
            sigaction(number, &action, nullptr);
}

void wait_without_session() {
    (void)poll(nullptr, 0, PERIOD_MS);
}

void pause_if_wanted(viewer *self) {
    if (!pause_wanted)
        return;
    pause_wanted = 0;
    take_screen(self, false);
    // The program stops inside this call. After SIGCONT the next snapshot takes the screen again.
    raise(SIGSTOP);
}

bool add_interests(ctl_session *session, std::string *out_reason) {
    static const struct {
        const char *event;
        std::vector<std::string> patterns;
    } wanted[] = {
        {EVENT_CONFIG_CHANGE,
         {NODE_WCCPD "/**", NODE_SYSTEM_MODE, NODE_INTERCEPT_CONFIG "/**", NODE_ACCEPT_CONFIG "/**"}},
        {EVENT_RAISE_ALARM, {}},
        {EVENT_CLEAR_ALARM, {}},
        {EVENT_ROLE_CHANGE, {}},
        {EVENT_PROXY_CHANGE, {}},
        {EVENT_GROUP_LEAVE, {}},
        {EVENT_GROUP_JOIN, {}},
        {EVENT_PROCESS_CRASH, {}},
        {EVENT_PROCESS_EXIT, {}},
        {EVENT_PROCESS_TERMINATE, {}},
    };
    return std::all_of(std::begin(wanted), std::end(wanted), [&](const auto &each) {
        return ctl_add_interest(session, each.event, each.patterns, out_reason);
    });
}

// Waits until the next snapshot is due, after one that took this long. False: the session has ended.
bool wait_for_news(ctl_session *session, int64_t cost_ms, std::string *out_reason) {
    const int64_t began = lt_monotonic_ms();
    // Gathering takes at most a fifth of the time.
    int64_t until = began + std::max(PERIOD_MS, 4 * cost_ms);
    while (!ctl_stop_signal && !pause_wanted) {
        ctl_event event;
        const int came =
            ctl_next_event(session, std::max<int64_t>(until - lt_monotonic_ms(), 0), &event, out_reason);
        if (came < 0)
            return false;
        if (came == 0)
            return true;
        // Not at once: further events of the same change arrive within this time.
        until = std::min(until, began + std::max(BURST_MS, cost_ms));
    }
    return true;
}

int watch_screen(viewer *self) {
    ctl_session *session = nullptr;
    take_signals();
    if (self->terminal)
        setvbuf(stdout, nullptr, _IOFBF, SCREEN_BYTES); // or each line is written by itself
    while (!ctl_stop_signal && !self->broken) {
        snapshot shown;
        if (!session) {
            session = ctl_open(self->options.timeout_ms, &shown.unreachable);
            if (session && !add_interests(session, &shown.unreachable)) {
                ctl_close(session);
                session = nullptr;
            }
            if (session)
                ctl_query_quietly(session);
        }
        const int64_t began = lt_monotonic_ms();
        if (session)
            shown = view_snapshot(*self, session);
        const int64_t cost_ms = lt_monotonic_ms() - began;
        if (ctl_stop_signal)
            break;
        if (self->terminal && self->how->is_screen)
            take_screen(self, true);
        self->how->show(self, shown);
        std::string reason;
        // A query that failed leaves a session that cannot be used again.
        if (session && (!shown.unreachable.empty() || !wait_for_news(session, cost_ms, &reason))) {
            ctl_close(session);
            session = nullptr;
        }
        if (!session && !shown.unreachable.empty() && !ctl_stop_signal)
            wait_without_session();
        pause_if_wanted(self);
    }
    take_screen(self, false);
    if (session)
        ctl_close(session);
    return CTL_OK;
}

} // namespace

int ctl_show(const ctl_options &options) {
    viewer self = {options, nullptr, false, false, {}, false, false};
    const char *kind = getenv("TERM");
    self.terminal = isatty(STDOUT_FILENO) && kind && strcmp(kind, "dumb") != 0;
    self.how = std::find_if(std::begin(renderers), std::end(renderers),
                            [&](const renderer &each) { return each.is_wanted(self); });
    // Or the character set would be ASCII, whatever the user's locale says.
    setlocale(LC_CTYPE, "");
    if (options.watch)
        return watch_screen(&self);
    snapshot shown;
    if (ctl_session *session = ctl_open(options.timeout_ms, &shown.unreachable)) {
        shown = view_snapshot(self, session);
        ctl_close(session);
    }
    const bool reached = shown.unreachable.empty();
    if (reached || !self.how->is_screen)
        self.how->show(&self, shown);
    if (!reached && !options.json)
        fprintf(stderr, "mgmtctl: %s\n", shown.unreachable.c_str());
    if (!reached || shown.wccpd != wccpd_condition::running)
        return CTL_UNREACHABLE;
    return self.unwritten ? CTL_OUTPUT : CTL_OK;
}
