#include <gtest/gtest.h>

#include "mgmt/log_sync.h"
#include "mgmt/mdc_main.h"
#include "tests/support/hand_session.h"
#include "tests/support/log_lines.h"
#include "tests/support/mgmt_owners.h"
#include "tests/support/texts.h"

namespace {

void add(bn_binding_array *bindings, const std::string &name, const char *value, uint32_t flags = 0,
         uint32_t type = bn_type_str) {
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, name.c_str(), bn_attrib_value, type, flags, value), 0);
    ASSERT_EQ(bn_binding_array_append_takeover(bindings, &binding.pointer), 0);
}
std::string value_of(const bn_binding_array *bindings, const char *name) {
    string_owner value;
    EXPECT_EQ(bn_binding_array_get_value_tstr_by_name(bindings, name, nullptr, &value), 0);
    return text(value);
}

// A server that answers queries from an array of bindings.
struct server {
    mdc *client = nullptr;
    bindings_owner held;
    lc_status failure = 0;
    bool silent = false;
    uint32_t code = 0;
    std::string asked; // the last request: type and action, then name, subop and flags of each node

    server() {
        EXPECT_EQ(bn_binding_array_new(&held), 0);
        EXPECT_EQ(mdc_init(answer, this, nullptr, nullptr, nullptr, &client), 0);
    }
    ~server() { mdc_free(&client); }

    static lc_status answer(void *data, gcl_session *, bn_request_msg *request, bn_response_msg **out) {
        auto *self = static_cast<server *>(data);
        self->asked = std::to_string(request->msg_type) + (request->text ? ts_str(request->text) : "");
        response_owner response;
        const uint16_t type = bn_request_msg_response_msg_type(request->msg_type);
        EXPECT_EQ(bn_response_msg_create(&response, type, 1, self->code, "message"), 0);
        response->db_revision_id = 77;
        for (uint32_t i = 0; i < bn_request_per_node_array_length_quick(request->nodes); i++) {
            const bn_request_node *node = bn_request_per_node_array_get_quick(request->nodes, i);
            const char *name = bn_binding_get_name_quick(node->binding);
            self->asked += std::string(" ") + name + ":" + std::to_string(node->subop) + ":" +
                           std::to_string(node->flags);
            const bn_binding *found = nullptr;
            binding_owner copy;
            EXPECT_EQ(bn_binding_array_get_binding_by_name(self->held, name, &found), 0);
            if (!found)
                continue;
            EXPECT_EQ(bn_binding_dup(found, &copy), 0);
            EXPECT_EQ(bn_response_msg_append_binding_takeover(response, &copy.pointer, node->node_id), 0);
        }
        if (!self->failure && !self->silent)
            *out = std::exchange(response.pointer, nullptr);
        return self->failure;
    }
    // A query for one name: the code, the message, and whether there was a binding.
    std::string get(const char *name) {
        uint32_t result = 9;
        string_owner message;
        binding_owner binding;
        EXPECT_EQ(mdc_get_binding(client, &result, &message, 0, &binding, name, nullptr), failure);
        return std::to_string(result) + " " + text(message) +
               (binding.pointer ? std::string(" ") + bn_binding_get_name_quick(binding) : "");
    }
};

TEST(client, requests_and_their_results) {
    server peer;
    add(peer.held, "/a", "one");
    EXPECT_EQ(mdc_init(nullptr, nullptr, nullptr, nullptr, nullptr, &peer.client), LC_NULL);
    EXPECT_EQ(peer.get("/a"), "0 message /a");
    EXPECT_EQ(peer.asked, "1 /a:1:0");
    peer.code = 5;
    EXPECT_EQ(peer.get("/missing"), "5 message");

    bindings_owner children;
    uint32_t code = 9, revision = 0;
    mdc *to = peer.client;
    for (const uint32_t wanted : {0u, 0x1000u, 0x2000u, 0x3000u}) {
        const int subtree = wanted & 0x1000, self = wanted & 0x2000;
        ASSERT_EQ(mdc_get_binding_children(to, nullptr, nullptr, 0, &children, self, subtree, "/a"), 0);
        EXPECT_EQ(peer.asked, "1 /a:2:" + std::to_string(wanted));
    }
    ASSERT_EQ(mdc_get_binding_children_ex(to, &code, nullptr, 0, &children, 0, "/a", nullptr, 3, &revision),
              0);
    EXPECT_EQ(revision, 77u);
    EXPECT_EQ(bn_binding_array_length_quick(children), 1u);

    constexpr uint32_t type = bn_type_str;
    EXPECT_EQ(
        mdc_send_action_with_bindings_str_va(to, &code, nullptr, "/do", 2, "x", type, "1", "y", type, "2"),
        0);
    EXPECT_EQ(peer.asked, "5/do x:0:0 y:0:0");
    EXPECT_EQ(code, 5u);
    ASSERT_EQ(mdc_send_action_with_bindings_str_va(to, nullptr, nullptr, "/do", 0), 0);
    EXPECT_EQ(peer.asked, "5/do");
    peer.silent = true;
    EXPECT_EQ(peer.get("/a"), "0 (null)");
    peer.failure = LC_NOT_FOUND;
    (void)peer.get("/a");
}

