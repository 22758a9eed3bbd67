// What mgmtctl knows about nodes beyond their names: which nodes can exist, the effect of a change of one on
// a running group, and which name somebody may have meant.
#pragma once

#include <functional>
#include <set>
#include <string>
#include <vector>

#include "peers/mgmtctl/session.h"
#include "peers/nodes/schema.h"

// A query of the session, so that a test can answer it. False: no answer.
using ctl_ask = std::function<bool(ctl_walk walk, const std::string &name, ctl_reply *out)>;

// Advice for somebody who asked for a node that does not exist, or wanted to change one that cannot be
// changed. May be empty.
std::string hint_for_missing(const ctl_ask &ask, const std::string &name);
std::string hint_for_unchangeable(const ctl_ask &ask, const std::string &name);
// The completions of a word that has been begun: node names up to their next part, or NAME=VALUE.
std::vector<std::string> complete_node_name(const ctl_ask &ask, const std::string &word);

// A walk. When its answer is larger than a message, it is asked for again in pieces, each below one of the
// next parts of the name: group by group in the end. False: no answer.
bool query_walk(const ctl_ask &ask, ctl_walk how, const node_name &root, ctl_reply *out);
// wccpd answers for the appliances of a group by number only: the nodes "ipaddr" and "weight" of the first
// `count` below `list` (".../51/appliance"), in their order, are appended to `inout`. False: no answer.
constexpr unsigned long APPLIANCES_MAX = 32; // of a group
bool query_appliances(const ctl_ask &ask, const std::string &list, unsigned long count,
                      std::vector<ctl_binding> *inout);
// A walk of wccpd's states leaves out the appliances of a group, because they are asked for by number. This
// asks for them, and inserts them where they belong. False: no answer.
bool add_appliances(const ctl_ask &ask, const std::string &root, std::vector<ctl_binding> *inout);

// NAME VALUE, or NAME=VALUE..., as items of one commit. Returns "", or the error.
std::string parse_assignments(const std::vector<std::string> &words, ctl_change change,
                              std::vector<ctl_change_item> *out);

// A value of the node as mgmtd keeps it ("0x0a" as "10"); unchanged when mgmtd would refuse it.
std::string kept_value(const std::string &name, const std::string &value);

// Groups as they were before a commit, and the notes that follow from it.
struct groups_before {
    std::set<std::string> roots;       // of groups
    std::vector<ctl_binding> bindings; // of the nodes that are changed
};
bool look_before(const ctl_ask &ask, const std::vector<ctl_change_item> &items, groups_before *out);
struct change_notes {
    std::vector<std::string> created; // roots of groups that are new
    std::vector<std::string> notes;
};
change_notes notes_of(const std::vector<ctl_change_item> &items, const groups_before &before);
// The note for a change that a running group follows only after a restart.
std::string at_start_note(const std::string &words, const std::string &group);
