// The message processing in both directions: a received packet from its header to the views, and the three
// kinds of packet that this appliance sends.
//
// Reception runs on the receive thread of an interface, whose stack holds the packet. Transmission runs on
// the timer thread or on the thread that stops a group. Both hold the engine lock throughout; therefore the
// group's single transmit packet needs no other protection. It is rebuilt for every Here-I-Am and
// Redirect-Assign; a removal reply is built when its query arrives and is sent unchanged each time.
//
// Anybody can send to the port. The order of checks is: length, version, type, group, security, contents.
// Only a complete I-See-You from a router that may join reaches the group's records; up to that point only
// counters and reasons change. A step that fails later does not undo the ones before it.
//
// Two tables list what messages consist of: the optional components of an I-See-You with their decoders, and
// the build steps of the sent messages with their encoders. A step that fails is logged by its name in the
// table.
//
// Acknowledgements. A router acknowledges an assignment by reporting its key, the address of the designated
// appliance and a number. That counts only after at least two Redirect-Assign messages have named the router,
// so that every router is sent every table at least twice.
#include "engine/wccp_pkt_mgr.h"

#include <cstring>

#include "engine/wccp_complaints.h"
#include "engine/wccp_owners.h"
#include "engine/wccp_packet_io.h"
#include "engine/wccp_pkt_load.h"
#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_view_utils.h"
#include "runtime/md5.h"

namespace {

constexpr uint32_t OPTIONAL_COMPONENTS = 3; // in one I-See-You

// Logs that a step of decoding or building a message failed, and returns `status`.
int log_failed_step(const char *words, int status) {
    WCCP_COMPLAIN(LC_LOG_ERR, "WCCP: %s failed.", words);
    return status;
}

void note_malformed_message(wccp_service_group *group, const wccp_pkt *pkt, const wccp_reason_text &offered,
                            const wccp_reason_text &wanted) {
    wccp_note_reason(group, WCCP_REASON_MESSAGE_MALFORMED, pkt->ipa, offered, wanted);
}

// --- An I-See-You

// The contents of an I-See-You, decoded completely before anything is changed by it.
struct icu_message {
    be32 router_id;
    be32 receive_id;
    wccp_rtr_view_info view;
    wccp_rtr_capabilities offered;
    bool has_capabilities; // the message has that component
    wccp_assign_map_info map;
};

int read_assignment_map(wccp_service_group *group, wccp_pkt *pkt, icu_message *icu) {
    return wccp_pkt_unload_assignment_map_component(group, pkt, &icu->map);
}
int read_command_extension(wccp_service_group *group, wccp_pkt *pkt, icu_message *icu) {
    wccp_command_info command;
    const int status = wccp_pkt_unload_command_ext_component(group, pkt, &command);
    if (status == 0)
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: router id %s sent command %d data 0x%x", group->id,
               addr_text(icu->router_id).s, command.command, command.data);
    return status;
}
int read_capabilities(wccp_service_group *group, wccp_pkt *pkt, icu_message *icu) {
    icu->has_capabilities = true;
    return wccp_pkt_unload_capability_info_component(group, pkt, &icu->offered);
}

struct optional_component {
    uint16_t type;
    const char *words;
    int (*read)(wccp_service_group *group, wccp_pkt *pkt, icu_message *icu);
};
const optional_component optional_components[] = {
    {WCCP_ASSIGNMENT_MAP, "unloading assignment map", read_assignment_map},
    {WCCP_COMMAND_EXTENSION, "unloading command ext comp.", read_command_extension},
    {WCCP_CAPABILITY_INFO, "unloading capability comp.", read_capabilities},
};

