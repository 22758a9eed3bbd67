// tunneld's routes and rules in the kernel. Adding missing ones and removing surplus ones are separate
// functions, since reconciliation changes other things in between. Functions that return an int return 0 or
// an errno.
#pragma once

#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// As found in the kernel. An `odd` one has tunneld's protocol number, but attributes that tunneld never sets.
struct found_route {
    wanted_route route;
    int out_index = 0;
    uint32_t priority = 0;
    uint8_t type = 0, prefix_length = 0;
    uint32_t destination = 0; // wire order
    bool odd = false;
};
struct found_rule {
    wanted_rule rule;
    bool odd = false;
};

int find_routes(std::vector<found_route> *out);
int find_rules(std::vector<found_rule> *out);

// Adds the route, or replaces the one in the same table atomically.
int put_route(const wanted_route &route);
int remove_route(const found_route &route); // 0 also when it is already gone
int add_rule(const wanted_rule &rule);      // 0 also when it already exists
int remove_rule(const wanted_rule &rule);   // 0 also when it is already gone
// For error messages.
std::string route_text(const wanted_route &route);
std::string rule_text(const wanted_rule &rule);
