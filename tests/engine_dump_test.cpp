// The diagnostic dumps: the whole text of a small group, compared with a file, and buffers of every size that
// is too small.
#include "engine/wccp_debug_utils.h"

#include <algorithm>
#include <fstream>

#include "runtime/csys.h"
#include "tests/support/reported_group.h"

namespace {

// The expected texts with these names, one after the other. In the file each is after a line with its name.
std::string golden(const std::string &names) {
    std::ifstream file(WCCP_SOURCE_DIR "/tests/golden/engine_dumps.txt");
    std::map<std::string, std::string> texts;
    for (std::string line, name; std::getline(file, line);)
        if (line.starts_with("== "))
            name = line.substr(3);
        else
            texts[name] += line + "\n";
    std::istringstream words(names);
    std::string joined;
    for (std::string name; words >> name;)
        joined += texts.at(name);
    return joined;
}

struct dump {
    int result;
    std::string text;
    uint32_t max;
};

// The text that `print` writes into a buffer of exactly this size.
dump dump_of(uint32_t size, const std::function<int(csys_display_buf *)> &print) {
    const std::unique_ptr<char[]> memory(new char[size]);
    memset(memory.get(), '~', size);
    csys_display_buf *buffer = csys_create_safe_display_buf_desc(memory.get(), size);
    const int result = print(buffer);
    return {result, csys_display_buf_text(buffer), csys_display_buf_bytes_max(buffer)};
}
int print_51(csys_display_buf *buffer) {
    return wccp_print_service_grp(buffer, 51);
}
int print_assignment_51(csys_display_buf *buffer) {
    return wccp_print_service_grp_assignment_details(51, buffer);
}

// Group 51 as in the expected texts.
struct EngineDump : testing::Test, reported_group {
    EngineDump() : reported_group(false) {
        wccp_g.seconds = 200000;
        wccp_g.mcast_ttl = 5;
        see(ROUTER_A, {ROUTER_A}, {{US, 50}});
        first = router(ROUTER_A);
        interface.link_up = 1;
        interface.ready_flags = WCCP_IPA_READY;
        group->state_flags = WCCP_STATE_ACTIVE | WCCP_CAPABILITIES_SET | WCCP_SHUTTING_DOWN;
        group->state_time = wccp_g.seconds - (86400 + 2 * 3600 + 3 * 60 + 4);
        group->protocol = 6;
        group->service_flags = 0x6;
        group->security_option = 1;
        group->priority = 240;
        memcpy(group->password, "secret12", sizeof group->password);
        group->force_l2_return = 1;
        for (const be32 each : {ROUTER_A, ROUTER_B})
            group->ucast_routers[group->ucast_router_count++] = each;
        group->cfg_fwd_method = WCCP_METHOD_EITHER;
        group->cfg_assign_method = WCCP_ASSIGN_EITHER;
        group->ret_method = WCCP_METHOD_GRE; // the others are as the router has agreed them
        group->change_number = 7;
        group->transitions = 3;
        group->designated = 1;
        group->dsg_key_change = 9;
        group->pending_acks = 1;
        group->redirecting_routers = 4;
        group->raised_alarms = WCCP_ALARM_ADJACENCY | WCCP_ALARM_ASSIGNMENT;
        group->router_alarm_timer = {1, WCCP_TIMER_COUNTS, 1, 30, 12};
        group->assign_alarm_timer = {0, WCCP_TIMER_COUNTS, 1, 30, 5};
        uint32_t value = 1;
        for (uint32_t *each :
             {&group->rx_icus, &group->rx_removal_queries, &group->tx_here_i_am, &group->tx_redirect_assign,
              &group->tx_removal_replies, &group->alarm_router_sched, &group->alarm_assign_sched,
              &group->rx_unknown_capabilities, &group->rx_failures, &group->tx_failures,
              &group->rx_service_mismatches, &group->rx_auth_mismatches, &group->rx_auth_failures})
            *each = value++;

        first->src_ipa = host(211);
        first->receive_id = to_be32(0x12);
        first->change_number = to_be32(5);
        first->flags = WCCP_RTR_TWO_WAY | WCCP_RTR_ASSIGN_UNACKED;
        first->state_time = wccp_g.seconds - 65;
        first->cap_assign = 4;
        first->cap_ret = 3;
        first->view_routers[0].flags = 1;
        first->view_appliances[0] = {US, 50, 0, 64, 256, {0x01020304, 0, 0, 0, 0, 0, 0, 0x80000000}};
        group->appliance_view->weight = 100;
        group->appliance_view->ref_count = 2;
        group->router_view->ref_count = 3;

        group->mask_src_ip = 0x1741;
        group->mask_dst_port = 1;
        group->dsg_appliance_count = group->dsg_active_count = 2;
        group->dsg_appliances[0] = {US, 1, 100, 85};
        group->dsg_appliances[1] = {host(2), 1, 200, 171};
        group->bucket_count = 256;
        for (uint32_t i = 0; i < WCCP_MAX_BUCKETS; i++)
            group->bucket_ipa[i] = i < 85 ? US : host(2);
        wccp_g.stat_allocs = 41;
        wccp_g.stat_frees = 31;
        wccp_g.stat_alloc_fails = 2;
        wccp_g.rx_failures = 17;
    }
    wccp_sending_router *first;
};

TEST_F(EngineDump, TheWholeTexts) {
    const std::string hash = "hash-head hash-designator hash-routers ";
    const auto matches = [](uint32_t size, int (*print)(csys_display_buf *), const std::string &names) {
        const dump found = dump_of(size, print);
        const std::string text = golden(names);
        EXPECT_EQ(found.result, 0);
        EXPECT_EQ(found.text, text + "    (debug buffer: used " + std::to_string(text.size()) + " max len " +
                                  std::to_string(found.max) + ")\n");
    };
    matches(WCCP_DUMP_GROUP_BYTES, print_51,
            "group-start group assignment-start " + hash + "statistics group-end");
    matches(WCCP_DUMP_GLOBAL_BYTES, wccp_print_global, "global");
    matches(WCCP_DUMP_ALL_BYTES, wccp_print_all_wccp_info,
            "global one-of-all-start group empty-line assignment-start " + hash +
                "statistics one-of-all-end");
    wccp_service_group *const list = std::exchange(wccp_g.group_list, nullptr);
    matches(WCCP_DUMP_ALL_BYTES, wccp_print_all_wccp_info, "global");
    wccp_g.group_list = list;
    EXPECT_EQ(dump_of(WCCP_DUMP_ASSIGNMENT_BYTES, print_assignment_51).text, golden(hash));
    EXPECT_EQ(wccp_print_service_grp_assignment_details(51, nullptr), 1);

    log_lines log;
    const dump missing = dump_of(100, [](csys_display_buf *b) {
        return wccp_print_service_grp(b, 7) + wccp_print_service_grp_assignment_details(7, b);
    });
    EXPECT_TRUE(missing.result == 2 && missing.text == "\n    group 7 does not exist!\n");
    EXPECT_TRUE(log.say("WCCP GRP 7: show assignment: cannot find group id 7"));
}

TEST_F(EngineDump, TheDesignatedAppliancesTable) {
    const auto text = [] { return dump_of(WCCP_DUMP_ASSIGNMENT_BYTES, print_assignment_51).text; };
    // One appliance with all buckets.
    group->dsg_active_count = 1;
    std::fill(group->bucket_ipa, group->bucket_ipa + WCCP_MAX_BUCKETS, US);
    const std::string full = "\t                           : 0xffffffff ffffffff ffffffff ffffffff\n";
    EXPECT_EQ(count_of(full + full + "\n", text()), 1);

    // Mask values instead of buckets.
    group->assign_method = WCCP_ASSIGN_MASK;
    group->cfg_assign_method = 4;
    group->dsg_appliances[0].assigned = 2;
    group->bucket_count = group->mask_value_count = 2;
    group->mask_in_use = {0x1, 0x1700, 0, 0x80};
    group->mask_values[0] = {0, 0, 0, 0, US};
    group->mask_values[1] = {0x1, 0x1000, 2, 0x80, US};
    EXPECT_EQ(text(), golden("mask-head mask-designator mask-routers"));

    // Not designated: only the routers' reports are shown. No buckets give 0 %.
    group->designated = 0;
    first->view_appliances[0].buckets_total = 0;
    EXPECT_EQ(text(), golden("mask-head no-designator mask-routers-without-values"));

    // No method agreed: no rows of buckets or values.
    group->assign_method = WCCP_ASSIGN_NONE;
    EXPECT_EQ(count_of("Negotiated assign. method  : not set\n", text()), 1);
    EXPECT_EQ(count_of("Rxed ", text()), 0);
}

TEST_F(EngineDump, WordsForOtherStates) {
    const auto row = [](const std::string &label) {
        const std::string text = dump_of(WCCP_DUMP_GROUP_BYTES, print_51).text;
        const size_t at = text.find("    WCCP " + label) + 39;
        return text.substr(at, text.find('\n', at) - at);
    };
    wccp_interface primary = {};
    const std::tuple<std::function<void()>, const char *, const char *> rows[] = {
        {[&] { group->admin_state = WCCP_ADMIN_DOWN; }, "admin state", "disabled"},
        {[&] { group->designated = 0; }, "designated appliance", "no"},
        {[&] { group->raised_alarms = 0; }, "raised alarms", "none"},
        {[&] { group->raised_alarms = 2; }, "raised alarms", "flag: 0x2 assign tbl mismatch"},
        {[&] { first->flags = WCCP_RTR_ONE_WAY; }, "router connected", "one-way"},
        {[&] { memset(group->password, 0, 8); }, "password", " 0x0, 0x0, 0x0, 0x0, 0x0, 0x0, 0x0, 0x0, "},
        {[&] { interface.link_up = 0; }, "interface ipa and link", "10.0.0.1 down "},
        {[&] { interface.ready_flags = WCCP_LINK_READY, wccp_g.primary_if = &primary; },
         "interface ready flags", "ipa: no link: ok track intf: no "},
        {[&] { primary.ready_flags = WCCP_ALL_READY; }, "interface ready flags",
         "ipa: no link: ok track intf: ok "},
    };
    for (const auto &[change, label, wanted] : rows) {
        change();
        EXPECT_EQ(row(label), wanted);
    }
    wccp_g.primary_if = nullptr;
    const char *const states[] = {"none", "init", "active", "bad", "backup", "bad", "bad", "bad"};
    for (uint32_t bits = 0; bits < 8; bits++) {
        group->state_flags = bits | WCCP_DESG_ELECT_PENDING;
        EXPECT_EQ(row("service group (STATE)"), std::string("51 (") + states[bits] + ")");
    }
    EXPECT_EQ(row("state flags"), "0x17 = { INIT BACKUP ACTIVE DESG_ELECT_PENDING  }");
}

// Each gives the beginning of the text, a newline, the result 1 and a line in the log.
TEST_F(EngineDump, EveryBufferThatIsTooSmall) {
    log_lines log;
    for (const auto print : {wccp_print_global, wccp_print_all_wccp_info, print_51, print_assignment_51}) {
        const dump whole = dump_of(WCCP_DUMP_ALL_BYTES, print);
        ASSERT_EQ(whole.result, 0);
        const uint32_t overhead = WCCP_DUMP_ALL_BYTES - whole.max;
        const auto length = static_cast<uint32_t>(whole.text.size());
        // The closing line is shorter with a smaller buffer; 24 bytes less are certainly too few.
        for (uint32_t max = 1; max < length - 24; max += max + 300 < length ? 23 : 1) {
            const dump cut = dump_of(max + overhead, print);
            ASSERT_TRUE(cut.result == 1 && cut.text.back() == '\n' && cut.text.size() <= max) << max;
            ASSERT_EQ(cut.text.compare(0, cut.text.size() - 1, whole.text, 0, cut.text.size() - 1), 0) << max;
            ASSERT_NE(log.take(), "") << max;
        }
    }
}

} // namespace