// Reads one component; one of an unknown type is skipped. Fewer bytes than a component's head are refused.
int read_optional_component(wccp_service_group *group, wccp_pkt *pkt, icu_message *icu) {
    const uint16_t type = wccp_pkt_next_component_type(pkt);
    for (const optional_component &row : optional_components) {
        if (row.type != type)
            continue;
        const int status = row.read(group, pkt, icu);
        return status ? log_failed_step(row.words, status) : 0;
    }
    WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: ICU component type (%d) not recognized. sender router id %s",
                  group->id, type, addr_text(icu->router_id).s);
    return wccp_pkt_unload_unknown_component(group, pkt) ? log_failed_step("unloading unknown component", 1)
                                                         : 0;
}

wccp_reason_text format_service(uint32_t priority, uint32_t protocol, uint32_t flags) {
    return wccp_reason_value("priority %u, protocol %u, flags 0x%x", priority, protocol, flags);
}

// Decodes the whole message. Changes nothing in the group but its counters and reasons.
int read_i_see_you(wccp_service_group *group, wccp_pkt *pkt, const wccp_wire_service_info *service,
                   icu_message *icu) {
    *icu = {};
    icu->offered = {WCCP_METHOD_GRE, WCCP_ASSIGN_HASH, WCCP_METHOD_GRE}; // without a Capability Info
    const wccp_wire_router_identity *identity;
    if (const int status = wccp_pkt_unload_router_identity_info_component(group, pkt, &identity))
        return log_failed_step("unloading router identity", status);
    // Kept in wire order: both are compared and echoed, never computed with.
    icu->router_id = identity->router_id;
    icu->receive_id = identity->receive_id;
    const uint32_t flags = to_host(service->flags);
    // Also compared for standard services, for which routers send zeros.
    if (service->priority != group->priority || service->protocol != group->protocol ||
        flags != group->service_flags) {
        wccp_note_reason(group, WCCP_REASON_SERVICE_MISMATCH, icu->router_id,
                         format_service(service->priority, service->protocol, flags),
                         format_service(group->priority, group->protocol, group->service_flags));
        WCCP_COMPLAIN(
            LC_LOG_WARNING,
            "WCCP GRP %d: service group config mismatch (router id: %s) .priority: rxed = %u local = %u, "
            "protocol: rxed = %u local = %u, service flags: rxed = 0x%x local =  0x%x",
            group->id, addr_text(icu->router_id).s, service->priority, group->priority, service->protocol,
            group->protocol, flags, group->service_flags);
        group->rx_service_mismatches++; // only counted: the router is accepted
    }
    // The two fixed components have a fixed order; those that follow may come in any.
    if (const int status = wccp_pkt_unload_router_view_component(group, pkt, &icu->view))
        return log_failed_step("unloading router view", status);
    // Ends because each component that is read moves the cursor by its head at least.
    for (uint32_t count = 0; pkt->offset < pkt->length;) {
        if (const int status = read_optional_component(group, pkt, icu))
            return status;
        // Only now, when the component has been read and could be refused itself.
        if (++count > OPTIONAL_COMPONENTS) {
            WCCP_COMPLAIN(LC_LOG_ERR, "WCCP GRP %d: ICU bogus packet  (too many optional components).",
                          group->id);
            note_malformed_message(group, pkt, wccp_reason_value("%u optional components", count),
                                   wccp_reason_value("%u at most", OPTIONAL_COMPONENTS));
            return 1;
        }
    }
    return 0;
}

// The router's record, created by its first I-See-You. Null when it may not join; `out_status` is then the
// result of the processing.
wccp_sending_router *find_or_create_router(wccp_service_group *group, const icu_message *icu,
                                           int *out_status) {
    *out_status = 0;
    if (wccp_sending_router *router = wccp_find_sending_router(group, icu->router_id)) {
        // A known router is not negotiated with again; a change in what it offers is only noted.
        if (icu->has_capabilities)
            wccp_check_offered_methods(group, icu->router_id, &icu->offered);
        return router;
    }
    wccp_rtr_capabilities agreed;
    uint32_t compatible;
    *out_status =
        wccp_process_router_capabilities(group, icu->router_id, &icu->offered, &agreed, &compatible);
    return compatible ? wccp_create_sending_router(group, icu->router_id, &icu->offered, &agreed) : nullptr;
}

