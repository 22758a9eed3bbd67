// Received packets, from the header on, into a group that two routers already report to.
//
// An input is a mode byte and then packets, each after two bytes: in their low 13 bits its length (the rest
// of the input, when there is less), in the high 3 bits how much time passes after it. The mode's bits are in
// `mode` below. MENDED makes length, version, group and digest of each packet right before it is processed,
// so that what is wrong further in is reached; without it they have to be found.
//
// The whole engine runs, but for its threads and sockets: time passes by ticks, messages are built and go
// nowhere, and there is no mailbox, so that a tunnel is refused at once. After each packet the records must
// agree with each other, and when the group has gone nothing may be left of it.

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "engine/wccp_pkt_load.h"
#include "engine/wccp_pkt_mgr.h"
#include "runtime/logging.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/reported_group.h"

namespace {

enum mode : uint8_t {
    NEXUS = 1,
    MD5 = 2,
    BY_MASK = 4,
    MENDED = 8,
    DESIGNATED = 16, // a table is out and waits for acknowledgements
    LOGGED = 32,     // every line is written, and costs most of the time
};
constexpr uint32_t ticks_after[8] = {0, 1, 2, 11, 17, 41, 61, 0};
constexpr size_t DIGEST_AT = 16;

void require(bool condition, const char *what) {
    if (condition)
        return;
    fprintf(stderr, "the records don't agree: %s\n", what);
    abort();
}
#define REQUIRE(condition) require((condition), #condition)

template <typename Entry>
uint32_t list_length(Entry *const *head) {
    uint32_t length = 0;
    for (Entry *const *link = head; *link; link = &(*link)->next) {
        REQUIRE((*link)->prev_link == link);
        REQUIRE(++length <= 4096);
    }
    return length;
}

// A reference count is the number of routers that report an address, and no router reports one twice.
template <typename UnionEntry, typename Entry, size_t Size>
void check_references(const wccp_service_group *group, const UnionEntry *first,
                      uint32_t wccp_sending_router::*count, Entry (wccp_sending_router::*entries)[Size]) {
    uint32_t references = 0, reported = 0;
    for (const UnionEntry *entry = first; entry; entry = entry->next) {
        uint32_t routers = 0;
        for (const wccp_sending_router *router = group->sending_routers; router; router = router->next) {
            const Entry *begin = router->*entries, *end = begin + router->*count;
            const auto found =
                std::count_if(begin, end, [entry](const Entry &each) { return each.ipa == entry->ipa; });
            REQUIRE(found <= 1);
            routers += found == 1;
        }
        REQUIRE(entry->ref_count != 0 && entry->ref_count == routers);
        references += entry->ref_count;
    }
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        reported += router->*count;
    REQUIRE(reported == references);
}

void check_group(const wccp_service_group *group) {
    REQUIRE(list_length(&group->sending_routers) == group->sending_router_count);
    REQUIRE(list_length(&group->appliance_view) == group->appliance_view_count);
    REQUIRE(list_length(&group->router_view) == group->router_view_count);
    REQUIRE(list_length(&group->removal_replies) == group->removal_reply_count);
    REQUIRE(group->sending_router_count <= WCCP_MAX_ROUTERS);
    REQUIRE(group->redirecting_routers <= WCCP_MAX_ROUTERS);
    REQUIRE(group->pending_acks <= WCCP_MAX_ROUTERS);
    REQUIRE(__builtin_popcount(group->state_flags & WCCP_STATE_MASK) == 1);
    REQUIRE(group->dsg_active_count <= group->dsg_appliance_count);
    REQUIRE(group->dsg_appliance_count <= WCCP_MAX_APPLIANCES);
    REQUIRE(group->bucket_count <= WCCP_MAX_BUCKETS);
    REQUIRE(group->mask_value_count <= WCCP_MAX_MASK_VALUES);
    const bool agreed = (group->state_flags & WCCP_CAPABILITIES_SET) != 0;
    REQUIRE(agreed == (group->fwd_method != 0) && agreed == (group->assign_method != 0));
    REQUIRE(agreed == (group->ret_method != 0) && agreed == (group->sending_router_count != 0));
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        REQUIRE(!is_zero(router->router_id));
        REQUIRE(router->view_router_count <= WCCP_MAX_ROUTERS);
        REQUIRE(router->view_appliance_count <= WCCP_MAX_APPLIANCES);
        const uint32_t both = WCCP_RTR_ONE_WAY | WCCP_RTR_TWO_WAY;
        REQUIRE((router->flags & both) != both && (router->flags & both) != 0);
    }
    check_references(group, group->router_view, &wccp_sending_router::view_router_count,
                     &wccp_sending_router::view_routers);
    check_references(group, group->appliance_view, &wccp_sending_router::view_appliance_count,
                     &wccp_sending_router::view_appliances);
}

