// Changes of what happens to redirected packets: intercepts, bypasses, and further sources of tunnels.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "peers/mgmtctl/link.h"

struct traffic_result {
    int exit = CTL_OK;
    const char *kind = ""; // "intercept", "bypass", "source", "protection"
    std::string subject;   // a group's number, a prefix, an address; empty: none was understood
    std::string done;  // "added", "accepted", "changed", "deleted", "refused", "unchanged"; empty: nothing
    uint32_t code = 0; // of mgmtd's refusal
    std::string error;
    std::string note;    // for a person, after what was done
    std::string tunneld; // "running", "absent", "silent"; empty where it was not asked
};

// "051" as "51". False when it is not a number.
bool parse_group_number(const std::string &text, std::string *out);
// `words` follow "intercept", "bypass" and "tunnel". Each command is one commit.
traffic_result intercept_command(const ctl_link &link, const std::vector<std::string> &words);
// `now` in seconds since 1970. mgmtd deletes a bypass whose time is over.
traffic_result bypass_command(const ctl_link &link, const std::vector<std::string> &words, int64_t now);
traffic_result tunnel_command(const ctl_link &link, const std::vector<std::string> &words);
traffic_result protection_command(const ctl_link &link, const std::vector<std::string> &words); // not empty

// `words` follow "drain". Prints, and returns the exit code.
int run_drain(const ctl_options &options, const ctl_link &link, const std::vector<std::string> &words);

// Print what is configured and what tunneld answers. They return the exit code.
int tell_intercepts(const ctl_options &options, const ctl_link &link, const std::string &only);
int tell_bypasses(const ctl_options &options, const ctl_link &link);
int tell_tunnels(const ctl_options &options, const ctl_link &link);