TEST(client, foreach_counts_successful_calls) {
    bindings_owner bindings;
    ASSERT_EQ(bn_binding_array_new(&bindings), 0);
    for (const std::string name : {"/a/b/c", "/a/b/c/d", "/z/b/c", "/a/x/c", "/a/y/c"})
        add(bindings, name, name == "/a/x/c" ? "bad" : "v");
    uint32_t count = 0;
    std::string seen;
    const auto note = [](const bn_binding_array *, uint32_t, bn_binding *, const tstring *,
                         const tstr_array *, const tstring *last, const tstring *value, void *data) {
        *static_cast<std::string *>(data) += text(last) + "=" + text(value) + ";";
        return lc_status{text(value) == "bad" ? LC_BAD_TYPE : LC_OK};
    };
    EXPECT_EQ(mdc_foreach_binding_prequeried(bindings, "/a/*/c", nullptr, note, &seen, &count), LC_BAD_TYPE);
    EXPECT_TRUE(count == 1 && seen == "c=v;c=bad;") << count << seen;
}

TEST(client, change_event) {
    log_lines log;
    // "before > after" as extracted, with "-" for a deleted node; or the status.
    const auto extract = [](const char *type, const char *before, const char *after) {
        bindings_owner bindings, old_values, new_values;
        EXPECT_EQ(bn_binding_array_new(&bindings), 0);
        const std::string entry = "/mgmtd/notification/dbchange/1";
        const char *const nodes[][2] = {{"", ""},
                                        {"/name", "/n"},
                                        {"/change_type", type},
                                        {"/prev_attribs/value", before},
                                        {"/new_attribs/value", after},
                                        {"", "again"}};
        for (const auto &[name, value] : nodes)
            if (value)
                add(bindings, entry + name, value);
        const lc_status status = mdc_event_config_change_notif_extract(bindings, &old_values, &new_values);
        EXPECT_EQ(!old_values.pointer && !new_values.pointer, status != 0);
        if (status != 0)
            return std::to_string(status);
        EXPECT_LE(bn_binding_array_length_quick(new_values), 1u);
        const bn_binding *changed = nullptr;
        uint32_t type_of = bn_type_str, flags = 0;
        EXPECT_EQ(bn_binding_array_get_binding_by_name(new_values, "/n", &changed), 0);
        EXPECT_EQ(changed ? bn_binding_get_type(changed, bn_attrib_value, &type_of, &flags) : 0, 0);
        EXPECT_EQ(type_of & BN_TYPE_MASK, uint32_t{bn_type_str});
        const std::string values = value_of(old_values, "/n") + " > " + value_of(new_values, "/n");
        EXPECT_EQ(mdc_event_config_change_notif_extract(bindings, nullptr, &new_values), 0);
        return values + (flags == (bn_flag_deleted | bn_flag_absent) ? "-" : "");
    };
    const std::string refused = std::to_string(LC_ASSERTION);
    EXPECT_EQ(extract("add", nullptr, "2"), "(null) > 2");
    EXPECT_EQ(extract("add", "1", "2"), refused);
    EXPECT_EQ(extract("delete", "1", nullptr), "1 > -");
    EXPECT_EQ(extract("delete", "1", "2"), refused);
    EXPECT_EQ(extract("modify", "1", "2"), "1 > 2");
    EXPECT_EQ(extract("modify", "1", nullptr), refused);
    EXPECT_EQ(extract("moved", "1", "2"), "(null) > (null)");
    EXPECT_EQ(extract(nullptr, "1", "2"), std::to_string(LC_NULL));
    EXPECT_TRUE(log.say("Unexpected change type moved under binding /mgmtd/notification/dbchange/1"));
}