void mend(const wccp_service_group *group, wccp_pkt *pkt) {
    uint8_t *bytes = pkt->data;
    const uint32_t service_at = group->security_option == 1 ? 32 : 16;
    if (pkt->length < service_at + 28)
        return;
    const uint32_t behind = pkt->length - 8;
    const uint8_t header[] = {2, 0, static_cast<uint8_t>(behind >> 8), static_cast<uint8_t>(behind & 0xff)};
    memcpy(bytes + 4, header, sizeof header);
    bytes[service_at + 5] = group->id;
    if (group->security_option != 1)
        return;
    uint8_t digest[16] = {};
    memcpy(bytes + DIGEST_AT, digest, sizeof digest);
    wccp_pkt_digest(group, pkt, digest);
    memcpy(bytes + DIGEST_AT, digest, sizeof digest);
}

void prepare(const reported_group &reported, uint8_t mode) {
    wccp_service_group *group = reported.group;
    group->compat_mode = mode & NEXUS ? WCCP_COMPAT_NEXUS : WCCP_COMPAT_IOS;
    group->security_option = mode & MD5 ? 1 : 0;
    if (mode & MD5)
        memcpy(group->password, "password", WCCP_PASSWORD_BYTES);
    group->cfg_fwd_method = WCCP_METHOD_EITHER;
    group->cfg_assign_method = WCCP_ASSIGN_EITHER;
    group->mask_dst_ip = 0xf00;
    group->mask_bits = 4;
    for (const be32 router : {ROUTER_A, ROUTER_B})
        reported.see(router, {ROUTER_A, ROUTER_B}, {{US, 100}, {host(2), 50}});
    if (mode & BY_MASK)
        group->assign_method = WCCP_ASSIGN_MASK;
    if (mode & DESIGNATED)
        pass_seconds(27);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *input, size_t size) {
    if (size < 1)
        return 0;
    const uint8_t mode = *input;
    const uint8_t *const end = input + size;
    wccp_g.seconds = wccp_g.rx_failures = 0;
    G_daemon_log_level = mode & LOGGED ? LC_LOG_DEBUG : LC_LOG_EMERG;
    {
        const reported_group reported(true);
        prepare(reported, mode);
        check_group(reported.group);
        for (input++; end - input > 2;) {
            const uint32_t word = static_cast<uint32_t>(input[0] << 8 | input[1]);
            input += 2;
            const size_t length =
                std::min({size_t{word & 0x1fff}, size_t{WCCP_MAX_PACKET}, static_cast<size_t>(end - input)});
            const received_packet pkt = make_received(std::vector<uint8_t>(input, input + length), ROUTER_A);
            input += length;
            if (mode & MENDED)
                mend(reported.group, pkt.get());
            wccp_process_received_packet(pkt.get());
            REQUIRE(pkt->offset <= pkt->length && pkt->cursor == pkt->data + pkt->offset);
            check_group(reported.group);
            pass_seconds(ticks_after[word >> 13]);
            check_group(reported.group);
        }
    }
    REQUIRE(wccp_g.stat_allocs == wccp_g.stat_frees);
    REQUIRE(wccp_g.group_count == 0 && !wccp_g.group_list);
    return 0;
}
