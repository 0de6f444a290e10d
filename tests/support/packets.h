// Ethernet frames, made by hand, sent over the interfaces of a sandbox, and read back from pcap
// streams; and TCP connections over loopback. Knows nothing of the code under test.
#pragma once

#include <stdint.h>
#include <sys/socket.h>

#include <string>
#include <string_view>
#include <vector>

// Bytes from hexadecimal digits; white space between them is skipped.
std::string from_hex(std::string_view digits);

// A frame from 02:00:00:00:00:02 to 02:00:00:00:00:01.
std::string make_frame(uint16_t ether_type, std::string_view payload);

// An ether type that is set aside for experiments: no protocol reacts to it.
constexpr uint16_t TEST_ETHER_TYPE = 0x88b5;

// A test frame of `size` bytes in all, at least 14, whose payload is `filling` over and over.
std::string test_frame(size_t size, char filling);

// Puts a frame on the wire of `interface` (so that its other end receives it).
void send_frame(const std::string &interface, std::string_view frame);

// What `ip link set INTERFACE up` and `promisc on` do, and what the interface says afterwards.
void set_link_up(const std::string &interface, bool up);
void set_link_promiscuous(const std::string &interface, bool on);
bool is_link_promiscuous(const std::string &interface);

struct PcapTestRecord {
    uint32_t seconds = 0;
    uint32_t microseconds = 0;
    uint32_t captured_length = 0;
    uint32_t original_length = 0;
    std::string data;
};

struct PcapTestStream {
    std::string header;                   // 24 bytes, unless the stream is shorter
    std::vector<PcapTestRecord> records;  // the whole ones
    std::string rest;                     // what follows the last whole one
};

PcapTestStream parse_pcap(std::string_view stream);

// The records' frames alone, without fillers.
std::vector<std::string> frames_of(std::string_view stream);

// From a written IPv4 or IPv6 address, and back.
sockaddr_storage address(const std::string &text, uint16_t port);
uint16_t port_of(const sockaddr_storage &address);

// Both ends of a TCP connection.
struct TcpConnection {
    int server = -1;
    int client = -1;
    TcpConnection() = default;
    TcpConnection(const TcpConnection &) = delete;
    TcpConnection &operator=(const TcpConnection &) = delete;
    ~TcpConnection();
    void close_client();
};

// Makes one from a client that connects to the address `connect_to` to a server that listens on
// `listen_on`; the client is a new socket unless there is one already. Skips the test where the
// machine has no such addresses.
void connect_tcp(const std::string &listen_on, const std::string &connect_to, TcpConnection *ret);
