#include "proc/descriptors.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

std::string describe(int fd) {
    char buf[512] = "(untouched)";
    int length = describe_fd(getpid(), fd, buf, sizeof buf);
    if (length == -1)
        return std::string("-1 ") + buf;
    EXPECT_EQ(length, static_cast<int>(std::string(buf).size()));
    return buf;
}

// "socket:[INODE]" of a descriptor.
std::string link_text(int fd) {
    struct stat status;
    EXPECT_EQ(0, fstat(fd, &status));
    return "socket:[" + std::to_string(status.st_ino) + "]";
}

// A listening socket of `family` on the loopback address, and its port.
UniqueFd listen_on_loopback(int family, int *port) {
    UniqueFd fd(socket(family, SOCK_STREAM, 0));
    sockaddr_in6 address6 = {};
    address6.sin6_family = AF_INET6;
    address6.sin6_addr = in6addr_loopback;
    sockaddr_in address4 = {};
    address4.sin_family = AF_INET;
    address4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bool v4 = family == AF_INET;
    const sockaddr *address =
        v4 ? reinterpret_cast<sockaddr *>(&address4) : reinterpret_cast<sockaddr *>(&address6);
    EXPECT_EQ(0, bind(fd.get(), address, v4 ? sizeof address4 : sizeof address6));
    EXPECT_EQ(0, listen(fd.get(), 1));
    sockaddr_storage bound;
    socklen_t length = sizeof bound;
    EXPECT_EQ(0, getsockname(fd.get(), reinterpret_cast<sockaddr *>(&bound), &length));
    // The port stands at the same place in both.
    *port = ntohs(reinterpret_cast<sockaddr_in *>(&bound)->sin_port);
    return fd;
}

int local_port(int fd) {
    sockaddr_storage bound;
    socklen_t length = sizeof bound;
    EXPECT_EQ(0, getsockname(fd, reinterpret_cast<sockaddr *>(&bound), &length));
    return ntohs(reinterpret_cast<sockaddr_in *>(&bound)->sin_port);
}

UniqueFd connect_to(int listener) {
    sockaddr_storage peer;
    socklen_t length = sizeof peer;
    EXPECT_EQ(0, getsockname(listener, reinterpret_cast<sockaddr *>(&peer), &length));
    UniqueFd fd(socket(peer.ss_family, SOCK_STREAM, 0));
    EXPECT_EQ(0, connect(fd.get(), reinterpret_cast<sockaddr *>(&peer), length));
    return fd;
}

UniqueFd unix_listener(const std::string &path, bool abstract) {
    UniqueFd fd(socket(AF_UNIX, SOCK_STREAM, 0));
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path + (abstract ? 1 : 0), path.size());
    socklen_t length =
        static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + path.size() + (abstract ? 1 : 0));
    EXPECT_EQ(0, bind(fd.get(), reinterpret_cast<sockaddr *>(&address), length));
    EXPECT_EQ(0, listen(fd.get(), 1));
    return fd;
}

TEST(ListFds, GivesTheOpenDescriptorsUpToTheMaximum) {
    UniqueFd first(open("/dev/null", O_RDONLY));
    UniqueFd second(open("/dev/null", O_RDONLY));
    int fds[1024];
    int count = list_fds(getpid(), fds, 1024);
    std::vector<int> listed(fds, fds + count);
    for (int fd : {0, 1, 2, first.get(), second.get()})
        EXPECT_NE(listed.end(), std::find(listed.begin(), listed.end(), fd)) << fd;
    fds[2] = -7;
    EXPECT_EQ(2, list_fds(getpid(), fds, 2));
    EXPECT_EQ(-7, fds[2]);
    EXPECT_EQ(0, list_fds(0x7fffffff, fds, 1024));
}

TEST(DescribeFd, ShowsAFilesPath) {
    UniqueFd fd(open("/dev/null", O_RDONLY));
    EXPECT_EQ("/dev/null", describe(fd.get()));
}

