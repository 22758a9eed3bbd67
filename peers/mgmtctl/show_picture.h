// The state of the appliance as it is shown: gathered in one place, drawn by several renderers.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "peers/mgmtctl/session.h"

// All texts come cleaned: printable ASCII of bounded length.
struct picture_load {
    std::string appliance;
    uint32_t percent = 0; // of the router's assignment
};
struct picture_router {
    std::string address; // that it speaks from, or that is configured for it
    std::string id;
    bool configured = false;
    std::string connection; // "two-way", "one-way", "unknown"; "none": nothing is heard
    uint64_t connected_ms = 0;
    std::string forward, assign, back; // "gre", "l2", "hash", "mask"; empty as long as nothing is agreed
    std::vector<picture_load> loads;
};
struct picture_appliance {
    std::string address;
    bool self = false;
    int64_t weight = -1;                          // -1: unknown
    int asked_percent = -1;                       // what the weights, or the designated appliance, give it
    bool reported = false;                        // a router tells of its share
    uint32_t least_percent = 0, most_percent = 0; // over the routers
};
// Which appliance has which bucket or mask value, as routers report it.
struct picture_table {
    bool mask = false;
    std::vector<std::string> routers; // that report this very table, by their ids
    std::vector<int> owners; // places in the group's appliances, -1 for nobody; a power of two of them
};
struct picture_alarm {
    long type = 0;
    std::string name; // "adjacency", "assignment"
    std::string source, text, since, reporter;
    int group = -1;
};
struct picture_group {
    int id = 0;
    // What is configured.
    bool configured = false;
    std::string interface, admin, protocol, encap, assign_method;
    bool authenticated = false;
    int64_t weight = -1, priority = -1, policy = -1;
    // What wccpd has.
    bool running = false;
    std::string state; // "ACTIVE", "BACKUP", "INIT"
    bool designated = false;
    uint64_t uptime_ms = 0;
    std::string address; // of this appliance in the group
    std::string link;    // of its first interface: "up", "down"; empty: unknown
    size_t routers_configured = 0, routers_heard = 0;
    std::vector<picture_router> routers;
    std::vector<picture_appliance> appliances;
    std::vector<picture_table> tables;
};
enum class picture_wccpd { running, silent, absent };
struct picture {
    std::string unreachable; // why there is nothing of mgmtd; the rest is empty then
    picture_wccpd wccpd = picture_wccpd::absent;
    std::string status, mode; // of the daemon; of the system
    std::vector<picture_group> groups;
    size_t groups_total = 0;
    bool brief = false; // groups without routers, weights, tables and link, and with the own share alone
    size_t roles_active = 0, roles_backup = 0;
    std::vector<picture_alarm> alarms;
    size_t alarms_total = 0;
};

// What one gathering may cost. More groups than `detailed` come briefly, and of them as many as `listed`.
struct picture_limits {
    size_t detailed = 256;
    size_t listed = 256;
    size_t alarms = 256;
    size_t queries = 8192; // groups that are left when these are used up count as not shown
};

// A query of mgmtd; false with the reason when there is no answer.
using picture_query =
    std::function<bool(ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason)>;
picture gather_picture(const picture_query &query, const picture_limits &limits);

// The assignment text of a group: which tables its routers report, and what the designated appliance allots.
// Reads what it understands, and bounds it; appliances that it alone names are added to the group.
void take_assignment_text(const std::string &text, picture_group *inout);
// The first interface of a group and its link, from the group's text.
void take_group_text(const std::string &text, picture_group *inout);

std::string clean_text(const std::string &text, size_t most);
// The place of the appliance, which is added when it is new; -1 when there are too many.
int appliance_place(picture_group *inout, const std::string &address);

struct screen_form {
    int columns = 80;
    int rows = 0; // 0: as many lines as it takes
    bool colour = false;
    bool utf8 = false;
    std::string corner; // text behind the first line
};
// Lines without their ends, none longer than the columns and no more than the rows.
std::vector<std::string> draw_screen(const picture &shown, const screen_form &form);
// One line for each group and alarm, without what changes by itself: a change shows in a comparison.
std::vector<std::string> draw_lines(const picture &shown);
std::string draw_json(const picture &shown);
std::string duration_text(uint64_t milliseconds);
