#include "pcap/connection_filter.h"

#include <arpa/inet.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "support/packets.h"
#include "support/sandbox.h"

namespace {

// An instruction as four plain numbers, so that programs can be compared and shown.
struct Instruction {
    unsigned code, jt, jf, k;
    bool operator==(const Instruction &) const = default;
};

std::ostream &operator<<(std::ostream &out, const Instruction &i) {
    return out << std::hex << "{0x" << i.code << ", " << i.jt << ", " << i.jf << ", 0x" << i.k
               << "}" << std::dec;
}

using Program = std::vector<sock_filter>;

std::vector<Instruction> listing(const Program &program) {
    std::vector<Instruction> ret;
    for (const sock_filter &f : program)
        ret.push_back({f.code, f.jt, f.jf, f.k});
    return ret;
}

Program build(const sockaddr_storage &own, const sockaddr_storage &peer) {
    std::array<sock_filter, CONNECTION_FILTER_MAX_LENGTH> program;
    unsigned length = build_connection_filter(own, peer, &program);
    return Program(program.begin(), program.begin() + length);
}

// Own port 80 (0x0050), peer port 49153 (0xc001).
const std::vector<Instruction> IPV4_LISTING = {
    {0x28, 0, 0, 12},          // ldh [12]
    {0x15, 0, 5, 0x0800},      // jeq #0x800, 2, 7
    {0xb1, 0, 0, 14},          // ldxb 4*([14]&0xf)
    {0x40, 0, 0, 14},          // ld [x + 14]
    {0x15, 1, 0, 0x0050c001},  // jeq, 6, 5
    {0x15, 0, 1, 0xc0010050},  // jeq, 6, 7
    {0x06, 0, 0, 0},           // ret #0
    {0x06, 0, 0, 0xffffffff},  // ret #-1
};

const std::vector<Instruction> IPV6_LISTING = {
    {0x28, 0, 0, 12},          // ldh [12]
    {0x15, 0, 6, 0x86dd},      // jeq #0x86dd, 2, 8
    {0x30, 0, 0, 20},          // ldb [20]
    {0x15, 0, 4, 6},           // jeq #6, 4, 8
    {0x20, 0, 0, 54},          // ld [54]
    {0x15, 1, 0, 0x0050c001},  // jeq, 7, 6
    {0x15, 0, 1, 0xc0010050},  // jeq, 7, 8
    {0x06, 0, 0, 0},           // ret #0
    {0x06, 0, 0, 0xffffffff},  // ret #-1
};

// A load of `size` bytes; nothing when it goes beyond the frame.
std::optional<uint32_t> load(std::string_view frame, uint64_t at, unsigned size) {
    if (at + size > frame.size())
        return std::nullopt;
    uint32_t ret = 0;
    for (unsigned i = 0; i < size; ++i)
        ret = ret << 8 | static_cast<uint8_t>(frame[static_cast<size_t>(at + i)]);
    return ret;
}

// Runs a filter as the kernel would, for the instructions that a connection filter may hold.
// Returns how much of the frame is accepted; 0 when it is dropped, as it is when a load fails.
uint32_t run_filter(const Program &program, std::string_view frame) {
    uint32_t a = 0;
    uint32_t x = 0;
    for (size_t pc = 0; pc < program.size(); ++pc) {
        const sock_filter &f = program[pc];
        std::optional<uint32_t> loaded = 0;
        switch (f.code) {
            case 0x28:
                loaded = load(frame, f.k, 2);
                break;
            case 0x30:
                loaded = load(frame, f.k, 1);
                break;
            case 0x20:
                loaded = load(frame, f.k, 4);
                break;
            case 0x40:
                loaded = load(frame, uint64_t{x} + f.k, 4);
                break;
            case 0xb1:
                loaded = load(frame, f.k, 1);
                if (loaded)
                    x = 4 * (*loaded & 15);
                loaded = loaded ? std::optional(a) : std::nullopt;
                break;
            case 0x15:
                loaded = a;
                pc += a == f.k ? f.jt : f.jf;
                break;
            case 0x06:
                return f.k;
            default:
                ADD_FAILURE() << "instruction " << f.code;
                return 0;
        }
        if (!loaded)
            return 0;
        a = *loaded;
    }
    ADD_FAILURE() << "the program has no end";
    return 0;
}

// Transport headers that begin with these two ports; the rest does not matter.
const char *const OURS_TO_CLIENT = "0050 c001 00000001 00000000 5010 1000 0000 0000";
const char *const CLIENT_TO_US = "c001 0050 00000001 00000000 5010 1000 0000 0000";
const char *const OTHER_PORTS = "0050 c002 00000001 00000000 5010 1000 0000 0000";
const char *const OTHER_OWN_PORT = "c001 0051 00000001 00000000 5010 1000 0000 0000";

std::string ipv4(const std::string &protocol, const std::string &transport,
                 const std::string &options = "", const std::string &fragment = "0000") {
    std::string version_and_length = options.empty() ? "45" : "46";
    return make_frame(0x0800, from_hex(version_and_length + "00 003c 0001" + fragment + "40" +
                                       protocol + "0000 0a630001 0a630002" + options + transport));
}

std::string ipv6(const std::string &next_header, const std::string &payload) {
    return make_frame(0x86dd, from_hex("60000000 0014" + next_header +
                                       "40 fd000000000000000000000000000001"
                                       "fd000000000000000000000000000002" +
                                       payload));
}

struct FrameCase {
    const char *name;
    std::string frame;
    bool passes;
};

std::vector<FrameCase> ipv4_cases() {
    return {
        {"ours to the client", ipv4("06", OURS_TO_CLIENT), false},
        {"the client to us", ipv4("06", CLIENT_TO_US), false},
        {"another client port", ipv4("06", OTHER_PORTS), true},
        {"another port of ours", ipv4("06", OTHER_OWN_PORT), true},
        {"with IP options", ipv4("06", OURS_TO_CLIENT, "94040000"), false},
        {"others with IP options", ipv4("06", OTHER_PORTS, "94040000"), true},
        {"options that look like the ports", ipv4("06", OTHER_PORTS, "0050c001"), true},
        {"UDP with the same ports", ipv4("11", "0050 c001 0008 0000"), false},
        {"UDP with other ports", ipv4("11", "0050 0035 0008 0000"), true},
        {"a later fragment that looks the same", ipv4("06", OURS_TO_CLIENT, "", "2064"), false},
        {"cut before the ports end", ipv4("06", "0050 c0"), false},
        {"IPv6 with the same ports", ipv6("06", OURS_TO_CLIENT), true},
        {"ARP", make_frame(0x0806, from_hex("0001 0800 06 04 0001")), true},
        {"no payload", make_frame(TEST_ETHER_TYPE, ""), true},
    };
}

std::vector<FrameCase> ipv6_cases() {
    return {
        {"ours to the client", ipv6("06", OURS_TO_CLIENT), false},
        {"the client to us", ipv6("06", CLIENT_TO_US), false},
        {"another client port", ipv6("06", OTHER_PORTS), true},
        {"another port of ours", ipv6("06", OTHER_OWN_PORT), true},
        {"UDP with the same ports", ipv6("11", "0050 c001 0008 0000"), true},
        {"behind an extension header",
         ipv6("00", "0600 0104 0000 0000" + std::string(CLIENT_TO_US)), true},
        {"cut before the ports end", ipv6("06", "0050 c0"), false},
        {"IPv4 with the same ports", ipv4("06", OURS_TO_CLIENT), true},
        {"no payload", make_frame(TEST_ETHER_TYPE, ""), true},
    };
}

void expect_filtered(const Program &program, const std::vector<FrameCase> &cases) {
    for (const FrameCase &row : cases)
        EXPECT_EQ(row.passes ? 0xffffffff : 0, run_filter(program, row.frame)) << row.name;
}

// Sends the frames over the sandbox's wire to a packet socket with the filter.
void expect_filtered_by_kernel(Program program, const std::vector<FrameCase> &cases) {
    int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
    ASSERT_GE(fd, 0) << strerror(errno);
    sock_fprog attached = {.len = static_cast<unsigned short>(program.size()),
                           .filter = program.data()};
    ASSERT_EQ(0, setsockopt(fd, SOL_SOCKET, SO_ATTACH_FILTER, &attached, sizeof attached))
        << strerror(errno);
    sockaddr_ll link = {};
    link.sll_family = AF_PACKET;
    link.sll_protocol = htons(3);
    link.sll_ifindex = static_cast<int>(if_nametoindex("eth0"));
    ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr *>(&link), sizeof link)) << strerror(errno);

    const std::string last = test_frame(60, '!');
    for (const FrameCase &row : cases) {
        send_frame("eth1", row.frame);
        send_frame("eth1", last);
        bool seen = false;
        for (;;) {
            char buffer[2048];
            ssize_t n = recv(fd, buffer, sizeof buffer, 0);
            ASSERT_GT(n, 0) << strerror(errno);
            std::string frame(buffer, static_cast<size_t>(n));
            if (frame == last)
                break;
            EXPECT_EQ(row.frame, frame) << row.name;
            seen = true;
        }
        EXPECT_EQ(row.passes, seen) << row.name;
    }
    close(fd);
}

