// No length is trusted: the reader checks each value against what is left, and remembers the first one that
// is missing, so that the caller needs to check only after a series of reads. The writer appends, fills in
// the lengths of components and of the message when their ends are known, and computes the digest last.
#include "lab/router/wire.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cstring>

#include "runtime/byte_order.h"
#include "runtime/md5.h"

namespace lab {

std::string text_of(address a) {
    char text[INET_ADDRSTRLEN];
    const in_addr wire = {htonl(a)};
    return inet_ntop(AF_INET, &wire, text, sizeof text) ? text : "?";
}

std::optional<address> address_of(const std::string &text) {
    in_addr wire;
    if (inet_pton(AF_INET, text.c_str(), &wire) != 1)
        return std::nullopt;
    return ntohl(wire.s_addr);
}

namespace {

constexpr size_t PASSWORD_BYTES = 8;
constexpr size_t HEADER_BYTES = 8;
constexpr size_t DIGEST_OFFSET = HEADER_BYTES + 8;

std::array<uint8_t, MD5_DIGEST_BYTES> digest_of(const bytes &message, std::string_view password) {
    uint8_t secret[PASSWORD_BYTES] = {};
    // The digest covers the password, padded with zeros to 8 bytes, and the message with a digest of zeros.
    memcpy(secret, password.data(), std::min(password.size(), PASSWORD_BYTES));
    bytes blank = message;
    std::fill_n(blank.begin() + DIGEST_OFFSET, MD5_DIGEST_BYTES, uint8_t{0});
    std::array<uint8_t, MD5_DIGEST_BYTES> digest;
    md5_state state;
    md5_init(&state);
    md5_append(&state, secret, sizeof secret);
    md5_append(&state, blank.data(), blank.size());
    md5_finish(&state, digest.data());
    return digest;
}

// --- Reading

struct reader {
    const uint8_t *place;
    size_t left;
    std::string missed; // the first value that did not fit; empty: none

