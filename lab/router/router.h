// A simulated router as a state machine without sockets or a clock: each call takes a packet or a command and
// returns packets and events. Times are seconds of the caller's clock.
#pragma once

#include <deque>
#include <map>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include <nlohmann/json.hpp>

#include "lab/router/wire.h"

namespace lab {

using json = nlohmann::ordered_json;

struct router_options {
    address self = 0;
    bool nexus = false;
    methods offer = {3, 3, 3};  // bit sets
    std::string password;       // empty: no security
    std::set<uint8_t> services; // empty: all
    address group = 0;          // multicast address, 0: none
    bool reply_to_group = true; // answer multicast messages by multicast
    bool join_at_first = false; // accept an appliance at its first message, before it has echoed a receive id
    double query_after = 25;    // seconds without a valid Here-I-Am
    double drop_after = 30;
    std::string gre_format = "redirect"; // of redirected packets: one of gre_formats
    address gre_source = 0;              // of redirected packets, 0: `self`
};
// GRE type 0x883E with the redirect header, 0x883E without it, 0x0800.
constexpr const char *gre_formats[] = {"redirect", "plain", "ip"};

// Counters of the data path. Bytes are those of the inner packets.
struct appliance_traffic {
    uint64_t packets = 0, bytes = 0;
    uint64_t flows = 0;               // different ones
    uint64_t returned = 0;            // packets returned in GRE
    uint64_t returned_redirected = 0; // of these, with type 0x883E
};
struct traffic {
    std::map<address, appliance_traffic> appliances;
    std::unordered_set<uint64_t> flows;
    uint64_t routed = 0;          // packets that were not redirected
    uint64_t lost = 0;            // not sent: no neighbour entry, or the queue is full
    uint64_t fragmented = 0;      // sent in more than one outer packet
    uint64_t refused_returns = 0; // GRE that is not from an appliance, or is malformed
};

struct member {
    address id = 0;
    address source = 0;
    bool by_group = false; // it sends to the multicast address
    bool usable = false;   // in the view
    uint16_t weight = 0;
    methods chosen;
    mask_fields mask;
    std::vector<address> routers;  // that it reports
    std::deque<uint32_t> sent_ids; // the last receive ids sent to it, newest last
    double sent_at = 0;
    double heard_at = 0; // its last Here-I-Am that echoed one of them
    bool queried = false;
    std::string refused; // why it is not in the view
};

enum class kind { none, hash, mask };

struct assignment {
    kind by = kind::none;
    address key = 0;
    uint32_t key_change = 0;
    std::array<address, BUCKETS> buckets = {}; // owners, 0: none
    std::vector<mask_set> sets;
};

struct group {
    service_info service = {};
    bool defined = false; // the first appliance in the view defines the service
    uint32_t receive_id = 0;
    uint32_t change_number = 1;
    std::vector<address> router_view;
    std::set<address> listed; // routers that it reports because of the command `list`
    std::map<address, member> members;
    assignment current;
};

struct datagram {
    address to;
    bytes data;
};
struct output {
    std::vector<datagram> send;
    std::vector<json> events; // one for each message and each change
};

struct router {
    router_options options;
    std::map<uint8_t, group> groups;
    bool stopped = false;
    std::set<address> ignored;
    std::string fault;  // of the next I-See-You messages
    int fault_left = 0; // number of these messages, -1: all
    std::map<std::string, uint64_t> counters;
    bool forwards = false; // it has a data path
    lab::traffic traffic;
};

// `to` is the destination of the packet: the router's address or the multicast address.
void router_receive(router *self, double now, address from, address to, const bytes &data, output *out);
// Call it at least once a second.
void router_tick(router *self, double now, output *out);
// Executes a command and returns the answer, which begins with "error:" if the command is invalid.
std::string router_command(router *self, double now, const std::vector<std::string> &words, output *out);
json router_state(const router &self, double now);
json traffic_state(const router &self);
std::string event_line(const json &event);

extern const char *const ROUTER_COMMANDS; // help text

// --- For commands.cpp
void send_i_see_you(router *self, group *in, member *to, double now, output *out, uint16_t command);
void send_query(router *self, group *in, member *to, double now, output *out);
void drop_member(router *self, group *in, address id, double now, const char *why, output *out);
void refresh_router_view(router *self, group *in, double now, output *out);
void count_event(router *self, const std::string &counter);
json event_of(const router &self, const group *in, double now, const char *what);

// --- Faults of outgoing messages (faults.cpp)
bool is_fault(const std::string &name);
std::string fault_names();
void spoil_message(const std::string &fault, i_see_you *message, std::string *password);
void spoil_bytes(const std::string &fault, bytes *data, std::string_view password);

} // namespace lab
