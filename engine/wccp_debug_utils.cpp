// Diagnostic dumps: the global counters, the state of a group, and its statistics, as text for an operator.
//
// The public functions run on the main thread and hold the engine lock while they read, which delays the tick
// and packet processing for that time. They allocate nothing. Rows are tables of label and value, each
// appended on its own, so that no number of routers or appliances can outgrow the scratch buffer. When the
// display buffer is full, the dump ends there with a newline and the result 1. The assignment text is in
// wccp_debug_assignment.cpp.
#include "engine/wccp_debug_utils.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "engine/wccp_debug_pieces.h"
#include "engine/wccp_utils.h"

namespace {

const char *name_link_state(uint32_t up) {
    return up ? "up" : "down";
}
const char *name_readiness(bool ok) {
    return ok ? "ok" : "no";
}
void put_uptime(wccp_piece *piece, uint32_t since) {
    char text[64] = "";
    wccp_seconds_to_str(wccp_g.seconds - since, text, sizeof text);
    wccp_piece_add(piece, "%s", text);
}
void put_countdown(wccp_piece *piece, const wccp_timer *timer) {
    wccp_piece_add(piece, "%u (seconds)", timer->active == 1 ? timer->countdown : 0);
}
void put_swapped_words(wccp_piece *piece, const uint32_t *words) {
    // Swapped, so that the first byte on the wire, with buckets 0 to 7, is printed last in its word.
    wccp_piece_add(piece, "0x%08x %08x %08x %08x", __builtin_bswap32(words[0]), __builtin_bswap32(words[1]),
                   __builtin_bswap32(words[2]), __builtin_bswap32(words[3]));
}

} // namespace

using group_row = wccp_dump_row<wccp_service_group>;
using router_row = wccp_dump_row<wccp_sending_router>;

// A row whose value is one field of the record.
#define NUMBER_ROW(record, label, format, field)                                                             \
    {                                                                                                        \
        label, [](wccp_piece *p, const record *r) { wccp_piece_add(p, format, r->field); }                   \
    }

