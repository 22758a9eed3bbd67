// A command reads the present configuration, makes one commit, and asks whether tunneld is running to follow
// it. An intercept without a matching group is useless: it is made all the same, with a note, because the
// group may be added later.
#include "peers/mgmtctl/intercepts.h"

#include <chrono>
#include <map>
#include <optional>
#include <thread>

#include "mgmt/node_paths.h"
#include "mgmt/protocol_names.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/intercept_words.h"
#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/show_model.h"
#include "peers/nodes/value_lists.h"
#include "runtime/common.h"

namespace {
traffic_result with_failure(traffic_result result, int exit, const std::string &error, uint32_t code = 0) {
    result.exit = exit;
    result.error = error;
    result.code = code;
    result.done.clear();
    return result;
}

bool ask_mgmtd(const ctl_link &link, ctl_walk walk, const std::string &name, ctl_reply *out,
               traffic_result *inout) {
    std::string reason;
    *out = {};
    if (!link.query(walk, name, out, &reason))
        *inout = with_failure(*inout, CTL_UNREACHABLE, reason);
    else if (out->code != 0)
        *inout = with_failure(*inout, CTL_REFUSED, out->message, out->code);
    return inout->exit == CTL_OK;
}
} // namespace

// The node and the nodes below it, by their names below it; "" is the node itself.
using node_texts = std::map<std::string, std::string>;