// ---- Monitoring queries

// The daemon's side of a query, which records what it is asked for, and the session that gets the answer.
struct monitored {
    hand_session with;
    request_owner request;
    strings asked;
    lc_status failure = 0;
    std::string value = "v";

    monitored() {
        EXPECT_TRUE(with.open());
        EXPECT_EQ(bn_query_request_msg_create(&request, 0, nullptr), 0);
    }
    void add_node(const std::string &name, uint32_t subop, uint32_t flags = 0, uint32_t mask_type = 0) {
        constexpr uint32_t id = bn_attrib_capability_mask;
        binding_owner mask;
        ASSERT_EQ(bn_binding_new_named(&mask, "x"), 0);
        ASSERT_EQ(mask_type ? bn_binding_set_str(mask, id, mask_type, 0, "1") : 0, 0);
        ASSERT_EQ(bn_query_request_msg_append_with_attribs(request, subop, flags, name.c_str(),
                                                           mask->attributes, nullptr),
                  0);
    }
    void add_registered(const strings &names) {
        for (const std::string &name : names)
            add_node(name, bn_query_registration_info, 0, bn_type_uint32);
    }
    static lc_status get(const char *name, const tstr_array *, void *data, bn_binding_array *out) {
        auto *self = static_cast<monitored *>(data);
        self->asked.emplace_back(name);
        add(out, name, self->value.c_str());
        return self->failure;
    }
    static lc_status list(const char *name, const tstr_array *parts, void *data, tstr_array *out) {
        static_cast<monitored *>(data)->asked.push_back(std::string("?") + name);
        EXPECT_EQ(bn_binding_name_pattern_match(name, "/a") ? 1u : 3u, tstr_array_length_quick(parts));
        for (const char *child : {"1", "2"})
            EXPECT_EQ(tstr_array_append_str(out, child), 0);
        return LC_OK;
    }
    lc_status dispatch() { return mdc_dispatch_mon_request(with.session, request, get, this, list, this); }
    // The name of each binding in the answer, with the id of the node that it answers.
    strings answer() {
        const wire frame = with.provider.take_frame(100);
        buffer_owner buffer;
        response_owner response;
        strings got;
        if (frame.empty())
            return {"(none)"};
        EXPECT_EQ(tb_new_buf(&buffer, frame.data(), static_cast<int32_t>(frame.size())), 0);
        EXPECT_EQ(bn_response_msg_deserialize(buffer, 32, &response), 0);
        EXPECT_EQ(response->response_to, request->msg_id);
        if (response->return_code)
            got.push_back(std::to_string(response->return_code) + " " + ts_str(response->return_message));
        for (uint32_t i = 0; i < bn_response_per_node_array_length_quick(response->nodes); i++) {
            const bn_response_node *node = bn_response_per_node_array_get_quick(response->nodes, i);
            got.push_back(bn_binding_get_name_quick(node->binding) + (" " + std::to_string(node->node_id)));
        }
        return got;
    }
};

