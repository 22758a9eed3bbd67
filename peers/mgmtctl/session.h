// One session of mgmtctl with mgmtd: requests that wait for their answers, and events as they arrive.
#pragma once

#include <csignal>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

// A binding as text: the type is its name ("uint32", "string", "ipv4addr"), the value as a person reads it.
struct ctl_binding {
    std::string name; // "/a/b"; a "/" within a part is written "\/"
    std::string type;
    std::string value;
};

// mgmtd's answer. Code 0 is success; others are status codes (14008: a bad value, ...), with the reason.
struct ctl_reply {
    uint32_t code = 0;
    std::string message;
    std::vector<ctl_binding> bindings;
    uint32_t revision = 0; // of the configuration, in answers to queries and changes
};

struct ctl_event {
    std::string name;
    std::vector<ctl_binding> bindings;
};

enum class ctl_walk { node, children, subtree, leaves };
enum class ctl_change { create, modify, remove, reset };
struct ctl_change_item {
    ctl_change change;
    ctl_binding binding; // removed and reset ones need only the name; a type left empty is sent as a string
};

// Set by the program's handlers of SIGINT, SIGTERM and SIGHUP, 0 until then. Once it is set every wait ends,
// and a request fails with "interrupted".
extern volatile std::sig_atomic_t ctl_stop_signal;

struct ctl_session; // owned by the caller of ctl_open

// Null, with the reason, when mgmtd is not running, refuses, or does not answer in time. No wait of the
// session is longer than `timeout_ms`.
ctl_session *ctl_open(int64_t timeout_ms, std::string *out_reason);
void ctl_close(ctl_session *session);
// For a session that repeats its queries: wccpd logs them at debug level only.
void ctl_query_quietly(ctl_session *session);

// False, with the reason, when there was no answer; the session cannot be used any more.
bool ctl_query(ctl_session *session, ctl_walk walk, const std::string &name, ctl_reply *out,
               std::string *out_reason);
// Several names in one request. Nodes that do not exist are left out of the answer.
bool ctl_query_all(ctl_session *session, ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out,
                   std::string *out_reason);
// How a commit is made.
struct ctl_order {
    std::string cause;            // its purpose, for the history
    bool check_only = false;      // only check whether it would be accepted
    bool ends_wait = false;       // allowed while another commit waits to be confirmed, which it ends
    uint32_t revision = 0;        // refused when the configuration has another one; 0: any
    uint32_t confirm_minutes = 0; // in which it has to be confirmed; 0: it stays
};
bool ctl_set(ctl_session *session, const std::vector<ctl_change_item> &items, const ctl_order &order,
             ctl_reply *out, std::string *out_reason);
// Has mgmtd carry out an action.
bool ctl_action(ctl_session *session, const std::string &name, const std::vector<ctl_binding> &bindings,
                ctl_reply *out, std::string *out_reason);
// Subscribes to an event; with patterns, only when one of its bindings matches one of them.
bool ctl_add_interest(ctl_session *session, const std::string &event,
                      const std::vector<std::string> &patterns, std::string *out_reason);
// Waits for the next event, which may have arrived during a request. 1: here it is; 0: none within `wait_ms`
// (-1: no limit); -1: the session has ended, with the reason. A signal ends the wait with 0, as does
// `other_fd` (-1: none) when it can be read.
int ctl_next_event(ctl_session *session, int64_t wait_ms, ctl_event *out, std::string *out_reason,
                   int other_fd = -1);