wccp_reason_text format_assignment_key(be32 address, uint32_t change) {
    return wccp_reason_value("table %s number %u", addr_text(address).s, change);
}

void check_acknowledgement(wccp_service_group *group, wccp_sending_router *router,
                           const wccp_rtr_view_info *view) {
    if (!(router->flags & WCCP_RTR_ASSIGN_UNACKED))
        return;
    // Another key is that of an earlier table, or of the appliance that was designated before.
    const uint32_t key_change = to_host(view->key_change);
    if (view->key_ipa == group->appliance_ipa && key_change == group->dsg_key_change &&
        router->assign_tx_count > 1) {
        router->flags &= ~WCCP_RTR_ASSIGN_UNACKED;
        wccp_forget_reason(group, WCCP_REASON_NOT_ACKNOWLEDGED, router->router_id);
        if (group->pending_acks != 0)
            group->pending_acks--;
        if (group->pending_acks == 0) // all routers have the table: nothing to repeat
            group->assign_timer.active = 0;
        return;
    }
    QV_LOG(LC_LOG_INFO,
           "WCCP GRP %d: router %s did NOT ack. REDIRECT ASSGN msg. expected key: %s, 0x%x rxed key: %s, "
           "0x%x. pkts txed: %d, pending rtrs: %d",
           group->id, addr_text(router->router_id).s, addr_text(group->appliance_ipa).s,
           group->dsg_key_change, addr_text(view->key_ipa).s, key_change,
           static_cast<int>(router->assign_tx_count), group->pending_acks);
    if (router->assign_tx_count > 1) // before that nothing is wrong
        wccp_note_reason(group, WCCP_REASON_NOT_ACKNOWLEDGED, router->router_id,
                         format_assignment_key(view->key_ipa, key_change),
                         format_assignment_key(group->appliance_ipa, group->dsg_key_change));
}

// Stores the values of an Assignment Map in the router's last report, and counts those of this appliance.
wccp_assign_summary apply_assignment_map(const wccp_service_group *group, wccp_sending_router *router,
                                         const wccp_assign_map_info *map) {
    router->map_src_ip = to_host(map->masks->mask.src_ip);
    router->map_dst_ip = to_host(map->masks->mask.dst_ip);
    router->map_src_port = router->map_dst_port = 0;
    router->map_in_order = wccp_map_is_in_order(group, map);
    // The map replaces what the elements of this message or an earlier map have left here.
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        memset(router->view_appliances[i].bucket_bits, 0, sizeof router->view_appliances[i].bucket_bits);

    // A packet has room for 255 values at most.
    wccp_assign_summary summary = {
        .valid = 1, .self_count = 0, .total_count = static_cast<uint16_t>(map->value_count)};
    wccp_rtr_view_appliance *entry = nullptr;
    for (uint32_t i = 0; i < map->value_count; i++) {
        const be32 id = map->values[i].appliance_id;
        // Counted even if the router does not list this appliance among its web-caches.
        if (id == group->appliance_ipa)
            summary.self_count++;
        // Values of one appliance are usually consecutive.
        if (i == 0 || !(id == map->values[i - 1].appliance_id))
            entry = wccp_get_router_appliance_view_element(router, id);
        if (!entry) // the router does not list this appliance
            continue;
        if (i < WCCP_MAX_BUCKETS) { // bucket_bits has no room for more
            uint8_t *byte = reinterpret_cast<uint8_t *>(entry->bucket_bits) + i / 8;
            *byte = static_cast<uint8_t>(*byte | 1u << (i % 8));
        }
        entry->buckets_assigned++;
        entry->buckets_total = summary.total_count;
    }
    return summary;
}

