// A snapshot is gathered from wccpd's monitoring nodes, from mgmtd's alarms and roles, and from the
// configuration.
//
// A group costs a walk of its nodes (its texts among them), one of its routers with their appliances, one of
// its configuration, and two queries for each appliance, whose numbers cannot be walked. wccpd answers node
// by node under its engine lock. Therefore, when there are more groups than a screen has room for, each is
// gathered briefly, from six nodes and its reasons, and its share is the one at its first router. The number
// of queries is bounded in any case.
//
// Each answer shows its own moment. A group, router or appliance that is gone by the time it is asked for
// has no nodes and is left out. Once wccpd has not answered, it is not asked again for this snapshot.
#include "peers/mgmtctl/show_gather.h"

#include <algorithm>

#include <arpa/inet.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_texts.h"
#include "runtime/common.h"

namespace {

constexpr size_t ROUTERS_MAX = 64; // of a group, configured ones and others
constexpr size_t REASONS_MAX = 64; // of a group
constexpr size_t PROCESSES_MAX = 8;

struct gathering {
    const snapshot_query &query;
    const snapshot_limits &limits;
    snapshot shown;
    size_t queries = 0;

    // False ends the gathering: there is no answer any more.
    bool ask(ctl_walk walk, const std::string &name, ctl_reply *out) {
        std::string reason;
        queries++;
        *out = {};
        if (query(walk, name, out, &reason))
            return true;
        // Half a snapshot would look like a fault of the appliance. What was gathered so far is dropped.
        shown = {};
        shown.unreachable = reason.empty() ? "no answer" : clean_text(reason, 200);
        return false;
    }
    // The same for wccpd's nodes; they are empty once it has not answered.
    bool ask_wccpd(ctl_walk walk, const std::string &name, ctl_reply *out) {
        *out = {};
        if (shown.wccpd != wccpd_condition::running)
            return true;
        if (!ask(walk, name, out))
            return false;
        // The codes are mgmtd's: wccpd has no session, or has not answered mgmtd in time.
        if (out->code == LC_IO_CLOSED)
            shown.wccpd = wccpd_condition::absent;
        else if (out->code == LC_IO_TIMED_OUT)
            shown.wccpd = wccpd_condition::silent;
        return true;
    }
};

template <typename Subject>
struct node_row {
    const char *node;
    void (*take)(Subject *subject, const std::string &value);
};

template <typename Subject, size_t COUNT>
void take_node(const node_row<Subject> (&rows)[COUNT], const std::string &node, const std::string &value,
               Subject *subject) {
    for (const auto &row : rows)
        if (node == row.node)
            row.take(subject, value);
}

// "GRE" and the like, as words of the configuration; "not set" and "not-set" are none.
std::string method_word(const std::string &value) {
    std::string out = clean_text(value, 16);
    std::transform(out.begin(), out.end(), out.begin(),
                   [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; });
    return out.starts_with("not") ? "" : out;
}

const node_row<snapshot_router> router_rows[] = {
    {"state",
     [](snapshot_router *r, const std::string &v) {
         r->connection = v.starts_with("TWO-WAY")   ? "two-way"
                         : v.starts_with("ONE-WAY") ? "one-way"
                                                    : "unknown";
     }},
    {"fwd_method", [](snapshot_router *r, const std::string &v) { r->forward = method_word(v); }},
    {"assign_method", [](snapshot_router *r, const std::string &v) { r->assign = method_word(v); }},
    {"ret_method", [](snapshot_router *r, const std::string &v) { r->back = method_word(v); }},
    {"id", [](snapshot_router *r, const std::string &v) { r->id = clean_text(v, 15); }},
    {"ipaddr", [](snapshot_router *r, const std::string &v) { r->address = clean_text(v, 15); }},
    {"conn_time",
     [](snapshot_router *r, const std::string &v) { r->connected_ms = number_of<uint64_t>(v, 0); }},
};

const node_row<snapshot_group> group_rows[] = {
    {"oper",
     [](snapshot_group *g, const std::string &v) {
         // "ACTIVE" or "ACTIVE, DESIGNATED"; a group that wccpd does not have has no such node.
         g->running = true;
         g->state = clean_text(v.substr(0, v.find(',')), 16);
         g->designated = v.ends_with(", DESIGNATED");
     }},
    {"uptime", [](snapshot_group *g, const std::string &v) { g->uptime_ms = number_of<uint64_t>(v, 0); }},
    {"since", [](snapshot_group *g, const std::string &v) { g->since_ms = number_of<uint64_t>(v, 0); }},
    {"app_id", [](snapshot_group *g, const std::string &v) { g->address = clean_text(v, 15); }},
    {"num_routers",
     [](snapshot_group *g, const std::string &v) { g->routers_heard = number_of<size_t>(v, 0); }},
};

const node_row<snapshot_group> config_rows[] = {
    {"interface", [](snapshot_group *g, const std::string &v) { g->interface = clean_text(v, 15); }},
    {"admin", [](snapshot_group *g, const std::string &v) { g->admin = clean_text(v, 15); }},
    {"protocol", [](snapshot_group *g, const std::string &v) { g->protocol = clean_text(v, 31); }},
    {"encap", [](snapshot_group *g, const std::string &v) { g->encap = clean_text(v, 15); }},
    {"assign_method", [](snapshot_group *g, const std::string &v) { g->assign_method = clean_text(v, 15); }},
    {"password", [](snapshot_group *g, const std::string &v) { g->authenticated = !v.empty(); }},
    {"weight", [](snapshot_group *g, const std::string &v) { g->weight = number_of<int64_t>(v, -1); }},
    {"priority", [](snapshot_group *g, const std::string &v) { g->priority = number_of<int64_t>(v, -1); }},
    {"policy_grp", [](snapshot_group *g, const std::string &v) { g->policy = number_of<int64_t>(v, -1); }},
};

const node_row<snapshot_reason> reason_rows[] = {
    {"code", [](snapshot_reason *r, const std::string &v) { r->code = clean_text(v, 31); }},
    {"sender",
     [](snapshot_reason *r, const std::string &v) { r->sender = v == "0.0.0.0" ? "" : clean_text(v, 15); }},
    {"source",
     [](snapshot_reason *r, const std::string &v) { r->source = v == "0.0.0.0" ? "" : clean_text(v, 15); }},
    {"offered", [](snapshot_reason *r, const std::string &v) { r->offered = clean_text(v, 63); }},
    {"wanted", [](snapshot_reason *r, const std::string &v) { r->wanted = clean_text(v, 63); }},
    {"count", [](snapshot_reason *r, const std::string &v) { r->count = number_of<uint64_t>(v, 0); }},
    {"first", [](snapshot_reason *r, const std::string &v) { r->first_ms = number_of<int64_t>(v, 0); }},
    {"last", [](snapshot_reason *r, const std::string &v) { r->last_ms = number_of<int64_t>(v, 0); }},
};

// Those below `above`. One that has ended meanwhile has no code, and is left out.
bool gather_reasons(gathering *work, const std::string &above, std::vector<snapshot_reason> *out) {
    ctl_reply reply;
    const std::string root = above + "/reason";
    if (!work->ask_wccpd(ctl_walk::subtree, root, &reply))
        return false;
    std::string number;
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(root, binding.name);
        if (parts.size() != 2)
            continue;
        // The nodes of a reason follow one another: another number begins the next one.
        if (out->empty() || parts[0] != number) {
            if (out->size() >= REASONS_MAX)
                break;
            number = parts[0];
            out->emplace_back();
        }
        take_node(reason_rows, parts[1], binding.value, &out->back());
    }
    std::erase_if(*out, [](const snapshot_reason &each) { return each.code.empty(); });
    return true;
}

