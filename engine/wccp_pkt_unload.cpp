// The decoder of received messages, the only place where their bytes are read.
//
// A packet lies in a buffer on the stack of the receive thread, which holds the engine lock from here to the
// end of the packet's processing. Decoding copies only the fixed fields of a result and allocates nothing;
// the pointers in a result point into the packet and are valid until the thread receives the next one. The
// only changes in a group are its reasons and the counter of unknown capabilities.
//
// Any message may be hostile. Every read goes through peek_layout<T>(), which returns a pointer to a layout
// at a distance from the cursor if all of it was received, and null otherwise. Where a check has a log line
// of its own it comes first, but the read is still bounded by peek_layout. Counts from the wire are compared
// with the bytes received before they are used. Sizes are computed in 64 bits, because a 32-bit count times
// 16 can wrap.
//
// After a component of odd length everything that follows is at odd addresses. The wire layouts have
// alignment 1 and can be read at any address.
//
// A refused component leaves the cursor where it was. The caller logs which step failed and drops the
// message.
#include "engine/wccp_pkt_unload.h"

#include <cinttypes>
#include <climits>
#include <iterator>

#include "engine/wccp_complaints.h"
#include "engine/wccp_utils.h"

namespace {

// --- The cursor

struct received_bytes {
    const uint8_t *first;
    uint32_t size;
};

uint32_t count_remaining_bytes(const wccp_pkt *pkt) {
    // Reads stay within the buffer even if a caller has set a wrong length.
    const uint32_t received = pkt->length < WCCP_MAX_PACKET ? pkt->length : WCCP_MAX_PACKET;
    return pkt->offset < received ? received - pkt->offset : 0;
}

// `count` objects of type T at `distance` bytes from the first byte, or null when not all were received.
template <typename T>
const T *peek_layout(received_bytes bytes, uint64_t distance = 0, uint64_t count = 1) {
    static_assert(alignof(T) == 1);
    if (distance + count * sizeof(T) > bytes.size)
        return nullptr;
    return reinterpret_cast<const T *>(bytes.first + distance);
}
// The same, from the packet's cursor.
template <typename T>
const T *peek_layout(const wccp_pkt *pkt, uint64_t distance = 0, uint64_t count = 1) {
    return peek_layout<T>({pkt->data + pkt->offset, count_remaining_bytes(pkt)}, distance, count);
}

// Moves the cursor past `size` bytes. Returns 1 and leaves the cursor in place when they were not received.
int skip_bytes(wccp_pkt *pkt, uint64_t size) {
    if (size > count_remaining_bytes(pkt))
        return 1;
    pkt->offset += static_cast<uint32_t>(size);
    pkt->cursor = pkt->data + pkt->offset;
    return 0;
}

// These note the reason for refusing a message, with the values found and expected, and return 1.
int refuse_message(wccp_service_group *group, const wccp_pkt *pkt, const wccp_reason_text &has,
                   const wccp_reason_text &should_have,
                   wccp_reason_code code = WCCP_REASON_MESSAGE_MALFORMED) {
    wccp_note_reason(group, code, pkt->ipa, has, should_have);
    return 1;
}
// For a component that does not fit in the message, or whose length field is wrong.
int refuse_message_size(wccp_service_group *group, const wccp_pkt *pkt, const char *what, uint64_t size,
                        uint64_t should_be) {
    return refuse_message(group, pkt, wccp_reason_value("%s of %" PRIu64 " bytes", what, size),
                          wccp_reason_value("%" PRIu64 " bytes", should_be));
}
int refuse_component_type(wccp_service_group *group, const wccp_pkt *pkt, uint32_t type, uint32_t should_be) {
    return refuse_message(group, pkt, wccp_reason_value("component type %u", type),
                          wccp_reason_value("type %u", should_be));
}

// A size as an argument for %d in a log line.
int clamp_to_int(uint64_t size) {
    return size < INT_MAX ? static_cast<int>(size) : INT_MAX;
}

} // namespace

