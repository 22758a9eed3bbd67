// Fuzzer for received packets, in a group that has reports of two routers.
//
// An input is a mode byte, followed by packets. Two bytes precede each packet: the low 13 bits are its length
// (or the rest of the input, if that is shorter), the high 3 bits select how much time passes after it. With
// MENDED the length, version, group and digest of each packet are corrected, so that the code after these
// checks is reached; without it the fuzzer has to find them.
//
// The whole engine runs except for its threads and sockets: ticks make the time pass, messages are built and
// not sent, and without a mailbox tunnels are refused at once. After each packet the records must be
// consistent, and after the group is deleted nothing of it may be left.

#include <algorithm>
#include <cstring>
#include <utility>

#include "engine/wccp_pkt_load.h"
#include "engine/wccp_pkt_mgr.h"
#include "fuzz/require.h"
#include "runtime/logging.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/reported_group.h"

namespace {

enum mode : uint8_t {
    NEXUS = 1,
    MD5 = 2,
    BY_MASK = 4,
    MENDED = 8,
    DESIGNATED = 16, // we are designated and wait for acknowledgements of a table
    LOGGED = 32,     // formats all log lines, which takes most of the time
};
constexpr uint32_t ticks_after[8] = {0, 1, 2, 11, 17, 41, 61, 0};
constexpr size_t DIGEST_AT = 16;

template <typename Entry>
uint32_t list_length(Entry *const *head) {
    uint32_t length = 0;
    for (Entry *const *link = head; *link; link = &(*link)->next) {
        REQUIRE((*link)->prev_link == link);
        REQUIRE(++length <= 4096);
    }
    return length;
}

// The reference count of an address is the number of routers that report it, and none reports it twice.
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

void mend_packet(const wccp_service_group *group, wccp_pkt *pkt) {
    uint8_t *bytes = pkt->data;
    const uint32_t service_at = group->security_option == 1 ? 32 : 16;
    if (pkt->length < service_at + 28)
        return;
    const uint32_t body = pkt->length - 8;
    const uint8_t header[] = {2, 0, static_cast<uint8_t>(body >> 8), static_cast<uint8_t>(body & 0xff)};
    memcpy(bytes + 4, header, sizeof header);
    bytes[service_at + 5] = group->id;
    if (group->security_option != 1)
        return;
    uint8_t digest[16] = {};
    memcpy(bytes + DIGEST_AT, digest, sizeof digest);
    wccp_pkt_digest(group, pkt, digest);
    memcpy(bytes + DIGEST_AT, digest, sizeof digest);
}

void prepare_group(const reported_group &reported, uint8_t mode) {
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
        prepare_group(reported, mode);
        check_group(reported.group);
        for (input++; end - input > 2;) {
            const uint32_t word = static_cast<uint32_t>(input[0] << 8 | input[1]);
            input += 2;
            const size_t length =
                std::min({size_t{word & 0x1fff}, size_t{WCCP_MAX_PACKET}, static_cast<size_t>(end - input)});
            const received_packet pkt = make_received(std::vector<uint8_t>(input, input + length), ROUTER_A);
            input += length;
            if (mode & MENDED)
                mend_packet(reported.group, pkt.get());
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