// The connection's two port pairs as they stand in frames, ours to the client first.
void ports_of(const TcpConnection &connection, uint32_t *to_peer, uint32_t *from_peer) {
    sockaddr_storage own = {};
    sockaddr_storage peer = {};
    socklen_t size = sizeof own;
    ASSERT_EQ(0, getsockname(connection.server, reinterpret_cast<sockaddr *>(&own), &size));
    size = sizeof peer;
    ASSERT_EQ(0, getsockname(connection.client, reinterpret_cast<sockaddr *>(&peer), &size));
    *to_peer = uint32_t{port_of(own)} * 65536 + port_of(peer);
    *from_peer = uint32_t{port_of(peer)} * 65536 + port_of(own);
}

void expect_filter_of_connection(const std::string &listen_on, const std::string &connect_to,
                                 std::vector<Instruction> expected, size_t first_port_jump) {
    TcpConnection connection;
    connect_tcp(listen_on, connect_to, &connection);
    if (testing::Test::IsSkipped() || testing::Test::HasFatalFailure())
        return;
    ports_of(connection, &expected[first_port_jump].k, &expected[first_port_jump + 1].k);
    unsigned length = 77;
    sock_filter *program = make_connection_filter(connection.server, &length);
    ASSERT_NE(nullptr, program);
    EXPECT_EQ(expected, listing(Program(program, program + length)));
    free(program);
}

