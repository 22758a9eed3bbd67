// What mgmtd does with the messages of its sessions, apart from sockets, processes and the clock.
#pragma once

#include <cstdint>
#include <ctime>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "peers/mgmtd/config_file.h"
#include "peers/mgmtd/history.h"
#include "peers/mgmtd/messages.h"
#include "peers/mgmtd/router_addresses.h"
#include "peers/nodes/node_tree.h"

constexpr int64_t MONITOR_TIMEOUT_MS = 5000;
constexpr size_t ALARMS_MAX = 4096; // that are kept
// What clients can make mgmtd keep for them: queries that wait for a daemon, of one session and of all, and
// the names in these; the interests of one session, and the text in these.
constexpr size_t PENDING_SESSION_MAX = 32, PENDING_MAX = 512, PENDING_BYTES_MAX = 8u << 20;
// What daemons have answered to walks that go on, of all sessions.
constexpr size_t GATHERED_BYTES_MAX = 32u << 20;
constexpr size_t INTERESTS_MAX = 64, INTEREST_BYTES_MAX = 64u << 10;

struct interest {
    std::string event;
    std::vector<std::string> patterns; // of changed nodes; none means all
};
// Whose process a session is of.
struct peer_owner {
    std::string user = "root"; // its name
    bool may_change = true;    // or only look
};
struct peer {
    std::string name; // "wccpd-123"
    peer_owner owner = {};
    std::vector<interest> interests;
    uint32_t next_message_id = 1;
    uint64_t first_seen = 0;
};

struct asked_node {
    uint32_t id, subop, flags;
    std::string name;
};
// What a query asks one daemon for.
struct daemon_part {
    size_t source;                 // the daemon, by its place in the table of daemons
    std::vector<asked_node> nodes; // of the request to the daemon
    std::vector<asked_node> walks; // of all groups, which are asked for one after the other
    bool whole;                    // asked for by name: no answer is a failure
};
// A query that waits for the daemon whose nodes it asks for. What mgmtd answers of it itself is looked up
// when the daemon has answered, and not kept until then.
struct pending_query {
    uint32_t asker, provider;
    uint32_t asker_message_id, asker_transaction_id;
    int64_t deadline_ms;
    std::vector<asked_node> asked;         // as they came
    std::map<uint32_t, uint32_t> node_ids; // of the forwarded query to the asker's
    size_t bytes;                          // that count against PENDING_BYTES_MAX
    std::vector<daemon_part> parts;        // daemons that it asks, one after the other
    size_t next_part;                      // the one before it is under way
    uint32_t list_id;                      // of the forwarded query that lists the groups, or 0
    std::vector<std::string> groups;       // their names
    size_t next_group;
    std::shared_ptr<bn_response_msg> gathered; // what daemons have answered so far
    size_t gathered_bytes;                     // of it in messages
};

// A group that is out of its routers for a time, without a change of the configuration: wccpd is given "down"
// for its admin, everybody else what is configured.
struct left_group {
    uint32_t reporter;   // tunneld's session, 0 when it has ended
    int64_t orphaned_ms; // when it has
};
// A group that announces less than its weight, because tunneld says so.
struct slowed_group {
    uint32_t percent;
    uint32_t reporter; // as of a group that is out of its routers
    int64_t orphaned_ms;
};
constexpr int64_t LEFT_KEEP_MS = 10000; // without a session of tunneld
// A group that an operator wants emptied, so that it can leave its routers without breaking a connection. It
// stays out until the operator says so.
struct drain_request {
    int64_t until_ms; // monotonic; then it leaves, whatever is left
    bool left = false;
    int64_t flows = -1; // that the proxy still has, by tunneld's last report; -1 unknown
};
// A daemon that is restarted this often within this time raises an alarm.
constexpr size_t RESTARTS_MAX = 3;
constexpr int64_t RESTARTS_WITHIN_MS = 300000;
constexpr size_t RESTARTS_KEPT = 100; // the times of a daemon's last restarts
struct restart_watch {
    std::deque<int64_t> at_ms;     // within RESTARTS_WITHIN_MS of the last one
    int64_t running_since_ms = -1; // it has a session since; -1: it has none
    bool alarm = false;            // is active
};
// What wccpd is given instead of what is configured.
struct group_overlay {
    bool down = false;
    uint32_t weight_percent = 100;
};

