// Settings of the host that keep a group from working, and how to fix them: facts about the host are gathered
// first, then judged. Nothing is changed, and no daemon has to run; checks that cannot be made are listed.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "peers/mgmtctl/link.h"
#include "peers/mgmtctl/reasons.h"

constexpr unsigned WCCP_UDP_PORT = 2048;

struct check_group {
    int id = 0;
    std::string interface; // empty: none is set
    bool up = true;        // administratively
    std::string encap;     // "gre", "l2", "either"
};
struct check_interface {
    bool up = false; // and has its carrier
    std::vector<std::string> addresses;
    long mtu = 0;
    std::optional<long> rp_filter, forwarding; // its own; empty: cannot be read
};
// A socket on UDP port 2048. Where only root may see them, the program is empty and the process 0.
struct check_socket {
    std::string address; // 0.0.0.0 for a socket of IPv6 as well
    std::string program;
    int process = 0;
};
enum class check_feature { missing, present, unknown };
// A file of the host's configuration.
struct check_file {
    int error = 0;         // errno of reading it
    uint32_t bad_line = 0; // the first one; 0: none
    bool complete = true;  // it has all that wccpd needs
};
struct check_facts {
    std::string mgmtd_error; // why the groups are not known; empty: they are
    std::vector<check_group> groups;
    std::map<std::string, check_interface> interfaces; // of the host, by name
    std::optional<long> all_rp_filter;
    std::string ports_error;
    std::vector<check_socket> sockets;
    std::string filter_error, legacy_tables; // the tables that iptables has of its own
    std::string legacy_error;
    std::string filter_listing; // of nftables, as JSON
    check_feature gre = check_feature::unknown, tun = check_feature::unknown, tproxy = check_feature::unknown;
    std::optional<bool> clock_synchronised;
    bool wccpd_runs = false;
    std::string lock_limit_error;             // why the next two are unknown
    std::optional<uint64_t> lock_limit_bytes; // of wccpd; empty: none
    bool may_lock = false;                    // CAP_IPC_LOCK
    check_file mem_conf, platform_conf;
    bool root = true; // this process runs as root
};

struct check_result {
    std::vector<reason> findings; // in the order of the checks
    struct unchecked {
        std::string check, why;
    };
    std::vector<unchecked> unchecked;
    std::vector<std::string> fine; // checks with neither
};
check_result judge_facts(const check_facts &facts);
// The words of findings. Codes that wccpd has as well are in the table of reasons.h.
const std::vector<reason_text> &check_texts();

// Examines the host (check_facts.cpp), and queries mgmtd for the groups.
check_facts gather_facts(const ctl_link &link);
// Prints the result. 0: nothing to fix, 1: something.
int tell_checks(const ctl_options &options, const check_result &result);