TEST(DescribeFd, ShowsAPipesNumber) {
    int ends[2];
    ASSERT_EQ(0, pipe(ends));
    struct stat status;
    ASSERT_EQ(0, fstat(ends[0], &status));
    EXPECT_EQ("pipe:[" + std::to_string(status.st_ino) + "]", describe(ends[0]));
    close(ends[0]);
    close(ends[1]);
}

TEST(DescribeFd, LeavesTheBufferAloneWhenThereIsNoSuchDescriptor) {
    EXPECT_EQ("-1 (untouched)", describe(987));
}

TEST(DescribeFd, FollowsADescriptorThatBecomesAnother) {
    UniqueFd fd(open("/dev/null", O_RDONLY));
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ("/dev/null", describe(fd.get()));
    UniqueFd other(open("/dev/zero", O_RDONLY));
    ASSERT_EQ(fd.get(), dup2(other.get(), fd.get()));
    EXPECT_EQ("/dev/zero", describe(fd.get()));
    int number = fd.get();
    fd.reset();
    EXPECT_EQ("-1 (untouched)", describe(number));
    forget_last_process();
}

TEST(DescribeFd, KeepsOneDescriptorForOneProcessAndNoneInTheEnd) {
    forget_last_process();
    int fds[1024];
    int before = list_fds(getpid(), fds, 1024);
    (void)describe(0);
    EXPECT_EQ(before, list_fds(getpid(), fds, 1024)) << "also for one that is asked for once";
    (void)describe(0);
    (void)describe(1);
    EXPECT_EQ(before + 1, list_fds(getpid(), fds, 1024));
    forget_last_process();
    EXPECT_EQ(before, list_fds(getpid(), fds, 1024));
}

// In the sandbox a process can get the number of another one that has just gone.
TEST(DescribeFd, TellsAProcessFromAnotherThatHasTakenItsNumber) {
    run_in_sandbox([] {
        auto start = [](const char *path) {
            pid_t pid = fork();
            if (pid == 0) {
                int fd = open(path, O_RDONLY);
                dup2(fd, 100);
                pause();
            }
            return pid;
        };
        auto shown = [](pid_t pid) {
            char buf[512] = "";
            return describe_fd(pid, 100, buf, sizeof buf) > 0 ? std::string(buf) : "";
        };
        pid_t first = start("/dev/null");
        EXPECT_TRUE(wait_until([&] { return shown(first) == "/dev/null"; }));
        EXPECT_EQ("/dev/null", shown(first));
        kill(first, SIGKILL);
        waitpid(first, nullptr, 0);
        EXPECT_EQ("", shown(first));
        std::ofstream("/proc/sys/kernel/ns_last_pid") << first - 1;
        pid_t second = start("/dev/zero");
        if (second != first)
            GTEST_SKIP() << "this kernel gives no chosen process number";
        EXPECT_TRUE(wait_until([&] { return shown(second) == "/dev/zero"; }));
        kill(second, SIGKILL);
        waitpid(second, nullptr, 0);
    });
}

TEST(DescribeFd, ShowsAListeningSocketWithTheRemoteSideZero) {
    run_in_sandbox([] {
        forget_last_process();
        int port;
        UniqueFd fd = listen_on_loopback(AF_INET, &port);
        EXPECT_EQ(link_text(fd.get()) + "[127.0.0.1:" + std::to_string(port) +
                      " -> 0.0.0.0:0][TCP_LISTEN]",
                  describe(fd.get()));
    });
}

TEST(DescribeFd, ShowsAConnectionsEndsAndState) {
    run_in_sandbox([] {
        forget_last_process();
        int port;
        UniqueFd listener = listen_on_loopback(AF_INET, &port);
        UniqueFd client = connect_to(listener.get());
        EXPECT_EQ(link_text(client.get()) +
                      "[127.0.0.1:" + std::to_string(local_port(client.get())) +
                      " -> 127.0.0.1:" + std::to_string(port) + "][TCP_ESTABLISHED]",
                  describe(client.get()));
    });
}