namespace {
bool read_nodes(const ctl_link &link, const std::string &root, node_texts *out, traffic_result *inout) {
    ctl_reply reply;
    if (!ask_mgmtd(link, ctl_walk::subtree, root, &reply, inout))
        return false;
    for (const ctl_binding &binding : reply.bindings)
        if (binding.name == root || binding.name.starts_with(root + "/"))
            (*out)[binding.name == root ? "" : binding.name.substr(root.size() + 1)] = binding.value;
    return true;
}

// Finds out whether tunneld is running. One that has just been started gets time to open its session.
void look_for_tunneld(const ctl_link &link, traffic_result *inout) {
    using clock = std::chrono::steady_clock;
    const auto until = clock::now() + std::chrono::milliseconds(link.session_ms);
    for (;;) {
        ctl_reply reply;
        std::string reason;
        if (!link.query(ctl_walk::node, NODE_PLANE_STATE "/name", &reply, &reason))
            return; // the change has been made in any case
        inout->tunneld = reply.code == LC_IO_TIMED_OUT                   ? "silent"
                         : reply.code != LC_OK || reply.bindings.empty() ? "absent"
                                                                         : "running";
        if (inout->tunneld != "absent" || clock::now() >= until)
            return;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
}

void commit_items(const ctl_link &link, const std::vector<ctl_change_item> &items, const char *done,
                  traffic_result *inout) {
    ctl_reply reply;
    std::string reason;
    if (items.empty())
        inout->done = "unchanged";
    else if (!link.set(items, &reply, &reason))
        *inout = with_failure(*inout, CTL_UNREACHABLE, reason);
    else if (reply.code != 0)
        *inout = with_failure(*inout, CTL_REFUSED, reply.message, reply.code);
    else
        inout->done = done;
    if (inout->exit != CTL_OK)
        return;
    look_for_tunneld(link, inout);
}

void delete_root(const ctl_link &link, const std::string &root, const char *done, const std::string &missing,
                 traffic_result *inout) {
    commit_items(link, {{ctl_change::remove, {root, "", ""}}}, done, inout);
    if (inout->code == LC_NOT_FOUND)
        *inout = with_failure(*inout, CTL_NOT_FOUND, missing, inout->code);
}

// The nodes that differ, or all of something new.
std::vector<ctl_change_item> change_items(const std::string &root, const intercept_wish &wish,
                                          const node_texts &before) {
    std::vector<ctl_change_item> items;
    // The entry itself. It may be all there is, for example of an accepted source without a router.
    if (before.empty())
        items.push_back({ctl_change::create, {root, "", ""}});
    for (const auto &[node, value] : wish) {
        const std::string name = std::string(root).append("/").append(node);
        const schema_row *row = find_schema_row(parsed_name(name));
        const auto old = before.find(node);
        const auto fallback = row && row->fallback ? std::optional<std::string>(row->fallback) : std::nullopt;
        const auto present_value = old != before.end() ? std::optional(old->second) : fallback;
        const auto wanted = value ? std::optional(kept_value(name, *value)) : fallback;
        if (wanted == present_value)
            continue;
        if (value)
            items.push_back({ctl_change::create, {name, "", *wanted}});
        else
            items.push_back({ctl_change::reset, {name, "", ""}});
    }
    return items;
}

// --- Intercepts

int protocol_number(const std::string &text) {
    const bool digits = !text.empty() && text.size() < 4 && text.find_first_not_of("0123456789") == text.npos;
    return digits ? std::stoi(text) : ip_protocol_by_name(text.c_str());
}

// A group may have its protocol as a number; people know it by name.
std::string protocol_word(const std::string &text) {
    for (const char *word : {"tcp", "udp"})
        if (protocol_number(text) == ip_protocol_by_name(word))
            return word;
    return "protocol " + text;
}

// mgmtd accepts an intercept without a matching group, but it gets no packets.
std::string misfit_note(const ctl_link &link, const std::string &number, const std::string &protocol) {
    traffic_result unused;
    node_texts group;
    if (!read_nodes(link, std::string(NODE_GROUP_CONFIG "/") + number, &group, &unused))
        return "";
    if (group.empty())
        return "there is no group " + number + "; the intercept has no effect until the group exists";
    // A protocol that is not set is TCP, for the group as for the intercept.
    const std::string redirected = group.contains("protocol") ? group["protocol"] : "tcp";
    if (protocol_number(redirected) == protocol_number(protocol))
        return "";
    return "group " + number + " redirects " + protocol_word(redirected) + ", and an intercept of " +
           protocol + " gets none of that";
}
} // namespace

bool parse_group_number(const std::string &text, std::string *out) {
    if (text.empty() || text.size() > 6 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = std::to_string(std::stol(text));
    return true;
}

namespace {
void set_intercept(const ctl_link &link, const std::string &root, bool fresh, const intercept_wish &wish,
                   traffic_result *inout) {
    node_texts before;
    if (!read_nodes(link, root, &before, inout))
        return;
    // `add` needs a new one, `set` an existing one.
    if (fresh != before.empty()) {
        *inout =
            fresh ? with_failure(*inout, CTL_REFUSED,
                                 "there is an intercept for group " + inout->subject +
                                     "; \"mgmtctl intercept set\" changes it")
                  : with_failure(*inout, CTL_NOT_FOUND, "there is no intercept for group " + inout->subject);
        return;
    }
    commit_items(link, change_items(root, wish, before), fresh ? "added" : "changed", inout);
    if (inout->exit != CTL_OK)
        return;
    std::string protocol = before.contains("protocol") ? before["protocol"] : "tcp";
    if (const auto wanted = wish.find("protocol"); wanted != wish.end())
        protocol = wanted->second.value_or("tcp");
    inout->note = misfit_note(link, inout->subject, protocol);
}
} // namespace

traffic_result intercept_command(const ctl_link &link, const std::vector<std::string> &words) {
    static const char *const USAGE =
        "intercept add GROUP {port N[-M] ... | all} to PORT [CLAUSE ...], intercept set GROUP CLAUSE ..., "
        "intercept delete GROUP, intercept show [GROUP]; \"intercept words\" lists the clauses";
    traffic_result result;
    result.kind = "intercept";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "set" && verb != "delete")
        return with_failure(result, CTL_USAGE,
                            verb.empty() || verb == "show" || verb == "words"
                                ? USAGE
                                : unknown_word_text(verb, {"add", "set", "delete", "show", "words"}));
    std::string number;
    if (words.size() < 2 || !parse_group_number(words[1], &number) ||
        (verb == "delete") != (words.size() == 2))
        return with_failure(result, CTL_USAGE, USAGE);
    result.subject = number;
    intercept_wish wish;
    if (const std::string wrong = parse_intercept_wish(words, &wish); !wrong.empty())
        return with_failure(result, CTL_USAGE, wrong);
    if (verb == "add" && (!wish.contains("ports") || !wish.contains("to")))
        return with_failure(result, CTL_USAGE,
                            wish.contains("ports")
                                ? "\"to\" is missing: the port that the proxy listens on"
                                : "\"port\" or \"all\" is missing: the ports that the proxy wants");
    const std::string root = NODE_INTERCEPT_CONFIG "/" + result.subject;
    if (verb == "delete")
        delete_root(link, root, "deleted", "there is no intercept for group " + result.subject, &result);
    else
        set_intercept(link, root, verb == "add", wish, &result);
    return result;
}

// --- Bypasses

namespace {
std::string instance_name(const char *above, const std::string &part) {
    return parsed_name(above).below(part).text();
}
} // namespace

traffic_result bypass_command(const ctl_link &link, const std::vector<std::string> &words, int64_t now) {
    static const char *const USAGE = "bypass add PREFIX [for SECONDS], bypass delete PREFIX, bypass show";
    traffic_result result;
    result.kind = "bypass";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "add" && verb != "delete")
        return with_failure(
            result, CTL_USAGE,
            verb.empty() || verb == "show" ? USAGE : unknown_word_text(verb, {"add", "delete", "show"}));
    if (words.size() != 2 && (verb == "delete" || words.size() != 4))
        return with_failure(result, CTL_USAGE, USAGE);
    // A single host.
    result.subject = words[1].find('/') == std::string::npos ? words[1] + "/32" : words[1];
    if (const char *wrong = check_prefix(&result.subject))
        return with_failure(result, CTL_USAGE, wrong); // printed after the kind and the subject
    const std::string root = instance_name(NODE_BYPASS_CONFIG, result.subject);
    if (verb == "delete") {
        delete_root(link, root, "deleted", "there is no such bypass", &result);
        return result;
    }
    int64_t until = 0;
    if (words.size() == 4) {
        if (words[2] != "for")
            return with_failure(result, CTL_USAGE, unknown_word_text(words[2], {"for"}));
        const int64_t seconds = number_of<int64_t>(words[3], 0);
        // Written back and compared: signs, leading zeros and trailing letters are refused. The node has 32
        // bits.
        if (std::to_string(seconds) != words[3] || seconds < 1 || now + seconds > UINT32_MAX)
            return with_failure(result, CTL_USAGE, "\"for\" needs a number of seconds");
        until = now + seconds;
    }
    node_texts before;
    if (!read_nodes(link, root, &before, &result))
        return result;
    commit_items(link, change_items(root, {{"until", std::to_string(until)}}, before),
                 before.empty() ? "added" : "changed", &result);
    return result;
}

