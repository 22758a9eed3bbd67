// The encoder of sent messages.
//
// Messages are written into the group's wccp_pkt, or into that of a removal reply, with the engine lock held,
// by the timer thread or by any thread that stops a group or receives a query. The buffer is all zero before
// the first component, and zero fields are not written. Every write goes through find_room<T>(), which
// returns the component's place if all of it fits into 4096 bytes; commit_component() advances the cursor
// once the component is complete. A component that fails therefore leaves the cursor where it was, and the
// builder abandons the message.
//
// A message carries the group's present state. Nothing is kept from one message to the next but
// assign_tx_count: each Redirect-Assign that names a router adds 1 to it, and the acknowledgement rule of
// wccp_pkt_mgr.cpp reads it.
#include "engine/wccp_pkt_load.h"

#include <cstring>

#include "engine/wccp_utils.h"
#include "engine/wccp_wire.h"
#include "runtime/md5.h"

namespace {

// The place for a component of `size` bytes that begins with a T, or null when it does not fit.
template <typename T>
T *find_room(wccp_pkt *pkt, uint64_t size = sizeof(T)) {
    static_assert(alignof(T) == 1);
    if (pkt->offset + size > WCCP_MAX_PACKET)
        return nullptr;
    return reinterpret_cast<T *>(pkt->data + pkt->offset);
}

int commit_component(wccp_pkt *pkt, uint64_t size) {
    pkt->offset += static_cast<uint32_t>(size);
    pkt->length += static_cast<uint32_t>(size);
    pkt->cursor = pkt->data + pkt->offset;
    return 0;
}

wccp_wire_component make_component_head(uint16_t type, uint64_t size) {
    return {to_be16(type), to_be16(static_cast<uint16_t>(size - sizeof(wccp_wire_component)))};
}

template <typename Entry>
bool list_is_longer_than(const Entry *entry, uint32_t count) {
    for (; entry; entry = entry->next)
        if (count-- == 0)
            return true;
    return false;
}

} // namespace

int wccp_pkt_load_msg_header(wccp_pkt *pkt, uint32_t type) {
    auto *header = find_room<wccp_wire_msg_header>(pkt);
    if (!header)
        return 1;
    // The length is filled in by wccp_pkt_finish.
    *header = {.type = to_be32(type), .version = to_be16(WCCP_VERSION), .length = to_be16(0)};
    return commit_component(pkt, sizeof *header);
}

int wccp_pkt_load_security_info_component(wccp_service_group *group, wccp_pkt *pkt, uint8_t **out_digest) {
    *out_digest = nullptr;
    const bool digested = group->security_option == 1;
    const uint32_t size = digested ? sizeof(wccp_wire_security_md5) : sizeof(wccp_wire_security_info);
    auto *info = find_room<wccp_wire_security_info>(pkt, size);
    if (!info)
        return 1;
    *info = {make_component_head(WCCP_SECURITY_INFO, size), to_be32(group->security_option)};
    // The digest covers the whole message, with these bytes zero; wccp_pkt_finish computes it last.
    if (digested)
        *out_digest = reinterpret_cast<wccp_wire_security_md5 *>(info)->digest;
    return commit_component(pkt, size);
}

int wccp_pkt_load_service_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    auto *info = find_room<wccp_wire_service_info>(pkt);
    if (!info)
        return 1;
    info->head = make_component_head(WCCP_SERVICE_INFO, sizeof *info);
    info->service_id = group->id;
    // A standard service is defined by its id alone; routers expect its other fields to be zero.
    if (group->id > WCCP_LAST_STANDARD_ID) {
        info->service_type = 1;
        info->priority = group->priority;
        info->protocol = group->protocol;
        info->flags = to_be32(group->service_flags);
    }
    return commit_component(pkt, sizeof *info);
}

int wccp_pkt_load_web_cache_identity_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    // Until a method has been agreed, the hash form is sent.
    if (group->assign_method == WCCP_ASSIGN_MASK) {
        auto *identity = find_room<wccp_wire_identity_mask>(pkt);
        if (!identity)
            return 1;
        identity->head = make_component_head(WCCP_WEB_CACHE_IDENTITY_INFO, sizeof *identity);
        identity->web_cache_id = group->appliance_ipa;
        identity->flags = to_be16(WCCP_IDENTITY_MASK);
        // One mask without values: the configured one, even where the assignment uses the default instead.
        identity->mask_elements = to_be32(1);
        identity->mask.mask = {to_be32(group->mask_src_ip), to_be32(group->mask_dst_ip),
                               to_be16(group->mask_src_port), to_be16(group->mask_dst_port)};
        identity->weight = to_be16(group->weight);
        return commit_component(pkt, sizeof *identity);
    }
    auto *identity = find_room<wccp_wire_identity_hash>(pkt);
    if (!identity)
        return 1;
    identity->head = make_component_head(WCCP_WEB_CACHE_IDENTITY_INFO, sizeof *identity);
    identity->web_cache_id = group->appliance_ipa;
    identity->weight = to_be16(group->weight);
    return commit_component(pkt, sizeof *identity);
}

