// A second network namespace for the routers of a test, connected to the test's own by veth pairs.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "runtime/byte_order.h"

// Runs a shell command; its failure fails the test.
void run_command(const std::string &command);

struct peer_network {
    peer_network();
    ~peer_network(); // the pairs are deleted with it
    peer_network(const peer_network &) = delete;
    peer_network &operator=(const peer_network &) = delete;

    // A pair: `name` here, `peer_name` there, both up; addresses as "10.0.0.1/24", empty for none.
    void link(const std::string &name, const std::string &address, const std::string &peer_name,
              const std::string &peer_address) const;
    void run(const std::string &command) const; // in the other namespace

    // A UDP socket there, bound to address and port, that waits at most a second for a datagram.
    int udp_socket(const std::string &address, uint16_t port) const;

    int home, there; // the two namespaces
};

struct datagram {
    std::vector<uint8_t> bytes; // empty: none received
    std::string from;
};
datagram receive_datagram(int fd, int wait_ms = 1000);
void send_datagram(int fd, const std::string &to, uint16_t port, const std::vector<uint8_t> &bytes);
uint32_t address_word(const std::string &text); // in network byte order
be32 ipa(const std::string &text);
