// What is in the stream of a capture.
#include "pcap/capture.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/time.h>

#include <algorithm>
#include <string>
#include <vector>

#include "capture_run.h"
#include "pcap/connection_filter.h"
#include "support/packets.h"
#include "support/sandbox.h"

namespace {

std::string zeros(size_t count) {
    return std::string(count, '\0');
}

std::string global_header() {
    return from_hex("d4c3b2a1 0200 0400 00000000 00000000 ffff0000 01000000");
}

uint64_t microseconds_now() {
    timeval now;
    gettimeofday(&now, nullptr);
    return static_cast<uint64_t>(now.tv_sec) * 1000000 + static_cast<uint64_t>(now.tv_usec);
}

// Sends a datagram to the discard port of `host`, with this payload.
void send_datagram(const std::string &host, const std::string &payload) {
    sockaddr_storage to = address(host, 9);
    int fd = socket(to.ss_family, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    // Nobody listens: the refusal of an earlier one must not fail this one, so it is not connected.
    EXPECT_EQ(
        static_cast<ssize_t>(payload.size()),
        sendto(fd, payload.data(), payload.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof to))
        << strerror(errno);
    close(fd);
}

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

// Streams a capture of loopback over loopback itself, which would never end if it saw itself.
void expect_connection_hidden(const std::string &listen_on, const std::string &connect_to,
                              size_t protocol_at) {
    TcpConnection connection;
    connect_tcp(listen_on, connect_to, &connection);
    if (testing::Test::IsSkipped() || testing::Test::HasFatalFailure())
        return;
    unsigned length = 0;
    sock_filter *program = make_connection_filter(connection.server, &length);
    ASSERT_NE(nullptr, program);
    const sock_fprog filter = {.len = static_cast<unsigned short>(length), .filter = program};
    {
        CaptureRun run({.interface = "lo", .size_limit = 30000, .filter = &filter},
                       std::exchange(connection.server, -1), std::exchange(connection.client, -1));
        // Each is seen when it is sent and when it is received, and so is the refusal.
        for (int i = 0; i < 20; ++i) {
            send_datagram(connect_to, "datagram number " + std::to_string(i));
            ASSERT_EQ(4, write(run.client(), "ping", 4));
        }
        // Until it is full; by itself the connection would have filled it at once.
        for (int i = 0; i < 60; ++i)
            send_datagram(connect_to, std::string(200, 'x'));
        const std::string stream = run.read_all();
        EXPECT_EQ(30000u, stream.size());
        EXPECT_TRUE(contains(stream, "datagram number 0"));
        EXPECT_TRUE(contains(stream, "datagram number 19"));
        for (const std::string &frame : frames_of(stream)) {
            EXPECT_NE(IPPROTO_TCP, frame.at(protocol_at));
            EXPECT_FALSE(contains(frame, "ping"));
        }
        EXPECT_EQ(30000, run.result());
    }
    free(program);
}

}  // namespace

TEST(CapturePackets, WritesEachFrameAfterARecordHeaderWithItsTime) {
    run_in_sandbox(
        [] {
            const std::vector<std::string> frames = {test_frame(14, 'a'), test_frame(60, 'b'),
                                                     test_frame(1514, 'c')};
            CaptureRun run({});
            uint64_t before = microseconds_now();
            for (const std::string &frame : frames)
                send_frame("eth1", frame);
            const std::string stream = run.read_until(24 + 3 * 16 + 14 + 60 + 1514);
            uint64_t after = microseconds_now();

            PcapTestStream parsed = parse_pcap(stream);
            EXPECT_EQ(global_header(), parsed.header);
            EXPECT_EQ("", parsed.rest);
            ASSERT_EQ(3u, parsed.records.size());
            for (size_t i = 0; i < 3; ++i) {
                const PcapTestRecord &record = parsed.records[i];
                EXPECT_EQ(frames[i], record.data);
                EXPECT_EQ(frames[i].size(), record.captured_length);
                EXPECT_EQ(frames[i].size(), record.original_length);
                EXPECT_LT(record.microseconds, 1000000u);
                uint64_t time = uint64_t{record.seconds} * 1000000 + record.microseconds;
                EXPECT_LE(before, time);
                EXPECT_GE(after, time);
            }
            run.close_client();
            EXPECT_EQ(24 + 3 * 16 + 14 + 60 + 1514, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, SeesWhatTheInterfaceSendsAndWhatOthersReceive) {
    run_in_sandbox(
        [] {
            CaptureRun run({});
            send_frame("eth0", test_frame(60, 'o'));
            // To a station that is not this one.
            std::string other = test_frame(60, 'i');
            other[5] = 0x77;
            send_frame("eth1", other);
            EXPECT_EQ((std::vector<std::string>{test_frame(60, 'o'), other}),
                      frames_of(run.read_until(24 + 2 * 76)));
        },
        WITH_ETH0);
}

TEST(CapturePackets, CutsFramesOf1537BytesAndMoreTo1536) {
    run_in_sandbox(
        [] {
            sandbox_shell("ip link set eth0 mtu 3000 && ip link set eth1 mtu 3000");
            CaptureRun run({});
            for (size_t size : {1536u, 1537u, 2500u})
                send_frame("eth1", test_frame(size, 'l'));
            PcapTestStream parsed = parse_pcap(run.read_until(24 + 3 * 1552));
            ASSERT_EQ(3u, parsed.records.size());
            for (const PcapTestRecord &record : parsed.records) {
                EXPECT_EQ(1536u, record.captured_length);
                EXPECT_EQ(1536u, record.original_length);
                EXPECT_EQ(test_frame(1536, 'l'), record.data);
            }
        },
        WITH_ETH0);
}

TEST(CapturePackets, ACutLengthShortensLongFrames) {
    run_in_sandbox(
        [] {
            CaptureRun run({.cut_length = 20});
            send_frame("eth1", test_frame(300, 'c'));
            PcapTestStream parsed = parse_pcap(run.read_until(24 + 36));
            ASSERT_EQ(1u, parsed.records.size());
            EXPECT_EQ(20u, parsed.records[0].captured_length);
            EXPECT_EQ(300u, parsed.records[0].original_length);
            EXPECT_EQ(test_frame(20, 'c'), parsed.records[0].data);
        },
        WITH_ETH0);
}

TEST(CapturePackets, ACutLengthOf1536MakesEveryRecord16Plus1536Bytes) {
    run_in_sandbox(
        [] {
            // A larger one cannot make them longer than what is kept of a frame.
            for (uint32_t cut_length : {1536u, 1537u, 0xffffffffu}) {
                CaptureRun run({.cut_length = cut_length});
                const std::string first = test_frame(200, 'A');
                const std::string second = test_frame(60, 'B');
                // What the client sends meanwhile goes nowhere.
                const std::string secret(3000, 's');
                ASSERT_EQ(3000, write(run.client(), secret.data(), secret.size()));
                send_frame("eth1", first);
                run.read_until(24 + 1552);
                send_frame("eth1", second);
                PcapTestStream parsed = parse_pcap(run.read_until(24 + 2 * 1552));
                EXPECT_EQ("", parsed.rest);
                ASSERT_EQ(2u, parsed.records.size());
                EXPECT_EQ(1536u, parsed.records[0].captured_length);
                EXPECT_EQ(200u, parsed.records[0].original_length);
                EXPECT_EQ(first + zeros(1336), parsed.records[0].data);
                // After a short frame comes what was there before.
                EXPECT_EQ(1536u, parsed.records[1].captured_length);
                EXPECT_EQ(60u, parsed.records[1].original_length);
                EXPECT_EQ(second + std::string(140, 'A') + zeros(1336), parsed.records[1].data);
            }
        },
        WITH_ETH0);
}

TEST(CapturePackets, ASizeLimitOf1000OnAQuietNetworkGivesOneFillerOf16Plus960) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 1000, .time_limit = 1});
            EXPECT_EQ(
                global_header() + from_hex("00000000 00000000 c0030000 c0030000") + zeros(960),
                run.read_all());
            EXPECT_EQ(1000, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, ARemainderOf32770IsFilledWithTwoRecords) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 24 + 32770, .time_limit = 1});
            EXPECT_EQ(global_header() + from_hex("00000000 00000000 ef3f0000 ef3f0000") +
                          zeros(16367) + from_hex("00000000 00000000 f33f0000 f33f0000") +
                          zeros(16371),
                      run.read_all());
            EXPECT_EQ(32794, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, GivesExactlyTheSizeForLimitsNearTheHeaders) {
    run_in_sandbox(
        [] {
            const struct {
                uint32_t limit;
                std::string stream;
            } CASES[] = {
                {1, global_header()},  // the header is never cut
                {24, global_header()},
                {25, global_header() + zeros(1)},
                {39, global_header() + zeros(15)},
                {40, global_header() + zeros(16)},
                {41, global_header() + from_hex("00000000 00000000 01000000 01000000") + zeros(1)},
            };
            for (const auto &row : CASES) {
                CaptureRun run({.size_limit = row.limit});
                // Without a time limit the first frame ends it: none fits.
                send_frame("eth1", test_frame(14, 'n'));
                EXPECT_EQ(row.stream, run.read_all()) << row.limit;
                EXPECT_EQ(static_cast<int64_t>(row.stream.size()), run.result());
            }
        },
        WITH_ETH0);
}