void expect_no_filter(int fd) {
    unsigned length = 77;
    EXPECT_EQ(nullptr, make_connection_filter(fd, &length));
    EXPECT_EQ(77u, length);
}

const SandboxOptions WITH_ETH0 = {.eth0 = true};

}  // namespace

TEST(BuildConnectionFilter, HasEightInstructionsForIpv4) {
    EXPECT_EQ(IPV4_LISTING, listing(build(address("10.99.0.1", 80), address("10.99.0.2", 49153))));
}

TEST(BuildConnectionFilter, HasNineInstructionsForIpv6) {
    EXPECT_EQ(IPV6_LISTING, listing(build(address("fd00::1", 80), address("fd00::2", 49153))));
}

TEST(BuildConnectionFilter, UsesTheIpv4FormForAMappedPeer) {
    EXPECT_EQ(IPV4_LISTING,
              listing(build(address("::ffff:10.99.0.1", 80), address("::ffff:10.99.0.2", 49153))));
}

TEST(BuildConnectionFilter, TakesOnlyExactlyMappedAddressesForIpv4) {
    for (const char *peer : {"::10.99.0.2", "::fffe:10.99.0.2", "::1:ffff:10.99.0.2",
                             "1::ffff:10.99.0.2", "0:0:0:1::ffff:a63:2", "::ffff:0:a63:2"})
        EXPECT_EQ(IPV6_LISTING, listing(build(address("fd00::1", 80), address(peer, 49153))))
            << peer;
}