namespace {

const wccp_dump_row<wccp_global> global_rows[] = {
    NUMBER_ROW(wccp_global, "WCCP # of groups", "%d", group_count),
    NUMBER_ROW(wccp_global, "WCCP multicast TTL", "%d", mcast_ttl),
    NUMBER_ROW(wccp_global, "WCCP stat num allocs", "%d", stat_allocs.load()),
    NUMBER_ROW(wccp_global, "WCCP stat num frees", "%d", stat_frees.load()),
    NUMBER_ROW(wccp_global, "WCCP err alloc fails", "%d", stat_alloc_fails.load()),
    NUMBER_ROW(wccp_global, "WCCP # err rx total failures", "%d", rx_failures),
};

const group_row stats_rows[] = {
    NUMBER_ROW(wccp_service_group, "WCCP # rx icus", "%u", rx_icus),
    NUMBER_ROW(wccp_service_group, "WCCP # rx removal queries", "%u", rx_removal_queries),
    NUMBER_ROW(wccp_service_group, "WCCP # tx here_i_am", "%u", tx_here_i_am),
    NUMBER_ROW(wccp_service_group, "WCCP # tx redirect assign", "%u", tx_redirect_assign),
    NUMBER_ROW(wccp_service_group, "WCCP # tx removal query h-i-m", "%u", tx_removal_replies),
    NUMBER_ROW(wccp_service_group, "WCCP # alarm router verify sch.", "%u", alarm_router_sched),
    NUMBER_ROW(wccp_service_group, "WCCP # alarm assign. verify sch.", "%u", alarm_assign_sched),
    NUMBER_ROW(wccp_service_group, "WCCP # rx unknown capabilities", "%u", rx_unknown_capabilities),
    NUMBER_ROW(wccp_service_group, "WCCP # rx err total failures", "%u", rx_failures),
    NUMBER_ROW(wccp_service_group, "WCCP # tx err total failures", "%u", tx_failures),
    NUMBER_ROW(wccp_service_group, "WCCP # tx err service mismatch", "%u", rx_service_mismatches),
    NUMBER_ROW(wccp_service_group, "WCCP # rx err authen. mismatch", "%u", rx_auth_mismatches),
    NUMBER_ROW(wccp_service_group, "WCCP # rx err authen. failures", "%u", rx_auth_failures),
};

const char *dump_state_name(uint32_t state_flags) {
    switch (state_flags & WCCP_STATE_MASK) {
    case 0:
        return "none";
    case WCCP_STATE_INIT:
        return "init";
    case WCCP_STATE_ACTIVE:
        return "active";
    case WCCP_STATE_BACKUP:
        return "backup";
    default:
        return "bad";
    }
}

void put_password(wccp_piece *p, const wccp_service_group *g) {
    // A password of 8 bytes has no terminating NUL.
    wccp_piece_add(p, "%.*s ", static_cast<int>(strnlen(g->password, sizeof g->password)), g->password);
    for (const char byte : g->password)
        wccp_piece_add(p, "0x%x, ", static_cast<unsigned>(static_cast<uint8_t>(byte)));
}

void put_state_flags(wccp_piece *p, const wccp_service_group *g) {
    static const struct {
        uint32_t flag;
        const char *name;
    } names[] = {
        {WCCP_STATE_INIT, "INIT "},
        {WCCP_STATE_BACKUP, "BACKUP "},
        {WCCP_STATE_ACTIVE, "ACTIVE "},
        {WCCP_DESG_ELECT_PENDING, "DESG_ELECT_PENDING "},
        {WCCP_CAPABILITIES_SET, "CAPABILITIES_SET "},
        {WCCP_SHUTTING_DOWN, "SHUTTING_DOWN "},
    };
    wccp_piece_add(p, "0x%x = { ", g->state_flags);
    for (const auto &entry : names)
        if (g->state_flags & entry.flag)
            wccp_piece_add(p, "%s", entry.name);
    wccp_piece_add(p, " }");
}

void put_raised_alarms(wccp_piece *p, const wccp_service_group *g) {
    if (g->raised_alarms == 0) {
        wccp_piece_add(p, "none");
        return;
    }
    wccp_piece_add(p, "flag: 0x%x ", g->raised_alarms);
    if (g->raised_alarms & WCCP_ALARM_ADJACENCY)
        wccp_piece_add(p, "adj down, ");
    if (g->raised_alarms & WCCP_ALARM_ASSIGNMENT)
        wccp_piece_add(p, "assign tbl mismatch");
}

const group_row configured_rows[] = {
    {"WCCP appliance ipa",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%s", addr_text(g->appliance_ipa).s);
     }},
    {"WCCP service group (STATE)",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%u (%s)", g->id, dump_state_name(g->state_flags));
     }},
    {"WCCP current state up time",
     [](wccp_piece *p, const wccp_service_group *g) { put_uptime(p, g->state_time); }},
    NUMBER_ROW(wccp_service_group, "WCCP protocol", "%u", protocol),
    NUMBER_ROW(wccp_service_group, "WCCP service flags", "0x%x", service_flags),
    NUMBER_ROW(wccp_service_group, "WCCP security option", "%u", security_option),
    NUMBER_ROW(wccp_service_group, "WCCP weight", "%u", weight),
    NUMBER_ROW(wccp_service_group, "WCCP priority", "%u", priority),
    {"WCCP password", put_password},
    {"WCCP admin state",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%s", g->admin_state == WCCP_ADMIN_UP ? "enabled" : "disabled");
     }},
    {"WCCP configured multicast IP",
     [](wccp_piece *p, const wccp_service_group *g) { wccp_piece_add(p, "%s", addr_text(g->mcast_ipa).s); }},
    NUMBER_ROW(wccp_service_group, "WCCP cfg force L2 return", "%u", force_l2_return),
    NUMBER_ROW(wccp_service_group, "WCCP cfg compatibility mode", "%u (ios:1 nexus:2)", compat_mode),
    NUMBER_ROW(wccp_service_group, "WCCP configured interfaces", "%d", if_count),
};