TEST(client, monitoring_walk) {
    constexpr uint32_t get = bn_query_get, walk = bn_query_iterate;
    constexpr uint32_t tree = bn_qf_subtree, self = bn_qf_include_self, leaves = bn_qf_leaves_only;
    const auto check = [](const std::string &name, uint32_t subop, uint32_t flags,
                          const strings &asked) { // "?": asked for the children
        SCOPED_TRACE(name + " " + std::to_string(flags));
        monitored daemon;
        daemon.add_node(name, subop, flags); // the query comes before the registrations
        daemon.add_registered({"/a/*", "/a/*/b", "/a/*/c/*", "/s/x", "/s/x", "/s/x/y"});
        ASSERT_EQ(daemon.dispatch(), 0);
        EXPECT_EQ(daemon.asked, asked);
        strings answered;
        for (const std::string &each : asked)
            if (each[0] != '?')
                answered.push_back(each + " 1000");
        EXPECT_EQ(daemon.answer(), answered);
    };
    check("/a/1/b", get, 0, {"/a/1/b"});
    check("/other", get, 0, {"/other"});
    check("/other", walk, tree | self, {});
    check("/a/*", walk, 0, {"?/a", "/a/1", "/a/2"});
    check("/a", walk, 0, {"?/a", "/a/1", "/a/2"}); // only the direct children
    check("/a/1", walk, 0, {"/a/1/b"});
    check("/a/1", walk, self, {"/a/1", "/a/1/b"});
    check("/a/1/c", walk, 0, {"?/a/1/c", "/a/1/c/1", "/a/1/c/2"});
    check("/a/1", walk, tree, {"/a/1/b", "?/a/1/c", "/a/1/c/1", "/a/1/c/2"});
    check("/a/1", walk, tree | self | leaves, {"/a/1/b", "?/a/1/c", "/a/1/c/1", "/a/1/c/2"});
    check("/a/1", walk, tree | bn_qf_walk_only, {"?/a/1/c"});
    check("/s", walk, 0, {"/s/x"});
    check("/s", walk, tree, {"/s/x", "/s/x/y"});
    check("/s", walk, tree | leaves, {"/s/x/y"});
    check("/s/x/y", walk, 0, {});
    check("/s/x/y", walk, self, {"/s/x/y"});
    check("/", walk, 0, {}); // no registered child
}

TEST(client, monitoring_answers) {
    log_lines log;
    std::string deep;
    for (int part = 1; part <= 64; part++)
        deep += "/d";
    monitored several;
    several.add_registered({deep, deep + "/e"});
    several.add_registered(strings(63, deep));
    several.add_registered({"/late", "/later"}); // beyond the limit for all names
    several.add_node("/odd", bn_query_none);
    several.add_node(deep, bn_query_iterate, bn_qf_include_self);
    several.add_node(deep + "/e", bn_query_iterate, bn_qf_include_self);
    several.add_node("/late", bn_query_iterate, bn_qf_include_self);
    several.add_node("/one", bn_query_get);
    ASSERT_EQ(several.dispatch(), 0);
    EXPECT_EQ(several.answer(), (strings{deep + " 1068", "/one 1071"}));
    const std::string lines = log.take();
    EXPECT_TRUE(contains(lines, "Ignoring a registered name of 65 parts, the limit is 64",
                         "Registered names have more than 4096 parts in all, ignoring /late and what follows",
                         "Unexpected query subop 0; ignoring request for binding /odd"));
    EXPECT_TRUE(lacks(lines, "/later"));

    const std::pair<lc_status, uint32_t> masks[] = {
        {LC_NULL, 0}, {LC_ASSERTION, bn_type_str}, {LC_BAD_TYPE, bn_type_uint32}};
    for (const auto &[status, mask_type] : masks) { // and no answer is sent
        monitored failing;
        failing.add_node("/a", bn_query_registration_info, 0, mask_type);
        failing.failure = LC_BAD_TYPE;
        failing.add_node("/one", bn_query_get);
        EXPECT_EQ(failing.dispatch(), status);
        EXPECT_EQ(failing.answer(), strings{"(none)"});
    }
    monitored large; // it is not asked for more than fits in a message
    large.value.resize(1 << 20, 'v');
    large.add_registered({"/a/*", "/a/*/b"});
    for (int i = 0; i < 14; i++)
        large.add_node("/one", bn_query_get);
    large.add_node("/a/*", bn_query_iterate, bn_qf_subtree);
    ASSERT_EQ(large.dispatch(), 0);
    EXPECT_EQ(large.answer(), strings{"14011 The answer is larger than a message: ask for less"});
    EXPECT_EQ(large.asked.size(), 14u + 3);
    monitored empty;
    EXPECT_EQ(empty.dispatch(), LC_ASSERTION);
    empty.request->msg_type = bn_msg_event;
    EXPECT_EQ(empty.dispatch(), LC_ASSERTION);
}

const std::string MESSAGES = "/logging/syslog/action/file/\\/var\\/log\\/messages/facility/",
                  PROCESS = "/logging/syslog/process/wccpd/log_level", SYSTEM = MESSAGES + "all/min_priority",
                  OVERRIDE = MESSAGES + "override/enable", CLASS = MESSAGES + "single/local0/min_priority";