// --- The beginning of every message

int wccp_pkt_unload_msg_header(wccp_pkt *pkt, const wccp_wire_msg_header **out) {
    // No group is known yet: the reason is kept with those of packets that belong to none.
    *out = peek_layout<wccp_wire_msg_header>(pkt);
    return *out ? skip_bytes(pkt, sizeof **out)
                : refuse_message_size(nullptr, pkt, "a header", count_remaining_bytes(pkt), sizeof **out);
}

int wccp_pkt_unload_security_info_component(wccp_pkt *pkt, const wccp_wire_security_info **out,
                                            uint8_t **out_digest) {
    *out = nullptr;
    *out_digest = nullptr;
    const auto *info = peek_layout<wccp_wire_security_info>(pkt);
    if (!info)
        return refuse_message_size(nullptr, pkt, "a security info", count_remaining_bytes(pkt), sizeof *info);
    // Every option other than 1 has the short form. The check of the group's security refuses unknown ones.
    const bool digested = to_host(info->option) == 1;
    const uint32_t size = digested ? sizeof(wccp_wire_security_md5) : sizeof(wccp_wire_security_info);
    if (to_host(info->head.type) != WCCP_SECURITY_INFO) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP: expected security componenet. rxed %d", to_host(info->head.type));
        return refuse_component_type(nullptr, pkt, to_host(info->head.type), WCCP_SECURITY_INFO);
    }
    if (to_host(info->head.length) > size - sizeof info->head) // a smaller length is accepted
        return refuse_message_size(nullptr, pkt, "a security info", to_host(info->head.length),
                                   size - sizeof info->head);
    // The digest is not const: it is zeroed in place before the message is hashed.
    uint8_t *const digest = pkt->data + pkt->offset + offsetof(wccp_wire_security_md5, digest);
    if (skip_bytes(pkt, size))
        return refuse_message_size(nullptr, pkt, "a security info", count_remaining_bytes(pkt), size);
    *out = info;
    *out_digest = digested ? digest : nullptr;
    return 0;
}

int wccp_pkt_unload_service_info_component(wccp_pkt *pkt, const wccp_wire_service_info **out) {
    *out = nullptr;
    const auto *info = peek_layout<wccp_wire_service_info>(pkt);
    if (!info)
        return refuse_message_size(nullptr, pkt, "a service info", count_remaining_bytes(pkt), sizeof *info);
    if (to_host(info->head.type) != WCCP_SERVICE_INFO) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP: expected service info componenet. rxed %d",
                      to_host(info->head.type));
        return refuse_component_type(nullptr, pkt, to_host(info->head.type), WCCP_SERVICE_INFO);
    }
    // The eight ports are always sent, used or not; therefore the length is fixed.
    if (to_host(info->head.length) != sizeof *info - sizeof info->head)
        return refuse_message_size(nullptr, pkt, "a service info", to_host(info->head.length),
                                   sizeof *info - sizeof info->head);
    *out = info;
    return skip_bytes(pkt, sizeof *info);
}

// --- The components that every I-See-You has

