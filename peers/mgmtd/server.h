// The server handles the messages of all sessions and keeps the configuration and the reported states. It
// knows no sockets, child processes or clocks: main.cpp and the transport provide them as functions. One
// thread runs all of it. Times in milliseconds are monotonic.
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
constexpr size_t ALARMS_MAX = 4096; // alarms and roles that are kept
// Limits of what clients can make mgmtd store. Queries that wait for a daemon: of one session, of all
// sessions, and the bytes of the names in them.
constexpr size_t PENDING_SESSION_MAX = 32, PENDING_MAX = 512, PENDING_BYTES_MAX = 8u << 20;
// Partial answers of daemons to walks that are still in progress, of all sessions.
constexpr size_t GATHERED_BYTES_MAX = 32u << 20;
// Of one session.
constexpr size_t INTERESTS_MAX = 64, INTEREST_BYTES_MAX = 64u << 10;

struct interest {
    std::string event;
    std::vector<std::string> patterns; // of changed nodes; empty: all nodes
};
// The user whose process opened a session.
struct peer_owner {
    std::string user = "root";
    bool may_change = true; // false: a viewer, who may only look
};
struct peer {
    std::string name; // of the client and its process: "wccpd-123"
    peer_owner owner = {};
    std::vector<interest> interests;
    uint32_t next_message_id = 1;
    uint64_t first_seen = 0; // rises with each session
};

struct asked_node {
    uint32_t id, subop, flags;
    std::string name;
};
// The part of a query that one daemon answers.
struct daemon_part {
    size_t source;                 // index of the daemon in the table of daemons
    std::vector<asked_node> nodes; // asked for in one request
    std::vector<asked_node> walks; // of all groups: asked for group by group
    bool whole; // the daemon's nodes were asked for by name: without its answer the query fails
};
// A query that waits for a daemon. The nodes that mgmtd answers itself are looked up after the daemon has
// answered, so that their values are not stored meanwhile.
struct pending_query {
    uint32_t asker, provider; // sessions: the client's, the daemon's
    uint32_t asker_message_id, asker_transaction_id;
    int64_t deadline_ms;
    std::vector<asked_node> asked;         // as received from the asker
    std::map<uint32_t, uint32_t> node_ids; // from ids in the forwarded query to ids in the asker's
    size_t bytes;                          // counted against PENDING_BYTES_MAX
    std::vector<daemon_part> parts;        // asked one after the other
    size_t next_part;                      // the part before it is in progress
    uint32_t list_id;                      // node id, in the forwarded query, of the list of groups; 0: none
    std::vector<std::string> groups;       // names from that list
    size_t next_group;
    std::shared_ptr<bn_response_msg> gathered; // answers of daemons so far
    size_t gathered_bytes;                     // of the messages that brought them
};

// A group that tunneld has taken out of its routers. The configuration does not change: wccpd is given "down"
// for the group's admin, everybody else the configured value.
struct left_group {
    uint32_t reporter;   // tunneld's session; 0: it has ended
    int64_t orphaned_ms; // when it ended
};
// A group that announces a part of its weight, as tunneld asks.
struct slowed_group {
    uint32_t percent;
    uint32_t reporter; // as in left_group
    int64_t orphaned_ms;
};
constexpr int64_t LEFT_KEEP_MS = 10000; // that reports of tunneld last without a session of tunneld
// A group that is drained: it leaves its routers once its connections have ended, and stays out until the
// drain is cancelled.
struct drain_request {
    int64_t until_ms;   // then it leaves with the connections that it still has
    bool left = false;  // it has left
    int64_t flows = -1; // connections of the proxy, by tunneld's last report; -1: unknown
};
// A daemon that is restarted this often within this time raises an alarm.
constexpr size_t RESTARTS_MAX = 3;
constexpr int64_t RESTARTS_WITHIN_MS = 300000;
constexpr size_t RESTARTS_KEPT = 100; // the times of a daemon's last restarts
struct restart_watch {
    std::deque<int64_t> at_ms;     // its restarts, within RESTARTS_WITHIN_MS of the last one
    int64_t running_since_ms = -1; // since when it has had a session; -1: it has none
    bool alarm = false;            // the alarm is active
};
// Values that wccpd is given instead of the configured ones.
struct group_overlay {
    bool down = false;
    uint32_t weight_percent = 100;
};

