// A snapshot drawn for a terminal, for a file of lines and for a script.
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
std::string duration_text(uint64_t milliseconds); // "3d 1:02:03"
