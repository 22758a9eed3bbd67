#include "peers/mgmtctl/ctl_json.h"

#include <algorithm>

namespace {
// The place of the last item with this name; without one, the number of items.
size_t find_name(const ctl_json &object, const std::string &name) {
    for (size_t i = object.names.size(); i-- > 0;)
        if (object.names[i] == name)
            return i;
    return object.items.size();
}

bool is_pair(const ctl_json &value) {
    return value.is_array() && value.items.size() == 2 && value.items[0].is_text();
}
} // namespace

ctl_json::ctl_json(double value) : type(kind::real), real(value) {}
ctl_json::ctl_json(const char *value) : ctl_json(std::string(value)) {}
ctl_json::ctl_json(std::string value) : type(kind::text), text(std::move(value)) {}
ctl_json::ctl_json(const std::vector<std::string> &values)
    : type(kind::array), items(values.begin(), values.end()) {}

ctl_json::ctl_json(std::initializer_list<ctl_json> values) {
    if (!std::all_of(values.begin(), values.end(), is_pair)) {
        type = kind::array;
        items = values;
        return;
    }
    type = kind::object;
    for (const ctl_json &pair : values)
        if (!contains(pair.items[0].text))
            (*this)[pair.items[0].text] = pair.items[1];
}

ctl_json ctl_json::array() {
    ctl_json out;
    out.type = kind::array;
    return out;
}

ctl_json ctl_json::object() {
    ctl_json out;
    out.type = kind::object;
    return out;
}

ctl_json &ctl_json::operator[](const std::string &name) {
    if (is_null())
        type = kind::object;
    if (const size_t found = find_name(*this, name); found < items.size())
        return items[found];
    names.push_back(name);
    return items.emplace_back();
}

const ctl_json &ctl_json::operator[](const std::string &name) const {
    static const ctl_json none;
    const size_t found = find_name(*this, name);
    return found < items.size() ? items[found] : none;
}

bool ctl_json::contains(const std::string &name) const {
    return find_name(*this, name) < items.size();
}

void ctl_json::push_back(ctl_json value) {
    if (is_null())
        type = kind::array;
    items.push_back(std::move(value));
}

void ctl_json::update(const ctl_json &other) {
    for (size_t i = 0; i < other.names.size(); i++)
        (*this)[other.names[i]] = other.items[i];
}

ctl_json text_or_null(const std::string &text) {
    return text.empty() ? ctl_json(nullptr) : ctl_json(text);
}