// Compares the mask that the router uses, which the designated appliance sent it, with this group's.
void note_mask_difference(wccp_service_group *group, const wccp_sending_router *router,
                          const wccp_wire_mask *mask) {
    const bool same =
        to_host(mask->src_ip) == group->mask_src_ip && to_host(mask->dst_ip) == group->mask_dst_ip &&
        to_host(mask->src_port) == group->mask_src_port && to_host(mask->dst_port) == group->mask_dst_port;
    // The designated appliance has sent its own mask or will do so; every appliance replaces a mask of too
    // many bits by the same default.
    if (same || group->designated == 1 || group->mask_bits > WCCP_MAX_MASK_BITS)
        return;
    const auto text = [](uint32_t src_ip, uint32_t dst_ip, uint32_t src_port, uint32_t dst_port) {
        return wccp_reason_value("src 0x%x dst 0x%x ports 0x%x 0x%x", src_ip, dst_ip, src_port, dst_port);
    };
    wccp_note_reason(
        group, WCCP_REASON_MASK_DIFFERS, router->router_id,
        text(to_host(mask->src_ip), to_host(mask->dst_ip), to_host(mask->src_port), to_host(mask->dst_port)),
        text(group->mask_src_ip, group->mask_dst_ip, group->mask_src_port, group->mask_dst_port));
}

// An appliance that is configured for another method shows in the form of its element in the router's view.
void note_method_differences(wccp_service_group *group, const wccp_sending_router *router,
                             const wccp_rtr_view_appliance *decoded, uint32_t count, uint32_t by_mask) {
    for (uint32_t i = 0; i < count; i++) {
        const uint32_t method = (by_mask >> i & 1) != 0 ? WCCP_ASSIGN_MASK : WCCP_ASSIGN_HASH;
        if (method != group->assign_method && !(decoded[i].ipa == group->appliance_ipa))
            wccp_note_reason(
                group, WCCP_REASON_METHOD_DIFFERS, router->router_id,
                wccp_reason_value("%s by %s", wccp_assign_method_name(method), addr_text(decoded[i].ipa).s),
                wccp_reason_value("%s", wccp_assign_method_name(group->assign_method)));
    }
}

void note_missing_listing(wccp_service_group *group, const wccp_sending_router *router) {
    if (!(router->flags & WCCP_RTR_TWO_WAY))
        wccp_note_reason(
            group, WCCP_REASON_NOT_IN_VIEW, router->router_id,
            wccp_reason_value(router->view_appliance_count == 1 ? "%u appliance" : "%u appliances",
                              router->view_appliance_count),
            wccp_reason_value("%s", addr_text(group->appliance_ipa).s));
}

} // namespace

int wccp_pkt_process_i_see_you(wccp_service_group *group, wccp_pkt *pkt,
                               const wccp_wire_service_info *service) {
    icu_message icu;
    if (const int status = read_i_see_you(group, pkt, service, &icu))
        return status;
    int status;
    wccp_sending_router *router = find_or_create_router(group, &icu, &status);
    // Not every refusal of a router counts as a failed I-See-You.
    if (!router)
        return status;

    // From here on the group changes, and nothing is undone when a later step fails.
    router->receive_id = icu.receive_id;
    router->last_icu_time = wccp_g.seconds;
    router->src_ipa = pkt->ipa;
    router->change_number = icu.view.change_number;
    check_acknowledgement(group, router, &icu.view);
    if ((status = wccp_update_router_view(group, router, icu.view.router_count, icu.view.routers)) != 0)
        return status;
    // Zeroed, because elements without assignment leave their counts untouched.
    wccp_rtr_view_appliance decoded[WCCP_MAX_APPLIANCES] = {};
    wccp_assign_summary hash = {}, mask = {};
    status = wccp_process_router_view_web_cache_id_elements(group, icu.view.appliance_count,
                                                            icu.view.appliances, decoded, &hash);
    if (status != 0)
        note_malformed_message(group, pkt, wccp_reason_value("its appliances"), {});
    else
        status = wccp_update_appliance_view(group, router, icu.view.appliance_count, decoded);
    if (status != 0)
        return status;
    // Only now: the values are stored in the entries that the update above has written.
    if (icu.map.present) {
        if (!icu.map.masks || !icu.map.values) { // the decoder accepts a map of 0 mask elements
            note_malformed_message(group, pkt, wccp_reason_value("an assignment map without a mask"), {});
            return 1;
        }
        mask = apply_assignment_map(group, router, &icu.map);
        note_mask_difference(group, router, &icu.map.masks->mask);
    }
    note_method_differences(group, router, decoded, icu.view.appliance_count, hash.mask_forms);
    note_missing_listing(group, router);
    // Last, because the role follows from everything that the steps above have stored.
    status = wccp_update_appliance_redirect_status(group, router, &hash, &mask);
    if (status == 0) // complete: earlier refusals of this router no longer matter
        wccp_forget_refusals(group, router->router_id, pkt->ipa);
    return status;
}