TEST(DescribeFd, ShowsAnIpv6Connection) {
    run_in_sandbox([] {
        forget_last_process();
        int port;
        UniqueFd listener = listen_on_loopback(AF_INET6, &port);
        UniqueFd client = connect_to(listener.get());
        EXPECT_EQ(link_text(client.get()) +
                      "[0:0:0:0:0:0:0:1:" + std::to_string(local_port(client.get())) +
                      " -> 0:0:0:0:0:0:0:1:" + std::to_string(port) + "][TCP_ESTABLISHED]",
                  describe(client.get()));
    });
}

TEST(DescribeFd, ShowsAUnixSocketsPath) {
    TempDir dir;
    UniqueFd fd = unix_listener(dir / "app.sock", false);
    EXPECT_EQ(link_text(fd.get()) + "[" + (dir / "app.sock") + "]", describe(fd.get()));
}

TEST(DescribeFd, ShowsAnAbstractUnixSocketWithAnAtSign) {
    std::string name = "fieldkit-test-" + std::to_string(getpid());
    UniqueFd fd = unix_listener(name, true);
    EXPECT_EQ(link_text(fd.get()) + "[@" + name + "]", describe(fd.get()));
}

TEST(DescribeFd, ShowsAnUnnamedUnixSocketAsTheLinkAlone) {
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
    EXPECT_EQ(link_text(ends[0]), describe(ends[0]));
    close(ends[0]);
    close(ends[1]);
}

TEST(DescribeFd, ShowsADatagramSocketAsTheLinkAlone) {
    UniqueFd fd(socket(AF_INET, SOCK_DGRAM, 0));
    EXPECT_EQ(link_text(fd.get()), describe(fd.get()));
}

TEST(DescribeFd, ReportsMoreThanFitsWhenASocketsTextIsCut) {
    run_in_sandbox([] {
        forget_last_process();
        int port;
        UniqueFd fd = listen_on_loopback(AF_INET, &port);
        std::string whole = describe(fd.get());
        for (size_t size = link_text(fd.get()).size() + 1; size < whole.size() + 2; ++size) {
            std::string buf(size + 1, '#');
            EXPECT_EQ(static_cast<int>(whole.size()),
                      describe_fd(getpid(), fd.get(), buf.data(), size));
            EXPECT_EQ(whole.substr(0, size - 1), buf.c_str());
            EXPECT_EQ('#', buf[size]);
        }
    });
}

// Made-up tables.
struct Tables {
    TempDir dir;
    std::string find(unsigned long inode) const {
        char buf[300] = "(nothing)";
        int length = describe_socket_inode_in(dir.path().c_str(), inode, buf, sizeof buf);
        // What a snapshot holds is the same.
        char from_snapshot[300] = "(nothing)";
        SocketSnapshot snapshot(dir.path().c_str());
        for (int i = 0; i < 2; ++i)
            EXPECT_EQ(length, snapshot.describe(inode, from_snapshot, sizeof from_snapshot));
        EXPECT_STREQ(buf, from_snapshot);
        return std::to_string(length) + " " + buf;
    }
};

const char TCP_LINE[] =
    "   1: 0200000A:0050 0900000A:C886 01 00000000:00000000 00:00000000 00000000  1000        0 "
    "4711 1 0000000000000000 20 4 30 10 -1                     \n";

TEST(DescribeSocketInode, FindsNothingInMissingTables) {
    Tables tables;
    EXPECT_EQ("0 (nothing)", tables.find(4711));
}

TEST(DescribeSocketInode, SearchesTcpBeforeUnixAndGoesOnPastAMissingTable) {
    Tables tables;
    tables.dir.file("unix",
                    "Num       RefCount Protocol Flags    Type St Inode Path\n"
                    "00000000: 00000002 00000000 00010000 0001 01 4711 /run/a\n"
                    "00000000: 00000002 00000000 00010000 0001 01 4712\n"
                    "00000000: 00000002 00000000 00010000 0001 01 4712 /run/b\n");
    EXPECT_EQ("8 [/run/a]", tables.find(4711));
    EXPECT_EQ("0 (nothing)", tables.find(4712)) << "the first matching line ends the search";
    tables.dir.file("tcp", TCP_LINE);
    EXPECT_EQ("48 [10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]", tables.find(4711));
}