// Who makes a commit, why, and on which conditions.
struct commit_order {
    std::string who;                   // for the log
    std::string user = {}, cause = {}; // for the history
    bool check_only = false;           // only check whether it would be accepted
    uint32_t revision = 0;             // refuse it if the configuration has another revision; 0: any
    uint32_t confirm_minutes = 0;      // undo it unless it is confirmed within this time; 0: it stays
    bool ends_wait = false; // also while another commit waits to be confirmed, which then counts as settled
};

struct server {
    // Whether the queue of the peer has room for this many bytes; null: always.
    std::function<bool(uint32_t peer_id, size_t bytes)> fits;
    // Sends a frame, which begins with 32 bytes of room for its header. The callee takes ownership.
    std::function<void(uint32_t peer_id, uint16_t mtype, tbuffer *frame)> send;
    std::function<int64_t()> now_ms;                  // monotonic
    std::function<void(const std::string &line)> say; // to the log of mgmtd, without a newline
    std::function<int64_t()> clock_s = [] { return static_cast<int64_t>(time(nullptr)); }; // since 1970
    std::function<void(const std::string &name)> opened, closed; // called for each session; may be null
    // Whether the reported end of a process is passed on as an event; null: always.
    std::function<bool(const std::string &process)> is_news;
    std::function<std::vector<local_address>()> local_addresses = find_local_addresses;
    std::string
        facility_file; // from which programs read the log facility at their start; "": none is written

    config_file file;
    node_tree tree;
    config_comments comments;
    history kept;
    int64_t return_at_ms = -1; // when the commit that waits to be confirmed is undone; -1: not computed yet
    node_map state;            // nodes below /qv/alarms/state and /mgmtd/config/state
    std::map<uint32_t, peer> peers;
    std::map<uint32_t, pending_query> pending;    // by the message id of the forwarded query
    size_t pending_bytes = 0, gathered_bytes = 0; // of all pending queries
    std::map<node_name, uint32_t>
        alarm_owners;                    // root nodes of alarms and roles, and the session that reported each
    uint32_t next_query_id = 0x40000000; // of forwarded queries; no other message reaches these ids
    uint64_t peers_seen = 0;
    std::map<uint8_t, left_group> left;
    std::map<uint8_t, slowed_group> slowed;
    std::map<uint8_t, drain_request> drains;
    std::map<std::string, restart_watch> restarts; // by the daemon's name
    bool supervises = false;                       // the supervisor reports restarts; sessions do not count
    int64_t expire_at_ms = 0; // when bypasses are checked next for their time; -1: after the next commit
};

void server_peer_opened(server *self, uint32_t peer_id, const std::string &name,
                        const peer_owner &owner = {});
void server_peer_closed(server *self, uint32_t peer_id);
// Handles a complete frame of protocol 2. False: it could not be read, and the session has to be ended.
bool server_take_frame(server *self, uint32_t peer_id, uint16_t mtype, const tbuffer *frame);
// Does the work that is due: queries that time out, drains, bypasses, unconfirmed commits. Returns the time
// of the next such work, or -1.
int64_t server_tick(server *self);

void server_send_event(server *self, const std::string &event, const std::vector<event_field> &fields);
// Logs and sends an event about a process, EVENT_PROCESS_CRASH and the like.
void server_process_event(server *self, const std::string &event, const std::string &process);
commit_result server_commit(server *self, const std::vector<set_step> &steps, const commit_order &order);

// Reads the configuration file. False with its errors. A file without errors may have warnings. Both are
// lines.
bool server_load(server *self, std::string *out_errors, std::string *out_warnings);
// To be called before the first session, and after the lock against a second mgmtd is held: removes the
// leftovers of an interrupted commit, opens the history, and writes the facility file.
void server_begin(server *self);
// Reads the configuration file again and commits the differences. A file with errors changes nothing.
void server_reload(server *self);

// --- Functions that the source files of the server share

// Replaces the time by an earlier one; -1 is no time.
inline void keep_earlier(int64_t *inout, int64_t at_ms) {
    if (at_ms >= 0 && (*inout < 0 || at_ms < *inout))
        *inout = at_ms;
}
bool server_send_request(server *self, uint32_t peer_id, bn_request_msg *msg);
bool server_send_response(server *self, uint32_t peer_id, bn_response_msg *msg, uint32_t transaction_id);
void server_answer_query(server *self, uint32_t peer_id, bn_request_msg *msg);
// Removes a query from those that wait.
pending_query server_take_pending(server *self, std::map<uint32_t, pending_query>::iterator at);
// Continues a query whose daemon failed to answer.
void server_answer_without(server *self, pending_query query, uint32_t code, const std::string &why);
void server_take_monitor_answer(server *self, uint32_t peer_id, bn_response_msg *msg, size_t bytes);
void server_take_event(server *self, uint32_t peer_id, const std::string &event,
                       const std::vector<event_field> &fields);