int wccp_pkt_process_removal_query(wccp_service_group *group, wccp_pkt *pkt) {
    const wccp_wire_router_query *query;
    if (wccp_pkt_unload_router_query_component(group, pkt, &query))
        return log_failed_step("unloading router query", 1);
    if (!(query->target == group->appliance_ipa)) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: removal query is not for us. sending router id: %s target appliance: %s",
               group->id, addr_text(query->router_id).s, addr_text(query->target).s);
        return 0;
    }
    return wccp_process_router_removal_query(group, query->router_id, query->receive_id);
}

// --- A received packet

namespace {

int refuse_packet(const wccp_pkt *pkt) {
    wccp_g.rx_failures++;
    WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP processing received packet from %s failed", addr_text(pkt->ipa).s);
    return 1;
}

// `digest` points into the packet. It is zeroed, because the digest was computed with these bytes zero.
bool verify_digest(const wccp_service_group *group, const wccp_pkt *pkt, uint8_t *digest) {
    // The received digest has to be saved before its place in the packet is overwritten.
    uint8_t received[MD5_DIGEST_BYTES], computed[MD5_DIGEST_BYTES];
    memcpy(received, digest, sizeof received);
    memset(digest, 0, sizeof received);
    wccp_pkt_digest(group, pkt, computed);
    return memcmp(received, computed, sizeof received) == 0;
}

wccp_reason_text format_security_option(uint32_t option) {
    return option <= 1 ? wccp_reason_value("%s", option ? "MD5" : "none")
                       : wccp_reason_value("option %u", option);
}

// Whether the packet has the security that the group is configured for.
bool check_security(wccp_service_group *group, const wccp_pkt *pkt, const wccp_wire_security_info *security,
                    uint8_t *digest) {
    const uint32_t option = to_host(security->option);
    if (option != group->security_option) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: rxed mismatch security opt: %d configured opt: %d",
                      group->id, static_cast<int>(option), static_cast<int>(group->security_option));
        group->rx_auth_mismatches++;
        wccp_note_reason(group, option == 0 ? WCCP_REASON_SECURITY_MISSING : WCCP_REASON_SECURITY_UNWANTED,
                         pkt->ipa, format_security_option(option),
                         format_security_option(group->security_option));
        return false;
    }
    if (option == 1 && !verify_digest(group, pkt, digest)) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: rxed authentication failed. Sender's source IP: %s",
                      group->id, addr_text(pkt->ipa).s);
        group->rx_auth_failures++;
        wccp_note_reason(group, WCCP_REASON_PASSWORD_MISMATCH, pkt->ipa, {}, {});
        return false;
    }
    return true;
}

} // namespace

