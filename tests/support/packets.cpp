#include "support/packets.h"

#include <arpa/inet.h>
#include <ctype.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

namespace {

uint32_t le32(std::string_view bytes) {
    uint32_t ret = 0;
    for (size_t i = 4; i-- > 0;)
        ret = ret << 8 | static_cast<uint8_t>(bytes[i]);
    return ret;
}

// Sets and clears flags of an interface; returns all that it then has.
int change_flags(const std::string &interface, int set, int clear) {
    ifreq request = {};
    EXPECT_LT(interface.size(), sizeof request.ifr_name);
    memcpy(request.ifr_name, interface.c_str(), interface.size() + 1);
    int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(0, ioctl(fd, SIOCGIFFLAGS, &request)) << interface << ": " << strerror(errno);
    int flags = (request.ifr_flags | set) & ~clear;
    if (set != 0 || clear != 0) {
        request.ifr_flags = static_cast<short>(flags);
        EXPECT_EQ(0, ioctl(fd, SIOCSIFFLAGS, &request)) << interface << ": " << strerror(errno);
    }
    close(fd);
    return flags;
}

}  // namespace

std::string from_hex(std::string_view digits) {
    std::string ret;
    int high = -1;
    for (char c : digits) {
        if (isspace(static_cast<unsigned char>(c)))
            continue;
        EXPECT_TRUE(isxdigit(static_cast<unsigned char>(c))) << c;
        int value = isdigit(static_cast<unsigned char>(c)) ? c - '0' : (c | 0x20) - 'a' + 10;
        if (high < 0) {
            high = value;
        } else {
            ret += static_cast<char>(high << 4 | value);
            high = -1;
        }
    }
    EXPECT_EQ(-1, high) << "half a byte in " << digits;
    return ret;
}

std::string make_frame(uint16_t ether_type, std::string_view payload) {
    std::string ret = from_hex("020000000001 020000000002");
    ret += static_cast<char>(ether_type >> 8);
    ret += static_cast<char>(ether_type & 0xff);
    ret += payload;
    return ret;
}

std::string test_frame(size_t size, char filling) {
    EXPECT_GE(size, 14u);
    return make_frame(TEST_ETHER_TYPE, std::string(size - 14, filling));
}

void send_frame(const std::string &interface, std::string_view frame) {
    int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
    ASSERT_GE(fd, 0) << strerror(errno);
    sockaddr_ll address = {};
    address.sll_family = AF_PACKET;
    address.sll_ifindex = static_cast<int>(if_nametoindex(interface.c_str()));
    EXPECT_NE(0, address.sll_ifindex) << interface;
    EXPECT_EQ(static_cast<ssize_t>(frame.size()),
              sendto(fd, frame.data(), frame.size(), 0, reinterpret_cast<sockaddr *>(&address),
                     sizeof address))
        << interface << ": " << strerror(errno);
    close(fd);
}

void set_link_up(const std::string &interface, bool up) {
    change_flags(interface, up ? IFF_UP : 0, up ? 0 : IFF_UP);
}

void set_link_promiscuous(const std::string &interface, bool on) {
    change_flags(interface, on ? IFF_PROMISC : 0, on ? 0 : IFF_PROMISC);
}

bool is_link_promiscuous(const std::string &interface) {
    return (change_flags(interface, 0, 0) & IFF_PROMISC) != 0;
}

PcapTestStream parse_pcap(std::string_view stream) {
    PcapTestStream ret;
    ret.header = stream.substr(0, 24);
    stream.remove_prefix(ret.header.size());
    while (stream.size() >= 16) {
        PcapTestRecord record;
        record.seconds = le32(stream);
        record.microseconds = le32(stream.substr(4));
        record.captured_length = le32(stream.substr(8));
        record.original_length = le32(stream.substr(12));
        if (stream.size() - 16 < record.captured_length)
            break;
        record.data = stream.substr(16, record.captured_length);
        stream.remove_prefix(16 + record.data.size());
        ret.records.push_back(record);
    }
    ret.rest = stream;
    return ret;
}

std::vector<std::string> frames_of(std::string_view stream) {
    std::vector<std::string> ret;
    for (const PcapTestRecord &record : parse_pcap(stream).records) {
        if (record.seconds != 0)
            ret.push_back(record.data);
    }
    return ret;
}

sockaddr_storage address(const std::string &text, uint16_t port) {
    sockaddr_storage ret = {};
    sockaddr_in in = {};
    sockaddr_in6 in6 = {};
    if (inet_pton(AF_INET, text.c_str(), &in.sin_addr) == 1) {
        in.sin_family = AF_INET;
        in.sin_port = htons(port);
        memcpy(&ret, &in, sizeof in);
    } else if (inet_pton(AF_INET6, text.c_str(), &in6.sin6_addr) == 1) {
        in6.sin6_family = AF_INET6;
        in6.sin6_port = htons(port);
        memcpy(&ret, &in6, sizeof in6);
    } else {
        ADD_FAILURE() << text;
    }
    return ret;
}

uint16_t port_of(const sockaddr_storage &address) {
    sockaddr_in in;
    memcpy(&in, &address, sizeof in);
    return ntohs(in.sin_port);
}

TcpConnection::~TcpConnection() {
    close_client();
    if (server >= 0)
        close(server);
}

void TcpConnection::close_client() {
    if (client >= 0)
        close(client);
    client = -1;
}

void connect_tcp(const std::string &listen_on, const std::string &connect_to, TcpConnection *ret) {
    sockaddr_storage at = address(listen_on, 0);
    int listener = socket(at.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (listener < 0 && errno == EAFNOSUPPORT)
        GTEST_SKIP() << strerror(errno);
    ASSERT_GE(listener, 0) << strerror(errno);
    int off = 0;
    if (at.ss_family == AF_INET6) {
        ASSERT_EQ(0, setsockopt(listener, IPPROTO_IPV6, IPV6_V6ONLY, &off, sizeof off));
    }
    if (bind(listener, reinterpret_cast<sockaddr *>(&at), sizeof at) != 0) {
        close(listener);
        GTEST_SKIP() << listen_on << ": " << strerror(errno);
    }
    ASSERT_EQ(0, listen(listener, 1)) << strerror(errno);
    socklen_t size = sizeof at;
    ASSERT_EQ(0, getsockname(listener, reinterpret_cast<sockaddr *>(&at), &size));
    sockaddr_storage to = address(connect_to, port_of(at));
    if (ret->client < 0)
        ret->client = socket(to.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_EQ(0, connect(ret->client, reinterpret_cast<sockaddr *>(&to), sizeof to))
        << strerror(errno);
    ret->server = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    ASSERT_GE(ret->server, 0) << strerror(errno);
    close(listener);
}
