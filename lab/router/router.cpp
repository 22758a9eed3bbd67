// The router's side of the protocol.
//
// Each Here-I-Am is answered with an I-See-You that has the group's next receive id. An appliance enters the
// view once it has echoed a receive id, which shows that both directions work; each further echo keeps it
// alive. After query_after seconds without an echo the router sends a Removal Query, and after drop_after it
// drops the appliance. A shutdown command drops it at once. The change number increases with each change of
// the members of the view and of the routers that they report.
//
// The first appliance in the view defines the service and the methods of the group. One that differs gets
// answers, but does not enter the view. A Redirect-Assign is adopted if it comes from the appliance with the
// lowest address in the view, is of the agreed kind, and has this router's last receive id and change number.
// The receive id before that is valid for a second, because the two messages may have crossed. The adopted
// assignment is part of each I-See-You until it is replaced. Buckets of an appliance that leaves have no
// owner until the next assignment.
#include "lab/router/router.h"

#include <algorithm>

namespace lab {

void count_event(router *self, const std::string &counter) {
    self->counters[counter]++;
}

json event_of(const router &self, const group *in, double now, const char *what) {
    json event;
    event["t"] = now;
    event["router"] = text_of(self.options.self);
    event["what"] = what;
    if (in)
        event["service"] = in->service.id;
    return event;
}

namespace {

constexpr size_t IDS_REMEMBERED = 4;
constexpr double CROSSING_SECONDS = 1;

json describe_methods(const methods &chosen) {
    const char *encapsulation[] = {"none", "gre", "l2", "gre,l2"};
    const char *assign[] = {"none", "hash", "mask", "hash,mask"};
    return {{"forward", encapsulation[chosen.forward & 3]},
            {"assign", assign[chosen.assign & 3]},
            {"return", encapsulation[chosen.giveback & 3]}};
}

// The methods of the group: those of any member in the view other than `except`.
const methods *agreed_methods(const group &in, address except) {
    for (const auto &[id, one] : in.members)
        if (one.usable && id != except)
            return &one.chosen;
    return nullptr;
}

size_t usable_count(const group &in) {
    return static_cast<size_t>(std::count_if(in.members.begin(), in.members.end(),
                                             [](const auto &entry) { return entry.second.usable; }));
}

// --- Outgoing messages

std::vector<address> list_reported_routers(const router &self, const group &in) {
    std::set<address> all = in.listed;
    for (const auto &[id, one] : in.members)
        if (one.usable)
            all.insert(one.routers.begin(), one.routers.end());
    // This router is always the first, and only once.
    all.erase(self.options.self);
    std::vector<address> view = {self.options.self};
    for (const address router : all)
        if (view.size() < MOST_IN_VIEW)
            view.push_back(router);
    return view;
}

} // namespace

void refresh_router_view(router *self, group *in, double now, output *out) {
    std::vector<address> view = list_reported_routers(*self, *in);
    if (view == in->router_view)
        return;
    const bool first = in->router_view.empty();
    in->router_view = std::move(view);
    // The initial view is not a change.
    if (first)
        return;
    in->change_number++;
    json event = event_of(*self, in, now, "router-view");
    for (const address router : in->router_view)
        event["routers"].push_back(text_of(router));
    event["change_number"] = in->change_number;
    out->events.push_back(event);
}

namespace {

size_t count_values(const group &in, address owner) {
    size_t found = 0;
    for (const mask_set &set : in.current.sets)
        found +=
            static_cast<size_t>(std::count_if(set.values.begin(), set.values.end(),
                                              [=](const mask_value &value) { return value.owner == owner; }));
    return found;
}

view_element element_of(const router &self, const group &in, const member &one) {
    view_element element;
    element.id = one.id;
    element.weight = one.weight;
    if (one.chosen.assign == 2) {
        // Routers of the two formats differ in the element of an appliance that gets packets by mask: 16
        // bytes, or the long form with its masks.
        const bool redirected = in.current.by == kind::mask && count_values(in, one.id) > 0;
        element.flags = redirected ? 2 : 3;
        element.is_short = redirected && !self.options.nexus;
        element.mask = in.current.sets.empty() ? one.mask : in.current.sets.front().mask;
    } else if (in.current.by == kind::hash) {
        for (size_t i = 0; i < BUCKETS; i++)
            if (in.current.buckets[i] == one.id)
                element.buckets[i / 8] = static_cast<uint8_t>(element.buckets[i / 8] | 1U << i % 8);
    }
    return element;
}

// The next receive id. It is remembered for all appliances that will receive it.
uint32_t next_receive_id(const router &self, group *in, member *to, address where, double now) {
    const uint32_t id = ++in->receive_id;
    for (auto &[key, one] : in->members) {
        // A multicast message is also received by the other members of the multicast group.
        if (&one != to && !(where == self.options.group && one.by_group))
            continue;
        one.sent_ids.push_back(id);
        one.sent_at = now;
        if (one.sent_ids.size() > IDS_REMEMBERED)
            one.sent_ids.pop_front();
    }
    return id;
}

address reply_address(const router &self, const member &to) {
    return to.by_group && self.options.reply_to_group ? self.options.group : to.source;
}

} // namespace

void send_i_see_you(router *self, group *in, member *to, double now, output *out, uint16_t command) {
    refresh_router_view(self, in, now, out);
    const address where = reply_address(*self, *to);
    i_see_you message;
    message.service = in->service;
    message.router = self->options.self;
    message.receive_id = next_receive_id(*self, in, to, where, now);
    // The destination of the appliance's own message, by which it recognizes the answer.
    message.sent_to = to->by_group ? self->options.group : self->options.self;
    // All appliances that are heard, also those that are not in the view yet: a new one waits to see itself
    // here.
    for (const auto &[id, one] : in->members)
        message.received_from.push_back(id);
    message.change_number = in->change_number;
    message.key = in->current.key;
    message.key_change = in->current.key_change;
    message.routers = in->router_view;
    for (const auto &[id, one] : in->members)
        if (one.usable)
            message.appliances.push_back(element_of(*self, *in, one));
    if (in->current.by == kind::mask)
        message.map = in->current.sets;
    // Without a Capabilities component GRE and hash assignment are meant.
    if (!(self->options.offer == methods{}))
        message.offer = self->options.offer;
    if (command != 0)
        message.command = command_info{command, to->id};

    json event = event_of(*self, in, now, "i-see-you");
    event["to"] = text_of(where);
    event["receive_id"] = message.receive_id;
    event["change_number"] = message.change_number;
    event["key"] = text_of(message.key) + "/" + std::to_string(message.key_change);
    event["routers"] = message.routers.size();
    event["appliances"] = message.appliances.size();

    std::string password = self->options.password;
    std::string fault;
    if (self->fault_left != 0) {
        fault = self->fault;
        // A negative number means every message.
        if (self->fault_left > 0)
            self->fault_left--;
        spoil_message(fault, &message, &password);
        event["fault"] = fault;
        count_event(self, "faults");
    }
    bytes data = write_message(message, password);
    if (!fault.empty())
        spoil_bytes(fault, &data, password);
    event["bytes"] = data.size();
    out->send.push_back({where, std::move(data)});
    out->events.push_back(event);
    count_event(self, "tx_i_see_you");
}

void send_query(router *self, group *in, member *to, double now, output *out) {
    const address where = reply_address(*self, *to);
    removal_query message;
    message.service = in->service;
    message.router = self->options.self;
    message.receive_id = next_receive_id(*self, in, to, where, now);
    message.sent_to = to->by_group ? self->options.group : self->options.self;
    message.target = to->id;
    to->queried = true;
    json event = event_of(*self, in, now, "removal-query");
    event["to"] = text_of(where);
    event["target"] = text_of(to->id);
    event["receive_id"] = message.receive_id;
    out->send.push_back({where, write_message(message, self->options.password)});
    out->events.push_back(event);
    count_event(self, "tx_removal_query");
}

// --- Membership

void drop_member(router *self, group *in, address id, double now, const char *why, output *out) {
    const auto place = in->members.find(id);
    if (place == in->members.end())
        return;
    const bool was_usable = place->second.usable;
    in->members.erase(place);
    // The others never saw it: nothing has changed for them.
    if (!was_usable)
        return;
    for (address &owner : in->current.buckets)
        if (owner == id)
            owner = 0;
    for (mask_set &set : in->current.sets)
        for (mask_value &value : set.values)
            if (value.owner == id)
                value.owner = 0;
    in->change_number++;
    // The next appliance may define another service.
    if (usable_count(*in) == 0) {
        in->current = {};
        in->defined = false;
    }
    json event = event_of(*self, in, now, "left");
    event["appliance"] = text_of(id);
    event["why"] = why;
    event["change_number"] = in->change_number;
    out->events.push_back(event);
    count_event(self, "left");
    refresh_router_view(self, in, now, out);
}

namespace {

// The reason why the appliance may not be in the view with this message; empty if it may.
std::string find_objection(const router &self, const group &in, const service_info &service,
                           const here_i_am &hello) {
    const methods &offer = self.options.offer;
    const methods &chosen = hello.chosen;
    // An appliance chooses exactly one method of each kind.
    if (chosen.forward < 1 || chosen.forward > 2 || !(offer.forward & chosen.forward))
        return "forwarding method not offered";
    if (chosen.assign < 1 || chosen.assign > 2 || !(offer.assign & chosen.assign))
        return "assignment method not offered";
    if (chosen.giveback < 1 || chosen.giveback > 2 || !(offer.giveback & chosen.giveback))
        return "return method not offered";
    const methods *others = agreed_methods(in, hello.id);
    if (others && !(*others == chosen))
        return "methods differ from the group's";
    if (others && in.defined && !(in.service == service))
        return "service differs from the group's";
    const auto known = in.members.find(hello.id);
    const bool in_already = known != in.members.end() && known->second.usable;
    if (!in_already && usable_count(in) >= MOST_IN_VIEW)
        return "the view is full";
    return "";
}

// Whether the Here-I-Am echoes a receive id of this router: "good", "stale" or "none".
const char *check_echo(const router &self, const member &one, const here_i_am &hello) {
    for (const router_mark &mark : hello.routers) {
        if (mark.router != self.options.self)
            continue;
        const bool known =
            std::find(one.sent_ids.begin(), one.sent_ids.end(), mark.receive_id) != one.sent_ids.end();
        return known ? "good" : "stale";
    }
    return "none";
}

const char *accept_hello(router *self, group *in, member *one, const incoming &message, const char *echo,
                         double now, output *out) {
    const here_i_am &hello = message.hello;
    const bool echoed = std::string_view(echo) == "good";
    if (!echoed && !(self->options.join_at_first && !one->usable && std::string_view(echo) == "none"))
        return echo;
    // Before its first echo an appliance has not seen the router's offer, and its methods mean nothing.
    one->refused = echoed ? find_objection(*self, *in, message.service, hello) : "";
    if (!one->refused.empty()) {
        const std::string why = one->refused;
        if (one->usable) {
            // drop_member() erases the record. The appliance stays known, so that it still gets answers.
            const member kept = *one;
            drop_member(self, in, hello.id, now, why.c_str(), out);
            member &again = in->members[hello.id] = kept;
            again.usable = false;
        }
        count_event(self, "refused_appliances");
        return "refused";
    }
    one->heard_at = now;
    one->queried = false;
    one->weight = hello.weight;
    one->mask = hello.mask;
    one->routers.clear();
    for (const router_mark &mark : hello.routers)
        one->routers.push_back(mark.router);
    const bool first = !agreed_methods(*in, hello.id);
    // The only member has changed its methods: its table is of the old kind.
    if (first && one->usable && !(one->chosen == hello.chosen))
        in->current = {};
    one->chosen = hello.chosen;
    if (first) {
        in->service = message.service;
        in->defined = true;
    }
    if (one->usable)
        return "member";
    one->usable = true;
    in->change_number++;
    json event = event_of(*self, in, now, "joined");
    event["appliance"] = text_of(hello.id);
    event["weight"] = hello.weight;
    event["methods"] = describe_methods(hello.chosen);
    event["change_number"] = in->change_number;
    out->events.push_back(event);
    count_event(self, "joined");
    return "joined";
}

void receive_hello(router *self, group *in, const incoming &message, double now, address from, address to,
                   json event, output *out) {
    const here_i_am &hello = message.hello;
    event["appliance"] = text_of(hello.id);
    event["weight"] = hello.weight;
    event["format"] = hello.mask_format ? "mask" : "hash";
    event["methods"] = describe_methods(hello.chosen);
    event["change_number"] = hello.change_number;
    event["routers"] = hello.routers.size();
    event["appliances"] = hello.appliances.size();
    count_event(self, "rx_here_i_am");
    if (hello.id == 0) {
        event["result"] = "refused: no identity";
        out->events.push_back(event);
        count_event(self, "rx_refused");
        return;
    }
    member &one = in->members[hello.id];
    one.id = hello.id;
    one.source = from;
    one.by_group = self->options.group != 0 && to == self->options.group;
    // An appliance outside the view is kept as long as it sends; in the view only echoes count.
    if (!one.usable)
        one.heard_at = now;
    const char *echo = check_echo(*self, one, hello);
    event["echo"] = echo;
    if (hello.command && hello.command->command == COMMAND_SHUTDOWN && hello.command->data == hello.id &&
        one.usable) {
        event["result"] = "shutdown";
        out->events.push_back(event);
        count_event(self, "rx_shutdown");
        // A copy, because the record is erased before the answer is sent.
        member leaving = one;
        drop_member(self, in, hello.id, now, "shutdown", out);
        send_i_see_you(self, in, &leaving, now, out, COMMAND_SHUTDOWN_SEEN);
        return;
    }
    // The message comes first in the log, before the changes that it causes.
    const size_t place = out->events.size();
    const char *result = accept_hello(self, in, &one, message, echo, now, out);
    // `one` may be invalid: accept_hello() drops and adds members.
    member &kept = in->members[hello.id];
    event["result"] = kept.refused.empty() ? std::string(result) : "refused: " + kept.refused;
    out->events.insert(out->events.begin() + static_cast<std::ptrdiff_t>(place), event);
    send_i_see_you(self, in, &kept, now, out, 0);
}

// --- Assignment

std::string judge_assignment(const router &self, const group &in, const redirect_assign &assign, address from,
                             double now) {
    // The key is the address of the designated appliance.
    const auto sender = in.members.find(assign.key);
    if (sender == in.members.end() || !sender->second.usable || sender->second.source != from)
        return "not from a member";
    for (const auto &[id, one] : in.members)
        if (one.usable && id < assign.key)
            return "not from the designated appliance";
    const member &by = sender->second;
    if (by.chosen.assign != (assign.by_mask ? 2U : 1U))
        return "not the agreed kind";
    for (const router_mark &mark : assign.routers) {
        if (mark.router != self.options.self)
            continue;
        const size_t known = by.sent_ids.size();
        const bool newest = known > 0 && by.sent_ids[known - 1] == mark.receive_id;
        const bool crossed =
            known > 1 && by.sent_ids[known - 2] == mark.receive_id && now - by.sent_at < CROSSING_SECONDS;
        if (!newest && !crossed)
            return "stale receive id";
        if (mark.change_number != in.change_number)
            return "stale change number";
        return "";
    }
    return "this router is not named";
}

// `owner`, or 0 if it is not in the view.
address owner_if_usable(const group &in, address owner) {
    const auto place = in.members.find(owner);
    return place != in.members.end() && place->second.usable ? owner : 0;
}

void adopt_assignment(group *in, const redirect_assign &assign) {
    assignment fresh;
    fresh.by = assign.by_mask ? kind::mask : kind::hash;
    fresh.key = assign.key;
    fresh.key_change = assign.key_change;
    if (assign.by_mask) {
        fresh.sets = assign.sets;
        for (mask_set &set : fresh.sets)
            for (mask_value &value : set.values)
                value.owner = owner_if_usable(*in, value.owner);
    } else {
        for (size_t i = 0; i < BUCKETS; i++)
            if (assign.buckets[i] != NO_APPLIANCE)
                // The index was checked when the message was read.
                fresh.buckets[i] = owner_if_usable(*in, assign.appliances[assign.buckets[i]]);
    }
    in->current = std::move(fresh);
}

void receive_assignment(router *self, group *in, const incoming &message, double now, address from,
                        json event, output *out) {
    const redirect_assign &assign = message.assign;
    event["key"] = text_of(assign.key) + "/" + std::to_string(assign.key_change);
    event["kind"] = assign.by_mask ? "mask" : "hash";
    count_event(self, "rx_redirect_assign");
    const std::string wrong = judge_assignment(*self, *in, assign, from, now);
    if (!wrong.empty()) {
        event["result"] = "ignored: " + wrong;
        count_event(self, "ignored_assignments");
        out->events.push_back(event);
        return;
    }
    const bool again = in->current.key == assign.key && in->current.key_change == assign.key_change;
    adopt_assignment(in, assign);
    event["result"] = again ? "adopted again" : "adopted";
    for (const auto &[id, one] : in->members) {
        if (!one.usable)
            continue;
        const size_t share =
            assign.by_mask
                ? count_values(*in, id)
                : static_cast<size_t>(std::count(in->current.buckets.begin(), in->current.buckets.end(), id));
        event["shares"][text_of(id)] = share;
    }
    count_event(self, "adopted_assignments");
    out->events.push_back(event);
}

} // namespace

// --- Interface

void router_receive(router *self, double now, address from, address to, const bytes &data, output *out) {
    if (self->stopped || self->ignored.contains(from)) {
        count_event(self, "rx_unheard");
        return;
    }
    incoming message;
    const std::string wrong = read_message(data, self->options.password, &message);
    const bool hello = message.type == HERE_I_AM;
    json event = event_of(*self, nullptr, now,
                          hello                             ? "here-i-am"
                          : message.type == REDIRECT_ASSIGN ? "redirect-assign"
                                                            : "message");
    event["service"] = message.service.id;
    event["from"] = text_of(from);
    event["bytes"] = data.size();
    const bool wanted = self->options.services.empty() || self->options.services.contains(message.service.id);
    if (!wrong.empty() || !wanted) {
        event["result"] = "refused: " + (wrong.empty() ? std::string("service is not configured") : wrong);
        out->events.push_back(event);
        count_event(self, "rx_refused");
        return;
    }
    group &in = self->groups[message.service.id];
    if (!in.defined)
        in.service = message.service;
    if (hello)
        receive_hello(self, &in, message, now, from, to, event, out);
    else
        receive_assignment(self, &in, message, now, from, event, out);
}

void router_tick(router *self, double now, output *out) {
    if (self->stopped)
        return;
    for (auto &[number, in] : self->groups) {
        std::vector<address> silent;
        for (auto &[id, one] : in.members) {
            const double silence = now - one.heard_at;
            // A member is asked before it is dropped, even if both times have passed in one tick.
            if (silence >= self->options.drop_after && (one.queried || !one.usable))
                silent.push_back(id);
            else if (silence >= self->options.query_after && one.usable && !one.queried)
                send_query(self, &in, &one, now, out);
        }
        // After the loop, which iterates over the members.
        for (const address id : silent)
            drop_member(self, &in, id, now, "silent", out);
    }
}

namespace {

json describe_mask(const mask_fields &mask) {
    return {{"src_ip", mask.src_ip},
            {"dst_ip", mask.dst_ip},
            {"src_port", mask.src_port},
            {"dst_port", mask.dst_port}};
}

json describe_group(const group &in, double now) {
    const char *kinds[] = {"none", "hash", "mask"};
    json state;
    state["service"] = {{"id", in.service.id},
                        {"type", in.service.type},
                        {"priority", in.service.priority},
                        {"protocol", in.service.protocol},
                        {"flags", in.service.flags}};
    state["receive_id"] = in.receive_id;
    state["change_number"] = in.change_number;
    state["routers"] = json::array();
    for (const address router : in.router_view)
        state["routers"].push_back(text_of(router));
    state["appliances"] = json::array();
    const assignment &current = in.current;
    for (const auto &[id, one] : in.members) {
        const auto buckets = std::count(current.buckets.begin(), current.buckets.end(), id);
        json entry = {{"address", text_of(id)},
                      {"usable", one.usable},
                      {"weight", one.weight},
                      {"methods", describe_methods(one.chosen)},
                      {"buckets", buckets},
                      {"values", count_values(in, id)},
                      {"silent_for", now - one.heard_at},
                      {"queried", one.queried}};
        if (!one.refused.empty())
            entry["refused"] = one.refused;
        state["appliances"].push_back(entry);
    }
    json assigned = {{"kind", kinds[static_cast<int>(current.by)]},
                     {"key", text_of(current.key)},
                     {"key_change", current.key_change}};
    if (current.by == kind::hash)
        for (const address owner : current.buckets)
            assigned["buckets"].push_back(owner ? json(text_of(owner)) : json(nullptr));
    for (const mask_set &set : current.sets) {
        json words = {{"mask", describe_mask(set.mask)}, {"values", json::array()}};
        for (const mask_value &value : set.values) {
            json line = describe_mask(value.match);
            line["owner"] = value.owner ? json(text_of(value.owner)) : json(nullptr);
            words["values"].push_back(line);
        }
        assigned["masks"].push_back(words);
    }
    state["assignment"] = assigned;
    return state;
}

} // namespace

json traffic_state(const router &self) {
    const traffic &from = self.traffic;
    json state = {{"routed", from.routed},
                  {"lost", from.lost},
                  {"fragmented", from.fragmented},
                  {"refused_returns", from.refused_returns},
                  {"appliances", json::object()}};
    for (const auto &[who, one] : from.appliances)
        state["appliances"][text_of(who)] = {{"packets", one.packets},
                                             {"bytes", one.bytes},
                                             {"flows", one.flows},
                                             {"returned", one.returned},
                                             {"returned_redirected", one.returned_redirected}};
    return state;
}

json router_state(const router &self, double now) {
    json state;
    state["router"] = text_of(self.options.self);
    state["format"] = self.options.nexus ? "nexus" : "ios";
    state["offer"] = describe_methods(self.options.offer);
    state["stopped"] = self.stopped;
    state["groups"] = json::object();
    for (const auto &[number, in] : self.groups)
        state["groups"][std::to_string(number)] = describe_group(in, now);
    state["counters"] = json::object();
    for (const auto &[name, value] : self.counters)
        state["counters"][name] = value;
    if (self.forwards)
        state["traffic"] = traffic_state(self);
    return state;
}

std::string event_line(const json &event) {
    char time[32];
    snprintf(time, sizeof time, "%9.3f", event.value("t", 0.0));
    std::string line = std::string(time) + " " + event.value("router", "?") + " " + event.value("what", "?");
    for (const auto &[name, value] : event.items())
        if (name != "t" && name != "router" && name != "what")
            line += " " + name + "=" + (value.is_string() ? value.get<std::string>() : value.dump());
    return line;
}

} // namespace lab
