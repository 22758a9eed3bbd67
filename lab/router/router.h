// One router of the lab as a machine without sockets or a clock: a packet comes in at a time, packets and
// events go out. Times are seconds of the caller's clock.
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
    std::set<uint8_t> services; // empty: whatever is asked for
    address group = 0;          // multicast address, 0 none
    bool reply_to_group = true; // to what came by multicast
    bool join_at_first = false; // an appliance is taken into the view before it has echoed a receive id
    double query_after = 25;    // of silence
    double drop_after = 30;
    std::string gre_form = "redirect"; // of redirected packets; see gre_forms
    address gre_source = 0;            // they come from there, 0: from `self`
};
// 0x883E with the redirect header, 0x883E without it, 0x0800.
constexpr const char *gre_forms[] = {"redirect", "plain", "ip"};

// What the data path has carried. Bytes are those of the carried packets.
struct appliance_traffic {
    uint64_t packets = 0, bytes = 0;
    uint64_t flows = 0;               // that were seen for the first time
    uint64_t returned = 0;            // packets that came back in GRE
    uint64_t returned_redirected = 0; // of these, as type 0x883E
};
struct traffic {
    std::map<address, appliance_traffic> appliances;
    std::unordered_set<uint64_t> flows;
    uint64_t routed = 0;          // packets that were not redirected
    uint64_t lost = 0;            // no neighbour, or no room
    uint64_t fragmented = 0;      // sent in more than one outer packet
    uint64_t refused_returns = 0; // GRE that is from no appliance or cannot be read
};

struct member {
    address id = 0;
    address source = 0;
    bool by_group = false; // it talks to the multicast address
    bool usable = false;   // in the view
    uint16_t weight = 0;
    methods chosen;
    mask_fields mask;
    std::vector<address> routers;  // that it says it hears
    std::deque<uint32_t> sent_ids; // receive ids that went to it, newest last
    double sent_at = 0;
    double heard_at = 0; // its last Here-I-Am that echoed one of them
    bool queried = false;
    std::string refused; // why it is not taken in
};

enum class kind { none, hash, mask };

struct assignment {
    kind by = kind::none;
    address key = 0;
    uint32_t key_change = 0;
    std::array<address, BUCKETS> buckets = {}; // owner, 0 nobody
    std::vector<mask_set> sets;
};

struct group {
    service_info service = {};
    bool defined = false; // the first appliance in defines the service
    uint32_t receive_id = 0;
    uint32_t change_number = 1;
    std::vector<address> router_view;
    std::set<address> listed; // routers that it reports because it was told to
    std::map<address, member> members;
    assignment current;
};

struct datagram {
    address to;
    bytes data;
};
struct output {
    std::vector<datagram> send;
    std::vector<json> events; // one for each message and each change, ready to be printed
};

struct router {
    router_options options;
    std::map<uint8_t, group> groups;
    bool stopped = false;
    std::set<address> deaf_to;
    std::string fault;  // what is wrong with the next I-See-You messages
    int fault_left = 0; // -1 for ever
    std::map<std::string, uint64_t> counters;
    bool forwards = false; // has a data path
    lab::traffic traffic;
};

// `to` is the address that it was sent to: the router's or the multicast one.
void router_receive(router *self, double now, address from, address to, const bytes &data, output *out);
// Call it at least once a second.
void router_tick(router *self, double now, output *out);
// What the operator types: an answer, beginning with "error:" when it makes no sense.
std::string router_command(router *self, double now, const std::vector<std::string> &words, output *out);
json router_state(const router &self, double now);
json traffic_state(const router &self);
std::string event_line(const json &event);

extern const char *const ROUTER_COMMANDS; // help text

// The parts of the machine that the commands use.
void send_i_see_you(router *self, group *in, member *to, double now, output *out, uint16_t command);
void send_query(router *self, group *in, member *to, double now, output *out);
void drop_member(router *self, group *in, address id, double now, const char *why, output *out);
void refresh_router_view(router *self, group *in, double now, output *out);
void count(router *self, const std::string &what);
json event_of(const router &self, const group *in, double now, const char *what);

// Tampering with what goes out (faults.cpp).
bool is_fault(const std::string &name);
std::string fault_names();
void spoil_message(const std::string &fault, i_see_you *message, std::string *password);
void spoil_bytes(const std::string &fault, bytes *data, std::string_view password);

} // namespace lab
