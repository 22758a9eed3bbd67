// Alarms and state events, sent by engine threads while their session is opened, used, lost or shut down, and
// freed. Each session has a process of its own, because the client cannot be started again.
#include <thread>

#include <gtest/gtest.h>

#include "engine/cthread.h"
#include "engine/wccp_alarm_client.h"
#include "engine/wccp_state.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "mgmt/owners.h"
#include "runtime/list.h"
#include "tests/support/gcl_provider.h"
#include "tests/support/owners.h"
#include "tests/support/test_host.h"

namespace {

constexpr uint8_t FIRST_GROUP = 51, GROUPS = 3;

// Makes all changes of a group's alarms, each time in one hold of the engine lock.
void *engine_thread(void *data) {
    for (auto *group = static_cast<wccp_service_group *>(data);; usleep(100)) {
        const wccp_engine_lock lock;
        wccp_alarm_raise_router_down_alarm(group);
        wccp_alarms_verify_allocation_table(group); // its router redirects to no appliance
        wccp_set_role_and_send_event(group->id, WCCP_ROLE_BACKUP);
        wccp_alarms_clear_all_raised_alarms(group);
    }
}

// An event as "name binding=text ..."; "#" marks what is not a string.
std::string text_of_event(const wire &frame) {
    owned_tbuffer bytes;
    owned_request event;
    if (tb_new_buf(&bytes.pointer, frame.data(), static_cast<int32_t>(frame.size())) != LC_OK ||
        bn_request_msg_deserialize(bytes.pointer, BN_FRAME_HEADER_BYTES, &event.pointer) != LC_OK)
        return "unreadable";
    std::string text = ts_str(event.pointer->text);
    for (uint32_t i = 0; i < bn_request_per_node_array_length_quick(event.pointer->nodes); i++) {
        const bn_binding *binding = bn_request_per_node_array_get_quick(event.pointer->nodes, i)->binding;
        uint32_t type = 0;
        EXPECT_EQ(bn_binding_get_type(binding, bn_attrib_value, &type, nullptr), LC_OK);
        text += std::string(type == bn_type_str ? " " : " #") + bn_binding_get_name_quick(binding) + "=" +
                text_of([&](char **out) {
                    return bn_binding_get_str(binding, bn_attrib_value, 0, nullptr, out);
                });
    }
    return text;
}

// Counts the events, until the client closes or, if the session is to be lost, until each has arrived often.
struct listening_provider {
    gcl_provider provider;
    std::map<std::string, int> events;
    std::thread thread;

    explicit listening_provider(bool closes) {
        EXPECT_TRUE(provider.listen_as("mgmtd"));
        thread = std::thread([this, closes] {
            usleep(20000);
            EXPECT_TRUE(provider.open_session());
            for (wire frame; !(frame = provider.take_frame()).empty();) {
                events[text_of_event(frame)]++;
                enough = std::count_if(events.begin(), events.end(),
                                       [](auto &each) { return each.second > 20; }) == 5 * GROUPS;
                if (enough && closes)
                    break;
            }
            provider.close_client();
            over = true;
        });
    }
    std::atomic<bool> enough = false, over = false;
};

std::map<std::string, int> expected_events() {
    std::map<std::string, int> all;
    for (uint8_t id = FIRST_GROUP; id < FIRST_GROUP + GROUPS; id++) {
        const std::string number = std::to_string(id);
        const auto alarm = [&](const char *what, const char *type, const char *words) {
            all[std::string("/qv/alarms/events/") + what + "_alarm alarm_type=" + type +
                " param_1=0 param_2=0 param_3=lan0:grp:" + number + " comment=WCCP GRP " + number +
                ": alarm: " + words]++;
        };
        alarm("raise", "196638", "raising adjacency down alarm");
        alarm("clear", "196638", "clearing adjacency down alarm");
        alarm("raise", "196639", "raising assignment table mismatch alarm");
        alarm("clear", "196639", "clearing assignment table alarm");
        all["/qv/state/events/role_change #kind=1 group=" + number + " #role=1 #code=237"]++;
    }
    return all;
}

void live_and_end(bool session_is_lost) {
    alarm(60);
    wccp_interface interface = {};
    strcpy(interface.name, "lan0");
    wccp_service_group groups[GROUPS] = {};
    wccp_sending_router routers[GROUPS] = {};
    for (uint8_t i = 0; i < GROUPS; i++) {
        groups[i].id = static_cast<uint8_t>(FIRST_GROUP + i);
        groups[i].interfaces[0] = &interface;
        list_push_head(&groups[i].sending_routers, &routers[i]);
    }
    wccp_init_policy_grp_mgr();

    listening_provider provider(session_is_lost);
    for (wccp_service_group &group : groups) {
        cthread *thread = cthread_init("sender", engine_thread, &group, nullptr, nullptr, 0, 0, 0, 0);
        ASSERT_EQ(cthread_start(thread), 0);
    }
    EXPECT_TRUE(qv_alm_mgmt_init("wccpd") == LC_OK && qv_alm_mgmt_session.load());
    while (!(session_is_lost ? provider.over : provider.enough))
        usleep(session_is_lost ? 20000 : 1000);
    usleep(20000);
    EXPECT_EQ(qv_initiate_exit(), LC_OK);
    usleep(5000);
    EXPECT_TRUE(qv_alm_mgmt_deinit() == LC_OK && !qv_alm_mgmt_session.load());
    usleep(5000);
    cthread_cancel_all();
    provider.thread.join();

    for (auto &[text, count] : provider.events)
        count = 1;
    EXPECT_EQ(provider.events, expected_events());
    for (const wccp_service_group &group : groups)
        EXPECT_EQ(group.raised_alarms & ~(WCCP_ALARM_ADJACENCY | WCCP_ALARM_ASSIGNMENT), 0);
}

} // namespace

TEST(AlarmSession, EngineThreadsRaiseAlarmsThroughItsWholeLife) {
    for (const bool session_is_lost : {false, true}) {
        const pid_t child = start_child([&]() -> int {
            live_and_end(session_is_lost);
            exit(testing::Test::HasFailure());
        });
        EXPECT_EQ(wait_for_child(child), 0) << (session_is_lost ? "session lost" : "shut down");
    }
}