int wccp_pkt_unload_router_identity_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                                   const wccp_wire_router_identity **out) {
    *out = nullptr;
    const auto *identity = peek_layout<wccp_wire_router_identity>(pkt);
    if (!identity) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: static length (%d) is longer than remaining pkt len (%d)",
                      group->id, clamp_to_int(sizeof *identity), clamp_to_int(count_remaining_bytes(pkt)));
        return refuse_message_size(group, pkt, "a router identity", count_remaining_bytes(pkt),
                                   sizeof *identity);
    }
    if (to_host(identity->head.type) != WCCP_ROUTER_IDENTITY_INFO) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: expecting router id info, rxed %d", group->id,
                      to_host(identity->head.type));
        return refuse_component_type(group, pkt, to_host(identity->head.type), WCCP_ROUTER_IDENTITY_INFO);
    }
    // The received-from addresses are not used; their number matters only for the length.
    const uint64_t size = sizeof *identity + uint64_t{to_host(identity->received_from)} * sizeof(be32);
    if (size > count_remaining_bytes(pkt)) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: full length does not fit in pkt", group->id);
        return refuse_message_size(group, pkt, "a router identity", count_remaining_bytes(pkt), size);
    }
    if (to_host(identity->head.length) != size - sizeof identity->head) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: rxed length (%d) and expected length (%d) mismatch",
                      group->id, to_host(identity->head.length), clamp_to_int(size - sizeof identity->head));
        return refuse_message_size(group, pkt, "a router identity", to_host(identity->head.length),
                                   size - sizeof identity->head);
    }
    *out = identity;
    return skip_bytes(pkt, size);
}

wccp_element_shape wccp_view_element_shape(uint16_t flags, uint32_t compat_mode) {
    static constexpr wccp_element_shape hash = {WCCP_ELEMENT_HASH, sizeof(wccp_wire_view_element_hash),
                                                offsetof(wccp_wire_view_element_hash, weight)};
    static constexpr wccp_element_shape no_redirect = {WCCP_ELEMENT_NO_REDIRECT,
                                                       sizeof(wccp_wire_view_element_mask),
                                                       offsetof(wccp_wire_view_element_mask, weight)};
    static constexpr wccp_element_shape nexus = {WCCP_ELEMENT_REDIRECT, sizeof(wccp_wire_view_element_mask),
                                                 offsetof(wccp_wire_view_element_mask, weight)};
    static constexpr wccp_element_shape ios = {WCCP_ELEMENT_REDIRECT,
                                               sizeof(wccp_wire_view_element_mask_short),
                                               offsetof(wccp_wire_view_element_mask_short, weight)};
    // The compatibility mode matters only for elements with redirection; the other forms are common to both.
    if (!(flags & WCCP_IDENTITY_MASK))
        return hash;
    if (flags & WCCP_IDENTITY_NO_REDIRECT)
        return no_redirect;
    return compat_mode == WCCP_COMPAT_NEXUS ? nexus : ios;
}

namespace {

// Outputs the size of a router view whose `count` elements begin at `distance`. False when not all of them
// were received.
bool measure_router_view(const wccp_service_group *group, const wccp_pkt *pkt, uint64_t distance,
                         uint32_t count, uint64_t *out_size) {
    for (uint32_t i = 0; i < count; i++) {
        const auto *element = peek_layout<wccp_wire_view_element>(pkt, distance);
        if (!element)
            return false;
        distance += wccp_view_element_shape(to_host(element->flags), group->compat_mode).size;
    }
    *out_size = distance;
    // Only the heads have been read so far; the last element may still be cut off.
    return distance <= count_remaining_bytes(pkt);
}

} // namespace