std::string group_root(const char *above, int id) {
    return std::string(above) + "/" + std::to_string(id);
}

// What is configured; the addresses of its routers go to `out_routers`.
bool gather_config(gathering *work, snapshot_group *group, std::vector<std::string> *out_routers) {
    ctl_reply reply;
    const std::string root = group_root(NODE_GROUP_CONFIG, group->id);
    if (!work->ask(ctl_walk::subtree, root, &reply))
        return false;
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(root, binding.name);
        if (parts.size() == 1)
            take_node(config_rows, parts[0], binding.value, group);
        // Half of the limit is reserved for routers that wccpd reports and nobody configured.
        else if (parts.size() == 3 && parts[0] == "router" && parts[2] == "ipaddr" &&
                 out_routers->size() < ROUTERS_MAX / 2)
            out_routers->push_back(clean_text(binding.value, 15));
    }
    return true;
}

void take_load(snapshot_group *group, snapshot_router *router, const std::string &address,
               const std::string &value) {
    if (router->loads.size() >= APPLIANCES_MAX)
        return;
    const snapshot_load load = {clean_text(address, 15), number_of<uint32_t>(value, 0)};
    router->loads.push_back(load);
    // The router's list may have more appliances than a group can have here; then only its own record gets
    // the load.
    const int place = place_of_appliance(group, load.appliance);
    if (place < 0)
        return;
    snapshot_appliance *one = &group->appliances[static_cast<size_t>(place)];
    // Before the first report the minimum is 0, which min() would keep.
    one->least_percent = one->reported ? std::min(one->least_percent, load.percent) : load.percent;
    one->most_percent = std::max(one->most_percent, load.percent);
    one->reported = true;
}

