#include "peers/mgmtctl/show_model.h"

#include <ctime>

#include "peers/mgmtctl/nodes.h"

std::vector<std::string> parts_below(const std::string &root, const std::string &name) {
    node_name above, whole;
    if (!parse_node_name(root, &above) || !parse_node_name(name, &whole) || !whole.is_under(above))
        return {};
    return {whole.parts.begin() + static_cast<std::ptrdiff_t>(above.parts.size()), whole.parts.end()};
}

std::string clean_text(const std::string &text, size_t most) {
    std::string out = text.substr(0, most);
    for (char &c : out)
        // Where char is signed, bytes above 0x7f are negative: the first comparison catches them.
        if (c < 0x20 || c > 0x7e)
            c = '?';
    return out;
}

int place_of_appliance(snapshot_group *inout, const std::string &address) {
    for (size_t i = 0; i < inout->appliances.size(); i++)
        if (inout->appliances[i].address == address)
            return static_cast<int>(i);
    if (address.empty() || inout->appliances.size() >= APPLIANCES_MAX)
        return -1;
    inout->appliances.emplace_back().address = address;
    inout->appliances.back().self = address == inout->address;
    return static_cast<int>(inout->appliances.size() - 1);
}

int64_t ms_since(const std::string &time_text) {
    tm parts = {};
    const char *end = strptime(time_text.c_str(), "%Y/%m/%d %H:%M:%S", &parts);
    // The text has no zone: mktime() has to find out whether summer time applied.
    parts.tm_isdst = -1;
    const time_t then = end ? mktime(&parts) : -1, now = time(nullptr);
    // In the future: the clock has been set back.
    return then < 0 || then > now ? -1 : int64_t{now - then} * 1000;
}