// An interface of a group, for its three rows.
struct dump_interface {
    int number;
    const wccp_interface *interface;
};
const wccp_dump_row<dump_interface> interface_rows[] = {
    {"WCCP interfaces",
     [](wccp_piece *p, const dump_interface *i) {
         wccp_piece_add(p, "# %d %.*s", i->number, static_cast<int>(sizeof i->interface->name),
                        i->interface->name);
     }},
    {"WCCP interface ipa and link",
     [](wccp_piece *p, const dump_interface *i) {
         wccp_piece_add(p, "%s %s ", addr_text(i->interface->ipa).s, name_link_state(i->interface->link_up));
     }},
    {"WCCP interface ready flags",
     [](wccp_piece *p, const dump_interface *i) {
         const uint32_t flags = i->interface->ready_flags;
         wccp_piece_add(p, "ipa: %s link: %s track intf: %s ", name_readiness(flags & WCCP_IPA_READY),
                        name_readiness(flags & WCCP_LINK_READY),
                        name_readiness(wccp_if_is_ready(wccp_g.primary_if)));
     }},
};

const group_row state_rows[] = {
    {"WCCP config fwd, assign, return",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%s, %s, %s", wccp_method_name(g->cfg_fwd_method),
                        wccp_assign_method_name(g->cfg_assign_method), "gre or L2");
     }},
    {"WCCP actual fwd, assign, return",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%s, %s, %s", wccp_method_name(g->fwd_method),
                        wccp_assign_method_name(g->assign_method), wccp_method_name(g->ret_method));
     }},
    NUMBER_ROW(wccp_service_group, "WCCP # of view changes", "%u", change_number),
    NUMBER_ROW(wccp_service_group, "WCCP # of transitions (act/ina)", "%u", transitions),
    {"WCCP state flags", put_state_flags},
    {"WCCP designated appliance",
     [](wccp_piece *p, const wccp_service_group *g) {
         wccp_piece_add(p, "%s", g->designated ? "yes" : "no");
     }},
    NUMBER_ROW(wccp_service_group, "WCCP designated key change #", "%u", dsg_key_change),
    NUMBER_ROW(wccp_service_group, "WCCP designated pend. acks", "%u", pending_acks),
    NUMBER_ROW(wccp_service_group, "WCCP # rtrs redirecting to me", "%u", redirecting_routers),
    NUMBER_ROW(wccp_service_group, "WCCP # rmval queries remaining", "%u", removal_reply_count),
    NUMBER_ROW(wccp_service_group, "WCCP ICU sending routers", "%u", sending_router_count),
};