int wccp_pkt_unload_router_view_component(wccp_service_group *group, wccp_pkt *pkt, wccp_rtr_view_info *out) {
    *out = {};
    const auto *view = peek_layout<wccp_wire_router_view>(pkt);
    if (!view) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: static component does not fit in pkt", group->id);
        return refuse_message_size(group, pkt, "a router view", count_remaining_bytes(pkt), sizeof *view);
    }
    if (to_host(view->head.type) != WCCP_ROUTER_VIEW_INFO) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP: bad router view type rxed (%d)", to_host(view->head.type));
        return refuse_component_type(group, pkt, to_host(view->head.type), WCCP_ROUTER_VIEW_INFO);
    }
    const uint32_t routers = to_host(view->routers);
    if (routers > WCCP_MAX_ROUTERS) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: bad number of routers (%d) in ICU pkt. ", group->id,
                      static_cast<int>(routers));
        return refuse_message(group, pkt, wccp_reason_value("%u routers", routers),
                              wccp_reason_value("%u at most", WCCP_MAX_ROUTERS));
    }
    const auto *addresses = peek_layout<be32>(pkt, sizeof *view, routers);
    if (!addresses) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: number of routers does not fit in pkt", group->id);
        return refuse_message_size(group, pkt, "a router view", count_remaining_bytes(pkt),
                                   sizeof *view + routers * sizeof *addresses);
    }
    // The extra word is the count of appliances, between the router addresses and the elements.
    const uint32_t elements_at = static_cast<uint32_t>(sizeof *view + (routers + 1) * sizeof(be32));
    // Without the count of appliances, measure_router_view below refuses the view, because the count is
    // included in `elements_at`.
    const auto *count = peek_layout<be32>(pkt, elements_at - sizeof(be32));
    const uint32_t appliances = count ? to_host(*count) : 0;
    if (appliances > WCCP_MAX_APPLIANCES) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: bad number of appliances (%d) in ICU pkt.", group->id,
                      static_cast<int>(appliances));
        return refuse_message(group, pkt, wccp_reason_value("%u appliances", appliances),
                              wccp_reason_value("%u at most", WCCP_MAX_APPLIANCES));
    }
    // Elements differ in size, and only a walk over all of them gives the size of the view.
    uint64_t size;
    if (!measure_router_view(group, pkt, elements_at, appliances, &size)) {
        WCCP_COMPLAIN(LC_LOG_ERR,
                      "WCCP GRP %d: # of appliances (%u x %d bytes) does not fit in pkt length (%u)",
                      group->id, appliances, clamp_to_int(sizeof(wccp_wire_view_element_hash)), pkt->offset);
        return refuse_message(
            group, pkt,
            wccp_reason_value("%u bytes for %u appliances", count_remaining_bytes(pkt), appliances), {},
            WCCP_REASON_VIEW_LENGTH);
    }
    // The elements of a router in the other compatibility mode have another size; this is where it shows.
    if (to_host(view->head.length) != size - sizeof view->head) {
        WCCP_COMPLAIN(
            LC_LOG_ERR,
            "WCCP GRP %d: bad length. rxed length %d pkt length %d (check compatibility mode (IOS/Nexus))",
            group->id, to_host(view->head.length), clamp_to_int(size - sizeof view->head));
        return refuse_message(group, pkt, wccp_reason_value("%u bytes", to_host(view->head.length)),
                              wccp_reason_value("%d bytes", clamp_to_int(size - sizeof view->head)),
                              WCCP_REASON_VIEW_LENGTH);
    }
    *out = {
        .change_number = view->change_number,
        .key_ipa = view->key_address,
        .key_change = view->key_change,
        .router_count = routers,
        .appliance_count = appliances,
        .routers = addresses,
        .appliances = {pkt->data + pkt->offset + elements_at, static_cast<uint32_t>(size - elements_at)},
    };
    return skip_bytes(pkt, size);
}

// --- The web-cache elements of a Router View

namespace {

// Stores the bucket bits of an element and returns how many are set. The bits of two words at a time are
// added in parallel within one 64-bit word. The build targets processors without a popcount instruction; with
// eight calls of the library's bit count this would be the most expensive step of an I-See-You.
uint16_t decode_bucket_bits(const wccp_wire_view_element_hash *element, wccp_rtr_view_appliance *decoded) {
    uint64_t in_bytes = 0;
    for (uint32_t i = 0; i < 8; i += 2) {
        decoded->bucket_bits[i] = to_host(element->bucket_words[i]);
        decoded->bucket_bits[i + 1] = to_host(element->bucket_words[i + 1]);
        uint64_t bits = uint64_t{decoded->bucket_bits[i]} << 32 | decoded->bucket_bits[i + 1];
        bits -= (bits >> 1) & 0x5555555555555555;
        bits = (bits & 0x3333333333333333) + ((bits >> 2) & 0x3333333333333333);
        in_bytes += (bits + (bits >> 4)) & 0x0f0f0f0f0f0f0f0f;
    }
    // A sum of 256 does not fit in a byte; therefore the bytes are widened to 16 bits before the addition.
    const uint64_t in_pairs = (in_bytes & 0x00ff00ff00ff00ff) + ((in_bytes >> 8) & 0x00ff00ff00ff00ff);
    decoded->buckets_assigned = static_cast<uint16_t>((in_pairs * 0x0001000100010001) >> 48);
    decoded->buckets_total = WCCP_MAX_BUCKETS;
    return decoded->buckets_assigned;
}

} // namespace

