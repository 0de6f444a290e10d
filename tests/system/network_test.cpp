// Captures of real traffic: on the interface that a machine sets aside for tests (the emulated
// board does; FIELDKIT_NETWORK names it), and of an archive that goes out over the interface that
// it captures on.
#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "support/far_network.h"
#include "support/packets.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

constexpr uint16_t ECHO_PORT = 7;
const std::string GATEWAY = "10.0.2.2";
const std::string ECHO_HOST = "10.0.2.100";
const SandboxOptions ON_THE_NETWORK = {.own_network = false};

// ---- Connections

// Connects as soon as somebody listens; -1, with errno set, when nobody does.
int connect_to(const std::string &host, uint16_t port, int timeout_s) {
    const sockaddr_storage to = address(host, port);
    int fd = -1;
    wait_until(
        [&] {
            fd = socket(to.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
            if (connect(fd, reinterpret_cast<const sockaddr *>(&to), sizeof to) == 0)
                return true;
            const int error = errno;
            close(fd);
            fd = -1;
            errno = error;
            return false;
        },
        timeout_s);
    return fd;
}

uint16_t own_port(int fd) {
    sockaddr_storage own = {};
    socklen_t size = sizeof own;
    EXPECT_EQ(0, getsockname(fd, reinterpret_cast<sockaddr *>(&own), &size));
    return port_of(own);
}

// Both ends of a TCP connection. What is written at the near one comes out at the far one, which is
// the same one when it is the echo service that is spoken to.
struct Connection {
    int near = -1;
    int far = -1;
};

// A process that says something over a connection, over and over, in both directions.
class Talker {
  public:
    Talker(const Connection &over, unsigned pause_us) : pid_(fork()) {
        if (pid_ != 0)
            return;
        char text[64];
        while (write(over.near, "something\n", 10) == 10 && read(over.far, text, sizeof text) > 0) {
            if (over.far != over.near && (write(over.far, "something\n", 10) != 10 ||
                                          read(over.near, text, sizeof text) <= 0))
                break;
            usleep(pause_us);
        }
        _exit(1);
    }
    ~Talker() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    Talker(const Talker &) = delete;
    Talker &operator=(const Talker &) = delete;

  private:
    pid_t pid_;
};

// ---- Frames

unsigned half_word(const std::string &frame, size_t at) {
    return frame.size() < at + 2
               ? 0
               : static_cast<uint8_t>(frame[at]) * 256u + static_cast<uint8_t>(frame[at + 1]);
}

// Where the TCP header of a frame begins; 0 when it has none.
size_t tcp_header(const std::string &frame) {
    if (frame.size() < 54)
        return 0;
    if (half_word(frame, 12) == 0x0800 && frame[23] == 6)
        return 14 + 4 * (static_cast<size_t>(frame[14]) & 15);
    return half_word(frame, 12) == 0x86dd && frame[20] == 6 ? 54 : 0;
}

// How many of them belong to the TCP connection with this port of ours.
long count_of_port(const std::vector<std::string> &frames, uint16_t port) {
    return std::count_if(frames.begin(), frames.end(), [port](const std::string &frame) {
        const size_t at = tcp_header(frame);
        return at != 0 && (half_word(frame, at) == port || half_word(frame, at + 2) == port);
    });
}

std::vector<std::string> captured_frames(const std::string &archive) {
    const std::vector<TarMember> members = read_tar(archive);
    for (const TarMember &member : members) {
        if (member.name.find("/netdump.cap") != std::string::npos) {
            EXPECT_EQ(512000u, member.data.size());
            return frames_of(member.data);
        }
    }
    ADD_FAILURE() << "the archive has no capture";
    return {};
}

// ---- An archive that goes out over the interface that it captures on

// Makes an archive onto `own`, while something goes over `other`, and looks into what comes out.
void expect_own_connection_hidden(const Connection &own, const Connection &other) {
    Talker talker(other, 50000);

    const pid_t archive = fork();
    if (archive == 0) {
        dup2(own.near, STDOUT_FILENO);
        dup2(open("/dev/null", O_WRONLY), STDERR_FILENO);
        execl(fieldkit_path().c_str(), "fieldkit", "debugar.cgi", "-dt", "-p", "/nonexistent",
              nullptr);
        _exit(127);
    }
    std::string stream;
    int status = -1;
    bool running = true;
    const bool ended = wait_until(
        [&] {
            char block[65536];
            ssize_t n;
            while ((n = recv(own.far, block, sizeof block, MSG_DONTWAIT)) > 0)
                stream.append(block, static_cast<size_t>(n));
            if (running && waitpid(archive, &status, WNOHANG) == archive) {
                running = false;
                shutdown(own.near, SHUT_WR);
            }
            return n == 0;
        },
        60);
    EXPECT_TRUE(ended);
    EXPECT_EQ(0, status);
    const std::vector<std::string> frames = captured_frames(stream);
    // Those that come between the socket's binding and its filter are seen, like one or two that
    // were under way; without a filter the capture would be full of itself.
    EXPECT_GT(5, count_of_port(frames, own_port(own.near)));
    EXPECT_LT(10, count_of_port(frames, own_port(other.near)));
}

// A socket of that network that listens on port 7 of `host`.
int listen_far_away(const FarNetwork &network, const std::string &host) {
    const sockaddr_storage at = address(host, ECHO_PORT);
    const int listener = network.make_socket(at.ss_family, SOCK_STREAM);
    EXPECT_EQ(0, bind(listener, reinterpret_cast<const sockaddr *>(&at), sizeof at))
        << strerror(errno);
    EXPECT_EQ(0, listen(listener, 2));
    return listener;
}

// In a sandbox, with the other end of eth0's cable in a network of its own. The archive's reader is
// the process that starts it, which it does not trace: it would stop the one that it waits for.
void expect_hidden_in_a_sandbox(const std::string &near, const std::string &far) {
    run_in_sandbox(
        [&] {
            std::string far_address = far;
            if (near.find(':') != std::string::npos) {
                if (access("/proc/sys/net/ipv6/conf/eth0", F_OK) != 0)
                    GTEST_SKIP() << "this kernel has no IPv6";
                far_address += " nodad";
                sandbox_shell("echo 0 >/proc/sys/net/ipv6/conf/eth0/disable_ipv6; ip addr add " +
                              near + " dev eth0 nodad");
            }
            const std::string host = far.substr(0, far.find('/'));
            const FarNetwork network(far_address);
            const int listener = listen_far_away(network, host);
            Connection connections[2];
            for (Connection &connection : connections) {
                connection.near = connect_to(host, ECHO_PORT, 20);
                ASSERT_LE(0, connection.near) << strerror(errno);
                connection.far = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
                ASSERT_LE(0, connection.far) << strerror(errno);
            }
            expect_own_connection_hidden(connections[0], connections[1]);
        },
        {.eth0 = true});
}

TEST(ArchiveOverTheNetwork, DoesNotCaptureItsOwnIpv4Connection) {
    expect_hidden_in_a_sandbox("10.99.0.1/24", "10.99.0.2/24");
}

TEST(ArchiveOverTheNetwork, DoesNotCaptureItsOwnIpv6Connection) {
    expect_hidden_in_a_sandbox("fd00:99::1/64", "fd00:99::2/64");
}

// ---- The machine's own interface

Connection connect_to_echo() {
    const int fd = connect_to(ECHO_HOST, ECHO_PORT, 20);
    EXPECT_LE(0, fd) << strerror(errno);
    return {fd, fd};
}

class OnTheNetwork : public testing::Test {
  protected:
    void SetUp() override {
        const char *name = getenv("FIELDKIT_NETWORK");
        if (name == nullptr)
            GTEST_SKIP() << "this machine sets no network aside for tests (FIELDKIT_NETWORK)";
        interface_ = name;
        // One test at a time.
        lock_ = open("/tmp/fieldkit-network.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        ASSERT_EQ(0, flock(lock_, LOCK_EX)) << strerror(errno);
        ASSERT_FALSE(promiscuous());
    }
    void TearDown() override {
        if (lock_ < 0)
            return;
        bring_up();
        set_link_promiscuous(interface_, false);
        close(lock_);
    }

    void bring_up() const {
        set_link_up(interface_, true);
        EXPECT_TRUE(wait_until([&] { return attribute("carrier") == "1\n"; }));
    }
    std::string attribute(const std::string &name) const {
        return read_whole_file("/sys/class/net/" + interface_ + "/" + name);
    }
    // As the kernel tells it to everybody.
    bool promiscuous() const {
        return (strtoul(attribute("flags").c_str(), nullptr, 16) & 0x100) != 0;
    }
    std::vector<std::string> pcapdump(const std::string &path) const {
        return {fieldkit_path(), "pcapdump", interface_, path};
    }
    // Ends as soon as it begins.
    void run_short_capture() const { EXPECT_EQ(0, run_program(pcapdump("/dev/full")).exit_status); }

    std::string interface_;
    int lock_ = -1;
};

struct FrameKind {
    const char *name;
    size_t at;
    std::string bytes;
    std::string later;  // anywhere behind them
};

bool is_of_kind(const std::string &frame, const FrameKind &kind) {
    return frame.size() > kind.at && frame.compare(kind.at, kind.bytes.size(), kind.bytes) == 0 &&
           frame.find(kind.later, kind.at) != std::string::npos;
}

TEST_F(OnTheNetwork, PcapdumpRecordsWhatGoesToTheGatewayAndComesBack) {
    TempDir dir;
    const std::string path = dir / "dump";
    Background dump(pcapdump(path));
    ASSERT_TRUE(wait_until(
        [&] { return access(path.c_str(), F_OK) == 0 && read_whole_file(path).size() >= 24; }));
    EXPECT_TRUE(promiscuous());

    // Forgotten addresses have to be asked for again.
    sandbox_shell("ip neigh flush dev " + interface_);
    sandbox_shell("ping -c 1 " + GATEWAY);
    EXPECT_EQ(-1, connect_to(GATEWAY, 1, 0));
    EXPECT_EQ(ECONNREFUSED, errno);
    const int fd = connect_to(ECHO_HOST, ECHO_PORT, 20);
    ASSERT_LE(0, fd);
    ASSERT_EQ(9, write(fd, "an answer", 9));
    char answer[9];
    EXPECT_EQ(9, recv(fd, answer, sizeof answer, MSG_WAITALL));
    close(fd);

    const std::string ours = from_hex("0a00020f");
    const std::string gateway = from_hex("0a000202");
    const std::string echo_host = from_hex("0a000264");
    const std::vector<FrameKind> kinds = {
        {"question for an address", 12, from_hex("0806 0001 0800 06 04 0001"), gateway},
        {"answer with an address", 12, from_hex("0806 0001 0800 06 04 0002"), gateway},
        {"ping", 26, ours + gateway + from_hex("08"), ""},
        {"its answer", 26, gateway + ours + from_hex("00"), ""},
        {"beginning of a connection", 26, ours + gateway, from_hex("0001")},
        {"its refusal", 26, gateway + ours + from_hex("0001"), ""},
        {"text on a connection", 26, ours + echo_host, "an answer"},
        {"its echo", 26, echo_host + ours + from_hex("0007"), "an answer"},
    };
    for (const FrameKind &kind : kinds) {
        EXPECT_TRUE(wait_until([&] {
            const std::vector<std::string> frames = frames_of(read_whole_file(path));
            return std::any_of(frames.begin(), frames.end(),
                               [&](const std::string &frame) { return is_of_kind(frame, kind); });
        })) << kind.name;
    }

    set_link_up(interface_, false);
    EXPECT_EQ(0, dump.wait().exit_status);
    EXPECT_FALSE(promiscuous());
    const PcapTestStream whole = parse_pcap(read_whole_file(path));
    EXPECT_EQ("", whole.rest);
    for (const PcapTestRecord &record : whole.records)
        EXPECT_EQ(record.original_length, record.captured_length);
}

TEST_F(OnTheNetwork, ACaptureThatCannotBeWrittenLeavesNoPromiscuousMode) {
    set_link_promiscuous(interface_, true);
    run_short_capture();
    EXPECT_FALSE(promiscuous());
}

// Whoever kills a capture leaves nobody to clear the flag.
TEST_F(OnTheNetwork, PromiscuousModeOutlivesAKilledCaptureUntilTheNextOneEnds) {
    for (int signo : {SIGINT, SIGTERM, SIGKILL}) {
        Background dump(pcapdump("/dev/null"));
        ASSERT_TRUE(wait_until([&] { return promiscuous(); }));
        dump.send_signal(signo);
        EXPECT_EQ(signo, dump.wait().signal);
        EXPECT_TRUE(promiscuous()) << signo;
        run_short_capture();
        EXPECT_FALSE(promiscuous()) << signo;
    }
}

TEST_F(OnTheNetwork, TheTimeLimitOfACaptureLeavesNoPromiscuousMode) {
    run_in_sandbox(
        [&] {
            const RunResult result = run_fieldkit({"debugar.cgi", "-dt", "-p", "/nonexistent"});
            EXPECT_GT(300u, captured_frames(result.out).size());
            EXPECT_FALSE(promiscuous());
        },
        ON_THE_NETWORK);
}

TEST_F(OnTheNetwork, TheSizeLimitOfACaptureLeavesNoPromiscuousMode) {
    run_in_sandbox(
        [&] {
            Talker talker(connect_to_echo(), 2000);
            const RunResult result = run_fieldkit({"debugar.cgi", "-dt", "-p", "/nonexistent"});
            // As many as fit.
            EXPECT_EQ(329u, captured_frames(result.out).size());
            EXPECT_FALSE(promiscuous());
        },
        ON_THE_NETWORK);
}

TEST_F(OnTheNetwork, AReaderThatGoesAwayDuringACaptureLeavesNoPromiscuousMode) {
    run_in_sandbox(
        [&] {
            Talker talker(connect_to_echo(), 10000);
            Background archive({fieldkit_path(), "debugar.cgi", "-dt", "-p", "/nonexistent"});
            while (!promiscuous() && !HasFailure())
                (void)archive.read_line();
            archive.close_output();
            EXPECT_EQ(0, archive.wait().exit_status);
            EXPECT_FALSE(promiscuous());
        },
        ON_THE_NETWORK);
}

}  // namespace