int wccp_pkt_load_web_cache_view_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    const uint64_t routers = group->sending_router_count, appliances = group->appliance_view_count;
    const uint64_t size = sizeof(wccp_wire_web_cache_view) + routers * sizeof(wccp_wire_view_router_element) +
                          sizeof(be32) + appliances * sizeof(be32);
    auto *view = find_room<wccp_wire_web_cache_view>(pkt, size);
    if (!view)
        return 1;
    // A list longer than its count would be written past the room that was found.
    if (list_is_longer_than(group->sending_routers, group->sending_router_count)) {
        QV_LOG(LC_LOG_ERR, "WCCP router count (%d) mismatch with entries in router view list",
               static_cast<int>(group->sending_router_count));
        return 1;
    }
    if (list_is_longer_than(group->appliance_view, group->appliance_view_count)) {
        QV_LOG(LC_LOG_ERR, "WCCP web cache count (%d) mismatch with entries in appliance view list",
               static_cast<int>(group->appliance_view_count));
        return 1;
    }
    view->head = make_component_head(WCCP_WEB_CACHE_VIEW_INFO, size);
    view->change_number = to_be32(group->change_number);
    view->routers = to_be32(group->sending_router_count);
    // A list that is shorter than its count leaves zero elements.
    auto *const elements = reinterpret_cast<wccp_wire_view_router_element *>(view + 1);
    auto *element = elements;
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        *element++ = {router->router_id, router->receive_id};
    auto *address = reinterpret_cast<be32 *>(elements + routers);
    *address++ = to_be32(group->appliance_view_count);
    for (const wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next)
        *address++ = entry->ipa;
    return commit_component(pkt, size);
}

// --- The two forms of the assignment

namespace {

// Writes the router elements and returns a pointer past them.
uint8_t *write_router_elements(const wccp_service_group *group, void *elements) {
    auto *const first = static_cast<wccp_wire_assign_router_element *>(elements);
    auto *element = first;
    uint32_t left = group->sending_router_count;
    for (wccp_sending_router *router = group->sending_routers; router && left;
         router = router->next, left--) {
        // The receive id and the change number are echoed as received.
        *element++ = {router->router_id, router->receive_id, router->change_number};
        router->assign_tx_count++;
    }
    // The count decides, not the list: a shorter list leaves elements of zeros.
    return reinterpret_cast<uint8_t *>(first + group->sending_router_count);
}

// Logs `line`, a format for the group's id and two counts, when the appliances do not hold all slots
// together. The message is sent regardless.
void log_unassigned_slots(const wccp_service_group *group, const char *line) {
    uint32_t assigned = 0;
    for (uint32_t i = 0; i < group->dsg_active_count; i++)
        assigned += group->dsg_appliances[i].assigned;
    if (assigned != group->bucket_count)
        QV_LOG(LC_LOG_ERR, line, group->id, static_cast<int>(assigned),
               static_cast<int>(group->bucket_count));
}

} // namespace

int wccp_pkt_load_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    const uint32_t routers = group->sending_router_count, appliances = group->dsg_active_count;
    if (group->designated != 1 || routers == 0 || appliances == 0 || appliances > WCCP_MAX_APPLIANCES) {
        QV_LOG(LC_LOG_ERR,
               "WCCP GRP %d: redirect assignment load: invalid designated appliance state. designated %d # "
               "routers %d # active appliances %d",
               group->id, static_cast<int>(group->designated), static_cast<int>(routers),
               static_cast<int>(appliances));
        return 1;
    }
    // The last part has a fixed size: one byte for each of the 256 buckets.
    const uint64_t size = sizeof(wccp_wire_assignment_info) +
                          uint64_t{routers} * sizeof(wccp_wire_assign_router_element) + sizeof(be32) +
                          appliances * sizeof(be32) + sizeof group->bucket_index;
    auto *info = find_room<wccp_wire_assignment_info>(pkt, size);
    if (!info)
        return 1;
    *info = {make_component_head(WCCP_ASSIGNMENT_INFO, size), group->appliance_ipa,
             to_be32(group->dsg_key_change), to_be32(routers)};
    auto *address = reinterpret_cast<be32 *>(write_router_elements(group, info + 1));
    *address++ = to_be32(appliances);
    for (uint32_t i = 0; i < appliances; i++)
        *address++ = group->dsg_appliances[i].ipa;
    // The buckets are indexes into the addresses above: dsg_appliances has the same order.
    memcpy(address, group->bucket_index, sizeof group->bucket_index);
    log_unassigned_slots(
        group, "WCCP GRP %d: TX HASH redirect assign: not all buckets are assigned. assigned: %d total: %d");
    return commit_component(pkt, size);
}