    bool want(size_t count, const char *what) {
        if (missed.empty() && count > left)
            missed = std::string(what) + " does not fit";
        return missed.empty();
    }
    uint32_t take(size_t width, const char *what) {
        if (!want(width, what))
            return 0;
        uint32_t value = 0;
        for (size_t i = 0; i < width; i++)
            value = value << 8 | place[i];
        skip(width);
        return value;
    }
    uint8_t u8(const char *what) { return static_cast<uint8_t>(take(1, what)); }
    uint16_t u16(const char *what) { return static_cast<uint16_t>(take(2, what)); }
    uint32_t u32(const char *what) { return take(4, what); }
    // The number of entries of `each` bytes; an error if they do not fit into the remaining bytes.
    uint32_t count(size_t each, const char *what) {
        const uint32_t value = u32(what);
        // By division, because a product could overflow.
        if (missed.empty() && value > left / each)
            missed = std::string(what) + " of " + std::to_string(value) + " does not fit";
        return missed.empty() ? value : 0;
    }
    void skip(size_t width) {
        place += width;
        left -= width;
    }
};

mask_fields read_mask(reader *in) {
    mask_fields mask;
    mask.src_ip = in->u32("source mask");
    mask.dst_ip = in->u32("destination mask");
    mask.src_port = in->u16("source port mask");
    mask.dst_port = in->u16("destination port mask");
    return mask;
}

void read_sets(reader *in, std::vector<mask_set> *sets) {
    // 12 bytes of mask and a count of values, which may be 0.
    const uint32_t elements = in->count(16, "mask count");
    for (uint32_t i = 0; i < elements && in->missed.empty(); i++) {
        mask_set set;
        set.mask = read_mask(in);
        const uint32_t values = in->count(16, "value count");
        for (uint32_t v = 0; v < values; v++) {
            mask_value value;
            value.match = read_mask(in);
            value.owner = in->u32("owner");
            set.values.push_back(value);
        }
        sets->push_back(set);
    }
}

void read_marks(reader *in, bool with_change, std::vector<router_mark> *marks) {
    const uint32_t count = in->count(with_change ? 12 : 8, "router count");
    for (uint32_t i = 0; i < count; i++) {
        router_mark mark = {};
        mark.router = in->u32("router");
        mark.receive_id = in->u32("receive id");
        if (with_change)
            mark.change_number = in->u32("change number");
        marks->push_back(mark);
    }
}

void read_addresses(reader *in, std::vector<address> *list) {
    const uint32_t count = in->count(4, "appliance count");
    for (uint32_t i = 0; i < count; i++)
        list->push_back(in->u32("appliance"));
}

void read_identity(reader *in, incoming *message) {
    here_i_am &hello = message->hello;
    hello.id = in->u32("identity");
    if (in->u16("hash revision") != 0)
        in->missed = "hash revision is not 0";
    hello.mask_format = (in->u16("identity flags") & 2) != 0;
    if (hello.mask_format) {
        std::vector<mask_set> sets;
        read_sets(in, &sets);
        // Values and buckets are not used: the router knows them from the assignment.
        if (!sets.empty())
            hello.mask = sets.front().mask;
    } else if (in->want(BUCKETS / 8, "buckets")) {
        in->skip(BUCKETS / 8);
    }
    hello.weight = in->u16("weight");
    (void)in->u16("status");
}

void read_view(reader *in, incoming *message) {
    message->hello.change_number = in->u32("change number");
    read_marks(in, false, &message->hello.routers);
    read_addresses(in, &message->hello.appliances);
}

void read_capabilities(reader *in, incoming *message) {
    while (in->left > 0 && in->missed.empty()) {
        const uint16_t type = in->u16("capability");
        if (in->u16("capability length") != 4 && in->missed.empty())
            in->missed = "a capability is not 4 bytes long";
        const uint32_t value = in->u32("capability value");
        methods &chosen = message->hello.chosen;
        if (type == 1)
            chosen.forward = value;
        else if (type == 2)
            chosen.assign = value;
        else if (type == 3)
            chosen.giveback = value;
    }
}

void read_command(reader *in, incoming *message) {
    command_info command = {};
    command.command = in->u16("command");
    if (in->u16("command length") != 4 && in->missed.empty())
        in->missed = "a command is not 4 bytes long";
    command.data = in->u32("command data");
    message->hello.command = command;
}

void read_assignment(reader *in, incoming *message) {
    redirect_assign &assign = message->assign;
    assign.key = in->u32("key");
    assign.key_change = in->u32("key change number");
    read_marks(in, true, &assign.routers);
    if (assign.by_mask) {
        read_sets(in, &assign.sets);
        return;
    }
    read_addresses(in, &assign.appliances);
    for (uint8_t &bucket : assign.buckets) {
        bucket = in->u8("bucket");
        if (in->missed.empty() && bucket != NO_APPLIANCE && bucket >= assign.appliances.size())
            in->missed = "a bucket's appliance is not in the list";
    }
}

void read_mask_assignment(reader *in, incoming *message) {
    message->assign.by_mask = true;
    if (in->u16("assignment type") != 1 && in->missed.empty())
        in->missed = "assignment type is not 1";
    const uint16_t length = in->u16("assignment length");
    // The assignment has a header of its own inside the component.
    if (in->missed.empty() && length != in->left)
        in->missed = "assignment length is not that of the component";
    read_assignment(in, message);
}

struct component_reader {
    uint32_t message;
    uint16_t type;
    bool needed;
    const char *name;
    void (*read)(reader *in, incoming *message);
};
constexpr component_reader COMPONENT_READERS[] = {
    {HERE_I_AM, APPLIANCE_IDENTITY, true, "identity", read_identity},
    {HERE_I_AM, APPLIANCE_VIEW, true, "view", read_view},
    {HERE_I_AM, CAPABILITIES, false, "capabilities", read_capabilities},
    {HERE_I_AM, COMMAND, false, "command", read_command},
    {REDIRECT_ASSIGN, ASSIGNMENT, false, "assignment", read_assignment},
    {REDIRECT_ASSIGN, MASK_ASSIGNMENT, false, "mask assignment", read_mask_assignment},
};

std::string read_security(const bytes &data, std::string_view password, reader *in) {
    const uint16_t type = in->u16("security type");
    const uint16_t length = in->u16("security length");
    const uint32_t option = in->u32("security option");
    if (!in->missed.empty())
        return in->missed;
    if (type != SECURITY_INFO)
        return "the first component is not Security Info";
    // Option 0: no password. Option 1: an MD5 digest follows.
    if (length != (option == 1 ? 4 + MD5_DIGEST_BYTES : 4))
        return "length of the Security Info";
    if ((option == 1) != !password.empty())
        return option == 1 ? "signed, but this router has no password" : "not signed";
    if (option == 1) {
        if (!in->want(MD5_DIGEST_BYTES, "digest"))
            return in->missed;
        // Checked before anything else in the message is trusted.
        const auto wanted = digest_of(data, password);
        if (!std::equal(wanted.begin(), wanted.end(), in->place))
            return "wrong digest";
        in->skip(MD5_DIGEST_BYTES);
    }
    return "";
}

std::string read_service(reader *in, service_info *service) {
    const uint16_t type = in->u16("service component");
    const uint16_t length = in->u16("service length");
    service->type = in->u8("service type");
    service->id = in->u8("service id");
    service->priority = in->u8("priority");
    service->protocol = in->u8("protocol");
    service->flags = in->u32("service flags");
    for (uint16_t &port : service->ports)
        port = in->u16("port");
    if (!in->missed.empty())
        return in->missed;
    if (type != SERVICE_INFO || length != 24)
        return "the second component is not Service Info";
    return "";
}

} // namespace

std::string read_message(const bytes &data, std::string_view password, incoming *message) {
    *message = {};
    reader in = {data.data(), data.size(), ""};
    message->type = in.u32("message type");
    const uint16_t version = in.u16("version");
    const uint16_t length = in.u16("message length");
    if (!in.missed.empty())
        return in.missed;
    if (version != VERSION)
        return "version is not 2";
    if (length != in.left)
        return "message length is " + std::to_string(length) + ", but " + std::to_string(in.left) +
               " bytes follow";
    if (message->type != HERE_I_AM && message->type != REDIRECT_ASSIGN)
        return "message type " + std::to_string(message->type) + " is not for a router";
    std::string wrong = read_security(data, password, &in);
    if (wrong.empty())
        wrong = read_service(&in, &message->service);
    if (!wrong.empty())
        return wrong;

    uint32_t seen = 0;
    while (in.left > 0) {
        const uint16_t type = in.u16("component type");
        const uint16_t size = in.u16("component length");
        if (!in.want(size, "component"))
            return in.missed;
        reader inside = {in.place, size, ""};
        in.skip(size);
        // Unknown components are skipped.
        for (const component_reader &row : COMPONENT_READERS) {
            if (row.message != message->type || row.type != type)
                continue;
            if (seen & 1U << type)
                return std::string("two components: ") + row.name;
            seen |= 1U << type;
            row.read(&inside, message);
            if (!inside.missed.empty())
                return std::string(row.name) + ": " + inside.missed;
            if (inside.left > 0)
                return std::string(row.name) + ": bytes after its end";
        }
    }
    for (const component_reader &row : COMPONENT_READERS)
        if (row.message == message->type && row.needed && !(seen & 1U << row.type))
            return std::string("no ") + row.name;
    // Each kind is optional in the table, but one of them is needed.
    if (message->type == REDIRECT_ASSIGN && seen != 1U << ASSIGNMENT && seen != 1U << MASK_ASSIGNMENT)
        return "not exactly one assignment";
    return "";
}

// --- Writing

namespace {

struct writer {
    bytes out;