TEST(DescribeSocketInode, MatchesThePiecesOfALineLongerThan255Characters) {
    Tables tables;
    std::string filler(255, 'x');
    tables.dir.file("unix", filler + "0: 2 0 0 1 1 4711 /run/tail\n");
    EXPECT_EQ("11 [/run/tail]", tables.find(4711));
    std::string path(300, 'p');
    tables.dir.file("unix", "0: 2 0 0 1 1 4711 " + path + "\n");
    EXPECT_EQ("239 [" + path.substr(0, 237) + "]", tables.find(4711));
}

TEST(DescribeSocketInode, SurvivesTablesOfNoise) {
    Tables tables;
    unsigned seed = 1;
    for (int round = 0; round < 50; ++round) {
        std::string noise(3000, '\0');
        for (char &c : noise)
            c = static_cast<char>(rand_r(&seed) % 4 == 0 ? ' ' : rand_r(&seed));
        for (const char *name : {"tcp", "tcp6", "unix"})
            tables.dir.file(name, noise);
        (void)tables.find(static_cast<unsigned long>(round));
    }
}

TEST(SocketSnapshot, HoldsTablesOfThousandsOfLines) {
    Tables tables;
    std::string tcp, tcp6, unix_table;
    for (int i = 2000; i > 0; --i) {
        char line[256];
        (void)snprintf(
            line, sizeof line,
            "%4d: 0200000A:%04X 0900000A:C886 01 00000000:00000000 00:00000000 00000000  "
            "1000        0 %d 1 0000000000000000 20 4 30 10 -1\n",
            i, i, i * 7);
        tcp += line;
        (void)snprintf(line, sizeof line,
                       "00000000: 00000002 00000000 00010000 0001 01 %d /run/%d\n", i * 5, i);
        unix_table += line;
    }
    tables.dir.file("tcp", tcp);
    tables.dir.file("unix", unix_table);
    SocketSnapshot snapshot(tables.dir.path().c_str());
    for (unsigned long inode = 0; inode < 15000; inode += 5) {
        char expected[128] = "", actual[128] = "";
        if (inode % 500 == 0 || inode % 35 == 0)
            (void)describe_socket_inode_in(tables.dir.path().c_str(), inode, expected, 128);
        else
            continue;
        (void)snapshot.describe(inode, actual, 128);
        EXPECT_STREQ(expected, actual);
    }
}

TEST(SocketSnapshot, LeavesTablesThatAreTooLargeToASearch) {
    Tables tables;
    std::string line = "00000000: 00000002 00000000 00010000 0001 01 4711 /run/a\n";
    std::string text;
    while (text.size() < 4 * 1024 * 1024)
        text += line;
    tables.dir.file("unix", text);
    SocketSnapshot snapshot(tables.dir.path().c_str());
    char buf[100];
    EXPECT_EQ(NO_MATCH, snapshot.describe(4711, buf, sizeof buf));
    EXPECT_EQ(NO_MATCH, snapshot.describe(4711, buf, sizeof buf));
}

TEST(SocketSnapshot, ShowsWhatTheKernelShows) {
    run_in_sandbox([] {
        forget_last_process();
        int port;
        UniqueFd listener = listen_on_loopback(AF_INET, &port);
        UniqueFd client = connect_to(listener.get());
        SocketSnapshot snapshot;
        for (int fd : {listener.get(), client.get()}) {
            char buf[512];
            int length = describe_fd(getpid(), fd, buf, sizeof buf, &snapshot);
            EXPECT_EQ(describe(fd), buf);
            EXPECT_EQ(static_cast<int>(strlen(buf)), length);
        }
    });
}

}  // namespace
