#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "mgmt/log_levels.h"
#include "mgmt/mdc_main.h"
#include "runtime/logging.h"
#include "tests/support/log_lines.cpp" // this program is linked without the engine's helpers
#include "tests/support/owners.h"

using binding_owner = owner<bn_binding, bn_binding_free>;
using bindings_owner = owner<bn_binding_array, bn_binding_array_free>;
using response_owner = owner<bn_response_msg, bn_response_msg_free>;
using string_owner = owner<tstring, ts_free>;

static void add(bn_binding_array *bindings, const char *name, const char *value, uint32_t flags = 0,
                uint32_t type = bn_type_str) {
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, name, bn_attrib_value, type, flags, value), 0);
    ASSERT_EQ(bn_binding_array_append_takeover(bindings, &binding.pointer), 0);
}
static std::string value_of(const bn_binding_array *bindings, const char *name) {
    string_owner value;
    if (bn_binding_array_get_value_tstr_by_name(bindings, name, nullptr, &value) != 0 || !value.pointer)
        return "(none)";
    return ts_str(value);
}

// A server that answers a query for a node with what it holds, and remembers what it was asked.
struct server {
    server() {
        EXPECT_EQ(bn_binding_array_new(&held), 0);
        EXPECT_EQ(connect(), 0);
    }
    ~server() { mdc_free(&client); }
    server(const server &) = delete;
    server &operator=(const server &) = delete;
    lc_status connect() { return mdc_init(answer, this, nullptr, nullptr, nullptr, &client); }

    static lc_status answer(void *data, gcl_session *, bn_request_msg *request, bn_response_msg **out) {
        auto *self = static_cast<server *>(data);
        self->type = request->msg_type;
        self->action = request->text ? ts_str(request->text) : "";
        self->names.clear();
        const uint32_t count = bn_request_per_node_array_length_quick(request->nodes);
        response_owner response;
        EXPECT_EQ(bn_response_msg_create(&response, bn_request_msg_response_msg_type(request->msg_type), 1,
                                         self->code, "told"),
                  0);
        response->db_revision_id = 77;
        for (uint32_t i = 0; i < count; i++) {
            const bn_request_node *node = bn_request_per_node_array_get_quick(request->nodes, i);
            self->names.emplace_back(bn_binding_get_name_quick(node->binding));
            self->subop = node->subop;
            self->flags = node->flags;
            const bn_binding *found = nullptr;
            EXPECT_EQ(bn_binding_array_get_binding_by_name(self->held, self->names.back().c_str(), &found),
                      0);
            binding_owner copy;
            if (!found)
                continue;
            EXPECT_EQ(bn_binding_dup(found, &copy), 0);
            EXPECT_EQ(bn_response_msg_append_binding_takeover(response, &copy.pointer, node->node_id), 0);
        }
        if (self->failure)
            return self->failure;
        if (!self->silent)
            *out = response.pointer, response.pointer = nullptr;
        return LC_OK;
    }

    mdc *client = nullptr;
    bindings_owner held;
    lc_status failure = 0;
    bool silent = false;
    uint32_t code = 0, subop = 0, flags = 0;
    uint16_t type = 0;
    std::string action;
    std::vector<std::string> names;
};