uint32_t address_order(const std::string &address) {
    in_addr parsed = {};
    // In host order, because network order would sort by the last byte on a little-endian machine.
    return inet_pton(AF_INET, address.c_str(), &parsed) == 1 ? ntohl(parsed.s_addr) : 0;
}

bool gather_routers(gathering *work, snapshot_group *group, const std::vector<std::string> &configured) {
    ctl_reply reply;
    const std::string root = group_root(NODE_GROUP_STATE, group->id) + "/router";
    if (group->running && !work->ask_wccpd(ctl_walk::subtree, root, &reply))
        return false;
    std::string number;
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(root, binding.name);
        // N/NODE, or N/appliance/ADDRESS/load_dist.
        if (parts.size() != 2 && !(parts.size() == 4 && parts[1] == "appliance"))
            continue;
        if (group->routers.empty() || parts[0] != number) {
            if (group->routers.size() >= ROUTERS_MAX / 2)
                break;
            number = parts[0];
            group->routers.emplace_back();
        }
        if (parts.size() == 2)
            take_node(router_rows, parts[1], binding.value, &group->routers.back());
        else if (parts[3] == "load_dist")
            take_load(group, &group->routers.back(), parts[2], binding.value);
    }
    // wccpd's numbers change when a router is added or removed; a place on the screen shouldn't.
    std::sort(group->routers.begin(), group->routers.end(), [](const auto &a, const auto &b) {
        return address_order(a.address) < address_order(b.address);
    });
    for (const std::string &address : configured) {
        const auto heard =
            std::find_if(group->routers.begin(), group->routers.end(),
                         [&](const snapshot_router &r) { return r.address == address || r.id == address; });
        // A multicast address (224 and above in the first byte) serves to find routers and is not a router
        // itself. It is listed only until a router has answered it.
        if (heard != group->routers.end()) {
            heard->configured = true;
        } else if (const int first = number_of(address, 0); first < 224 || group->routers.empty()) {
            snapshot_router silent;
            silent.address = silent.id = address;
            silent.configured = true;
            silent.connection = work->shown.wccpd == wccpd_condition::running ? "none" : "unknown";
            group->routers.push_back(silent);
        }
    }
    return true;
}

