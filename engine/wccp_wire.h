// The WCCP version 2 wire format: the layout of every message and component, for the writer and the reader.
// All fields are big-endian, and all layouts have alignment 1, because a component may begin at any offset. A
// component starts with a 16-bit type and a 16-bit length; the length counts the bytes after these four.
#pragma once

#include <cstddef>
#include <cstdint>

#include "runtime/byte_order.h"

constexpr uint16_t WCCP_VERSION = 0x0200;
enum : uint32_t {
    WCCP_HERE_I_AM = 10,
    WCCP_I_SEE_YOU = 11,
    WCCP_REDIRECT_ASSIGN = 12,
    WCCP_REMOVAL_QUERY = 13
};
// Not on the wire, where it is a Here-I-Am: the kind that wccp_transmit_packet takes for a removal reply.
constexpr uint32_t WCCP_REMOVAL_REPLY = 25;
enum : uint16_t {
    WCCP_SECURITY_INFO = 0,
    WCCP_SERVICE_INFO = 1,
    WCCP_ROUTER_IDENTITY_INFO = 2,
    WCCP_WEB_CACHE_IDENTITY_INFO = 3,
    WCCP_ROUTER_VIEW_INFO = 4,
    WCCP_WEB_CACHE_VIEW_INFO = 5,
    WCCP_ASSIGNMENT_INFO = 6,
    WCCP_ROUTER_QUERY_INFO = 7,
    WCCP_CAPABILITY_INFO = 8,
    WCCP_MASK_ASSIGNMENT_INFO = 13,
    WCCP_ASSIGNMENT_MAP = 14,
    WCCP_COMMAND_EXTENSION = 15,
};
enum : uint16_t { WCCP_IDENTITY_NO_REDIRECT = 1, WCCP_IDENTITY_MASK = 2, WCCP_IDENTITY_HISTORICAL = 0x80 };
enum : uint16_t { WCCP_CAP_FORWARDING = 1, WCCP_CAP_ASSIGNMENT = 2, WCCP_CAP_RETURN = 3 };
constexpr uint16_t WCCP_COMMAND_SHUTDOWN = 1;

struct wccp_wire_msg_header {
    be32 type;
    be16 version;
    be16 length; // bytes of the message after this field
};
struct wccp_wire_component {
    be16 type;
    be16 length;
};
struct wccp_wire_security_info { // option 0 none, 1 MD5, with which the digest follows
    wccp_wire_component head;
    be32 option;
};
struct wccp_wire_security_md5 {
    wccp_wire_security_info info;
    uint8_t digest[16];
};
struct wccp_wire_service_info {
    wccp_wire_component head;
    uint8_t service_type;
    uint8_t service_id;
    uint8_t priority;
    uint8_t protocol;
    be32 flags;
    be16 ports[8];
};
struct wccp_wire_identity_hash {
    wccp_wire_component head;
    be32 web_cache_id;
    be16 hash_revision;
    be16 flags;
    uint8_t buckets[32];
    be16 weight;
    be16 status;
};
struct wccp_wire_mask {
    be32 src_ip;
    be32 dst_ip;
    be16 src_port;
    be16 dst_port;
};
struct wccp_wire_mask_element { // `values` value elements follow
    wccp_wire_mask mask;
    be32 values;
};
struct wccp_wire_value_element {
    wccp_wire_mask value;
    be32 appliance_id;
};
struct wccp_wire_identity_mask {
    wccp_wire_component head;
    be32 web_cache_id;
    be16 hash_revision;
    be16 flags;
    be32 mask_elements;
    wccp_wire_mask_element mask;
    be16 weight;
    be16 status;
};
struct wccp_wire_web_cache_view { // R router elements, a count, A addresses follow
    wccp_wire_component head;
    be32 change_number;
    be32 routers;
};
struct wccp_wire_view_router_element {
    be32 router_id;
    be32 receive_id;
};
struct wccp_wire_assign_router_element {
    be32 router_id;
    be32 receive_id;
    be32 change_number;
};
struct wccp_wire_assignment_info { // R router elements, a count, A addresses, 256 buckets follow
    wccp_wire_component head;
    be32 key_address;
    be32 key_change;
    be32 routers;
};
struct wccp_wire_mask_assignment_info { // R router elements, a count of 1, a mask element, V values follow
    wccp_wire_component head;
    be16 assignment_type;
    be16 assignment_length;
    be32 key_address;
    be32 key_change;
    be32 routers;
};
struct wccp_wire_capability_element {
    be16 type;
    be16 length;
    be32 value;
};
struct wccp_wire_command_ext {
    wccp_wire_component head;
    be16 command;
    be16 command_length;
    be32 data;
};
struct wccp_wire_router_identity { // n received-from addresses follow
    wccp_wire_component head;
    be32 router_id;
    be32 receive_id;
    be32 sent_to;
    be32 received_from;
};
struct wccp_wire_router_view { // r addresses, a count, w web-cache elements follow
    wccp_wire_component head;
    be32 change_number;
    be32 key_address;
    be32 key_change;
    be32 routers;
};
// The head of a web-cache element of a router view. Its flags decide which of the three forms follows.
struct wccp_wire_view_element {
    be32 web_cache_id;
    be16 hash_revision;
    be16 flags;
};
struct wccp_wire_view_element_hash {
    wccp_wire_view_element head;
    be32 bucket_words[8];
    be16 weight;
    be16 status;
};
struct wccp_wire_view_element_mask { // Nexus mode; in both modes for a web-cache without redirection
    wccp_wire_view_element head;
    uint8_t unread[20];
    be16 weight;
    be16 status;
};
struct wccp_wire_view_element_mask_short { // IOS mode
    wccp_wire_view_element head;
    be32 unread;
    be16 weight;
    be16 status;
};
struct wccp_wire_router_query {
    wccp_wire_component head;
    be32 router_id;
    be32 receive_id;
    be32 sent_to;
    be32 target;
};
struct wccp_wire_assignment_map { // m mask elements follow
    wccp_wire_component head;
    be32 mask_elements;
};