// Who makes a commit, what for and on which conditions.
struct commit_order {
    std::string who;                   // in lines of the log
    std::string user = {}, cause = {}; // in the history
    bool check_only = false;
    uint32_t revision = 0;        // that it was made for; 0: any
    uint32_t confirm_minutes = 0; // in which it has to be confirmed; 0: it stays
    bool ends_wait = false;       // of another commit for its confirmation; otherwise it is refused
};

struct server {
    // Whether the peer's queue takes so many bytes more; null: always.
    std::function<bool(uint32_t peer_id, size_t bytes)> fits;
    // The frame has 32 bytes of room for its header; it is the callee's.
    std::function<void(uint32_t peer_id, uint16_t mtype, tbuffer *frame)> send;
    std::function<int64_t()> now_ms; // monotonic
    std::function<void(const std::string &line)> say;
    std::function<int64_t()> clock_s = [] { return static_cast<int64_t>(time(nullptr)); }; // since 1970
    std::function<void(const std::string &name)> opened, closed; // each session; null: nobody cares
    // Whether a report of this process's end is passed on; null: it is.
    std::function<bool(const std::string &process)> is_news;
    std::function<std::vector<local_address>()> local_addresses = find_local_addresses;
    std::string facility_file; // where programs read the log facility when they start; "": nowhere

    config_file file;
    node_tree tree;
    config_comments comments;
    history kept;
    int64_t return_at_ms = -1; // when the commit that waits to be confirmed is undone; -1: not known yet
    node_map state;            // nodes that mgmtd itself reports
    std::map<uint32_t, peer> peers;
    std::map<uint32_t, pending_query> pending;    // by the message id of the forwarded query
    size_t pending_bytes = 0, gathered_bytes = 0; // of all pending queries
    std::map<node_name, uint32_t> alarm_owners;   // root nodes of what a session reported
    uint32_t next_query_id = 0x40000000;          // apart from the ids of other messages
    uint64_t peers_seen = 0;
    std::map<uint8_t, left_group> left;
    std::map<uint8_t, slowed_group> slowed;
    std::map<uint8_t, drain_request> drains;
    std::map<std::string, restart_watch> restarts; // by the daemon's name
    bool supervises = false;                       // restarts are reported by the supervisor
    int64_t expire_at_ms = 0; // when bypass entries are looked at again; -1: not before a commit
};

void server_peer_opened(server *self, uint32_t peer_id, const std::string &name,
                        const peer_owner &owner = {});
void server_peer_closed(server *self, uint32_t peer_id);
// A frame of protocol 2, whole. False: it could not be read, and the session ends.
bool server_take_frame(server *self, uint32_t peer_id, uint16_t mtype, const tbuffer *frame);
// Answers the queries whose time is over, and ends what lasts for a time only. Gives the time of the next
// thing to do, or -1.
int64_t server_tick(server *self);

void server_send_event(server *self, const std::string &event, const std::vector<event_field> &fields);
// "/pm/events/..." to whoever asked for it.
void server_process_event(server *self, const std::string &event, const std::string &process);
commit_result server_commit(server *self, const std::vector<set_step> &steps, const commit_order &order);

// Reads the configuration file. False with its errors; what is to be reported of a file that is good all the
// same goes to the warnings. Both are lines.
bool server_load(server *self, std::string *out_errors, std::string *out_warnings);
// Before the first session, once no other mgmtd can use the files: tidies up around the configuration file,
// and writes the facility.
void server_begin(server *self);
// The configuration file is read again and what differs is one commit; a bad file changes nothing.
void server_reload(server *self);

// The parts of it, for each other.
// The earlier of two times, of which -1 is none.
inline void keep_earlier(int64_t *inout, int64_t at_ms) {
    if (at_ms >= 0 && (*inout < 0 || at_ms < *inout))
        *inout = at_ms;
}
bool server_send_request(server *self, uint32_t peer_id, bn_request_msg *msg);
bool server_send_response(server *self, uint32_t peer_id, bn_response_msg *msg, uint32_t transaction_id);
void server_answer_query(server *self, uint32_t peer_id, bn_request_msg *msg);
// Takes a query out of those that wait.
pending_query server_take_pending(server *self, std::map<uint32_t, pending_query>::iterator at);
// The answer to a query that no daemon answers any more.
void server_answer_without(server *self, pending_query query, uint32_t code, const std::string &why);
void server_take_monitor_answer(server *self, uint32_t peer_id, bn_response_msg *msg, size_t bytes);
void server_take_event(server *self, uint32_t peer_id, const std::string &event,
                       const std::vector<event_field> &fields);
