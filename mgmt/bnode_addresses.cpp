// Conversion of addresses and prefixes from and to text.
#include <arpa/inet.h>

#include <bit>
#include <cctype>
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_rows.h"
#include "mgmt/bnode_types.h"

// --- IPv4 and IPv6

lc_status bn_text_to_ipaddr(const char *text, lc_ipaddr *out) {
    *out = lc_ipaddr{};
    out->family = strchr(text, ':') ? 6 : 4;
    if (inet_pton(out->family == 6 ? AF_INET6 : AF_INET, text, out->address) == 1)
        return LC_OK;
    *out = lc_ipaddr{};
    return LC_BAD_TYPE;
}
lc_status bn_text_to_ipprefix(const char *text, lc_ipprefix *out) {
    *out = lc_ipprefix{};
    char address_text[INET6_ADDRSTRLEN];
    const char *slash = strchr(text, '/');
    const size_t length = slash ? static_cast<size_t>(slash - text) : strlen(text);
    // No address is as long as that.
    if (length >= sizeof address_text)
        return LC_BAD_TYPE;
    memcpy(address_text, text, length);
    address_text[length] = 0;
    lc_ipaddr address;
    uint64_t mask_length = 0;
    CHECK_QUIET(bn_text_to_ipaddr(address_text, &address));
    if (slash)
        CHECK_QUIET(bn_text_to_natural(slash + 1, address.family == 6 ? 128 : 32, &mask_length));
    out->family = address.family;
    out->mask_length = static_cast<uint8_t>(mask_length);
    memcpy(out->address, address.address, sizeof out->address);
    return LC_OK;
}
lc_status lc_str_to_ipaddr(const char *text, lc_ipaddr *out) {
    CHECK_NULL(out);
    CHECK_NULL(text);
    CHECK_CONDITION(bn_text_to_ipaddr(text, out) == LC_OK);
    return LC_OK;
}
lc_status lc_str_to_ipprefix(const char *text, lc_ipprefix *out) {
    CHECK_NULL(out);
    CHECK_NULL(text);
    CHECK_CONDITION(bn_text_to_ipprefix(text, out) == LC_OK);
    return LC_OK;
}

namespace {

lc_status write_address_text(uint8_t family, const uint8_t *address, char *text, socklen_t size) {
    CHECK_NULL(inet_ntop(family == 6 ? AF_INET6 : AF_INET, address, text, size));
    return LC_OK;
}

} // namespace

lc_status lc_ipaddr_to_str(const lc_ipaddr *value, char **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(value);
    char text[INET6_ADDRSTRLEN];
    CHECK_STATUS(write_address_text(value->family, value->address, text, sizeof text));
    return bn_give_text(safe_strdup(text), out);
}
lc_status lc_ipprefix_to_str(const lc_ipprefix *value, char **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(value);
    char text[INET6_ADDRSTRLEN];
    CHECK_STATUS(write_address_text(value->family, value->address, text, sizeof text));
    return bn_give_text(smprintf("%s/%u", text, value->mask_length), out);
}
int lc_ipaddr_compare(const lc_ipaddr *a, const lc_ipaddr *b) {
    if (a->family != b->family)
        return a->family - b->family;
    return memcmp(a->address, b->address, sizeof a->address);
}
int lc_ipprefix_compare(const lc_ipprefix *a, const lc_ipprefix *b) {
    if (a->family != b->family)
        return a->family - b->family;
    const int order = memcmp(a->address, b->address, sizeof a->address);
    return order ? order : a->mask_length - b->mask_length;
}

// --- IPv4, as a number in host order

namespace {

// Reads four decimal numbers separated by dots; `out_rest` points to what follows.
lc_status read_ipv4(const char *text, uint32_t *out, const char **out_rest) {
    *out = 0;
    for (int part = 0; part < 4; part++) {
        if (part > 0 && *text++ != '.')
            return LC_BAD_TYPE;
        if (!isdigit(static_cast<unsigned char>(*text)))
            return LC_BAD_TYPE;
        char *end = nullptr;
        // Decimal also with leading zeros, unlike inet_aton(), which would read an octal number.
        const unsigned long value = strtoul(text, &end, 10);
        if (value > 255)
            return LC_BAD_TYPE;
        *out = (*out << 8) | static_cast<uint32_t>(value);
        text = end;
    }
    *out_rest = text;
    return LC_OK;
}

} // namespace

lc_status lc_str_to_ipv4addr(const char *text, uint32_t *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    uint32_t value = 0;
    const char *rest = nullptr;
    CHECK_QUIET(read_ipv4(text, &value, &rest));
    if (*rest)
        return LC_BAD_TYPE;
    *out = value;
    return LC_OK;
}
lc_status lc_str_to_ipv4prefix(const char *text, uint64_t *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    uint32_t address = 0;
    uint64_t length = 0;
    const char *rest = nullptr;
    CHECK_QUIET(read_ipv4(text, &address, &rest));
    if (*rest != '/')
        return LC_BAD_TYPE;
    CHECK_QUIET(bn_text_to_natural(rest + 1, 32, &length));
    // 64 bits, since shifting 32 bits by 32, for /0, would be undefined.
    const auto mask = static_cast<uint32_t>(UINT64_MAX << (32 - length));
    *out = uint64_t{address} << 32 | mask;
    return LC_OK;
}
lc_status lc_ipv4addr_to_str(uint32_t value, char **out) {
    CHECK_NULL(out);
    return bn_give_text(
        smprintf("%u.%u.%u.%u", value >> 24, (value >> 16) & 255, (value >> 8) & 255, value & 255), out);
}
lc_status lc_ipv4prefix_to_str(uint64_t value, char **out) {
    CHECK_NULL(out);
    const auto address = static_cast<uint32_t>(value >> 32);
    const auto mask = static_cast<uint32_t>(value);
    // A mask with gaps is shown by its leading ones.
    return bn_give_text(smprintf("%u.%u.%u.%u/%d", address >> 24, (address >> 16) & 255, (address >> 8) & 255,
                                 address & 255, std::countl_one(mask)),
                        out);
}

// --- Hardware addresses

// "00:11:22:33:44:55", or with groups of two bytes "0011:2233:4455": a group of up to two digits is one byte,
// a longer one two; there must be six bytes.
lc_status lc_str_to_macaddr802(const char *text, lc_macaddr802 *out) {
    CHECK_NULL(out);
    *out = lc_macaddr802{};
    CHECK_NULL(text);
    lc_macaddr802 value{};
    size_t filled = 0;
    while (true) {
        size_t digits = 0;
        while (digits < 4 && isxdigit(static_cast<unsigned char>(text[digits])))
            digits++;
        const size_t bytes = digits > 2 ? 2 : 1;
        if (digits == 0 || filled + bytes > sizeof value.bytes)
            return LC_BAD_TYPE;
        // If this reads further than the digits counted, what follows them isn't a colon, and the text is
        // refused.
        const unsigned long group = strtoul(text, nullptr, 16);
        if (bytes == 2)
            value.bytes[filled++] = static_cast<uint8_t>(group >> 8);
        value.bytes[filled++] = static_cast<uint8_t>(group & 255);
        text += digits;
        if (*text != ':')
            break;
        text++;
    }
    if (*text || filled != sizeof value.bytes)
        return LC_BAD_TYPE;
    *out = value;
    return LC_OK;
}
lc_status lc_macaddr802_to_str(const lc_macaddr802 *value, char **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(value);
    const uint8_t *b = value->bytes;
    return bn_give_text(smprintf("%02X:%02X:%02X:%02X:%02X:%02X", b[0], b[1], b[2], b[3], b[4], b[5]), out);
}