bool gather_weights(gathering *work, snapshot_group *group, uint32_t count) {
    const ctl_ask ask = [work](ctl_walk walk, const std::string &name, ctl_reply *out) {
        return work->ask_wccpd(walk, name, out);
    };
    std::vector<ctl_binding> found;
    if (!query_appliances(ask, group_root(NODE_GROUP_STATE, group->id) + "/appliance", count, &found))
        return false;
    for (size_t i = 0; i + 1 < found.size(); i++) {
        // Normally pairs of address and weight. An appliance that vanished between its two queries leaves one
        // of them; a step of one finds the next pair all the same.
        const ctl_binding &address = found[i], &weight = found[i + 1];
        if (!address.name.ends_with("/ipaddr") || !weight.name.ends_with("/weight") ||
            address.value == "0.0.0.0")
            continue;
        const int place = place_of_appliance(group, clean_text(address.value, 15));
        if (place >= 0)
            group->appliances[static_cast<size_t>(place)].weight = number_of<int64_t>(weight.value, -1);
    }
    return true;
}

// Without the designated appliance's own allotment, the weights determine the shares.
void finish_shares(snapshot_group *group) {
    int64_t sum = 0;
    bool known = !group->appliances.empty();
    for (const snapshot_appliance &one : group->appliances) {
        known = known && one.weight >= 0 && one.asked_percent < 0;
        sum += std::max<int64_t>(one.weight, 0);
    }
    for (snapshot_appliance &one : group->appliances)
        if (known && sum > 0)
            // Rounded to the nearest percent.
            one.asked_percent = static_cast<int>((one.weight * 100 + sum / 2) / sum);
}

// By address: an appliance keeps its letter and its place while others come and go.
void sort_appliances(snapshot_group *group) {
    std::vector<snapshot_appliance> sorted = group->appliances;
    std::sort(sorted.begin(), sorted.end(), [](const auto &a, const auto &b) {
        return address_order(a.address) < address_order(b.address);
    });
    group->appliances.swap(sorted);
    // `sorted` now has the old order, to whose places the tables refer.
    const auto renumber = [&](snapshot_table *table) {
        for (int &owner : table->owners)
            if (owner >= 0)
                owner = place_of_appliance(group, sorted[static_cast<size_t>(owner)].address);
    };
    for (snapshot_table &table : group->tables)
        renumber(&table);
    renumber(&group->wanted);
}

struct group_texts {
    std::string group, assignment;
    uint32_t appliances = 0;
};

void take_group_nodes(const std::string &root, const ctl_reply &reply, snapshot_group *group,
                      group_texts *out) {
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(root, binding.name);
        if (parts.size() != 1)
            continue;
        take_node(group_rows, parts[0], binding.value, group);
        if (parts[0] == "num_appliances")
            out->appliances = number_of<uint32_t>(binding.value, 0);
        else if (parts[0] == "debug")
            out->group = binding.value;
        else if (parts[0] == "assignment")
            out->assignment = binding.value;
    }
}

bool gather_briefly(gathering *work, snapshot_group *group, const std::string &root) {
    ctl_reply reply;
    group_texts unused;
    for (const char *node : {"/oper", "/uptime", "/app_id", "/num_routers"}) {
        if (!work->ask_wccpd(ctl_walk::node, root + node, &reply))
            return false;
        take_group_nodes(root, reply, group, &unused);
    }
    // Without a router there is no share to ask for.
    if (group->routers_heard == 0)
        return true;
    if (!work->ask_wccpd(ctl_walk::node, root + "/router/1/appliance/" + group->address + "/load_dist",
                         &reply))
        return false;
    if (!reply.bindings.empty()) {
        snapshot_router first;
        take_load(group, &first, group->address, reply.bindings[0].value);
    }
    return true;
}

