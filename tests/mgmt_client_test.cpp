#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "mgmt/log_sync.h"
#include "mgmt/mdc_main.h"
#include "runtime/logging.h"
#include "tests/support/hand_session.h"
#include "tests/support/log_lines.h"
#include "tests/support/owners.h"

namespace {

using binding_owner = owner<bn_binding, bn_binding_free>;
using bindings_owner = owner<bn_binding_array, bn_binding_array_free>;
using response_owner = owner<bn_response_msg, bn_response_msg_free>;
using string_owner = owner<tstring, ts_free>;

void add(bn_binding_array *bindings, const char *name, const char *value, uint32_t flags = 0,
         uint32_t type = bn_type_str) {
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, name, bn_attrib_value, type, flags, value), 0);
    ASSERT_EQ(bn_binding_array_append_takeover(bindings, &binding.pointer), 0);
}
std::string value_of(const bn_binding_array *bindings, const char *name) {
    string_owner value;
    if (bn_binding_array_get_value_tstr_by_name(bindings, name, nullptr, &value) != 0 || !value.pointer)
        return "(none)";
    return ts_str(value);
}

// A server that answers queries from an array of bindings, and records the last request.
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
                                         self->code, "message"),
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

TEST(client, requests_and_their_results) {
    server peer;
    add(peer.held, "/a", "one");
    EXPECT_EQ(mdc_init(nullptr, nullptr, nullptr, nullptr, nullptr, &peer.client), LC_NULL);
    binding_owner binding;
    string_owner message;
    uint32_t code = 9, revision = 0;
    ASSERT_EQ(mdc_get_binding(peer.client, &code, &message, 0, &binding, "/a", nullptr), 0);
    EXPECT_STREQ(bn_binding_get_name_quick(binding), "/a");
    EXPECT_EQ(peer.subop, bn_query_get);
    EXPECT_STREQ(ts_str(message), "message");
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
lc_status note(const bn_binding_array *, uint32_t index, bn_binding *, const tstring *, const tstr_array *,
               const tstring *last, const tstring *value, void *data) {
    auto *notes = static_cast<seen *>(data);
    if (index == notes->fail_at)
        return LC_BAD_TYPE;
    notes->texts += std::string(ts_str(last)) + "=" + ts_str(value) + ";";
    return LC_OK;
}

TEST(client, foreach_counts_successful_calls) {
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

} // namespace

#define ENTRY "/mgmtd/notification/dbchange/1"
namespace {

void add_change(bn_binding_array *bindings, const char *type, const char *before, const char *after) {
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
        add(bindings, ENTRY, "again");
        ASSERT_EQ(mdc_event_config_change_notif_extract(bindings, &before, &after), change.status);
        ASSERT_EQ(before.pointer == nullptr, change.status != 0);
        ASSERT_EQ(after.pointer == nullptr, change.status != 0);
        if (change.status)
            continue;
        EXPECT_EQ(value_of(before, "/n"), change.old_value);
        EXPECT_EQ(value_of(after, "/n"), change.new_value);
        EXPECT_LE(bn_binding_array_length_quick(after), 1u);
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

// ---- Monitoring queries

using strings = std::vector<std::string>;

// The daemon's side of a query, which records what it is asked for, and the session that gets the answer.
struct monitored {
    hand_session with;
    owner<bn_request_msg, bn_request_msg_free> request;
    strings asked;
    lc_status failure = 0;
    std::string value = "v";

    monitored() {
        EXPECT_TRUE(with.open());
        EXPECT_EQ(bn_query_request_msg_create(&request, 0, nullptr), 0);
    }
    void add_node(const std::string &name, uint32_t subop, uint32_t flags = 0, uint32_t mask_type = 0) {
        binding_owner with_mask;
        ASSERT_EQ(bn_binding_new_named(&with_mask, "x"), 0);
        if (mask_type) {
            ASSERT_EQ(bn_binding_set_str(with_mask, bn_attrib_capability_mask, mask_type, 0, "1"), 0);
        }
        ASSERT_EQ(bn_query_request_msg_append_with_attribs(request, subop, flags, name.c_str(),
                                                           with_mask->attributes, nullptr),
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
        owner<tbuffer, tb_free> buffer;
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
    const struct {
        const char *name;
        uint32_t subop, flags;
        strings asked; // "?": asked for the children
    } cases[] = {
        {"/a/1/b", get, 0, {"/a/1/b"}},
        {"/other", get, 0, {"/other"}},
        {"/other", walk, tree | self, {}},
        {"/a/*", walk, 0, {"?/a", "/a/1", "/a/2"}},
        {"/a", walk, 0, {"?/a", "/a/1", "/a/2"}}, // only the direct children
        {"/a/1", walk, 0, {"/a/1/b"}},
        {"/a/1", walk, self, {"/a/1", "/a/1/b"}},
        {"/a/1/c", walk, 0, {"?/a/1/c", "/a/1/c/1", "/a/1/c/2"}},
        {"/a/1", walk, tree, {"/a/1/b", "?/a/1/c", "/a/1/c/1", "/a/1/c/2"}},
        {"/a/1", walk, tree | self | leaves, {"/a/1/b", "?/a/1/c", "/a/1/c/1", "/a/1/c/2"}},
        {"/a/1", walk, tree | bn_qf_walk_only, {"?/a/1/c"}},
        {"/s", walk, 0, {"/s/x"}},
        {"/s", walk, tree, {"/s/x", "/s/x/y"}},
        {"/s", walk, tree | leaves, {"/s/x/y"}},
        {"/s/x/y", walk, 0, {}},
        {"/s/x/y", walk, self, {"/s/x/y"}},
        {"/", walk, 0, {}}, // no registered child
    };
    for (const auto &row : cases) {
        SCOPED_TRACE(std::string(row.name) + " " + std::to_string(row.flags));
        monitored daemon;
        daemon.add_node(row.name, row.subop, row.flags); // the query comes before the registrations
        daemon.add_registered({"/a/*", "/a/*/b", "/a/*/c/*", "/s/x", "/s/x", "/s/x/y"});
        ASSERT_EQ(daemon.dispatch(), 0);
        EXPECT_EQ(daemon.asked, row.asked);
        strings answered;
        for (const std::string &name : row.asked)
            if (name[0] != '?')
                answered.push_back(name + " 1000");
        EXPECT_EQ(daemon.answer(), answered);
    }
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
    EXPECT_NE(lines.find("Ignoring a registered name of 65 parts, the limit is 64"), std::string::npos);
    EXPECT_NE(
        lines.find("Registered names have more than 4096 parts in all, ignoring /late and what follows"),
        std::string::npos);
    EXPECT_EQ(lines.find("/later"), std::string::npos);
    EXPECT_NE(lines.find("Unexpected query subop 0; ignoring request for binding /odd"), std::string::npos);

    for (const lc_status status : {LC_NULL, LC_ASSERTION, LC_BAD_TYPE}) { // and no answer is sent
        monitored failing;
        if (status == LC_NULL)
            failing.add_node("/a", bn_query_registration_info);
        else if (status == LC_ASSERTION)
            failing.add_node("/a", bn_query_registration_info, 0, bn_type_str);
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

} // namespace

#define MESSAGES "/logging/syslog/action/file/\\/var\\/log\\/messages/facility/"

namespace {

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
    EXPECT_EQ(lc_log_get_facility(odd.client, "wccpd"), 136); // no such node
    add(odd.held, "/logging/syslog/facility/system", "160", 0, bn_type_uint32);
    EXPECT_EQ(lc_log_get_facility(odd.client, "wccpd"), 160);
}

// Each change meets the system level "warning" and a system-wide override without a level of the class.
TEST(client, log_levels_on_change) {
    constexpr const char *PROCESS = "/logging/syslog/process/wccpd/log_level",
                         *SYSTEM = MESSAGES "all/min_priority", *OVERRIDE = MESSAGES "override/enable",
                         *CLASS = MESSAGES "single/local0/min_priority";
    constexpr const char *deleted = nullptr;
    const struct {
        std::vector<std::pair<const char *, const char *>> changes;
        int32_t daemon_level, level;
        const char *line;
        lc_status status = LC_OK;
    } cases[] = {
        {{{"/qv/wccpd/other", "x"}}, LC_LOG_DEBUG, LC_LOG_WARNING, ""},
        {{{PROCESS, "info"}, {SYSTEM, "err"}}, LC_LOG_INFO, LC_LOG_WARNING, "Process log_level='info'"},
        {{{PROCESS, "loud"}, {SYSTEM, "err"}}, LC_LOG_DEBUG, LC_LOG_WARNING, "", LC_BAD_TYPE},
        {{{PROCESS, ""}, {SYSTEM, "info"}, {OVERRIDE, "false"}}, -1, LC_LOG_INFO, "level is set to \"info\""},
        {{{PROCESS, deleted}, {SYSTEM, "info"}}, -1, LC_LOG_INFO, "level is set to \"info\""},
        {{{SYSTEM, ""}, {CLASS, "debug"}},
         LC_LOG_DEBUG,
         LC_LOG_DEBUG,
         "override is enabled, log level is \"debug\""},
        {{{SYSTEM, deleted}, {OVERRIDE, "false"}}, LC_LOG_DEBUG, LC_LOG_WARNING, "override is disabled"},
        {{{OVERRIDE, "false"}, {CLASS, "debug"}},
         LC_LOG_DEBUG,
         LC_LOG_WARNING,
         "system-wide override is disabled"},
        {{{CLASS, "info"}},
         LC_LOG_DEBUG,
         LC_LOG_INFO,
         "per-class local0 override is enabled, log level is \"info\""},
        {{{CLASS, ""}}, LC_LOG_DEBUG, LC_LOG_WARNING, "per-class local0 override is disabled"},
    };
    log_lines log;
    EXPECT_EQ(qv_handle_log_level_change(nullptr), 0);
    for (const auto &each : cases) {
        SCOPED_TRACE(each.changes[0].first + std::string(" = ") +
                     (each.changes[0].second ? each.changes[0].second : "(deleted)"));
        ASSERT_EQ(lc_log_set_daemon_log_level(LC_LOG_DEBUG), 0);
        ASSERT_EQ(lc_log_set_max_log_level("warning"), 0);
        ASSERT_EQ(lc_log_enable_override_log_level(0, 0), 0);
        ASSERT_EQ(lc_log_enable_override_log_level(1, 1), 0);
        bindings_owner bindings;
        ASSERT_EQ(bn_binding_array_new(&bindings), 0);
        for (const auto &[name, value] : each.changes)
            add(bindings, name, value, value ? 0 : bn_flag_deleted | bn_flag_absent,
                name == OVERRIDE ? bn_type_bool : bn_type_str);
        EXPECT_EQ(qv_handle_log_level_change(bindings), each.status);
        EXPECT_EQ(lc_log_get_daemon_log_level(), each.daemon_level);
        EXPECT_EQ(G_log_level, each.level);
        const std::string lines = log.take();
        EXPECT_NE(lines.find(each.line), std::string::npos) << lines;
        EXPECT_EQ(lines.find(".ERR]"), std::string::npos) << lines;
    }
    EXPECT_EQ(lc_log_set_daemon_log_level(LC_LOG_DEBUG), 0);
    EXPECT_EQ(qv_handle_time_zone_change("/other"), LC_NOT_FOUND);
    EXPECT_EQ(qv_handle_time_zone_change("/time/notify/zonechange"), 0);
    EXPECT_NE(log.take().find("Time zone change handled OK"), std::string::npos);
}

} // namespace