TEST(client, requests_and_what_comes_back) {
    server peer;
    add(peer.held, "/a", "one");
    EXPECT_EQ(mdc_init(nullptr, nullptr, nullptr, nullptr, nullptr, &peer.client), LC_NULL);
    binding_owner binding;
    string_owner message;
    uint32_t code = 9, revision = 0;
    ASSERT_EQ(mdc_get_binding(peer.client, &code, &message, 0, &binding, "/a", nullptr), 0);
    EXPECT_STREQ(bn_binding_get_name_quick(binding), "/a");
    EXPECT_EQ(peer.subop, bn_query_get);
    EXPECT_STREQ(ts_str(message), "told");
    peer.code = 5;
    ASSERT_EQ(mdc_get_binding(peer.client, &code, nullptr, 0, &binding, "/missing", nullptr), 0);
    EXPECT_EQ(binding.pointer, nullptr);
    EXPECT_EQ(code, 5u);

    bindings_owner children;
    for (uint32_t wanted : {0u, 0x1000u, 0x2000u, 0x3000u}) {
        ASSERT_EQ(mdc_get_binding_children(peer.client, nullptr, nullptr, 0, &children, wanted & 0x2000,
                                           wanted & 0x1000, "/a"),
                  0);
        EXPECT_EQ(peer.flags, wanted);
        EXPECT_EQ(peer.subop, bn_query_iterate);
    }
    ASSERT_EQ(mdc_get_binding_children_ex(peer.client, nullptr, nullptr, 0, &children, 0, "/a", nullptr, 3,
                                          &revision),
              0);
    EXPECT_EQ(revision, 77u);
    EXPECT_EQ(bn_binding_array_length_quick(children), 1u);

    ASSERT_EQ(mdc_send_action_with_bindings_str_va(peer.client, &code, nullptr, "/do", 2, "x",
                                                   uint32_t{bn_type_str}, "1", "y", uint32_t{bn_type_uint8},
                                                   "2"),
              0);
    EXPECT_EQ(peer.action, "/do");
    EXPECT_EQ(peer.names, (std::vector<std::string>{"x", "y"}));
    ASSERT_EQ(mdc_send_action_with_bindings_str_va(peer.client, nullptr, nullptr, "/do", 0), 0);
    EXPECT_TRUE(peer.names.empty());

    peer.silent = true;
    ASSERT_EQ(mdc_get_binding(peer.client, &code, nullptr, 0, &binding, "/a", nullptr), 0);
    EXPECT_EQ(binding.pointer, nullptr);
    EXPECT_EQ(code, 0u);
    peer.failure = LC_NOT_FOUND;
    EXPECT_EQ(mdc_get_binding(peer.client, nullptr, nullptr, 0, &binding, "/a", nullptr), LC_NOT_FOUND);
}

struct seen {
    std::string texts;
    uint32_t fail_at;
};
static lc_status note(const bn_binding_array *, uint32_t index, bn_binding *, const tstring *,
                      const tstr_array *, const tstring *last, const tstring *value, void *data) {
    auto *notes = static_cast<seen *>(data);
    if (index == notes->fail_at)
        return LC_BAD_TYPE;
    notes->texts += std::string(ts_str(last)) + "=" + ts_str(value) + ";";
    return LC_OK;
}

TEST(client, foreach_counts_what_went_well) {
    bindings_owner bindings;
    ASSERT_EQ(bn_binding_array_new(&bindings), 0);
    for (const char *name : {"/a/b/c", "/a/b/c/d", "/a/x/c", "/z/b/c", "/a/y/c"})
        add(bindings, name, "v");
    uint32_t count = 0;
    seen all = {"", 99}, some = {"", 1};
    ASSERT_EQ(mdc_foreach_binding_prequeried(bindings, "/a/*/c", nullptr, note, &all, &count), 0);
    EXPECT_EQ(count, 3u);
    EXPECT_EQ(all.texts, "c=v;c=v;c=v;");
    EXPECT_EQ(mdc_foreach_binding_prequeried(bindings, "/a/*/c", nullptr, note, &some, &count), LC_BAD_TYPE);
    EXPECT_EQ(count, 1u);
    EXPECT_EQ(mdc_foreach_binding_prequeried(nullptr, "/a", nullptr, note, &all, &count), LC_NULL);
}

#define ENTRY "/mgmtd/notification/dbchange/1"
static void add_change(bn_binding_array *bindings, const char *type, const char *before, const char *after) {
    add(bindings, ENTRY, "");
    add(bindings, ENTRY "/name", "/n");
    if (type)
        add(bindings, ENTRY "/change_type", type);
    if (before)
        add(bindings, ENTRY "/prev_attribs/value", before);
    if (after)
        add(bindings, ENTRY "/new_attribs/value", after);
}