#define WIRE_AT(type, field, offset) static_assert(offsetof(type, field) == (offset))
#define WIRE_SIZE(type, size) static_assert(sizeof(type) == (size) && alignof(type) == 1)
WIRE_SIZE(wccp_wire_msg_header, 8);
WIRE_AT(wccp_wire_msg_header, version, 4);
WIRE_AT(wccp_wire_msg_header, length, 6);
WIRE_SIZE(wccp_wire_component, 4);
WIRE_AT(wccp_wire_component, length, 2);
WIRE_SIZE(wccp_wire_security_info, 8);
WIRE_AT(wccp_wire_security_info, option, 4);
WIRE_SIZE(wccp_wire_security_md5, 24);
WIRE_AT(wccp_wire_security_md5, digest, 8);
WIRE_SIZE(wccp_wire_service_info, 28);
WIRE_AT(wccp_wire_service_info, service_type, 4);
WIRE_AT(wccp_wire_service_info, service_id, 5);
WIRE_AT(wccp_wire_service_info, priority, 6);
WIRE_AT(wccp_wire_service_info, protocol, 7);
WIRE_AT(wccp_wire_service_info, flags, 8);
WIRE_AT(wccp_wire_service_info, ports, 12);
WIRE_SIZE(wccp_wire_identity_hash, 48);
WIRE_AT(wccp_wire_identity_hash, web_cache_id, 4);
WIRE_AT(wccp_wire_identity_hash, hash_revision, 8);
WIRE_AT(wccp_wire_identity_hash, flags, 10);
WIRE_AT(wccp_wire_identity_hash, buckets, 12);
WIRE_AT(wccp_wire_identity_hash, weight, 44);
WIRE_AT(wccp_wire_identity_hash, status, 46);
WIRE_SIZE(wccp_wire_mask, 12);
WIRE_AT(wccp_wire_mask, dst_ip, 4);
WIRE_AT(wccp_wire_mask, src_port, 8);
WIRE_AT(wccp_wire_mask, dst_port, 10);
WIRE_SIZE(wccp_wire_mask_element, 16);
WIRE_AT(wccp_wire_mask_element, values, 12);
WIRE_SIZE(wccp_wire_value_element, 16);
WIRE_AT(wccp_wire_value_element, appliance_id, 12);
WIRE_SIZE(wccp_wire_identity_mask, 36);
WIRE_AT(wccp_wire_identity_mask, web_cache_id, 4);
WIRE_AT(wccp_wire_identity_mask, hash_revision, 8);
WIRE_AT(wccp_wire_identity_mask, flags, 10);
WIRE_AT(wccp_wire_identity_mask, mask_elements, 12);
WIRE_AT(wccp_wire_identity_mask, mask, 16);
WIRE_AT(wccp_wire_identity_mask, weight, 32);
WIRE_AT(wccp_wire_identity_mask, status, 34);
WIRE_SIZE(wccp_wire_web_cache_view, 12);
WIRE_AT(wccp_wire_web_cache_view, change_number, 4);
WIRE_AT(wccp_wire_web_cache_view, routers, 8);
WIRE_SIZE(wccp_wire_view_router_element, 8);
WIRE_AT(wccp_wire_view_router_element, receive_id, 4);
WIRE_SIZE(wccp_wire_assign_router_element, 12);
WIRE_AT(wccp_wire_assign_router_element, receive_id, 4);
WIRE_AT(wccp_wire_assign_router_element, change_number, 8);
WIRE_SIZE(wccp_wire_assignment_info, 16);
WIRE_AT(wccp_wire_assignment_info, key_address, 4);
WIRE_AT(wccp_wire_assignment_info, key_change, 8);
WIRE_AT(wccp_wire_assignment_info, routers, 12);
WIRE_SIZE(wccp_wire_mask_assignment_info, 20);
WIRE_AT(wccp_wire_mask_assignment_info, assignment_type, 4);
WIRE_AT(wccp_wire_mask_assignment_info, assignment_length, 6);
WIRE_AT(wccp_wire_mask_assignment_info, key_address, 8);
WIRE_AT(wccp_wire_mask_assignment_info, key_change, 12);
WIRE_AT(wccp_wire_mask_assignment_info, routers, 16);
WIRE_SIZE(wccp_wire_capability_element, 8);
WIRE_AT(wccp_wire_capability_element, length, 2);
WIRE_AT(wccp_wire_capability_element, value, 4);
WIRE_SIZE(wccp_wire_command_ext, 12);
WIRE_AT(wccp_wire_command_ext, command, 4);
WIRE_AT(wccp_wire_command_ext, command_length, 6);
WIRE_AT(wccp_wire_command_ext, data, 8);
WIRE_SIZE(wccp_wire_router_identity, 20);
WIRE_AT(wccp_wire_router_identity, router_id, 4);
WIRE_AT(wccp_wire_router_identity, receive_id, 8);
WIRE_AT(wccp_wire_router_identity, sent_to, 12);
WIRE_AT(wccp_wire_router_identity, received_from, 16);
WIRE_SIZE(wccp_wire_router_view, 20);
WIRE_AT(wccp_wire_router_view, change_number, 4);
WIRE_AT(wccp_wire_router_view, key_address, 8);
WIRE_AT(wccp_wire_router_view, key_change, 12);
WIRE_AT(wccp_wire_router_view, routers, 16);
WIRE_SIZE(wccp_wire_view_element, 8);
WIRE_AT(wccp_wire_view_element, hash_revision, 4);
WIRE_AT(wccp_wire_view_element, flags, 6);
WIRE_SIZE(wccp_wire_view_element_hash, 44);
WIRE_AT(wccp_wire_view_element_hash, bucket_words, 8);
WIRE_AT(wccp_wire_view_element_hash, weight, 40);
WIRE_AT(wccp_wire_view_element_hash, status, 42);
WIRE_SIZE(wccp_wire_view_element_mask, 32);
WIRE_AT(wccp_wire_view_element_mask, weight, 28);
WIRE_SIZE(wccp_wire_view_element_mask_short, 16);
WIRE_AT(wccp_wire_view_element_mask_short, weight, 12);
WIRE_SIZE(wccp_wire_router_query, 20);
WIRE_AT(wccp_wire_router_query, router_id, 4);
WIRE_AT(wccp_wire_router_query, receive_id, 8);
WIRE_AT(wccp_wire_router_query, sent_to, 12);
WIRE_AT(wccp_wire_router_query, target, 16);
WIRE_SIZE(wccp_wire_assignment_map, 8);
WIRE_AT(wccp_wire_assignment_map, mask_elements, 4);
#undef WIRE_AT
#undef WIRE_SIZE
