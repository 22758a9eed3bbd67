// The assignment text of a group: what is configured, what the designated appliance computed, and what each
// router reports. Lock held. The routers' bucket words are printed as stored; those of the designated
// appliance are made from its table.
#include <cstdio>

#include "engine/wccp_debug_pieces.h"
#include "engine/wccp_debug_utils.h"
#include "engine/wccp_utils.h"

namespace {

const char *const method_words[] = {"not set", "hash", "mask", "either"};

const char *name_assign_method(uint32_t method, uint32_t known) {
    return method < known ? method_words[method] : "unknown";
}

uint32_t compute_percent(uint32_t part, uint32_t whole) {
    return whole ? part * 100 / whole : 0;
}

int wccp_print_service_grp_assignment_global(const wccp_service_group *group, csys_display_buf *buffer) {
    static const char *const hash_words[] = {"src-ip ", "dst-ip ", "src-port ", "dst-port "};
    wccp_piece piece = wccp_assignment_piece(buffer);
    wccp_piece_add(&piece, "\n\t%-26s\n", "Assignment");
    wccp_piece_add(&piece, "\t%-26s : ", "Configured HASH");
    // The words are in the order of the bits of the service flags.
    for (uint32_t bit = 0; bit < 4; bit++)
        if (group->service_flags & (1U << bit))
            wccp_piece_add(&piece, "%s", hash_words[bit]);
    wccp_piece_add(&piece, "\n");
    wccp_piece_add(&piece, "\t%-26s : src-ip: 0x%08x, src-port: 0x%04x ", "Configured MASK",
                   group->mask_src_ip, group->mask_src_port);
    wccp_piece_add(&piece, "\n\t%-26s : dst-ip: 0x%08x, dst-port: 0x%04x\n", "", group->mask_dst_ip,
                   group->mask_dst_port);
    wccp_piece_add(&piece, "\t%-26s : %s\n", "Configured assign. method",
                   name_assign_method(group->cfg_assign_method, 4));
    // `either` is not the result of a negotiation, and would be shown as unknown.
    wccp_piece_add(&piece, "\t%-26s : %s\n", "Negotiated assign. method",
                   name_assign_method(group->assign_method, 3));
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    return 0;
}

void put_bucket_set(wccp_piece *piece, const wccp_service_group *group, be32 appliance) {
    uint32_t words[8] = {};
    for (uint32_t i = 0; i < WCCP_MAX_BUCKETS; i++)
        if (group->bucket_ipa[i] == appliance)
            words[i / 32] |= 1U << (i % 32);
    // From the highest bucket down: bucket 0 is the last bit of the second line.
    for (int top = 7; top > 0; top -= 4)
        wccp_piece_add(piece, "\t%-26s : 0x%08x %08x %08x %08x\n", "", words[top], words[top - 1],
                       words[top - 2], words[top - 3]);
}

int print_mask_values(const wccp_service_group *group, wccp_piece *piece) {
    const wccp_mask *mask = &group->mask_in_use;
    wccp_piece_add(piece, "\t%-26s\n", "Designator mask assignment");
    wccp_piece_add(piece, "\t%10s : %-10s %-10s %-8s %-8s\n", "Mask", "src-ip", "dst-ip", "src-port",
                   "dst-port");
    wccp_piece_add(piece, "\t%10d : 0x%08x 0x%08x 0x%04x   0x%04x\n", 0, mask->src_ip, mask->dst_ip,
                   mask->src_port, mask->dst_port);
    wccp_piece_add(piece, "\n\t%10s : %-10s %-10s %-8s %-8s %-10s\n", "Value", "src-ip", "dst-ip", "src-port",
                   "dst-port", "appliance ip");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(piece));
    for (uint32_t i = 0; i < group->mask_value_count; i++) {
        const wccp_mask_value *value = &group->mask_values[i];
        wccp_piece_add(piece, "\t%10d : 0x%08x 0x%08x 0x%04x   0x%04x   %s\n", static_cast<int>(i),
                       value->src_ip, value->dst_ip, value->src_port, value->dst_port,
                       addr_text(value->appliance_ipa).s);
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(piece));
    }
    wccp_piece_add(piece, "\n");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(piece));
    return 0;
}