// The number of Here-I-Am sent, if a router does not answer.
bool gather_sent(gathering *work, snapshot_group *group, const std::string &root) {
    ctl_reply reply;
    // The count is of interest only beside a router that gives no answer.
    const bool silent =
        std::any_of(group->routers.begin(), group->routers.end(),
                    [](const snapshot_router &router) { return router.connection == "none"; });
    if (!silent || !group->running)
        return true;
    if (!work->ask_wccpd(ctl_walk::node, root + "/counter/tx_here_i_am", &reply))
        return false;
    if (!reply.bindings.empty())
        group->here_i_ams = number_of<uint64_t>(reply.bindings[0].value, 0);
    return true;
}

// A table is decoded by the agreed method. The table of a router that reports by another method would be
// wrong.
void drop_misread_tables(snapshot_group *group) {
    for (const snapshot_reason &reason : group->reasons)
        if (reason.code == "method-differs" && reason.offered.ends_with(" by the router"))
            for (snapshot_table &table : group->tables)
                std::erase(table.routers, reason.sender);
    std::erase_if(group->tables, [](const snapshot_table &table) { return table.routers.empty(); });
}

bool gather_group(gathering *work, snapshot_group *group, bool in_wccpd) {
    std::vector<std::string> configured;
    if (group->configured && !gather_config(work, group, &configured))
        return false;
    group->routers_configured = configured.size();
    group->interface_set = !group->interface.empty(); // wccpd's text names one in any case
    const std::string root = group_root(NODE_GROUP_STATE, group->id);
    if (work->shown.brief)
        return !in_wccpd ||
               (gather_briefly(work, group, root) && gather_reasons(work, root, &group->reasons));
    ctl_reply reply;
    group_texts texts;
    if (in_wccpd && !work->ask_wccpd(ctl_walk::children, root, &reply))
        return false;
    take_group_nodes(root, reply, group, &texts);
    if (!gather_routers(work, group, configured) || !gather_weights(work, group, texts.appliances) ||
        (in_wccpd && !gather_reasons(work, root, &group->reasons)) || !gather_sent(work, group, root))
        return false;
    // The text has the designated appliance's allotment; finish_shares() fills in what it leaves unknown.
    // Sorting renumbers the owners in all tables, and has to be last.
    take_group_text(texts.group, group);
    take_assignment_text(texts.assignment, group);
    drop_misread_tables(group);
    finish_shares(group);
    sort_appliances(group);
    return true;
}

bool gather_processes(gathering *work) {
    ctl_reply reply;
    if (!work->ask(ctl_walk::subtree, NODE_PROCESSES, &reply))
        return false;
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(NODE_PROCESSES, binding.name);
        if (parts.empty())
            continue;
        auto &processes = work->shown.processes;
        const std::string name = clean_text(parts[0], 15);
        if (processes.size() >= PROCESSES_MAX && !processes.contains(name))
            continue;
        snapshot_process *process = &processes[name];
        if (parts.size() == 1)
            process->running = binding.value == "running";
        else if (parts[1] == "since")
            process->since = clean_text(binding.value, 31);
        else if (parts[1] == "silent_since")
            process->silent_since = clean_text(binding.value, 31);
        else if (parts[1] == "restarts")
            process->restarts = number_of<uint64_t>(binding.value, 0);
    }
    return true;
}

bool gather_alarms(gathering *work) {
    ctl_reply reply;
    if (!work->ask(ctl_walk::subtree, NODE_ALARMS_RAISED, &reply))
        return false;
    const std::vector<ctl_alarm> active_alarms = alarms_of(reply.bindings);
    work->shown.alarms_total = active_alarms.size();
    for (size_t i = 0; i < std::min(active_alarms.size(), work->limits.alarms); i++) {
        const ctl_alarm &from = active_alarms[i];
        // The source of a group's alarm ends with ":grp:" and its number.
        const size_t at = from.source.rfind(":grp:");
        work->shown.alarms.push_back(
            {number_of<long>(from.type, 0), clean_text(from.name, 31), clean_text(from.source, 63),
             clean_text(from.text, 127), clean_text(from.since, 31), clean_text(from.reporter, 63),
             at == std::string::npos ? -1 : number_of(from.source.substr(at + 5), -1)});
    }
    if (!work->ask(ctl_walk::children, NODE_ROLES, &reply))
        return false;
    for (const ctl_binding &binding : reply.bindings) {
        work->shown.roles_active += binding.value == "ACTIVE";
        work->shown.roles_backup += binding.value == "BACKUP";
    }
    return true;
}