void server_forget_reports(server *self, uint32_t peer_id);
// An alarm of mgmtd itself, with the fields of EVENT_RAISE_ALARM. With `is_news` it is reported to watchers;
// without, it is active already and only its text is replaced.
void server_raise_own_alarm(server *self, const std::vector<event_field> &fields, bool is_news);
void server_clear_own_alarm(server *self, const std::vector<event_field> &fields);
node_value server_time_now();
// Removes a node of `state` and all nodes below it.
void server_remove_report(server *self, const node_name &root);

// Processes of the daemons (processes.cpp). To be called when a session has opened or closed.
void server_note_process(server *self, const std::string &session);
// The daemon has answered a query, or has not in time.
void server_note_answer(server *self, const std::string &session, bool answered);
// The process has been started again. `last_end` is how it ended before ("exited with 1"), or empty.
void server_note_restart(server *self, const std::string &process, const std::string &last_end);
int64_t server_clear_restart_alarms(server *self); // gives when to call it again, or -1

// Groups that are out of their routers (left_groups.cpp).
void server_take_leave(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_join(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_proxy_change(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_orphan_left_groups(server *self, uint32_t peer_id);
int64_t server_drop_left_groups(server *self); // gives when to call it again, or -1
bool server_runs_groups(const peer &who);      // a session of wccpd
bool server_is_tunneld(const peer &who);
bool server_has_tunneld(const server *self); // tunneld has a session
// Reads the group of a report. False: the peer is not tunneld, or the number is missing or bad.
bool server_read_reported_group(const server *self, uint32_t peer_id, const std::vector<event_field> &fields,
                                uint8_t *out_group);
void server_forget_deleted_groups(server *self);

// Drains, and groups that announce a part of their weight (drains.cpp). Actions give 0, or a status code with
// the reason in `out_message`.
void server_take_weight(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
void server_take_drain_progress(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
uint32_t server_begin_drain(server *self, const std::vector<event_field> &fields, std::string *out_message);
uint32_t server_cancel_drain(server *self, const std::vector<event_field> &fields, std::string *out_message);
int64_t server_end_drains(server *self); // whose time is over; gives when to call it again, or -1
void server_orphan_weights(server *self, uint32_t peer_id);
void server_forget_deleted_drains(server *self);

// Values that wccpd is given instead of the configured ones (overlays.cpp).
group_overlay server_overlay_of(const server *self, uint8_t group);
node_value server_value_for_wccpd(const server *self, const node_name &name, const node_value &value);
void server_adapt_for_wccpd(const server *self, std::vector<node_change> *inout);
// Sends wccpd the values that differ from those under the overlay `before`.
void server_send_overlay(server *self, uint8_t group, const group_overlay &before);
void server_send_to_wccpd(server *self, const std::vector<node_change> &changes);

// Commits that are kept (kept_commits.cpp).
void server_open_history(server *self);
void server_show_commits(server *self); // updates their nodes in `state`
// The number of nodes that a commit changes, and the first of them; null: none.
struct commit_extent {
    size_t changes = 0;
    const node_name *first = nullptr;
};
// Adds a commit to the history; the configuration file has it already. False with the reason.
bool server_keep(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason);
// Writes the configuration file and adds the commit to the history. False with the reason; nothing has
// changed then.
bool server_save(server *self, const node_tree &next, const config_comments &comments,
                 const commit_order &order, commit_extent extent, std::string *out_reason);
// The reason why no commit is accepted now: another one waits to be confirmed. "" if none waits.
std::string server_wait_for_confirmation(const server *self);
commit_result server_confirm(server *self, const std::string &who);
// Undoes a commit that was not confirmed in time. Returns when to call it again, or -1.
int64_t server_return_unconfirmed(server *self);
// Makes the text of a configuration, for a node that is in no walk. With `hide`, passwords are stars, and
// comments are left out because they may contain passwords. False: no such node.
bool server_config_text(const server *self, const node_name &name, bool hide, node_value *out);
// Makes `next` the configuration and sends the change events.
void server_take_over(server *self, node_tree next, const commit_result &commit);
// Deletes expired bypasses by a commit. Returns when to call it again, or -1.
int64_t server_expire_bypasses(server *self);
