// The faults that a router's message can have, one row each: in its contents or in its bytes.
#include "lab/router/router.h"

namespace lab {
namespace {

constexpr uint16_t UNKNOWN_COMPONENT = 77;

struct fault {
    const char *name;
    void (*message)(i_see_you *message, std::string *password);
    void (*data)(bytes *data, std::string_view password);
};

void add_unknown(i_see_you *message, int times) {
    for (int i = 0; i < times; i++)
        message->extra.emplace_back(UNKNOWN_COMPONENT, bytes(4, 0));
}

void set_length(bytes *data, size_t length) {
    (*data)[6] = static_cast<uint8_t>(length >> 8);
    (*data)[7] = static_cast<uint8_t>(length & 0xff);
}

constexpr fault FAULTS[] = {
    {"bad-digest", nullptr,
     [](bytes *data, std::string_view) {
         // The last byte of the digest, if there is one.
         if (data->size() > 31)
             (*data)[31] ^= 1;
     }},
    {"other-security",
     [](i_see_you *, std::string *password) { *password = password->empty() ? "secret" : ""; }, nullptr},
    {"bad-length", nullptr,
     [](bytes *data, std::string_view password) {
         set_length(data, data->size() - 8 + 1);
         // Signed again after each such change, so that the appliance finds the fault and not a wrong digest.
         sign_message(data, password);
     }},
    {"cut", nullptr,
     [](bytes *data, std::string_view password) {
         // The message has the right length, but its last component ends too early.
         data->resize(data->size() - 6);
         set_length(data, data->size() - 8);
         sign_message(data, password);
     }},
    {"bad-version", nullptr,
     [](bytes *data, std::string_view password) {
         (*data)[4] = 1;
         sign_message(data, password);
     }},
    {"odd-component",
     [](i_see_you *message, std::string *) { message->extra.emplace_back(UNKNOWN_COMPONENT, bytes(3, 0)); },
     nullptr},
    {"many-components", [](i_see_you *message, std::string *) { add_unknown(message, 4); }, nullptr},
    {"routers-33",
     [](i_see_you *message, std::string *) {
         // 10.99.0.N: addresses that no router of the lab has.
         while (message->routers.size() < MOST_IN_VIEW + 1)
             message->routers.push_back(0x0a630000 + static_cast<address>(message->routers.size()));
     },
     nullptr},
    {"appliances-33",
     [](i_see_you *message, std::string *) {
         while (message->appliances.size() < MOST_IN_VIEW + 1) {
             view_element element;
             element.id = 0x0a620000 + static_cast<address>(message->appliances.size());
             message->appliances.push_back(element);
         }
     },
     nullptr},
    {"nobodys-map",
     [](i_see_you *message, std::string *) {
         for (mask_set &set : message->map)
             for (mask_value &value : set.values)
                 value.owner = 0;
     },
     nullptr},
    {"other-service", [](i_see_you *message, std::string *) { message->service.priority ^= 1; }, nullptr},
    {"other-group", [](i_see_you *message, std::string *) { message->service.id ^= 0x80; }, nullptr},
    {"hash-revision",
     [](i_see_you *message, std::string *) {
         for (view_element &element : message->appliances)
             element.revision = 1;
     },
     nullptr},
    {"other-format",
     [](i_see_you *message, std::string *) {
         for (view_element &element : message->appliances)
             // Only an element in mask format with redirected packets exists in both sizes.
             element.is_short = element.flags == 2 && !element.is_short;
     },
     nullptr},
    {"no-router-id", [](i_see_you *message, std::string *) { message->router = 0; }, nullptr},
    {"huge-map",
     [](i_see_you *message, std::string *) {
         message->map.clear();
         // one mask that announces 2^28 values
         bytes map = {0, 0, 0, 1};
         map.resize(16);
         map.insert(map.end(), {0x10, 0, 0, 0});
         map.resize(36);
         message->extra.emplace_back(ASSIGNMENT_MAP, map);
     },
     nullptr},
    {"empty-map",
     [](i_see_you *message, std::string *) {
         message->map.clear();
         message->extra.emplace_back(ASSIGNMENT_MAP, bytes(36, 0));
     },
     nullptr},
};

const fault *find_fault(const std::string &name) {
    for (const fault &row : FAULTS)
        if (name == row.name)
            return &row;
    return nullptr;
}

} // namespace

bool is_fault(const std::string &name) {
    return find_fault(name) != nullptr;
}

std::string fault_names() {
    std::string all;
    for (const fault &row : FAULTS)
        all += (all.empty() ? "" : " ") + std::string(row.name);
    return all;
}

void spoil_message(const std::string &name, i_see_you *message, std::string *password) {
    const fault *row = find_fault(name);
    if (row && row->message)
        row->message(message, password);
}

void spoil_bytes(const std::string &name, bytes *data, std::string_view password) {
    const fault *row = find_fault(name);
    if (row && row->data)
        row->data(data, password);
}

} // namespace lab
