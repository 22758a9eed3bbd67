// Bytes as they are on the wire, appended one number after the other, big-endian. It knows no layout.
#pragma once

#include <cctype>
#include <cstdint>
#include <string>
#include <vector>

#include "runtime/byte_order.h"

struct wire_bytes {
    std::vector<uint8_t> bytes;

    wire_bytes &u8(uint32_t value) {
        bytes.push_back(static_cast<uint8_t>(value & 0xff));
        return *this;
    }
    wire_bytes &u16(uint32_t value) { return u8(value >> 8).u8(value); }
    wire_bytes &u32(uint32_t value) { return u16(value >> 16).u16(value); }
    wire_bytes &addr(be32 address) {
        bytes.insert(bytes.end(), address.bytes, address.bytes + 4);
        return *this;
    }
    // 10.0.<third>.<fourth>
    wire_bytes &ip(uint32_t third, uint32_t fourth) { return u8(10).u8(0).u8(third).u8(fourth); }
    wire_bytes &zeros(size_t count) { return fill(count, 0); }
    wire_bytes &fill(size_t count, uint8_t value) {
        bytes.insert(bytes.end(), count, value);
        return *this;
    }
    wire_bytes &add(const wire_bytes &other) {
        bytes.insert(bytes.end(), other.bytes.begin(), other.bytes.end());
        return *this;
    }
    // "0002 0004 ee*3": pairs of hexadecimal digits; other characters separate. "ee*3" is ee three times.
    wire_bytes &hex(const std::string &digits) {
        std::string pair;
        for (size_t at = 0; at < digits.size(); at++) {
            if (isxdigit(static_cast<unsigned char>(digits[at])))
                pair += digits[at];
            if (pair.size() == 2) {
                u8(static_cast<uint32_t>(std::stoul(pair, nullptr, 16)));
                pair.clear();
            }
            if (digits[at] == '*') {
                size_t length;
                fill(std::stoul(digits.substr(at + 1), &length) - 1, bytes.back());
                at += length;
            }
        }
        return *this;
    }
    wire_bytes &put16(size_t at, uint32_t value) {
        bytes.at(at) = static_cast<uint8_t>(value >> 8 & 0xff);
        bytes.at(at + 1) = static_cast<uint8_t>(value & 0xff);
        return *this;
    }
    size_t size() const { return bytes.size(); }
};

inline wire_bytes hex(const std::string &digits) {
    return wire_bytes().hex(digits);
}

// A message: the header with the right length, then its components.
inline std::vector<uint8_t> wire_message(uint32_t type, const std::vector<wire_bytes> &components) {
    wire_bytes out;
    out.u32(type).u16(0x0200).u16(0);
    for (const wire_bytes &component : components)
        out.add(component);
    out.put16(6, static_cast<uint32_t>(out.size() - 8));
    return out.bytes;
}