const router_row router_rows[] = {
    {"WCCP router id (src ip)",
     [](wccp_piece *p, const wccp_sending_router *r) {
         wccp_piece_add(p, "%s (%s)", addr_text(r->router_id).s, addr_text(r->src_ipa).s);
     }},
    {"WCCP router received id",
     [](wccp_piece *p, const wccp_sending_router *r) { wccp_piece_add(p, "0x%x", to_host(r->receive_id)); }},
    // Printed as stored, in wire order.
    {"WCCP router change number",
     [](wccp_piece *p, const wccp_sending_router *r) {
         wccp_piece_add(p, "%u", raw_word(r->change_number));
     }},
    NUMBER_ROW(wccp_sending_router, "WCCP router state flags", "0x%x", flags),
    {"WCCP router connected",
     [](wccp_piece *p, const wccp_sending_router *r) {
         wccp_piece_add(p, "%s", r->flags & WCCP_RTR_TWO_WAY ? "two-way" : "one-way");
     }},
    {"WCCP current state up time",
     [](wccp_piece *p, const wccp_sending_router *r) { put_uptime(p, r->state_time); }},
};
const router_row router_capability_rows[] = {
    {"WCCP router fwd, assign, return",
     [](wccp_piece *p, const wccp_sending_router *r) {
         wccp_piece_add(p, "%s, %s, %s", wccp_method_name(r->cap_fwd), wccp_assign_method_name(r->cap_assign),
                        wccp_method_name(r->cap_ret));
     }},
};
const wccp_dump_row<wccp_rtr_view_appliance> rx_assignment_rows[] = {
    {"WCCP appliance id",
     [](wccp_piece *p, const wccp_rtr_view_appliance *a) { wccp_piece_add(p, "%s", addr_text(a->ipa).s); }},
    {"WCCP rx buckets assigned/total",
     [](wccp_piece *p, const wccp_rtr_view_appliance *a) {
         wccp_piece_add(p, "%d/%d", a->buckets_assigned, a->buckets_total);
     }},
    {"WCCP rx bucket bits 0-127",
     [](wccp_piece *p, const wccp_rtr_view_appliance *a) { put_swapped_words(p, a->bucket_bits); }},
    {"WCCP rx bucket bits 128-255",
     [](wccp_piece *p, const wccp_rtr_view_appliance *a) { put_swapped_words(p, a->bucket_bits + 4); }},
};
const router_row view_router_count_rows[] = {
    NUMBER_ROW(wccp_sending_router, "WCCP # routers in view", "%u", view_router_count),
};
const wccp_dump_row<wccp_rtr_view_router> view_router_rows[] = {
    {"WCCP view router id/flags",
     [](wccp_piece *p, const wccp_rtr_view_router *v) {
         wccp_piece_add(p, "%s 0x%x", addr_text(v->ipa).s, v->flags);
     }},
};
const router_row view_appliance_count_rows[] = {
    NUMBER_ROW(wccp_sending_router, "WCCP # appliances in view", "%u", view_appliance_count),
};
const wccp_dump_row<wccp_rtr_view_appliance> view_appliance_rows[] = {
    {"WCCP view app.id/weight/flags",
     [](wccp_piece *p, const wccp_rtr_view_appliance *v) {
         wccp_piece_add(p, "%s %u 0x%x", addr_text(v->ipa).s, v->weight, v->flags);
     }},
};

const group_row appliance_count_rows[] = {
    NUMBER_ROW(wccp_service_group, "WCCP # of appliances in view", "%u", appliance_view_count),
};
const wccp_dump_row<wccp_view_appliance> appliance_rows[] = {
    {"WCCP appliance (sorted w+ip)",
     [](wccp_piece *p, const wccp_view_appliance *v) {
         wccp_piece_add(p, "%s wgt = %u ref = %u", addr_text(v->ipa).s, v->weight, v->ref_count);
     }},
};
const group_row router_count_rows[] = {
    NUMBER_ROW(wccp_service_group, "WCCP # of routers in view", "%u", router_view_count),
};
const wccp_dump_row<wccp_view_router> router_view_rows[] = {
    {"WCCP router view ipa/refcnt",
     [](wccp_piece *p, const wccp_view_router *v) {
         wccp_piece_add(p, "%s %u", addr_text(v->ipa).s, v->ref_count);
     }},
};
const group_row alarm_rows[] = {
    {"WCCP raised alarms", put_raised_alarms},
    {"WCCP timer router-down alarm ",
     [](wccp_piece *p, const wccp_service_group *g) { put_countdown(p, &g->router_alarm_timer); }},
    {"WCCP timer assin. mismatch alarm",
     [](wccp_piece *p, const wccp_service_group *g) { put_countdown(p, &g->assign_alarm_timer); }},
};

} // namespace

int32_t wccp_dump_failure_level = LC_LOG_ERR;

namespace {

int wccp_print_global_info(csys_display_buf *buffer) {
    wccp_piece piece = wccp_group_piece(buffer);
    wccp_piece_add(&piece, "\n    WCCP GLOBAL INFO\n\n");
    if (wccp_piece_flush(&piece) || wccp_print_rows(&piece, global_rows, &wccp_g)) {
        QV_LOG(wccp_dump_failure_level, "WCCP display print failed. %s", __func__);
        WCCP_BAIL_ON_ZERO(true);
    }
    return 0;
}

int wccp_print_service_group_stats(wccp_service_group *group, csys_display_buf *buffer) {
    wccp_piece piece = wccp_group_piece(buffer);
    wccp_piece_add(&piece, "\n    ********* WCCP GROUP ID %d STATS ****\n", group->id);
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, stats_rows, group));
    return 0;
}

