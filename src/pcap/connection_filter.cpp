// A packet filter that hides one connection.
#include "pcap/connection_filter.h"

#include <arpa/inet.h>
#include <linux/if_ether.h>
#include <netinet/in.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <iterator>

namespace {

// Where the fields are in an Ethernet frame.
constexpr uint32_t ETHER_TYPE_AT = 12;
constexpr uint32_t IP_HEADER_AT = 14;
constexpr uint32_t IPV6_NEXT_HEADER_AT = IP_HEADER_AT + 6;
constexpr uint32_t IPV6_PAYLOAD_AT = IP_HEADER_AT + 40;

constexpr uint32_t DROP = 0;
constexpr uint32_t ACCEPT = 0xffffffff;

using Program = std::array<sock_filter, CONNECTION_FILTER_MAX_LENGTH>;

// The first four bytes of a TCP header, as the filter machine loads them.
struct PortPairs {
    uint32_t to_peer;
    uint32_t from_peer;
};

// Deliberately narrow: only the port pairs are compared, not the addresses, the protocol or the
// fragment offset. A few frames too many are hidden, which is kept: what a capture leaves out must
// not change between versions.
unsigned fill_ipv4(const PortPairs &ports, Program *program) {
    const sock_filter code[] = {
        BPF_STMT(BPF_LD | BPF_H | BPF_ABS, ETHER_TYPE_AT),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ETH_P_IP, 0, 5),
        BPF_STMT(BPF_LDX | BPF_B | BPF_MSH, IP_HEADER_AT),
        BPF_STMT(BPF_LD | BPF_W | BPF_IND, IP_HEADER_AT),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ports.to_peer, 1, 0),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ports.from_peer, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, DROP),
        BPF_STMT(BPF_RET | BPF_K, ACCEPT),
    };
    std::copy(std::begin(code), std::end(code), program->begin());
    return static_cast<unsigned>(std::size(code));
}

unsigned fill_ipv6(const PortPairs &ports, Program *program) {
    const sock_filter code[] = {
        BPF_STMT(BPF_LD | BPF_H | BPF_ABS, ETHER_TYPE_AT),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ETH_P_IPV6, 0, 6),
        BPF_STMT(BPF_LD | BPF_B | BPF_ABS, IPV6_NEXT_HEADER_AT),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, IPPROTO_TCP, 0, 4),
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, IPV6_PAYLOAD_AT),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ports.to_peer, 1, 0),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, ports.from_peer, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, DROP),
        BPF_STMT(BPF_RET | BPF_K, ACCEPT),
    };
    std::copy(std::begin(code), std::end(code), program->begin());
    return static_cast<unsigned>(std::size(code));
}

struct Endpoint {
    uint16_t port;     // in host order
    bool ipv4_frames;  // also for an IPv6 socket that talks to an IPv4 host
};

bool read_endpoint(const sockaddr_storage &address, Endpoint *ret) {
    if (address.ss_family == AF_INET) {
        sockaddr_in in;
        memcpy(&in, &address, sizeof in);
        *ret = {.port = ntohs(in.sin_port), .ipv4_frames = true};
        return true;
    }
    if (address.ss_family == AF_INET6) {
        sockaddr_in6 in6;
        memcpy(&in6, &address, sizeof in6);
        *ret = {.port = ntohs(in6.sin6_port),
                .ipv4_frames = IN6_IS_ADDR_V4MAPPED(&in6.sin6_addr) != 0};
        return true;
    }
    return false;
}

uint32_t port_pair(uint16_t source, uint16_t destination) {
    return static_cast<uint32_t>(source) << 16 | destination;
}

}  // namespace

sock_filter *make_connection_filter(int socket_fd, unsigned *length) {
    sockaddr_storage own = {};
    sockaddr_storage peer = {};
    socklen_t own_size = sizeof own;
    socklen_t peer_size = sizeof peer;
    if (getpeername(socket_fd, reinterpret_cast<sockaddr *>(&peer), &peer_size) < 0 ||
        getsockname(socket_fd, reinterpret_cast<sockaddr *>(&own), &own_size) < 0)
        return nullptr;

    Program program;
    const unsigned count = build_connection_filter(own, peer, &program);
    if (count == 0)
        return nullptr;
    auto *ret = static_cast<sock_filter *>(malloc(count * sizeof(sock_filter)));
    if (ret == nullptr)
        return nullptr;
    std::copy_n(program.begin(), count, ret);
    *length = count;
    return ret;
}

unsigned build_connection_filter(const sockaddr_storage &own, const sockaddr_storage &peer,
                                 Program *program) {
    Endpoint own_end;
    Endpoint peer_end;
    if (own.ss_family != peer.ss_family || !read_endpoint(own, &own_end) ||
        !read_endpoint(peer, &peer_end))
        return 0;
    const PortPairs ports = {.to_peer = port_pair(own_end.port, peer_end.port),
                             .from_peer = port_pair(peer_end.port, own_end.port)};
    return peer_end.ipv4_frames ? fill_ipv4(ports, program) : fill_ipv6(ports, program);
}