int wccp_process_received_packet(wccp_pkt *pkt) {
    // Reasons that are noted until the end of the processing get this source.
    const wccp_packet_source_scope source(pkt->ipa);
    const wccp_wire_msg_header *header;
    if (wccp_pkt_unload_msg_header(pkt, &header)) {
        log_failed_step("unloading msg header", 1);
        return refuse_packet(pkt);
    }
    // Datagrams that were cut on receipt or padded by the sender are found here.
    const uint32_t claimed = to_host(header->length) + static_cast<uint32_t>(sizeof *header);
    if (claimed != pkt->length) {
        WCCP_COMPLAIN(
            LC_LOG_ERR,
            "WCCP: message header length (%d) and actual packet length (%d) do not match. sender ip: %s",
            to_host(header->length), static_cast<int>(pkt->length), addr_text(pkt->ipa).s);
        wccp_note_reason(nullptr, WCCP_REASON_MESSAGE_LENGTH, pkt->ipa,
                         wccp_reason_value("%u bytes by its header", claimed),
                         wccp_reason_value("%u bytes were received", pkt->length));
        return 0;
    }
    if (to_host(header->version) != WCCP_VERSION) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP rxed verion (%d) is not supported. sender ip: %s",
                      to_host(header->version), addr_text(pkt->ipa).s);
        wccp_note_reason(nullptr, WCCP_REASON_MESSAGE_VERSION, pkt->ipa,
                         wccp_reason_value("0x%x", to_host(header->version)),
                         wccp_reason_value("0x%x", WCCP_VERSION));
        return 0;
    }
    const uint32_t type = to_host(header->type);
    // The Here-I-Am messages of other appliances arrive as well if the group uses multicast.
    if (type != WCCP_I_SEE_YOU && type != WCCP_REMOVAL_QUERY) {
        QV_LOG(LC_LOG_INFO, "WCCP: message type (%u) is not for an appliance. sender ip: %s", type,
               addr_text(pkt->ipa).s);
        wccp_note_reason(nullptr, WCCP_REASON_MESSAGE_TYPE, pkt->ipa, wccp_reason_value("type %u", type),
                         wccp_reason_value("%u or %u", WCCP_I_SEE_YOU, WCCP_REMOVAL_QUERY));
        return 0;
    }
    const wccp_wire_security_info *security;
    uint8_t *digest;
    if (wccp_pkt_unload_security_info_component(pkt, &security, &digest)) {
        log_failed_step("unloading security info", 1);
        return refuse_packet(pkt);
    }
    const wccp_wire_service_info *service;
    if (wccp_pkt_unload_service_info_component(pkt, &service)) {
        log_failed_step("unloading service info", 1);
        return refuse_packet(pkt);
    }
    // The group is found by its id alone, whatever the service type and the interface that the packet came in
    // on.
    wccp_service_group *group = wccp_find_group(service->service_id);
    if (!group) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: rxed service group (%d) is not configured.",
                      service->service_id, service->service_id);
        wccp_note_reason(nullptr, WCCP_REASON_GROUP_UNKNOWN, pkt->ipa,
                         wccp_reason_value("group %d", service->service_id), {});
        return refuse_packet(pkt);
    }
    // Not a failure: routers continue to send until they notice that the group is disabled.
    if (group->admin_state != WCCP_ADMIN_UP) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: is disabled. dropping the rxed packet.", group->id);
        wccp_note_reason(group, WCCP_REASON_GROUP_DISABLED, pkt->ipa, {}, {});
        return 0;
    }
    // The packet was queued in the socket, or the receive thread waited for the lock, while the group
    // stopped.
    if (!wccp_group_is_running(group)) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: is not running. dropping the rxed packet.", group->id);
        wccp_note_reason(group, WCCP_REASON_GROUP_STOPPED, pkt->ipa, {}, {});
        return 0;
    }
    if (!check_security(group, pkt, security, digest)) {
        // Counted for the group here and for the daemon in refuse_packet.
        group->rx_failures++;
        return refuse_packet(pkt);
    }
    // Failures from here on have counters of their own and do not count as refused packets.
    if (type == WCCP_I_SEE_YOU) {
        group->rx_icus++;
        if (wccp_pkt_process_i_see_you(group, pkt, service))
            group->rx_icu_failures++;
    } else {
        group->rx_removal_queries++;
        if (wccp_pkt_process_removal_query(group, pkt))
            group->rx_removal_failures++;
    }
    return 0;
}

