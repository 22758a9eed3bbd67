// Routes and rules of ours in the kernel. What is missing is added in one step and what is too much removed
// in a later one, since other changes have their place between them.
#pragma once

#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// As they are in the kernel; `odd` ones carry our mark, but are none that could be wanted.
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

// Adds the route, or replaces the one of the same table in one step.
int put_route(const wanted_route &route);
int remove_route(const found_route &route); // one that is gone is no error
int add_rule(const wanted_rule &rule);      // one that is there is no error
int remove_rule(const wanted_rule &rule);   // one that is gone is no error
std::string route_text(const wanted_route &route);
std::string rule_text(const wanted_rule &rule);