int print_sending_router_rows(const wccp_sending_router *router, uint32_t number, csys_display_buf *buffer) {
    wccp_piece piece = wccp_group_piece(buffer);
    wccp_piece_add(&piece, "    %-32s : # %d\n", "***** WCCP ICU sending router **",
                   static_cast<int>(number));
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, router_rows, router));
    wccp_piece_add(&piece, "    %-32s \n", "WCCP router's capabilities");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, router_capability_rows, router));
    wccp_piece_add(&piece, "    %-32s\n", "WCCP router assignment (RXed)");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, rx_assignment_rows, &router->view_appliances[i]));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, view_router_count_rows, router));
    for (uint32_t i = 0; i < router->view_router_count; i++)
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, view_router_rows, &router->view_routers[i]));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, view_appliance_count_rows, router));
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, view_appliance_rows, &router->view_appliances[i]));
    return 0;
}

int wccp_print_icu_sending_router_info(const wccp_sending_router *router, uint32_t number,
                                       csys_display_buf *buffer) {
    const int status = print_sending_router_rows(router, number, buffer);
    if (status != 0)
        QV_LOG(wccp_dump_failure_level, "WCCP: %s failed. length (%u) buf len (%u)",
               "printing sending router", csys_display_buf_bytes_used(buffer),
               csys_display_buf_bytes_max(buffer));
    return status;
}

int wccp_print_service_group(wccp_service_group *group, csys_display_buf *buffer) {
    wccp_piece piece = wccp_group_piece(buffer);
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, configured_rows, group));
    for (int i = 0; i < group->if_count; i++) {
        const dump_interface entry = {i + 1, group->interfaces[i]};
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, interface_rows, &entry));
    }
    wccp_piece_add(&piece, "    %-32s : # %d\n", "WCCP configured unicast routers",
                   group->ucast_router_count);
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    for (uint32_t i = 0; i < group->ucast_router_count && i < WCCP_MAX_ROUTERS; i++) {
        wccp_piece_add(&piece, "    %-32s : #%d %s\n", "WCCP configured unicast rtr", static_cast<int>(i + 1),
                       addr_text(group->ucast_routers[i]).s);
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    }
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, state_rows, group));
    uint32_t number = 1;
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next, number++) {
        const int status = wccp_print_icu_sending_router_info(router, number, buffer);
        if (status != 0) {
            QV_LOG(wccp_dump_failure_level, "WCCP: %s failed. status  (%d) length (%u) buf len (%u)",
                   "printing sending router", status, csys_display_buf_bytes_used(buffer),
                   csys_display_buf_bytes_max(buffer));
            return status;
        }
    }
    wccp_piece_add(&piece, "    WCCP ICU sending routers end.\n");
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, appliance_count_rows, group));
    for (const wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next)
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, appliance_rows, entry));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, router_count_rows, group));
    for (const wccp_view_router *entry = group->router_view; entry; entry = entry->next)
        WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, router_view_rows, entry));
    WCCP_BAIL_ON_ZERO(wccp_print_rows(&piece, alarm_rows, group));
    return 0;
}

int append_formatted(csys_display_buf *buffer, const char *format, ...) __attribute__((format(printf, 2, 3)));
int append_formatted(csys_display_buf *buffer, const char *format, ...) {
    char text[128];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(text, sizeof text, format, arguments);
    va_end(arguments);
    return csys_append_to_safe_display_buf(buffer, text) == 0;
}

int append_closing_line(csys_display_buf *buffer) {
    char text[96];
    snprintf(text, sizeof text, "    (debug buffer: used %u max len %u)\n",
             csys_display_buf_bytes_used(buffer), csys_display_buf_bytes_max(buffer));
    WCCP_BAIL_ON_ZERO(csys_append_to_safe_display_buf(buffer, text) == 0);
    return 0;
}