TEST(CapturePackets, StopsBeforeTheFrameThatLeavesLessThan33BytesForAFiller) {
    run_in_sandbox(
        [] {
            const std::string frame = test_frame(100, 'f');
            {
                CaptureRun run({.size_limit = 24 + 48 + 100});
                send_frame("eth1", frame);
                EXPECT_EQ(
                    global_header() + from_hex("00000000 00000000 84000000 84000000") + zeros(132),
                    run.read_all());
            }
            CaptureRun run({.size_limit = 24 + 48 + 100 + 1});
            send_frame("eth1", frame);
            run.read_until(24 + 116);
            send_frame("eth1", frame);
            const std::string stream = run.read_all();
            EXPECT_EQ(173u, stream.size());
            EXPECT_EQ(frame, stream.substr(40, 100));
            EXPECT_EQ(from_hex("00000000 00000000 11000000 11000000") + zeros(17),
                      stream.substr(140));
            EXPECT_EQ(173, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, FillsUpAfterTheLastFrameThatFits) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 1000, .time_limit = 2147483647});
            for (int i = 0; i < 9; ++i)
                send_frame("eth1", test_frame(100, static_cast<char>('0' + i)));
            const std::string stream = run.read_all();
            EXPECT_EQ(1000u, stream.size());
            PcapTestStream parsed = parse_pcap(stream);
            EXPECT_EQ("", parsed.rest);
            ASSERT_EQ(9u, parsed.records.size());
            for (int i = 0; i < 8; ++i)
                EXPECT_EQ(test_frame(100, static_cast<char>('0' + i)),
                          parsed.records[static_cast<size_t>(i)].data);
            EXPECT_EQ(0u, parsed.records[8].seconds);
            EXPECT_EQ(zeros(32), parsed.records[8].data);
            EXPECT_EQ(1000, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, TheCutLengthAndNotTheFrameCountsForTheSizeLimit) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 24 + 1552 + 40, .cut_length = 1536});
            send_frame("eth1", test_frame(14, 'a'));
            run.read_until(24 + 1552);
            send_frame("eth1", test_frame(14, 'b'));
            EXPECT_EQ(24u + 1552 + 40, run.read_all().size());
            EXPECT_EQ(24 + 1552 + 40, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, CapturesOnAllInterfacesForAnUnknownName) {
    run_in_sandbox(
        [] {
            CaptureRun run({.interface = "nosuch"});
            send_frame("eth1", test_frame(60, 'w'));
            send_datagram("127.0.0.1", "over loopback");
            // Sent by eth1 and received by eth0; sent and received by lo.
            std::vector<std::string> frames =
                frames_of(run.read_until(24 + 2 * 76 + 2 * (16 + 42 + 13)));
            EXPECT_EQ(2, std::count(frames.begin(), frames.end(), test_frame(60, 'w')));
            EXPECT_EQ(2, std::count_if(frames.begin(), frames.end(), [](const std::string &frame) {
                          return contains(frame, "over loopback") && frame.size() == 42 + 13;
                      }));
        },
        WITH_ETH0);
}

