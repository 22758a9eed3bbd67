// The parts of the page that "mgmtctl show --html" makes (show_draw.h has the whole).
//
// The page is one file without scripts that loads nothing. Each state has a symbol and a word as well as a
// colour; unknown values are shown as unknown.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/html_text.h"
#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_words.h"

struct html_view {
    const snapshot &shown;
    const std::vector<reason> &reasons;
    const page_origin &origin;
    bool each_bucket; // has a title of its own; otherwise each run of buckets has one
};

// --- Pieces (html_parts.cpp)

std::string html_style(); // the content of the style element
html_markup make_badge(style how, const std::string &words);
html_markup symbol_of(style how);
html_markup unknown_badge();
html_markup known_or_unknown(const std::string &text);
std::string separate_by_dots(std::string words); // with dots where the screen has two blanks

// Begins a table with its column heads. On a narrow screen a row is a block, in which each cell after the
// first is preceded by its head.
void open_table(std::string *out, const char *name);
void close_table(std::string *out);

// Adds a cause with its values and times, and the next step.
void add_reason(std::string *out, const reason &one, bool name_group);

// --- Groups (html_group.cpp)

bool needs_attention(const html_view &view, const snapshot_group &group);
// Folded unless it needs attention or there are few groups.
void add_group(std::string *out, const html_view &view, const snapshot_group &group);

// How many buckets or values of a table have another owner than the wanted one.
size_t differing_buckets(const snapshot_table &wanted, const snapshot_table &found);
void add_strip(std::string *out, const html_view &view, const snapshot_group &group,
               const snapshot_table &table);

// --- Traffic (html_traffic.cpp)

void add_traffic(std::string *out, const html_view &view);