TEST(client, change_event) {
    log_lines log;
    const struct {
        const char *type, *before, *after;
        lc_status status;
        const char *old_value, *new_value;
    } cases[] = {
        {"add", nullptr, "2", 0, "(none)", "2"},    {"add", "1", "2", LC_ASSERTION, nullptr, nullptr},
        {"delete", "1", nullptr, 0, "1", ""},       {"delete", "1", "2", LC_ASSERTION, nullptr, nullptr},
        {"modify", "1", "2", 0, "1", "2"},          {"modify", "1", nullptr, LC_ASSERTION, nullptr, nullptr},
        {"moved", "1", "2", 0, "(none)", "(none)"}, {nullptr, "1", "2", LC_NULL, nullptr, nullptr},
    };
    for (const auto &change : cases) {
        SCOPED_TRACE(change.type ? change.type : "no type");
        bindings_owner bindings, before, after;
        ASSERT_EQ(bn_binding_array_new(&bindings), 0);
        add_change(bindings, change.type, change.before, change.after);
        ASSERT_EQ(mdc_event_config_change_notif_extract(bindings, &before, &after), change.status);
        ASSERT_EQ(before.pointer == nullptr, change.status != 0);
        ASSERT_EQ(after.pointer == nullptr, change.status != 0);
        if (change.status)
            continue;
        EXPECT_EQ(value_of(before, "/n"), change.old_value);
        EXPECT_EQ(value_of(after, "/n"), change.new_value);
        const bn_binding *gone = nullptr;
        uint32_t type = 0, flags = 0;
        ASSERT_EQ(bn_binding_array_get_binding_by_name(after, "/n", &gone), 0);
        if (change.before && !change.after) {
            ASSERT_EQ(bn_binding_get_type(gone, bn_attrib_value, &type, &flags), 0);
            EXPECT_EQ(type & BN_TYPE_MASK, uint32_t{bn_type_str});
            EXPECT_EQ(flags, uint32_t{bn_flag_deleted | bn_flag_absent});
        }
        EXPECT_EQ(mdc_event_config_change_notif_extract(bindings, nullptr, &after), 0);
    }
    EXPECT_NE(log.take().find("Unexpected change type moved under binding " ENTRY), std::string::npos);
}

#define MESSAGES "/logging/syslog/action/file/\\/var\\/log\\/messages/facility/"

TEST(client, log_levels_at_start) {
    log_lines log;
    server peer;
    add(peer.held, MESSAGES "all/min_priority", "warning");
    add(peer.held, "/logging/syslog/process/wccpd/log_level", "info");
    add(peer.held, MESSAGES "override/enable", "false", 0, bn_type_bool);
    add(peer.held, MESSAGES "single/local0/min_priority", "notice");
    ASSERT_EQ(qv_init_log_level(peer.client), 0);
    const std::string lines = log.take();
    EXPECT_NE(lines.find("Synchronized system log level to 'warning'"), std::string::npos) << lines;
    EXPECT_NE(lines.find("Synchronized daemon log level to 'info'"), std::string::npos);
    EXPECT_NE(lines.find("Synchronized override log level to \"notice\""), std::string::npos);
    EXPECT_EQ(lc_log_get_daemon_log_level(), LC_LOG_INFO);
    server odd;
    add(odd.held, "/logging/syslog/process/wccpd/log_level", "loud");
    EXPECT_EQ(qv_init_log_level(odd.client), LC_BAD_TYPE);
}

TEST(client, log_levels_on_change) {
    log_lines log;
    bindings_owner bindings;
    ASSERT_EQ(bn_binding_array_new(&bindings), 0);
    EXPECT_EQ(qv_handle_log_level_change(nullptr), 0);
    EXPECT_EQ(qv_handle_log_level_change(bindings), 0);
    add(bindings, "/logging/syslog/process/wccpd/log_level", nullptr, bn_flag_deleted | bn_flag_absent);
    add(bindings, MESSAGES "all/min_priority", "info");
    add(bindings, MESSAGES "override/enable", "true", 0, bn_type_bool);
    ASSERT_EQ(qv_handle_log_level_change(bindings), 0);
    EXPECT_EQ(lc_log_get_daemon_log_level(), -1);
    const std::string lines = log.take();
    EXPECT_NE(lines.find("Found process to change level: /logging/syslog/process/wccpd/log_level="),
              std::string::npos);
    EXPECT_NE(lines.find("Syslog log level is set to \"info\""), std::string::npos) << lines;
    EXPECT_EQ(lines.find("system-wide override"), std::string::npos);
    EXPECT_EQ(qv_handle_time_zone_change("/other"), LC_NOT_FOUND);
    EXPECT_EQ(qv_handle_time_zone_change("/time/notify/zonechange"), 0);
    EXPECT_NE(log.take().find("Time zone change handled OK"), std::string::npos);
}