TEST(CapturePackets, SeesOnlyItsOwnInterface) {
    run_in_sandbox(
        [] {
            CaptureRun run({.interface = "lo"});
            send_frame("eth1", test_frame(60, 'w'));
            send_datagram("127.0.0.1", "over loopback");
            const std::string stream = run.read_until(24 + 16 + 42 + 13);
            EXPECT_TRUE(contains(parse_pcap(stream).records.at(0).data, "over loopback"));
        },
        WITH_ETH0);
}

TEST(CapturePackets, WorksWithDescriptorsBeyondTheReachOfSelect) {
    run_in_sandbox(
        [] {
            const rlimit many = {.rlim_cur = 3000, .rlim_max = 3000};
            if (setrlimit(RLIMIT_NOFILE, &many) != 0)
                GTEST_SKIP() << "setrlimit: " << strerror(errno);
            int last = open("/dev/null", O_RDONLY | O_CLOEXEC);
            while (last >= 0 && last < 1100)
                last = open("/dev/null", O_RDONLY | O_CLOEXEC);
            ASSERT_EQ(1100, last);
            CaptureRun run({.time_limit = 2147483647});
            EXPECT_GT(run.server(), 1100);
            send_frame("eth1", test_frame(60, 'h'));
            EXPECT_EQ(test_frame(60, 'h'), frames_of(run.read_until(24 + 76)).at(0));
            set_link_up("eth0", false);
            EXPECT_EQ(100, run.result());
        },
        WITH_ETH0);
}

TEST(CapturePackets, HidesTheClientsOwnConnectionOverIpv4) {
    run_in_sandbox([] { expect_connection_hidden("127.0.0.1", "127.0.0.1", 23); });
}

TEST(CapturePackets, HidesTheClientsOwnConnectionOverIpv6) {
    run_in_sandbox([] { expect_connection_hidden("::1", "::1", 20); });
}

TEST(CapturePackets, HidesTheConnectionOfAnIpv4ClientToAnIpv6Server) {
    run_in_sandbox([] { expect_connection_hidden("::", "127.0.0.1", 23); });
}

TEST(CapturePackets, ShowsTheClientsConnectionWithoutAFilter) {
    run_in_sandbox([] {
        TcpConnection connection;
        connect_tcp("127.0.0.1", "127.0.0.1", &connection);
        ASSERT_GE(connection.server, 0);
        CaptureRun run({.interface = "lo", .size_limit = 20000},
                       std::exchange(connection.server, -1), std::exchange(connection.client, -1));
        const std::vector<std::string> frames = frames_of(run.read_all());
        ASSERT_FALSE(frames.empty());
        EXPECT_EQ(IPPROTO_TCP, frames[0].at(23));
        EXPECT_EQ(20000, run.result());
    });
}