void server_forget_reports(server *self, uint32_t peer_id);
// An alarm of mgmtd itself, with the fields of EVENT_RAISE_ALARM. `is_news`: it was not active before, and is
// reported; otherwise only its text is replaced.
void server_raise_own_alarm(server *self, const std::vector<event_field> &fields, bool is_news);
void server_clear_own_alarm(server *self, const std::vector<event_field> &fields);
node_value server_time_now();
// Takes a node of `state` out, with those below it.
void server_remove_report(server *self, const node_name &root);

// The daemons' processes, in processes.cpp. A session has opened or closed:
void server_note_process(server *self, const std::string &session);
// The process has been started again; `last_end` says how it had ended ("exited with 1"), or is empty.
void server_note_restart(server *self, const std::string &process, const std::string &last_end);
int64_t server_clear_restart_alarms(server *self); // the time of the next look, or -1

// Groups that are out of their routers, in left_groups.cpp.
void server_take_leave(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_join(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_proxy_change(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_orphan_left_groups(server *self, uint32_t peer_id);
int64_t server_drop_left_groups(server *self); // the time of the next look, or -1
bool server_runs_groups(const peer &who);      // it is wccpd's
bool server_is_tunneld(const peer &who);
bool server_has_tunneld(const server *self);
// The group that a report of tunneld is about. False: nobody else reports, or there is no number.
bool server_read_reported_group(const server *self, uint32_t peer_id, const std::vector<event_field> &fields,
                                uint8_t *out_group);
void server_forget_deleted_groups(server *self);

// Groups that announce less than their weight, and drains, in drains.cpp. Actions give 0, or a code with the
// reason.
void server_take_weight(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_drain_progress(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
uint32_t server_begin_drain(server *self, const std::vector<event_field> &fields, std::string *out_message);
uint32_t server_cancel_drain(server *self, const std::vector<event_field> &fields, std::string *out_message);
int64_t server_end_drains(server *self); // those whose time is over; the time of the next look, or -1
void server_orphan_weights(server *self, uint32_t peer_id);
void server_forget_deleted_drains(server *self);

// What wccpd is given, in overlays.cpp.
group_overlay server_overlay_of(const server *self, uint8_t group);
node_value server_value_for_wccpd(const server *self, const node_name &name, const node_value &value);
void server_adapt_for_wccpd(const server *self, std::vector<node_change> *inout);
// After a change: wccpd gets the values that differ.
void server_send_overlay(server *self, uint8_t group, const group_overlay &before);
void server_send_to_wccpd(server *self, const std::vector<node_change> &changes);

// Commits that are kept, in kept_commits.cpp.
void server_open_history(server *self);
void server_show_commits(server *self); // as nodes
// What a commit is about, beside who makes it: the number of nodes that it changes, and the first of them.
struct commit_extent {
    size_t changes = 0;
    const node_name *first = nullptr;
};
// Keeps a commit whose configuration is in the file already. False with the reason.
bool server_keep(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason);
// Writes the file and keeps the commit. False with the reason, and nothing is changed.
bool server_save(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason);
// Why there can be no commit while another one waits to be confirmed, or "".
std::string server_wait_for_confirmation(const server *self);
commit_result server_confirm(server *self, const std::string &who);
// A commit that nobody has confirmed in time is undone. Gives the time of the next look, or -1.
int64_t server_return_unconfirmed(server *self);
// The texts of configurations, which are made when they are asked for; with `hide` without passwords, and
// without comments, in which there may be some.
bool server_config_text(const server *self, const node_name &name, bool hide, node_value *out);
// Makes `next` the configuration, and sends what has changed.
void server_take_over(server *self, node_tree next, const commit_result &commit);
// Bypass entries whose time is over are deleted by a commit. Gives the time of the next look, or -1.
int64_t server_expire_bypasses(server *self);