namespace {

// --- Building messages

struct message_build {
    wccp_service_group *group;
    wccp_pkt *pkt;
    uint8_t *digest; // its place in the packet, once Security Info has been written
};
using step_condition = bool (*)(const wccp_service_group *group);

struct build_step {
    const char *words; // for the log
    int (*load)(message_build *build);
    step_condition wanted; // null: always
};

// Adapts an encoder that takes group and packet.
template <int (*Load)(wccp_service_group *, wccp_pkt *)>
int run_load(message_build *build) {
    return Load(build->group, build->pkt);
}
template <uint32_t Type>
int load_header(message_build *build) {
    return wccp_pkt_load_msg_header(build->pkt, Type);
}
int load_security_info(message_build *build) {
    return wccp_pkt_load_security_info_component(build->group, build->pkt, &build->digest);
}
int finish_message(message_build *build) {
    return wccp_pkt_finish(build->group, build->pkt, build->digest);
}
int refuse_unset_method(message_build *) {
    return 1;
}

template <uint32_t Method>
bool uses_assign_method(const wccp_service_group *group) {
    return group->assign_method == Method;
}
bool has_no_assign_method(const wccp_service_group *group) {
    return group->assign_method != WCCP_ASSIGN_HASH && group->assign_method != WCCP_ASSIGN_MASK;
}
bool has_capabilities(const wccp_service_group *group) {
    return group->fwd_method == WCCP_METHOD_L2 || group->assign_method == WCCP_ASSIGN_MASK ||
           group->ret_method == WCCP_METHOD_L2;
}
bool is_shutting_down(const wccp_service_group *group) {
    return (group->state_flags & WCCP_SHUTTING_DOWN) != 0;
}

const build_step here_i_am_steps[] = {
    {"here-i-am: loading message header", load_header<WCCP_HERE_I_AM>, nullptr},
    {"here-i-am: loading security info", load_security_info, nullptr},
    {"here-i-am: loading service info", run_load<wccp_pkt_load_service_info_component>, nullptr},
    {"here-i-am: loading web-cache info", run_load<wccp_pkt_load_web_cache_identity_info_component>, nullptr},
    {"here-i-am: loading web-cache view info", run_load<wccp_pkt_load_web_cache_view_info_component>,
     nullptr},
    {"here-i-am: loading capability info", run_load<wccp_pkt_load_capability_info_component>,
     has_capabilities},
    {"here-i-am: loading command extension", run_load<wccp_pkt_load_command_ext_component>, is_shutting_down},
    {"here-i-am: packet finish", finish_message, nullptr},
};
const build_step redirect_assign_steps[] = {
    {"redirect assign: loading message header", load_header<WCCP_REDIRECT_ASSIGN>, nullptr},
    {"redirect assign: loading security info", load_security_info, nullptr},
    {"redirect assign: loading service info", run_load<wccp_pkt_load_service_info_component>, nullptr},
    {"redirect assign: loading assign. info", run_load<wccp_pkt_load_assignment_info_component>,
     uses_assign_method<WCCP_ASSIGN_HASH>},
    {"redirect assign: loading mask assign. info", run_load<wccp_pkt_load_mask_assignment_info_component>,
     uses_assign_method<WCCP_ASSIGN_MASK>},
    {"redirect assign: groups actual assignment method is not set.", refuse_unset_method,
     has_no_assign_method},
    {"redirect assign: packet finish", finish_message, nullptr},
};

template <size_t Count>
int run_build_steps(const build_step (&steps)[Count], wccp_reason_code reason, wccp_service_group *group,
                    wccp_pkt *pkt) {
    message_build build = {group, pkt, nullptr};
    for (const build_step &step : steps) {
        if (step.wanted && !step.wanted(group))
            continue;
        if (const int status = step.load(&build)) {
            wccp_note_reason(group, reason, {}, wccp_reason_value("%s", step.words), {});
            return log_failed_step(step.words, status);
        }
    }
    // The message can be built again: the reason for an earlier failure no longer holds.
    wccp_forget_reason(group, reason, {});
    return 0;
}

// --- Sending

// A kind of packet for wccp_transmit_packet: its name in the log, the counter of attempts, and its builder,
// null when the packet is sent as it is.
struct packet_kind {
    uint32_t number;
    const char *name;
    uint32_t wccp_service_group::*attempts;
    int (*build)(wccp_service_group *group, wccp_pkt *pkt);
};
const packet_kind packet_kinds[] = {
    {WCCP_HERE_I_AM, "HERE-I-AM", &wccp_service_group::tx_here_i_am, wccp_pkt_build_here_i_am},
    {WCCP_REDIRECT_ASSIGN, "REDIRECT-ASSIGN", &wccp_service_group::tx_redirect_assign,
     wccp_pkt_build_redirect_assign},
    {WCCP_REMOVAL_REPLY, "HERE-I-AM (router query reply)", &wccp_service_group::tx_removal_replies, nullptr},
};

const packet_kind *find_packet_kind(uint32_t number) {
    for (const packet_kind &kind : packet_kinds)
        if (kind.number == number)
            return &kind;
    return nullptr;
}

void clear_packet(wccp_pkt *pkt) {
    memset(pkt, 0, sizeof *pkt);
    pkt->cursor = pkt->data;
}

} // namespace