int wccp_process_router_view_web_cache_id_elements(wccp_service_group *group, uint32_t count,
                                                   wccp_view_elements elements,
                                                   wccp_rtr_view_appliance *decoded,
                                                   wccp_assign_summary *hash_summary) {
    if (!group || !decoded || !hash_summary || count > WCCP_MAX_APPLIANCES)
        return 1;
    *hash_summary = {.valid = 1, .self_count = 0, .total_count = 0};
    const received_bytes bytes = {elements.first, elements.size};
    uint64_t distance = 0;
    uint32_t total = 0;
    for (uint32_t i = 0; i < count; i++, decoded++) {
        const auto *head = peek_layout<wccp_wire_view_element>(bytes, distance);
        if (!head)
            return 1;
        const uint16_t flags = to_host(head->flags);
        const wccp_element_shape shape = wccp_view_element_shape(flags, group->compat_mode);
        const bool by_hash = shape.form == WCCP_ELEMENT_HASH;
        const auto *hash = by_hash ? peek_layout<wccp_wire_view_element_hash>(bytes, distance) : nullptr;
        const auto *weight = peek_layout<be16>(bytes, distance + shape.weight_at);
        if (!weight || (by_hash && !hash))
            return 1;
        decoded->ipa = head->web_cache_id;
        if (by_hash && to_host(head->hash_revision) != 0) { // refuses the whole message
            WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: HASH revision is not supported.", group->id);
            return 1;
        }
        decoded->weight = to_host(*weight);
        hash_summary->mask_forms |= by_hash ? 0 : 1u << i;
        if (shape.form == WCCP_ELEMENT_REDIRECT) {
            hash_summary->valid = 0;                              // the assignment is in an Assignment Map
        } else if (by_hash && flags & WCCP_IDENTITY_HISTORICAL) { // not the assignment in force
            QV_LOG(LC_LOG_INFO, "WCCP GRP %d: app id. %s assignment is historical, ignored", group->id,
                   addr_text(decoded->ipa).s);
        } else if (by_hash) {
            const uint16_t assigned = decode_bucket_bits(hash, decoded);
            if (decoded->ipa == group->appliance_ipa)
                hash_summary->self_count = assigned;
            total += assigned;
        }
        distance += shape.size;
    }
    // The elements of a faulty router may overlap and add up to more buckets than there are.
    hash_summary->total_count = static_cast<uint16_t>(total < WCCP_MAX_BUCKETS ? total : WCCP_MAX_BUCKETS);
    return 0;
}

// --- The optional components of an I-See-You

