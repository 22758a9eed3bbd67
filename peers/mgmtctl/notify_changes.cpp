#include "peers/mgmtctl/notify_changes.h"

#include <algorithm>
#include <iterator>
#include <sstream>

#include "peers/mgmtctl/show_model.h"

namespace {

constexpr size_t NAME_MAX_BYTES = 160, SUBJECTS_MAX = 8192;

constexpr struct kind_row {
    notify_kind kind;
    const char *word, *first;
    const char *states; // all possible states, each followed by a blank
} KINDS[] = {
    {notify_kind::role, "role", "UNKNOWN", "UNKNOWN ACTIVE BACKUP "},
    {notify_kind::alarm, "alarm", "cleared", "cleared raised "},
    {notify_kind::health, "health", "unknown", "unknown up down "},
};

const kind_row &find_kind(notify_kind kind) {
    return *std::find_if(std::begin(KINDS), std::end(KINDS),
                         [&](const kind_row &row) { return row.kind == kind; });
}

std::string describe_subject(const notify_subject &subject) {
    return std::string(notify_kind_word(subject.kind)) + " " + subject.name;
}

std::string last_reported(const notify_book &book, const notify_subject &subject) {
    const auto found = book.reported.find(subject);
    return found == book.reported.end() ? notify_first_state(subject.kind) : found->second;
}

auto find_waiting(notify_book *book, const notify_subject &subject) {
    return std::find_if(book->waiting.begin(), book->waiting.end(),
                        [&](const notify_change &each) { return each.subject == subject; });
}

} // namespace

const char *notify_kind_word(notify_kind kind) {
    return find_kind(kind).word;
}

const char *notify_first_state(notify_kind kind) {
    return find_kind(kind).first;
}

void notify_note(notify_book *book, const notify_subject &subject, const std::string &state,
                 const std::string &detail) {
    if (subject.kind == notify_kind::health && state == notify_first_state(subject.kind))
        return; // tunneld is starting or gone: the previous health remains until it is known again
    if (const auto older = find_waiting(book, subject); older != book->waiting.end()) {
        if (older->state == state)
            return;
        book->merged++;
        book->say(describe_subject(subject) + ": " + older->state + " was replaced by " + state +
                  " before its turn (" + std::to_string(book->merged) + " replaced so far)");
        // `previous` stays: it is the state for which commands were last run.
        older->state = state;
        older->detail = detail;
        older->time = book->clock_s();
        older->merged++;
        return;
    }
    const std::string previous = last_reported(*book, subject);
    if (previous == state)
        return;
    if (book->waiting.size() >= NOTIFY_WAITING_MAX) {
        book->dropped++;
        book->say(describe_subject(subject) + ": " + state + " is dropped until there is room, " +
                  std::to_string(NOTIFY_WAITING_MAX) + " changes wait (" + std::to_string(book->dropped) +
                  " dropped so far)");
        return;
    }
    book->waiting.push_back({subject, state, previous, detail, book->clock_s(), 0});
}

void notify_compare(notify_book *book, notify_kind kind, const std::map<std::string, notify_state> &present) {
    for (const auto &[name, now] : present)
        notify_note(book, {kind, name}, now.state, now.detail);
    // Collected first, because the loop below changes both containers.
    std::vector<notify_subject> missing;
    const auto add_missing = [&](const notify_subject &subject) {
        if (subject.kind == kind && !present.contains(subject.name))
            missing.push_back(subject);
    };
    for (const auto &[subject, state] : book->reported)
        add_missing(subject);
    for (const notify_change &change : book->waiting)
        add_missing(change.subject);
    for (const notify_subject &subject : missing) {
        // The intercept was deleted: there is nothing to report.
        if (kind == notify_kind::health) {
            book->reported.erase(subject);
            std::erase_if(book->waiting, [&](const auto &each) { return each.subject == subject; });
        } else {
            notify_note(book, subject, notify_first_state(kind), "");
        }
    }
}

bool notify_take(notify_book *book, notify_change *out) {
    if (book->waiting.empty())
        return false;
    *out = std::move(book->waiting.front());
    book->waiting.pop_front();
    // Not kept, or the file would grow with each alarm that was ever raised.
    if (out->state == notify_first_state(out->subject.kind))
        book->reported.erase(out->subject);
    else
        book->reported[out->subject] = out->state;
    return true;
}

std::string notify_book_text(const notify_book &book) {
    std::string out;
    for (const auto &[subject, state] : book.reported)
        out += state + " " + describe_subject(subject) + "\n";
    return out;
}

size_t notify_read_book(notify_book *book, const std::string &text) {
    std::istringstream lines(text);
    size_t unreadable = 0;
    for (std::string line; std::getline(lines, line);) {
        std::istringstream words(line);
        std::string state, kind, name;
        words >> state >> kind;
        std::getline(words >> std::ws, name);
        const auto *row = std::find_if(std::begin(KINDS), std::end(KINDS),
                                       [&](const kind_row &each) { return kind == each.word; });
        if (row == std::end(KINDS) || name.empty() || clean_text(name, NAME_MAX_BYTES) != name ||
            state.size() > STATE_MAX ||
            // Blanks on both sides: only whole words match.
            (" " + std::string(row->states)).find(" " + state + " ") == std::string::npos ||
            book->reported.size() >= SUBJECTS_MAX)
            unreadable++;
        else
            book->reported[{row->kind, name}] = state;
    }
    return unreadable;
}