int wccp_pkt_build_here_i_am(wccp_service_group *group, wccp_pkt *pkt) {
    return run_build_steps(here_i_am_steps, WCCP_REASON_HERE_I_AM_NOT_BUILT, group, pkt);
}

int wccp_pkt_build_redirect_assign(wccp_service_group *group, wccp_pkt *pkt) {
    return run_build_steps(redirect_assign_steps, WCCP_REASON_TABLE_NOT_BUILT, group, pkt);
}

int wccp_transmit_packet(wccp_service_group *group, wccp_pkt *pkt, uint32_t number) {
    if (!pkt) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: packet is NULL. cannot send packet type %d", group->id,
               static_cast<int>(number));
        return 1;
    }
    const wccp_interface *interface = group->interfaces[0];
    if (!wccp_if_is_ready(interface)) { // not a failure: the group waits for its interface
        group->tx_link_drops++;
        return 0;
    }
    const packet_kind *kind = find_packet_kind(number);
    if (!kind) {
        QV_LOG(LC_LOG_ERR, "WCCP transmit: unknown packet type (%d)", static_cast<int>(number));
        group->tx_failures++;
        return 1;
    }
    group->*kind->attempts += 1; // attempts count, whatever becomes of them
    if (kind->build) {
        clear_packet(pkt);
        if (const int status = kind->build(group, pkt)) {
            group->tx_build_failures++;
            group->tx_failures++;
            return status;
        }
    }
    const int32_t sent = wccp_tx_pkt(group, pkt);
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: %s: sent %s to %s %d/%d (bytes)", group->id, interface->name,
           kind->name, addr_text(pkt->ipa).s, sent, static_cast<int>(pkt->length));
    if (sent != 0) // also -1: only a packet without any destination counts as failed
        return 0;
    group->tx_failures++;
    return 1;
}

wccp_pkt *wccp_pkt_alloc() {
    auto *pkt = static_cast<wccp_pkt *>(wccp_malloc(sizeof(wccp_pkt)));
    if (pkt)
        pkt->cursor = pkt->data;
    return pkt;
}

int wccp_pkt_free(wccp_pkt *pkt) {
    wccp_free(pkt);
    return 0;
}