// --- Further sources of tunnels

traffic_result tunnel_command(const ctl_link &link, const std::vector<std::string> &words) {
    static const char *const USAGE =
        "tunnel accept ADDRESS [router ADDRESS], tunnel refuse ADDRESS, tunnel show";
    traffic_result result;
    result.kind = "source";
    const std::string verb = words.empty() ? "" : words[0];
    if (verb != "accept" && verb != "refuse")
        return with_failure(
            result, CTL_USAGE,
            verb.empty() || verb == "show" ? USAGE : unknown_word_text(verb, {"accept", "refuse", "show"}));
    if (words.size() != 2 && (verb == "refuse" || words.size() != 4))
        return with_failure(result, CTL_USAGE, USAGE);
    if (words.size() == 4 && words[2] != "router")
        return with_failure(result, CTL_USAGE, unknown_word_text(words[2], {"router"}));
    std::string address = words[1];
    if (const char *wrong = check_host_address(&address))
        return with_failure(result, CTL_USAGE, "\"" + words[1] + "\" " + wrong);
    result.subject = address;
    const std::string root = instance_name(NODE_ACCEPT_CONFIG, address);
    if (verb == "refuse") {
        delete_root(link, root, "refused", "is not an accepted source", &result);
        return result;
    }
    node_texts before;
    if (!read_nodes(link, root, &before, &result))
        return result;
    const std::optional<std::string> router = words.size() == 4 ? std::optional(words[3]) : std::nullopt;
    commit_items(link, change_items(root, {{"router", router}}, before),
                 before.empty() ? "accepted" : "changed", &result);
    return result;
}

// --- Protection of flows

traffic_result protection_command(const ctl_link &link, const std::vector<std::string> &words) {
    traffic_result result;
    result.kind = "protection";
    if (words[0] != "time")
        return with_failure(result, CTL_USAGE, unknown_word_text(words[0], {"time"}));
    const int64_t seconds = words.size() == 2 ? number_of<int64_t>(words[1], -1) : -1;
    if (seconds < 0 || std::to_string(seconds) != words[1])
        return with_failure(result, CTL_USAGE, "protection [time SECONDS]; 0 switches it off");
    result.subject = "time";
    ctl_reply reply;
    if (!ask_mgmtd(link, ctl_walk::node, NODE_PROTECTION_TIME, &reply, &result))
        return result;
    const bool same = !reply.bindings.empty() && reply.bindings[0].value == words[1];
    commit_items(
        link,
        same ? std::vector<ctl_change_item>{}
             : std::vector<ctl_change_item>{{ctl_change::create, {NODE_PROTECTION_TIME, "", words[1]}}},
        "changed", &result);
    return result;
}
