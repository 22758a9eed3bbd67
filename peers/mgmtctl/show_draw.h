// A snapshot drawn for a terminal, for a file of lines, for a script, and as a page.
#pragma once

#include "peers/mgmtctl/show_model.h"

struct screen_form {
    int columns = 80;
    int rows = 0; // 0: as many lines as it takes
    bool colour = false;
    bool utf8 = false;
    std::string corner; // text after the first line
};
// Lines without their ends, none longer than the columns and no more than the rows.
std::vector<std::string> draw_screen(const snapshot &shown, const screen_form &form);
// One line for each group and alarm, without what changes by itself: a change shows in a comparison.
std::vector<std::string> draw_lines(const snapshot &shown);
std::string draw_json(const snapshot &shown);
struct page_origin {
    std::string host, made, version; // where, when and by which mgmtctl
    int64_t now = 0;                 // the same moment, in seconds since 1970
};
constexpr size_t PAGE_COLOURS = 8; // of appliances; those of further ones repeat, their letters do not
std::string draw_page(const snapshot &shown, const page_origin &origin); // HTML
std::string duration_text(uint64_t milliseconds);                        // "3d 1:02:03"
