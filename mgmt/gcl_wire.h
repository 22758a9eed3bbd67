// The layout of frames and of the messages of protocol 1, "admin", for both ends. Numbers are in network byte
// order. Text fields are padded with zero bytes, and have no NUL if they are full.
#pragma once

#include <cstddef>
#include <cstdint>

#include "runtime/byte_order.h"

constexpr char GCL_FRAME_IDENT[4] = {'G', 'C', 'L', 'F'};
constexpr uint32_t GCL_FRAME_MARKER = 0x33323130; // "0123" in host order, "3210" on the wire
constexpr uint32_t GCL_FRAME_VERSION = 1;
constexpr uint32_t GCL_SEQUENCE_CLIENT = 2000001;
constexpr uint32_t GCL_SEQUENCE_PROVIDER = 1000001;
constexpr const char *GCL_SOCKET_DIRECTORY = "/tmp/gcl-socks/";
// Writes the path of a socket to `out`, which has `size` bytes. `role` is "provider" or "client". On a
// development system (lc_devel_is_production) the path contains the user id.
void gcl_socket_path(const char *role, const char *name, char *out, size_t size);

struct gcl_wire_header {
    char ident[4];
    be32 marker;
    be32 version;
    be32 total_length; // header and body, in bytes
    be16 header_length;
    be16 reserved;
    be32 sequence;
    be16 proto;
    be16 mtype;
    be32 body_length;
};
static_assert(sizeof(gcl_wire_header) == 32 && alignof(gcl_wire_header) == 1);
static_assert(offsetof(gcl_wire_header, total_length) == 12 &&
              offsetof(gcl_wire_header, header_length) == 16);
static_assert(offsetof(gcl_wire_header, sequence) == 20 && offsetof(gcl_wire_header, proto) == 24);
static_assert(offsetof(gcl_wire_header, mtype) == 26 && offsetof(gcl_wire_header, body_length) == 28);

// The header in host order, before it is sent and after it has been received.
struct gcl_frame_header {
    char ident[4];
    uint32_t marker;
    uint32_t version;
    uint32_t total_length;
    uint16_t header_length;
    uint16_t reserved;
    uint32_t sequence;
    uint16_t proto;
    uint16_t mtype;
    uint32_t body_length;
};
static_assert(sizeof(gcl_frame_header) == sizeof(gcl_wire_header));

enum : uint16_t {
    GCL_ADMIN_GREETING = 1,
    GCL_ADMIN_GREETING_RESPONSE = 2,
    GCL_ADMIN_OPEN_SERVICE = 3,
    GCL_ADMIN_OPEN_SERVICE_RESPONSE = 4,
};
constexpr uint16_t GCL_ADMIN_VERSION = 2;
constexpr int32_t GCL_SERVICE_MIN = 1, GCL_SERVICE_MAX = 4;
constexpr const char *GCL_BAD_SERVICE_TEXT = "Bad service id in service open.";

struct gcl_wire_greeting {
    be16 version;
    be32 message_id;
    be32 second_counter;
    char name[32];
    be32 uid;
    be32 gid;
    char user[32];
    be32 flags;
};
static_assert(sizeof(gcl_wire_greeting) == 86 && alignof(gcl_wire_greeting) == 1);
static_assert(offsetof(gcl_wire_greeting, name) == 10 && offsetof(gcl_wire_greeting, uid) == 42);
static_assert(offsetof(gcl_wire_greeting, user) == 50 && offsetof(gcl_wire_greeting, flags) == 82);

struct gcl_wire_greeting_response {
    be16 version;
    be32 message_id;
    be32 second_counter;
    be32 reserved;
    char name[32];
    be32 uid;
    be32 gid;
    char user[32];
    be32 flags;
};
static_assert(sizeof(gcl_wire_greeting_response) == 90 && alignof(gcl_wire_greeting_response) == 1);
static_assert(offsetof(gcl_wire_greeting_response, name) == 14 &&
              offsetof(gcl_wire_greeting_response, uid) == 46);
static_assert(offsetof(gcl_wire_greeting_response, user) == 54 &&
              offsetof(gcl_wire_greeting_response, flags) == 86);

struct gcl_wire_open_service {
    be32 message_id;
    be32 second_counter;
    be32 protocol;
    be32 service;
    char name[32];
};
static_assert(sizeof(gcl_wire_open_service) == 48 && offsetof(gcl_wire_open_service, name) == 16);

// Followed by `text_length` bytes of text.
struct gcl_wire_open_service_response {
    be32 message_id;
    be32 request_second_counter;
    be32 request_message_id;
    char peer_name[32];
    be32 status;
    be32 text_length;
};
static_assert(sizeof(gcl_wire_open_service_response) == 52);
static_assert(offsetof(gcl_wire_open_service_response, peer_name) == 12 &&
              offsetof(gcl_wire_open_service_response, status) == 44);

// Converts a header between host and network byte order, in place. The ident is not changed.
void gcl_byte_swap_frame_header(void *header);