    void put(uint32_t value, size_t width) {
        for (size_t i = width; i-- > 0;)
            out.push_back(static_cast<uint8_t>(value >> 8 * i));
    }
    void u8(uint8_t value) { put(value, 1); }
    void u16(uint16_t value) { put(value, 2); }
    void u32(uint32_t value) { put(value, 4); }
    void count(size_t value) { put(static_cast<uint32_t>(value), 4); }
    void add(const uint8_t *data, size_t size) { out.insert(out.end(), data, data + size); }
    size_t begin(uint16_t type) {
        u16(type);
        u16(0);
        return out.size();
    }
    void end(size_t began) {
        const size_t length = out.size() - began;
        out[began - 2] = static_cast<uint8_t>(length >> 8);
        out[began - 1] = static_cast<uint8_t>(length & 0xff);
    }
};

void write_mask(writer *to, const mask_fields &mask) {
    to->u32(mask.src_ip);
    to->u32(mask.dst_ip);
    to->u16(mask.src_port);
    to->u16(mask.dst_port);
}

void write_head(writer *to, uint32_t type, const service_info &service, std::string_view password) {
    to->u32(type);
    to->u16(VERSION);
    to->u16(0);
    const size_t security = to->begin(SECURITY_INFO);
    to->u32(password.empty() ? 0 : 1);
    if (!password.empty())
        to->out.insert(to->out.end(), MD5_DIGEST_BYTES, 0);
    to->end(security);
    const size_t began = to->begin(SERVICE_INFO);
    to->u8(service.type);
    to->u8(service.id);
    to->u8(service.priority);
    to->u8(service.protocol);
    to->u32(service.flags);
    for (const uint16_t port : service.ports)
        to->u16(port);
    to->end(began);
}

void write_element(writer *to, const view_element &element) {
    to->u32(element.id);
    to->u16(element.revision);
    to->u16(element.flags);
    // The size of an element depends on its flags, and in mask format on the count of masks.
    if (!(element.flags & 2)) {
        to->add(element.buckets.data(), element.buckets.size());
    } else if (element.is_short) {
        to->u32(0); // masks
    } else {
        to->u32(1); // masks
        write_mask(to, element.mask);
        to->u32(0); // values
    }
    to->u16(element.weight);
    to->u16(0); // status
}

bytes finish_message(writer *to, std::string_view password) {
    // The length of the message is in the two bytes before its contents, like that of a component.
    to->end(HEADER_BYTES);
    sign_message(&to->out, password);
    return std::move(to->out);
}

} // namespace

void sign_message(bytes *message, std::string_view password) {
    // The byte before the digest is the last one of the security option.
    if (message->size() < DIGEST_OFFSET + MD5_DIGEST_BYTES || (*message)[DIGEST_OFFSET - 1] != 1)
        return;
    const auto digest = digest_of(*message, password);
    std::copy(digest.begin(), digest.end(), message->begin() + DIGEST_OFFSET);
}

bytes write_message(const i_see_you &message, std::string_view password) {
    writer to;
    write_head(&to, I_SEE_YOU, message.service, password);

    size_t began = to.begin(ROUTER_IDENTITY);
    to.u32(message.router);
    to.u32(message.receive_id);
    to.u32(message.sent_to);
    to.count(message.received_from.size());
    for (const address from : message.received_from)
        to.u32(from);
    to.end(began);

    began = to.begin(ROUTER_VIEW);
    to.u32(message.change_number);
    to.u32(message.key);
    to.u32(message.key_change);
    to.count(message.routers.size());
    for (const address router : message.routers)
        to.u32(router);
    to.count(message.appliances.size());
    for (const view_element &element : message.appliances)
        write_element(&to, element);
    to.end(began);

    if (!message.map.empty()) {
        began = to.begin(ASSIGNMENT_MAP);
        to.count(message.map.size());
        for (const mask_set &set : message.map) {
            write_mask(&to, set.mask);
            to.count(set.values.size());
            for (const mask_value &value : set.values) {
                write_mask(&to, value.match);
                to.u32(value.owner);
            }
        }
        to.end(began);
    }
    for (const auto &[type, content] : message.extra) {
        began = to.begin(type);
        to.add(content.data(), content.size());
        to.end(began);
    }
    if (message.offer) {
        began = to.begin(CAPABILITIES);
        const uint32_t words[] = {message.offer->forward, message.offer->assign, message.offer->giveback};
        for (uint16_t i = 0; i < 3; i++) {
            to.u16(static_cast<uint16_t>(i + 1));
            to.u16(4);
            to.u32(words[i]);
        }
        to.end(began);
    }
    if (message.command) {
        began = to.begin(COMMAND);
        to.u16(message.command->command);
        to.u16(4);
        to.u32(message.command->data);
        to.end(began);
    }
    return finish_message(&to, password);
}

bytes write_message(const removal_query &message, std::string_view password) {
    writer to;
    write_head(&to, REMOVAL_QUERY, message.service, password);
    const size_t began = to.begin(ROUTER_QUERY);
    to.u32(message.router);
    to.u32(message.receive_id);
    to.u32(message.sent_to);
    to.u32(message.target);
    to.end(began);
    return finish_message(&to, password);
}

} // namespace lab
