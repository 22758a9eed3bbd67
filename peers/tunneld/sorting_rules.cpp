#include "peers/tunneld/sorting_rules.h"

#include <optional>

#include "peers/tunneld/nft_commands.h"
#include "peers/tunneld/sorting_text.h"

namespace {

std::optional<nft_content> held; // the table's content, if this process has made it

// The declaration of a set or map in the form that sorting_text.cpp writes, up to the types.
std::string declare_left_set(const std::string &kind, const nlohmann::json &body) {
    std::string types;
    // nftables lists a single type as a text, and a concatenation as an array.
    const nlohmann::json type = body.value("type", nlohmann::json());
    for (const nlohmann::json &part : type.is_array() ? type : nlohmann::json::array({type}))
        types += (types.empty() ? "" : " . ") + (part.is_string() ? part.get<std::string>() : "");
    if (body.contains("map") && body["map"].is_string())
        types += " : " + body["map"].get<std::string>();
    return kind + " { type " + types + ";";
}

// False when a set has other types than the wanted one of that name. nftables would take elements of another
// type for host names and look them up.
bool can_be_taken_over(const nft_content &left, const nft_content &wanted) {
    for (const auto &[name, set] : left.sets) {
        const auto at = wanted.sets.find(name);
        if (at != wanted.sets.end() && !at->second.declaration.starts_with(set.declaration))
            return false;
    }
    return !left.empty();
}

// Reads the names in a table that an earlier tunneld has left, or that somebody else has changed.
bool read_left_content(nft_content *out, std::string *out_error) {
    *out = {};
    out->known = false;
    for (const char *what : {"counters", "chains", "sets", "maps"}) {
        nlohmann::json objects;
        if (!list_nft(std::string("list ") + what + " ip", &objects, out_error))
            return false;
        for (const nlohmann::json &object : objects)
            for (const auto &[kind, body] : object.items()) {
                if (!body.is_object() || body.value("table", "") != RULES_TABLE)
                    continue;
                const std::string name = body.value("name", "");
                if (kind == "counter")
                    out->counters.insert(name);
                else if (kind == "chain")
                    out->chains[name] = {};
                else if (kind == "set" || kind == "map")
                    out->sets[name].declaration = declare_left_set(kind, body);
            }
    }
    return true;
}

bool is_table_there() {
    std::string error;
    nlohmann::json objects;
    if (!list_nft("list tables ip", &objects, &error))
        return false;
    for (const nlohmann::json &object : objects)
        if (object.contains("table") && object["table"].value("name", "") == RULES_TABLE)
            return true;
    return false;
}

// Changes the existing table into the wanted one. If that fails, replaces it, and the counters begin at 0.
bool take_table_over(const nft_content &wanted, std::string *out_error) {
    nft_content left;
    if (!read_left_content(&left, out_error))
        return false;
    const std::string create = make_sorting_transaction({}, wanted);
    // Adding a table that exists changes nothing, and deleting one that does not exist would fail.
    const std::string delete_all =
        std::string("add table ip ") + RULES_TABLE + "\ndelete table ip " + RULES_TABLE + "\n";
    if (wanted.empty())
        return run_nft(delete_all, out_error);
    if (can_be_taken_over(left, wanted) && run_nft(make_sorting_transaction(left, wanted), out_error))
        return true;
    return run_nft(delete_all + create, out_error);
}

constexpr const char *SCRATCH = "tunneld_probe";

// Whether the kernel would accept a table with such a chain. Nothing is changed.
bool would_accept(const std::string &hook, const std::string &rule, std::string *out_error) {
    const std::string chain = std::string(" ip ") + SCRATCH + " probe ";
    return check_nft(std::string("add table ip ") + SCRATCH + "\nadd chain" + chain + "{ type filter hook " +
                         hook + " priority -150; }\nadd counter ip " + SCRATCH + " count\nadd rule" + chain +
                         rule + "\n",
                     out_error);
}

} // namespace

bool apply_sorting_rules(const wanted_sorting &wanted, std::string *out_error) {
    nft_content content;
    if (!make_sorting_content(wanted, &content, out_error))
        return false;
    if (held) {
        // Without a change it is still checked whether somebody else has removed the table.
        const std::string change = make_sorting_transaction(*held, content);
        if (change.empty() ? is_table_there() != content.empty() : run_nft(change, out_error)) {
            held = content;
            return true;
        }
        held.reset(); // somebody else may have changed the table
    }
    if (!take_table_over(content, out_error))
        return false;
    held = content;
    return true;
}

bool remove_sorting_rules(std::string *out_error) {
    held.reset();
    const bool removed = take_table_over({}, out_error);
    close_nft();
    return removed;
}

std::string probe_sorting_rules() {
    static constexpr struct {
        const char *what, *hook, *rule;
    } needs[] = {
        {"nftables", "prerouting", "counter name \"count\" accept"},
        {"TPROXY", "prerouting", "meta l4proto tcp tproxy to :1 accept"},
        {"socket matches", "prerouting", "socket transparent 1 socket wildcard 0 accept"},
        {"address type matches", "output", "fib saddr type != local accept"},
        {"TCP option changes", "output", "tcp flags syn tcp option maxseg size set 1000"},
    };
    std::string lacking;
    for (const auto &need : needs) {
        std::string error;
        if (would_accept(need.hook, need.rule, &error))
            continue;
        lacking += (lacking.empty() ? "the kernel lacks " : ", ") + std::string(need.what);
        if (&need == needs) // without nftables, all of the others are missing as well
            return lacking + " (" + error + ")";
    }
    return lacking;
}
