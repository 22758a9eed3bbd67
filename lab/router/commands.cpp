// The commands of a running router, one row each.
#include "lab/router/router.h"

#include <algorithm>
#include <charconv>

namespace lab {

const char *const ROUTER_COMMANDS =
    "[@ROUTER] COMMAND...   for one router, or for all\n"
    "  show                       the whole state, as JSON\n"
    "  owners SERVICE             owner of each bucket or value, on one line\n"
    "  members SERVICE            a line for each appliance: address, weight, share, seconds since its last "
    "Here-I-Am, queried (0 or 1)\n"
    "  stop | resume              send nothing and ignore everything | continue\n"
    "  ignore ADDRESS | heed ADDRESS     ignore the messages of one appliance | accept them again\n"
    "  forget ADDRESS             drop an appliance at once\n"
    "  query ADDRESS              send a Removal Query\n"
    "  assign SERVICE FIRST LAST ADDRESS|none   change the owner of these buckets or values\n"
    "  list ROUTER | unlist ROUTER       report a router that does not exist\n"
    "  offer FORWARD ASSIGN RETURN       change the offered methods, words as on the command line\n"
    "  nexus | ios                change the format of the views\n"
    "  password [TEXT]            change the password of its messages, or remove it\n"
    "  fault NAME [TIMES|always]  spoil the next I-See-You messages; fault none: stop that\n"
    "  raw HEX [ADDRESS]          send these bytes to all appliances or to one\n"
    "  traffic [reset]            show counters of redirected traffic as JSON; reset them\n"
    "  gre redirect|plain|ip      format of redirected packets: with redirect header, without it, type "
    "0x0800\n";

namespace {

struct command_call {
    router *self;
    double now;
    const std::vector<std::string> &words;
    output *out;
};

const std::string BAD_ADDRESS = "error: not an address";

// Calls `act` for each group that has the appliance of the first argument.
std::string for_appliance(const command_call &call, void (*act)(const command_call &, group *, address)) {
    const auto id = address_of(call.words[1]);
    if (!id)
        return BAD_ADDRESS;
    size_t found = 0;
    for (auto &[number, in] : call.self->groups) {
        if (!in.members.contains(*id))
            continue;
        act(call, &in, *id);
        found++;
    }
    return found ? "ok" : "error: no such appliance";
}

std::string do_forget(const command_call &call) {
    return for_appliance(call, [](const command_call &inner, group *in, address id) {
        drop_member(inner.self, in, id, inner.now, "forgotten", inner.out);
    });
}

std::string do_query(const command_call &call) {
    return for_appliance(call, [](const command_call &inner, group *in, address id) {
        send_query(inner.self, in, &in->members[id], inner.now, inner.out);
        in->members[id].queried = false; // the regular query is still sent
    });
}

std::string do_ignore(const command_call &call) {
    const auto id = address_of(call.words[1]);
    if (!id)
        return BAD_ADDRESS;
    if (call.words[0] == "ignore")
        call.self->ignored.insert(*id);
    else
        call.self->ignored.erase(*id);
    return "ok";
}

std::string do_stop(const command_call &call) {
    call.self->stopped = call.words[0] == "stop";
    return "ok";
}

std::string do_list(const command_call &call) {
    const auto id = address_of(call.words[1]);
    if (!id)
        return BAD_ADDRESS;
    for (auto &[number, in] : call.self->groups) {
        if (call.words[0] == "list")
            in.listed.insert(*id);
        else
            in.listed.erase(*id);
        refresh_router_view(call.self, &in, call.now, call.out);
    }
    return "ok";
}

std::string do_format(const command_call &call) {
    call.self->options.nexus = call.words[0] == "nexus";
    return "ok";
}

std::string do_password(const command_call &call) {
    call.self->options.password = call.words.size() > 1 ? call.words[1] : "";
    return "ok";
}

std::optional<uint32_t> number_of(const std::string &text) {
    uint32_t value = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (error != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

group *find_group(const command_call &call) {
    const auto id = number_of(call.words[1]);
    if (!id || *id > 255)
        return nullptr;
    const auto place = call.self->groups.find(static_cast<uint8_t>(*id));
    return place == call.self->groups.end() ? nullptr : &place->second;
}

std::vector<address *> owners_of(group *in) {
    // In the order of the wire, by which `owners` prints and `assign` counts them. A group has either buckets
    // or values.
    std::vector<address *> owners;
    if (in->current.by == kind::hash)
        for (address &owner : in->current.buckets)
            owners.push_back(&owner);
    for (mask_set &set : in->current.sets)
        for (mask_value &value : set.values)
            owners.push_back(&value.owner);
    return owners;
}

std::string do_owners(const command_call &call) {
    group *in = find_group(call);
    if (!in)
        return "none";
    const char *kinds[] = {"none", "hash", "mask"};
    std::string line = kinds[static_cast<int>(in->current.by)];
    line += " " + text_of(in->current.key) + " " + std::to_string(in->current.key_change);
    for (const address *owner : owners_of(in))
        line += " " + (*owner ? text_of(*owner) : std::string("-"));
    return line;
}

std::string do_members(const command_call &call) {
    group *in = find_group(call);
    std::string lines;
    if (!in)
        return lines;
    const std::vector<address *> owners = owners_of(in);
    for (const auto &[id, one] : in->members) {
        // Appliances outside the view are shown by `show` only.
        if (!one.usable)
            continue;
        const auto share = std::count_if(owners.begin(), owners.end(),
                                         [self = id](const address *owner) { return *owner == self; });
        lines += text_of(id) + " " + std::to_string(one.weight) + " " + std::to_string(share) + " " +
                 std::to_string(static_cast<int>(call.now - one.heard_at)) + (one.queried ? " 1\n" : " 0\n");
    }
    return lines;
}

std::string do_assign(const command_call &call) {
    group *in = find_group(call);
    const auto first = number_of(call.words[2]), last = number_of(call.words[3]);
    const auto owner = call.words[4] == "none" ? std::optional<address>(0) : address_of(call.words[4]);
    if (!in || !first || !last || !owner)
        return "error: assign SERVICE FIRST LAST ADDRESS";
    const auto owners = owners_of(in);
    if (*first > *last || *last >= owners.size())
        return "error: there are " + std::to_string(owners.size()) + " buckets or values";
    for (uint32_t i = *first; i <= *last; i++)
        *owners[i] = *owner;
    return "ok";
}

std::string do_offer(const command_call &call) {
    // "none" or any other word offers no method of that kind.
    methods offer = {0, 0, 0};
    uint32_t *const sets[] = {&offer.forward, &offer.assign, &offer.giveback};
    for (size_t i = 0; i < 3; i++) {
        const std::string &word = call.words[i + 1];
        const bool assign = i == 1;
        if (word.find(assign ? "hash" : "gre") != std::string::npos)
            *sets[i] |= 1;
        if (word.find(assign ? "mask" : "l2") != std::string::npos)
            *sets[i] |= 2;
    }
    call.self->options.offer = offer;
    return "ok";
}

std::string do_fault(const command_call &call) {
    const std::string &name = call.words[1];
    if (name == "none") {
        call.self->fault_left = 0;
        return "ok";
    }
    if (!is_fault(name))
        return "error: faults are " + fault_names();
    const std::string times = call.words.size() > 2 ? call.words[2] : "1";
    const auto number = number_of(times);
    if (times != "always" && (!number || *number > 1000000))
        return "error: not a number of times";
    call.self->fault = name;
    // Only now, so that a refused command leaves the fault before it in place.
    call.self->fault_left = times == "always" ? -1 : static_cast<int>(*number);
    return "ok";
}

std::string do_raw(const command_call &call) {
    bytes data;
    const std::string &hex = call.words[1];
    if (hex.size() % 2 != 0)
        return "error: not hexadecimal";
    for (size_t i = 0; i < hex.size(); i += 2) {
        uint8_t value = 0;
        if (std::from_chars(&hex[i], &hex[i] + 2, value, 16).ptr != &hex[i] + 2)
            return "error: not hexadecimal";
        data.push_back(value);
    }
    std::set<address> to;
    if (call.words.size() > 2) {
        const auto one = address_of(call.words[2]);
        if (!one)
            return BAD_ADDRESS;
        to.insert(*one);
    } else {
        for (const auto &[number, in] : call.self->groups)
            for (const auto &[id, one] : in.members)
                // A set, because an appliance that is in several groups gets the bytes once.
                to.insert(one.source);
    }
    for (const address one : to)
        call.out->send.push_back({one, data});
    return "ok";
}

std::string do_show(const command_call &call) {
    return router_state(*call.self, call.now).dump();
}

std::string do_traffic(const command_call &call) {
    if (call.words.size() == 1)
        return traffic_state(*call.self).dump();
    if (call.words[1] != "reset")
        return "error: traffic [reset]";
    call.self->traffic = {};
    return "ok";
}

std::string do_gre(const command_call &call) {
    if (std::find(std::begin(gre_formats), std::end(gre_formats), call.words[1]) == std::end(gre_formats))
        return "error: gre redirect|plain|ip";
    call.self->options.gre_format = call.words[1];
    return "ok";
}

struct command_row {
    const char *name;
    size_t least, most; // words, including the name
    std::string (*act)(const command_call &call);
};
constexpr command_row COMMANDS[] = {
    {"show", 1, 1, do_show},         {"owners", 2, 2, do_owners}, {"members", 2, 2, do_members},
    {"stop", 1, 1, do_stop},         {"resume", 1, 1, do_stop},   {"ignore", 2, 2, do_ignore},
    {"heed", 2, 2, do_ignore},       {"forget", 2, 2, do_forget}, {"query", 2, 2, do_query},
    {"assign", 5, 5, do_assign},     {"list", 2, 2, do_list},     {"unlist", 2, 2, do_list},
    {"offer", 4, 4, do_offer},       {"nexus", 1, 1, do_format},  {"ios", 1, 1, do_format},
    {"password", 1, 2, do_password}, {"fault", 2, 3, do_fault},   {"raw", 2, 3, do_raw},
    {"traffic", 1, 2, do_traffic},   {"gre", 2, 2, do_gre},
};

} // namespace

std::string router_command(router *self, double now, const std::vector<std::string> &words, output *out) {
    if (words.empty())
        return "error: no command";
    for (const command_row &row : COMMANDS) {
        if (words[0] != row.name)
            continue;
        if (words.size() < row.least || words.size() > row.most)
            return "error: too few or too many arguments";
        return row.act({self, now, words, out});
    }
    return std::string("error: unknown command\n") + ROUTER_COMMANDS;
}

} // namespace lab