int wccp_pkt_unload_assignment_map_component(wccp_service_group *group, wccp_pkt *pkt,
                                             wccp_assign_map_info *out) {
    constexpr uint32_t smallest =
        sizeof(wccp_wire_assignment_map) + sizeof(wccp_wire_mask_element) + sizeof(wccp_wire_value_element);
    constexpr uint32_t head = sizeof(wccp_wire_component);
    const auto *map = peek_layout<wccp_wire_assignment_map>(pkt);
    // A map must have room for one mask and one value even if it announces no mask elements.
    if (!map || count_remaining_bytes(pkt) < smallest) {
        WCCP_COMPLAIN(
            LC_LOG_ERR,
            "WCCP GRP %d: minimum assignment map (len = %d) does not fit in the packet. router src ip : "
            "%s ",
            group->id, clamp_to_int(smallest), addr_text(pkt->ipa).s);
        return refuse_message_size(group, pkt, "an assignment map", count_remaining_bytes(pkt), smallest);
    }
    const uint32_t declared = to_host(map->head.length);
    if (declared < smallest - head) {
        WCCP_COMPLAIN(LC_LOG_WARNING,
                      "WCCP GRP %d:  assignment map length: %d does not include at least one mask/value set "
                      "(expected minimum len: %d)  router src ip : %s ",
                      group->id, clamp_to_int(declared), clamp_to_int(smallest - head),
                      addr_text(pkt->ipa).s);
        return refuse_message_size(group, pkt, "an assignment map", declared, smallest - head);
    }
    *out = {}; // it may hold an earlier map of the same message
    out->element_count = to_host(map->mask_elements);
    out->masks = peek_layout<wccp_wire_mask_element>(pkt, sizeof *map);
    uint64_t size = sizeof *map; // including the component's head, which `declared` does not count
    // The declared length only limits this walk; the sizes of the elements decide where the component ends.
    for (uint32_t i = 0; i < out->element_count; i++) {
        const auto *element = peek_layout<wccp_wire_mask_element>(pkt, size);
        // An element that was not received counts no values and is refused by the test below.
        const uint64_t values_at = size + sizeof *element;
        const uint64_t values = element ? to_host(element->values) : 0;
        size = values_at + values * sizeof(wccp_wire_value_element);
        if (!element || size - head > declared || size > count_remaining_bytes(pkt)) {
            WCCP_COMPLAIN(
                LC_LOG_ERR,
                "WCCP GRP %d: unload assignment map: packet length is BAD or it has bogus values. rxed "
                "len: %d current len %d.",
                group->id, clamp_to_int(declared), clamp_to_int(size - head));
            return refuse_message_size(group, pkt, "an assignment map", declared, size - head);
        }
        out->value_count = static_cast<uint32_t>(values); // of the last mask element, when the loop ends
        out->values = peek_layout<wccp_wire_value_element>(pkt, values_at, values);
    }
    out->present = 1;
    return skip_bytes(pkt, size);
}

int wccp_pkt_unload_capability_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                              wccp_rtr_capabilities *out) {
    struct capability {
        uint16_t type;
        uint32_t wccp_rtr_capabilities::*word;
    };
    static constexpr capability known[] = {
        {WCCP_CAP_FORWARDING, &wccp_rtr_capabilities::forwarding},
        {WCCP_CAP_ASSIGNMENT, &wccp_rtr_capabilities::assignment},
        {WCCP_CAP_RETURN, &wccp_rtr_capabilities::ret},
    };
    constexpr uint32_t element_size = sizeof(wccp_wire_capability_element);
    const auto *head = peek_layout<wccp_wire_component>(pkt);
    if (!head)
        return refuse_message_size(group, pkt, "a capability info", count_remaining_bytes(pkt), sizeof *head);
    const uint32_t length = to_host(head->length);
    if (length % element_size != 0) {
        WCCP_COMPLAIN(
            LC_LOG_ERR,
            "WCCP GRP %d: capability component length is not aligned. length %d individual element size "
            "%d",
            group->id, clamp_to_int(length), clamp_to_int(element_size));
        return refuse_message(group, pkt, wccp_reason_value("a capability info of %u bytes", length),
                              wccp_reason_value("a multiple of %u", element_size));
    }
    if (length >= (std::size(known) + 1) * element_size) // logged, not refused
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: more capabilities than the known ones. length %d", group->id,
               clamp_to_int(length));
    const auto *element = peek_layout<wccp_wire_capability_element>(pkt, sizeof *head, length / element_size);
    if (!element)
        return refuse_message_size(group, pkt, "a capability info", count_remaining_bytes(pkt),
                                   sizeof *head + length);
    for (uint32_t i = 0; i < length / element_size; i++, element++) {
        const capability *found = nullptr;
        for (const capability &each : known)
            if (each.type == to_host(element->type))
                found = &each;
        // The element's own length is not read: all known capabilities have four bytes.
        if (found) // a repeated capability replaces the earlier one
            out->*found->word = to_host(element->value);
        else
            group->rx_unknown_capabilities++;
    }
    return skip_bytes(pkt, sizeof *head + length);
}