TEST(BuildConnectionFilter, LooksAtThePeerAndNotAtTheOwnEndForMappedAddresses) {
    EXPECT_EQ(IPV6_LISTING,
              listing(build(address("::ffff:10.99.0.1", 80), address("fd00::2", 49153))));
}

TEST(BuildConnectionFilter, IsNoneForDifferentOrUnknownFamilies) {
    EXPECT_TRUE(build(address("10.99.0.1", 80), address("fd00::2", 49153)).empty());
    EXPECT_TRUE(build(address("fd00::2", 80), address("10.99.0.1", 49153)).empty());
    sockaddr_storage local = {};
    local.ss_family = AF_UNIX;
    EXPECT_TRUE(build(local, local).empty());
    EXPECT_TRUE(build(sockaddr_storage{}, sockaddr_storage{}).empty());
}

TEST(ConnectionFilter, DropsIpv4FramesOfEitherDirectionAndPassesOthers) {
    expect_filtered(build(address("10.99.0.1", 80), address("10.99.0.2", 49153)), ipv4_cases());
}

TEST(ConnectionFilter, DropsMappedConnectionsByTheirIpv4Frames) {
    expect_filtered(build(address("::ffff:10.99.0.1", 80), address("::ffff:10.99.0.2", 49153)),
                    ipv4_cases());
}

TEST(ConnectionFilter, DropsIpv6TcpFramesOfEitherDirectionAndPassesOthers) {
    expect_filtered(build(address("fd00::1", 80), address("fd00::2", 49153)), ipv6_cases());
}

TEST(ConnectionFilter, HasTheSameEffectInTheKernelForIpv4) {
    run_in_sandbox(
        [] {
            expect_filtered_by_kernel(build(address("10.99.0.1", 80), address("10.99.0.2", 49153)),
                                      ipv4_cases());
        },
        WITH_ETH0);
}

TEST(ConnectionFilter, HasTheSameEffectInTheKernelForIpv6) {
    run_in_sandbox(
        [] {
            expect_filtered_by_kernel(build(address("fd00::1", 80), address("fd00::2", 49153)),
                                      ipv6_cases());
        },
        WITH_ETH0);
}

TEST(MakeConnectionFilter, TakesThePortsOfAnIpv4Connection) {
    expect_filter_of_connection("127.0.0.1", "127.0.0.1", IPV4_LISTING, 4);
}

TEST(MakeConnectionFilter, TakesThePortsOfAnIpv6Connection) {
    expect_filter_of_connection("::1", "::1", IPV6_LISTING, 5);
}

TEST(MakeConnectionFilter, TakesThePortsOfAnIpv4ClientOfAnIpv6Server) {
    expect_filter_of_connection("::", "127.0.0.1", IPV4_LISTING, 4);
}

TEST(MakeConnectionFilter, IsNoneWhenTheDescriptorIsNotOpen) {
    expect_no_filter(-1);
}

TEST(MakeConnectionFilter, IsNoneForAPipe) {
    int ends[2];
    ASSERT_EQ(0, pipe(ends));
    expect_no_filter(ends[1]);
    close(ends[0]);
    close(ends[1]);
}

TEST(MakeConnectionFilter, IsNoneForASocketThatIsNotConnected) {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_GE(fd, 0);
    expect_no_filter(fd);
    close(fd);
}

TEST(MakeConnectionFilter, IsNoneForALocalSocket) {
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    expect_no_filter(ends[0]);
    close(ends[0]);
    close(ends[1]);
}