int wccp_print_service_grp_assignment_designator(const wccp_service_group *group, csys_display_buf *buffer) {
    wccp_piece piece = wccp_assignment_piece(buffer);
    wccp_piece_add(&piece, "\n\t%-26s", "Designator allocation");
    // Only the designated appliance has a table of its own.
    if (group->designated != 1) {
        wccp_piece_add(&piece, " : not the designator \n\n");
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
        return 0;
    }
    wccp_piece_add(&piece, "\n\t%-26s : %d\n", "Active appliances",
                   static_cast<int>(group->dsg_active_count));
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    for (uint32_t i = 0; i < group->dsg_active_count && i < WCCP_MAX_APPLIANCES; i++) {
        const wccp_dsg_appliance *entry = &group->dsg_appliances[i];
        wccp_piece_add(&piece, "\t%-26s : %s\n", "Appliance ip", addr_text(entry->ipa).s);
        wccp_piece_add(&piece, "\t%-26s : %d\n", "Weight", entry->weight);
        wccp_piece_add(&piece, "\t%-26s : %d %% \n", "Hash/mask allotment",
                       static_cast<int>(compute_percent(entry->assigned, group->bucket_count)));
        if (group->assign_method == WCCP_ASSIGN_HASH)
            put_bucket_set(&piece, group, entry->ipa);
        wccp_piece_add(&piece, "\n");
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    }
    return group->assign_method == WCCP_ASSIGN_MASK ? print_mask_values(group, &piece) : 0;
}

void put_words(wccp_piece *piece, const uint32_t *words) {
    wccp_piece_add(piece, "0x%08x %08x %08x %08x\n", words[0], words[1], words[2], words[3]);
}

int wccp_print_service_grp_assignment_router(const wccp_service_group *group, csys_display_buf *buffer) {
    wccp_piece piece = wccp_assignment_piece(buffer);
    wccp_piece_add(&piece, "\t%-26s\n", "Received router allocation");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        for (uint32_t i = 0; i < router->view_appliance_count; i++) {
            const wccp_rtr_view_appliance *entry = &router->view_appliances[i];
            const int share =
                static_cast<int>(compute_percent(entry->buckets_assigned, entry->buckets_total));
            wccp_piece_add(&piece, "\t%-26s : %s\n", "Router id", addr_text(router->router_id).s);
            wccp_piece_add(&piece, "\t%-26s : %s\n", "Appliance ip", addr_text(entry->ipa).s);
            wccp_piece_add(&piece, "\t%-26s : %d\n", "Weight", entry->weight);
            if (group->assign_method == WCCP_ASSIGN_HASH) {
                wccp_piece_add(&piece, "\t%-26s : %d %% \n", "Rxed hash bucket allotment", share);
                wccp_piece_add(&piece, "\t%-26s : ", "Rxed hash assignment");
                put_words(&piece, entry->bucket_bits);
                wccp_piece_add(&piece, "\t%-26s : ", "");
                put_words(&piece, entry->bucket_bits + 4);
                wccp_piece_add(&piece, "\n");
            } else if (group->assign_method == WCCP_ASSIGN_MASK) {
                wccp_piece_add(&piece, "\t%-26s : %d %% \n", "Rxed mask value allotment", share);
                wccp_piece_add(&piece, "\t%-26s : ", "Rxed value buckets (0-127)");
                put_words(&piece, entry->bucket_bits);
                wccp_piece_add(&piece, "\n");
            }
            WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
        }
    wccp_piece_add(&piece, "\n");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    return 0;
}

} // namespace

int wccp_print_service_grp_assignment_details_by_grp_ptr(wccp_service_group *group,
                                                         csys_display_buf *buffer) {
    static const struct {
        int (*print)(const wccp_service_group *group, csys_display_buf *buffer);
        const char *words;
    } parts[] = {
        {wccp_print_service_grp_assignment_global, "show assignment global"},
        {wccp_print_service_grp_assignment_designator, "show assignment designator"},
        {wccp_print_service_grp_assignment_router, "show assignment router"},
    };
    for (const auto &part : parts)
        if (part.print(group, buffer)) {
            QV_LOG(wccp_dump_failure_level, "WCCP: %s failed.", part.words);
            return 1;
        }
    return 0;
}
