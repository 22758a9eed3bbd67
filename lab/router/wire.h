// The router's side of WCCP version 2 on the wire: parses messages of appliances and writes those of a
// router. It shares no code with the engine on purpose, so that a mistake in a layout does not cancel itself
// out.
//
// Addresses, ids and counts are in host byte order. Only the reader and the writer in wire.cpp swap bytes.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace lab {

using bytes = std::vector<uint8_t>;
using address = uint32_t;

enum : uint32_t { HERE_I_AM = 10, I_SEE_YOU = 11, REDIRECT_ASSIGN = 12, REMOVAL_QUERY = 13 };
enum : uint16_t {
    SECURITY_INFO = 0,
    SERVICE_INFO = 1,
    ROUTER_IDENTITY = 2,
    APPLIANCE_IDENTITY = 3,
    ROUTER_VIEW = 4,
    APPLIANCE_VIEW = 5,
    ASSIGNMENT = 6,
    ROUTER_QUERY = 7,
    CAPABILITIES = 8,
    MASK_ASSIGNMENT = 13,
    ASSIGNMENT_MAP = 14,
    COMMAND = 15,
};
enum : uint16_t { COMMAND_SHUTDOWN = 1, COMMAND_SHUTDOWN_SEEN = 2 };
constexpr uint16_t VERSION = 0x0200;
constexpr size_t MOST_IN_VIEW = 32;
constexpr size_t BUCKETS = 256;
constexpr uint8_t NO_APPLIANCE = 0xff; // in an assignment: the bucket has no owner

struct service_info {
    uint8_t type, id, priority, protocol;
    uint32_t flags;
    std::array<uint16_t, 8> ports;
    bool operator==(const service_info &) const = default;
};
// Forwarding and return: 1 GRE, 2 L2. Assignment: 1 hash, 2 mask. An offer is a bit set of these codes.
struct methods {
    uint32_t forward = 1, assign = 1, giveback = 1;
    bool operator==(const methods &) const = default;
};
struct mask_fields {
    uint32_t src_ip = 0, dst_ip = 0;
    uint16_t src_port = 0, dst_port = 0;
    bool operator==(const mask_fields &) const = default;
};
struct mask_value {
    mask_fields match;
    address owner = 0;
};
struct mask_set {
    mask_fields mask;
    std::vector<mask_value> values;
};
// The last ids that an appliance has received from a router.
struct router_mark {
    address router;
    uint32_t receive_id;
    uint32_t change_number; // not part of a Here-I-Am
};
struct command_info {
    uint16_t command;
    uint32_t data;
};

struct here_i_am {
    address id = 0;
    bool mask_format = false;
    mask_fields mask;
    uint16_t weight = 0;
    uint32_t change_number = 0;
    std::vector<router_mark> routers;
    std::vector<address> appliances;
    methods chosen;
    std::optional<command_info> command;
};
struct redirect_assign {
    address key = 0;
    uint32_t key_change = 0;
    bool by_mask = false;
    std::vector<router_mark> routers;
    std::vector<address> appliances;           // hash
    std::array<uint8_t, BUCKETS> buckets = {}; // hash: indexes into `appliances`
    std::vector<mask_set> sets;                // mask
};
struct incoming {
    uint32_t type = 0;
    service_info service = {};
    here_i_am hello;
    redirect_assign assign;
};

// Parses a message to a router that has this password ("": none). The result is empty, or describes the error
// in the message.
std::string read_message(const bytes &data, std::string_view password, incoming *message);

struct view_element {
    address id = 0;
    uint16_t revision = 0;
    uint16_t flags = 0;    // bit 1: mask format; bit 0: nothing is redirected to it by mask
    bool is_short = false; // mask format of 16 bytes
    std::array<uint8_t, BUCKETS / 8> buckets = {};
    mask_fields mask;
    uint16_t weight = 0;
};
struct i_see_you {
    service_info service = {};
    address router = 0;
    uint32_t receive_id = 0;
    address sent_to = 0;
    std::vector<address> received_from;
    uint32_t change_number = 0;
    address key = 0;
    uint32_t key_change = 0;
    std::vector<address> routers;
    std::vector<view_element> appliances;
    std::vector<mask_set> map;                     // sent when not empty
    std::vector<std::pair<uint16_t, bytes>> extra; // further components, before the capabilities
    std::optional<methods> offer;
    std::optional<command_info> command;
};
struct removal_query {
    service_info service = {};
    address router = 0;
    uint32_t receive_id = 0;
    address sent_to = 0;
    address target = 0;
};
bytes write_message(const i_see_you &message, std::string_view password);
bytes write_message(const removal_query &message, std::string_view password);

// Computes the digest of a complete message, for example after it was tampered with. Does nothing if the
// message has no digest.
void sign_message(bytes *message, std::string_view password);

std::string text_of(address a);
std::optional<address> address_of(const std::string &text);

} // namespace lab