bool gather_redirected(gathering *work) {
    traffic_state traffic;
    const auto ask = [work](ctl_walk walk, const std::string &name, ctl_reply *out) {
        return work->ask(walk, name, out);
    };
    if (!gather_traffic(ask, &traffic))
        return false;
    work->shown.traffic = std::move(traffic);
    return true;
}

std::string first_value(const ctl_reply &reply) {
    return reply.bindings.empty() ? "" : clean_text(reply.bindings[0].value, 31);
}

// The ids of the groups below a root, in the order of a walk of its children.
void add_ids(const char *root, const ctl_reply &reply, std::vector<int> *inout) {
    for (const ctl_binding &binding : reply.bindings) {
        const std::vector<std::string> parts = parts_below(root, binding.name);
        const int id = parts.size() == 1 ? number_of(parts[0], -1) : -1;
        if (id >= 0 && id <= 255 && inout->size() < 256)
            inout->push_back(id);
    }
    std::sort(inout->begin(), inout->end());
}

void gather_all(gathering *work) {
    ctl_reply alive, version, mode, states, configs;
    // Assumed until a query fails, because ask_wccpd() asks nothing of a wccpd that is not running.
    work->shown.wccpd = wccpd_condition::running;
    // mgmtd's own nodes come first: they are shown without wccpd as well.
    if (!work->ask(ctl_walk::node, NODE_SYSTEM_MODE, &mode) || !gather_alarms(work) ||
        !gather_redirected(work) || !work->ask(ctl_walk::children, NODE_GROUP_CONFIG, &configs) ||
        !work->ask_wccpd(ctl_walk::node, NODE_WCCPD_STATUS, &alive) ||
        !work->ask_wccpd(ctl_walk::node, NODE_WCCPD_VERSION, &version) ||
        !work->ask_wccpd(ctl_walk::children, NODE_GROUP_STATE, &states) ||
        !gather_reasons(work, NODE_WCCPD_STATE, &work->shown.reasons) || !gather_processes(work))
        return;
    work->shown.mode = first_value(mode);
    work->shown.status = first_value(alive);
    work->shown.version = first_value(version);
    std::vector<int> configured, running, all;
    add_ids(NODE_GROUP_CONFIG, configs, &configured);
    add_ids(NODE_GROUP_STATE, states, &running);
    std::set_union(configured.begin(), configured.end(), running.begin(), running.end(),
                   std::back_inserter(all));
    if (work->limits.only >= 0)
        std::erase_if(all, [&](int id) { return id != work->limits.only; });
    work->shown.groups_total = all.size();
    work->shown.brief = all.size() > work->limits.detailed;
    for (const int id : all) {
        // The groups that are left out are counted in groups_total.
        if (work->queries >= work->limits.queries ||
            (work->shown.brief && work->shown.groups.size() >= work->limits.listed))
            return;
        snapshot_group group;
        group.id = id;
        group.configured = std::binary_search(configured.begin(), configured.end(), id);
        if (!gather_group(work, &group, std::binary_search(running.begin(), running.end(), id)))
            return;
        work->shown.groups.push_back(std::move(group));
    }
}

} // namespace

snapshot gather_snapshot(const snapshot_query &query, const snapshot_limits &limits) {
    gathering work = {query, limits, {}, 0};
    gather_all(&work);
    return std::move(work.shown);
}