int wccp_pkt_unload_command_ext_component(wccp_service_group *group, wccp_pkt *pkt, wccp_command_info *out) {
    *out = {};
    const auto *extension = peek_layout<wccp_wire_command_ext>(pkt);
    if (!extension) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: no commands in pkt", group->id);
        return refuse_message_size(group, pkt, "a command", count_remaining_bytes(pkt), sizeof *extension);
    }
    const uint32_t length = to_host(extension->head.length);
    // The fields are at fixed places. Only the cursor follows the declared length, even a shorter one.
    if (skip_bytes(pkt, sizeof extension->head + length)) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: bogus component length (%d): does not  fit in the packet.",
                      group->id, clamp_to_int(length));
        return refuse_message_size(group, pkt, "a command", count_remaining_bytes(pkt),
                                   sizeof extension->head + length);
    }
    out->command = to_host(extension->command);
    out->data = to_host(extension->data);
    return 0;
}

uint16_t wccp_pkt_next_component_type(const wccp_pkt *pkt) {
    const auto *type = peek_layout<be16>(pkt);
    // 0 also stands for fewer bytes than a type. No optional component has it; they are refused as unknown.
    return type ? to_host(*type) : 0;
}

int wccp_pkt_unload_unknown_component(wccp_service_group *group, wccp_pkt *pkt) {
    const auto *head = peek_layout<wccp_wire_component>(pkt);
    // A component of one to three bytes has no head; it is refused below with the bytes of its type that were
    // received.
    const int type = wccp_pkt_next_component_type(pkt), length = head ? to_host(head->length) : 0;
    if (head && skip_bytes(pkt, sizeof *head + to_host(head->length)) == 0)
        return 0;
    WCCP_COMPLAIN(LC_LOG_ERR,
                  "WCCP GRP %d: unkown pkt length does not fit in the packet. component type: %d length %d ",
                  group->id, type, length);
    return refuse_message(group, pkt, wccp_reason_value("component type %d of %d bytes", type, length),
                          wccp_reason_value("%u bytes", count_remaining_bytes(pkt)));
}

// --- The component of a Removal Query

int wccp_pkt_unload_router_query_component(wccp_service_group *group, wccp_pkt *pkt,
                                           const wccp_wire_router_query **out) {
    constexpr uint32_t length = sizeof(wccp_wire_router_query) - sizeof(wccp_wire_component);
    *out = nullptr;
    const auto *query = peek_layout<wccp_wire_router_query>(pkt);
    if (!query) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: router query comp. does not fit in packet.", group->id);
        return refuse_message_size(group, pkt, "a router query", count_remaining_bytes(pkt), sizeof *query);
    }
    if (to_host(query->head.type) != WCCP_ROUTER_QUERY_INFO) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: bad router query type rxed (%d)", group->id,
                      to_host(query->head.type));
        return refuse_component_type(group, pkt, to_host(query->head.type), WCCP_ROUTER_QUERY_INFO);
    }
    if (to_host(query->head.length) != length) {
        WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: bad length. rxed length %d pkt length %d", group->id,
                      to_host(query->head.length), clamp_to_int(length));
        return refuse_message_size(group, pkt, "a router query", to_host(query->head.length), length);
    }
    *out = query;
    return skip_bytes(pkt, sizeof *query);
}