TEST(client, log_levels_at_start) {
    log_lines log;
    server peer;
    add(peer.held, SYSTEM, "warning");
    add(peer.held, PROCESS, "info");
    add(peer.held, OVERRIDE, "false", 0, bn_type_bool);
    add(peer.held, CLASS, "notice");
    ASSERT_EQ(qv_init_log_level(peer.client), 0);
    EXPECT_TRUE(contains(log.take(), "Synchronized system log level to 'warning'",
                         "Synchronized daemon log level to 'info'",
                         "Synchronized override log level to \"notice\""));
    EXPECT_EQ(lc_log_get_daemon_log_level(), LC_LOG_INFO);
    server odd;
    add(odd.held, PROCESS, "loud");
    EXPECT_EQ(qv_init_log_level(odd.client), LC_BAD_TYPE);
    EXPECT_EQ(lc_log_get_facility(odd.client, "wccpd"), 136); // no such node
    add(odd.held, "/logging/syslog/facility/system", "160", 0, bn_type_uint32);
    EXPECT_EQ(lc_log_get_facility(odd.client, "wccpd"), 160);
}

// Each change meets the system level "warning" and a system-wide override without a level of the class.
TEST(client, log_levels_on_change) {
    constexpr const char *deleted = nullptr;
    constexpr int32_t info = LC_LOG_INFO, debug = LC_LOG_DEBUG, warning = LC_LOG_WARNING;
    log_lines log;
    EXPECT_EQ(qv_handle_log_level_change(nullptr), 0);
    const auto check = [&](const std::vector<std::pair<std::string, const char *>> &changes,
                           int32_t daemon_level, int32_t level, const char *line, lc_status status = LC_OK) {
        SCOPED_TRACE(testing::PrintToString(changes[0]));
        ASSERT_EQ(lc_log_set_daemon_log_level(LC_LOG_DEBUG), 0);
        ASSERT_EQ(lc_log_set_max_log_level("warning"), 0);
        ASSERT_EQ(lc_log_enable_override_log_level(0, 0), 0);
        ASSERT_EQ(lc_log_enable_override_log_level(1, 1), 0);
        bindings_owner bindings;
        ASSERT_EQ(bn_binding_array_new(&bindings), 0);
        for (const auto &[name, value] : changes)
            add(bindings, name, value, value ? 0 : bn_flag_deleted | bn_flag_absent,
                name == OVERRIDE ? bn_type_bool : bn_type_str);
        EXPECT_EQ(qv_handle_log_level_change(bindings), status);
        EXPECT_EQ(lc_log_get_daemon_log_level(), daemon_level);
        EXPECT_EQ(G_log_level, level);
        const std::string lines = log.take();
        EXPECT_TRUE(contains(lines, line) && lacks(lines, ".ERR]")) << lines;
    };
    check({{"/qv/wccpd/other", "x"}}, debug, warning, "");
    check({{PROCESS, "info"}, {SYSTEM, "err"}}, info, warning, "Process log_level='info'");
    check({{PROCESS, "loud"}, {SYSTEM, "err"}}, debug, warning, "", LC_BAD_TYPE);
    check({{PROCESS, ""}, {SYSTEM, "info"}, {OVERRIDE, "false"}}, -1, info, "level is set to \"info\"");
    check({{PROCESS, deleted}, {SYSTEM, "info"}}, -1, info, "level is set to \"info\"");
    check({{SYSTEM, ""}, {CLASS, "debug"}}, debug, debug, "override is enabled, log level is \"debug\"");
    check({{SYSTEM, deleted}, {OVERRIDE, "false"}}, debug, warning, "override is disabled");
    check({{OVERRIDE, "false"}, {CLASS, "debug"}}, debug, warning, "system-wide override is disabled");
    check({{CLASS, "info"}}, debug, info, "per-class local0 override is enabled, log level is \"info\"");
    check({{CLASS, ""}}, debug, warning, "per-class local0 override is disabled");
    EXPECT_EQ(lc_log_set_daemon_log_level(LC_LOG_DEBUG), 0);
    EXPECT_EQ(qv_handle_time_zone_change("/other"), LC_NOT_FOUND);
    setenv("TZ", "ABC-5", 1);
    EXPECT_EQ(qv_handle_time_zone_change("/time/notify/zonechange"), 0);
    EXPECT_EQ(getenv("TZ"), nullptr);
    EXPECT_TRUE(log.say("Time zone change handled OK"));
}

} // namespace