// Logs which part of a dump failed, and returns 1.
int log_failed_part(const char *words) {
    QV_LOG(wccp_dump_failure_level, "WCCP: %s failed.", words);
    return 1;
}

} // namespace

int wccp_print_global(csys_display_buf *buffer) {
    wccp_engine_lock lock;
    const int status = wccp_print_global_info(buffer);
    if (status != 0) {
        QV_LOG(wccp_dump_failure_level, "WCCP: %s failed. status (%d) length (%u) buf len (%u)",
               "printing global info", status, csys_display_buf_bytes_used(buffer),
               csys_display_buf_bytes_max(buffer));
        return 1;
    }
    return append_closing_line(buffer);
}

namespace {

// A group within the dump of everything.
int print_one_of_all(wccp_service_group *group, csys_display_buf *buffer) {
    const int id = group->id;
    WCCP_BAIL_ON_ZERO(
        append_formatted(buffer, "\n\n************** WCCP GROUP ID %d START ************\n", id));
    if (wccp_print_service_group(group, buffer))
        return log_failed_part("printing service group");
    WCCP_BAIL_ON_ZERO(append_formatted(buffer, "\n    ******* WCCP GROUP %d ASSIGNMENT INFO ******\n", id));
    if (wccp_print_service_grp_assignment_details_by_grp_ptr(group, buffer))
        return log_failed_part("show assignment failed");
    if (wccp_print_service_group_stats(group, buffer))
        return log_failed_part("printing service group stats");
    WCCP_BAIL_ON_ZERO(append_formatted(buffer, "************** WCCP GROUP ID %d END **************\n", id));
    return 0;
}

} // namespace

int wccp_print_all_wccp_info(csys_display_buf *buffer) {
    {
        wccp_engine_lock lock;
        if (wccp_print_global_info(buffer))
            return log_failed_part("printing global info");
        for (wccp_service_group *group = wccp_g.group_list; group; group = group->next) {
            const int status = print_one_of_all(group, buffer);
            if (status != 0) {
                QV_LOG(wccp_dump_failure_level, "WCCP: %s failed. status  (%d) length (%u) buf len (%u)",
                       "print all failed", status, csys_display_buf_bytes_used(buffer),
                       csys_display_buf_bytes_max(buffer));
                return status;
            }
        }
    }
    return append_closing_line(buffer);
}

int wccp_print_service_grp(csys_display_buf *buffer, int id) {
    wccp_engine_lock lock;
    wccp_service_group *group = wccp_find_group(id);
    if (!group) {
        (void)append_formatted(buffer, "\n    group %d does not exist!\n", id);
        return 1;
    }
    WCCP_BAIL_ON_ZERO(append_formatted(buffer, "\n*******   WCCP GROUP %d INFO START **********\n", id));
    if (wccp_print_service_group(group, buffer))
        return log_failed_part("print service group failed");
    WCCP_BAIL_ON_ZERO(append_formatted(buffer, "    ******* WCCP GROUP %d ASSIGNMENT INFO ******\n", id));
    if (wccp_print_service_grp_assignment_details_by_grp_ptr(group, buffer))
        return log_failed_part("print service group assignment failed");
    if (wccp_print_service_group_stats(group, buffer))
        return log_failed_part("print service group stats failed");
    WCCP_BAIL_ON_ZERO(append_formatted(buffer, "\n*******   WCCP GROUP %d INFO END **********\n", id));
    return append_closing_line(buffer);
}

int wccp_print_service_grp_assignment_details(int id, csys_display_buf *buffer) {
    if (!buffer)
        return 1;
    wccp_engine_lock lock;
    wccp_service_group *group = wccp_find_group(id);
    if (!group) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: show assignment: cannot find group id %d", id, id);
        return 1;
    }
    if (wccp_print_service_grp_assignment_details_by_grp_ptr(group, buffer))
        return log_failed_part("show assignment failed");
    return 0;
}