int wccp_pkt_load_mask_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    const uint32_t routers = group->sending_router_count, values = group->mask_value_count;
    if (group->designated != 1 || routers == 0 || group->appliance_view_count == 0 || values == 0 ||
        values > WCCP_MAX_MASK_VALUES) {
        QV_LOG(LC_LOG_ERR,
               "WCCP GRP %d: TX MASK redirect assign: invalid designated appliance state. designated %d # "
               "routers %d appliances %d values: %d",
               group->id, static_cast<int>(group->designated), static_cast<int>(routers),
               static_cast<int>(group->appliance_view_count), static_cast<int>(values));
        return 1;
    }
    const uint64_t size = sizeof(wccp_wire_mask_assignment_info) +
                          uint64_t{routers} * sizeof(wccp_wire_assign_router_element) + sizeof(be32) +
                          sizeof(wccp_wire_mask_element) + values * sizeof(wccp_wire_value_element);
    auto *info = find_room<wccp_wire_mask_assignment_info>(pkt, size);
    if (!info) {
        QV_LOG(LC_LOG_ERR,
               "WCCP GRP %d: TX MASK redirect assign: component: (len %d) does not fit in the pkt.",
               group->id, static_cast<int>(size));
        return 1;
    }
    // The inner length counts from the key address on.
    constexpr uint64_t outside = offsetof(wccp_wire_mask_assignment_info, key_address);
    *info = {.head = make_component_head(WCCP_MASK_ASSIGNMENT_INFO, size),
             .assignment_type = to_be16(1),
             .assignment_length = to_be16(static_cast<uint16_t>(size - outside)),
             .key_address = group->appliance_ipa,
             .key_change = to_be32(group->dsg_key_change),
             .routers = to_be32(routers)};
    auto *elements = reinterpret_cast<be32 *>(write_router_elements(group, info + 1));
    // A group has one mask; its values follow it.
    *elements++ = to_be32(1);
    auto *element = reinterpret_cast<wccp_wire_mask_element *>(elements);
    const wccp_mask *mask = &group->mask_in_use;
    *element++ = {.mask = {to_be32(mask->src_ip), to_be32(mask->dst_ip), to_be16(mask->src_port),
                           to_be16(mask->dst_port)},
                  .values = to_be32(values)};
    auto *out = reinterpret_cast<wccp_wire_value_element *>(element);
    for (const wccp_mask_value *value = group->mask_values; value < group->mask_values + values; value++)
        *out++ = {.value = {to_be32(value->src_ip), to_be32(value->dst_ip), to_be16(value->src_port),
                            to_be16(value->dst_port)},
                  .appliance_id = value->appliance_ipa};
    log_unassigned_slots(
        group, "WCCP GRP %d: TX MASK redirect assign: not all buckets are assigned. assigned: %d total: %d");
    return commit_component(pkt, size);
}

int wccp_pkt_load_capability_info_component(wccp_service_group *group, wccp_pkt *pkt) {
    const struct {
        uint16_t type;
        uint32_t agreed;
    } capabilities[] = {
        {WCCP_CAP_FORWARDING, group->fwd_method},
        {WCCP_CAP_ASSIGNMENT, group->assign_method},
        {WCCP_CAP_RETURN, group->ret_method},
    };
    // The protocol's defaults, GRE, hash and GRE, are not sent.
    constexpr uint32_t other_than_default = 2; // L2, mask, L2
    uint32_t count = 0;
    for (const auto &capability : capabilities)
        count += capability.agreed == other_than_default;
    if (count == 0) {
        QV_LOG(LC_LOG_WARNING, "WCCP: GRP %d loading capability comp. all capabilities are default.",
               group->id);
        return 0;
    }
    const uint64_t size = sizeof(wccp_wire_component) + count * sizeof(wccp_wire_capability_element);
    auto *head = find_room<wccp_wire_component>(pkt, size);
    if (!head)
        return 1;
    *head = make_component_head(WCCP_CAPABILITY_INFO, size);
    auto *element = reinterpret_cast<wccp_wire_capability_element *>(head + 1);
    for (const auto &capability : capabilities)
        if (capability.agreed == other_than_default)
            *element++ = {to_be16(capability.type), to_be16(sizeof(be32)), to_be32(other_than_default)};
    return commit_component(pkt, size);
}

int wccp_pkt_load_command_ext_component(wccp_service_group *group, wccp_pkt *pkt) {
    auto *extension = find_room<wccp_wire_command_ext>(pkt);
    if (!extension)
        return 1;
    *extension = {make_component_head(WCCP_COMMAND_EXTENSION, sizeof *extension),
                  to_be16(WCCP_COMMAND_SHUTDOWN), to_be16(sizeof(be32)), group->appliance_ipa};
    return commit_component(pkt, sizeof *extension);
}

void wccp_pkt_digest(const wccp_service_group *group, const wccp_pkt *pkt, uint8_t digest[16]) {
    md5_state state;
    md5_init(&state);
    // All 8 bytes of the password are hashed, its padding included.
    md5_append(&state, group->password, sizeof group->password);
    md5_append(&state, pkt->data, pkt->length);
    md5_finish(&state, digest);
}

int wccp_pkt_finish(wccp_service_group *group, wccp_pkt *pkt, uint8_t *digest) {
    auto *header = reinterpret_cast<wccp_wire_msg_header *>(pkt->data);
    // The header's length does not count the header itself. It is part of what is hashed, so it comes first.
    header->length = to_be16(static_cast<uint16_t>(pkt->length - sizeof *header));
    if (group->security_option == 1 && digest)
        wccp_pkt_digest(group, pkt, digest);
    return 0;
}
