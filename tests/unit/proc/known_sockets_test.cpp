// What is told of a socket that was seen before is what a search of the tables tells.
#include "proc/known_sockets.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "proc/descriptors.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

unsigned long inode_of(const UniqueFd &fd) {
    struct stat status = {};
    EXPECT_EQ(0, fstat(fd.get(), &status));
    return static_cast<unsigned long>(status.st_ino);
}

std::string text(const std::function<int(char *, size_t)> &describe) {
    char buf[300] = "(nothing)";
    int length = describe(buf, sizeof buf);
    return std::to_string(length) + " " + buf;
}

std::string by_tables(unsigned long inode) {
    return text([=](char *buf, size_t size) {
        return describe_socket_inode_in("/proc/net", inode, buf, size);
    });
}

std::string as_shown(unsigned long inode) {
    return text(
        [=](char *buf, size_t size) { return describe_socket_inode(getpid(), inode, buf, size); });
}

std::string from_memory(unsigned long inode) {
    return text([=](char *buf, size_t size) { return describe_known_socket(inode, buf, size); });
}

// Holds the two against each other twice, so that the second time comes from memory, and gives
// what both say.
std::string both(const UniqueFd &fd) {
    unsigned long inode = inode_of(fd);
    std::string expected = by_tables(inode);
    EXPECT_EQ(expected, as_shown(inode));
    EXPECT_EQ(expected, as_shown(inode));
    return expected;
}

// The other end's answer takes a moment, also on loopback.
void await(const UniqueFd &fd, const std::string &text) {
    EXPECT_TRUE(
        wait_until([&] { return by_tables(inode_of(fd)).find(text) != std::string::npos; }));
}

// A socket of `family` bound to the loopback address.
UniqueFd bound_socket(int family) {
    UniqueFd fd(socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address4 = {};
    address4.sin_family = AF_INET;
    address4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    sockaddr_in6 address6 = {};
    address6.sin6_family = AF_INET6;
    address6.sin6_addr = in6addr_loopback;
    int result = family == AF_INET
                     ? bind(fd.get(), reinterpret_cast<sockaddr *>(&address4), sizeof address4)
                     : bind(fd.get(), reinterpret_cast<sockaddr *>(&address6), sizeof address6);
    EXPECT_EQ(0, result) << strerror(errno);
    return fd;
}

UniqueFd connect_to(const UniqueFd &listener) {
    sockaddr_storage peer;
    socklen_t length = sizeof peer;
    EXPECT_EQ(0, getsockname(listener.get(), reinterpret_cast<sockaddr *>(&peer), &length));
    UniqueFd fd(socket(peer.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(0, connect(fd.get(), reinterpret_cast<sockaddr *>(&peer), length));
    return fd;
}

int bind_unix(const UniqueFd &fd, const std::string &name) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    name.copy(address.sun_path, name.size());
    auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size());
    return bind(fd.get(), reinterpret_cast<sockaddr *>(&address), length);
}

void follow_a_connection(int family) {
    UniqueFd listener = bound_socket(family);
    (void)both(listener);  // in none of the tables yet
    ASSERT_EQ(0, listen(listener.get(), 5));
    EXPECT_NE(std::string::npos, both(listener).find("[TCP_LISTEN]"));

    UniqueFd client = connect_to(listener);
    UniqueFd server(accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
    EXPECT_NE(std::string::npos, both(client).find("[TCP_ESTABLISHED]"));
    EXPECT_NE(std::string::npos, both(server).find("[TCP_ESTABLISHED]"));
    ASSERT_EQ(0, shutdown(client.get(), SHUT_WR));
    await(client, "[TCP_FIN_WAIT2]");
    EXPECT_NE(std::string::npos, both(client).find("[TCP_FIN_WAIT2]"));
    EXPECT_NE(std::string::npos, both(server).find("[TCP_CLOSE_WAIT]"));
    // The end of a connection by a reset takes it out of the table.
    linger hard = {1, 0};
    ASSERT_EQ(0, setsockopt(server.get(), SOL_SOCKET, SO_LINGER, &hard, sizeof hard));
    server.reset();
    await(client, "0 (nothing)");
    EXPECT_EQ("0 (nothing)", both(client));
    (void)both(listener);
}

// In a sandbox that keeps nothing of the test's own network.
void in_new_network(const std::function<void()> &body) {
    run_in_sandbox([&] {
        forget_last_process();
        body();
    });
}

}  // namespace

TEST(KnownSockets, FollowAConnectionThroughItsStates) {
    in_new_network([] { follow_a_connection(AF_INET); });
}

TEST(KnownSockets, FollowAnIpv6ConnectionThroughItsStates) {
    in_new_network([] { follow_a_connection(AF_INET6); });
}

TEST(KnownSockets, FollowAnIpv4ConnectionOfAnIpv6Socket) {
    in_new_network([] {
        UniqueFd listener(socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in6 any = {};
        any.sin6_family = AF_INET6;
        ASSERT_EQ(0, bind(listener.get(), reinterpret_cast<sockaddr *>(&any), sizeof any));
        ASSERT_EQ(0, listen(listener.get(), 5));
        socklen_t length = sizeof any;
        ASSERT_EQ(0, getsockname(listener.get(), reinterpret_cast<sockaddr *>(&any), &length));
        sockaddr_in peer = {};
        peer.sin_family = AF_INET;
        peer.sin_port = any.sin6_port;
        peer.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        UniqueFd client(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        ASSERT_EQ(0, connect(client.get(), reinterpret_cast<sockaddr *>(&peer), sizeof peer));
        UniqueFd server(accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
        (void)both(listener);
        (void)both(client);
        EXPECT_NE(std::string::npos, both(server).find(":ffff:7f00:1:"));
    });
}

TEST(KnownSockets, TellListenersThatShareAPortApart) {
    in_new_network([] {
        std::vector<UniqueFd> listeners;
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(7777);
        for (int i = 0; i < 4; ++i) {
            listeners.emplace_back(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
            int on = 1;
            setsockopt(listeners[i].get(), SOL_SOCKET, SO_REUSEPORT, &on, sizeof on);
            ASSERT_EQ(0, bind(listeners[i].get(), reinterpret_cast<sockaddr *>(&address),
                              sizeof address));
            ASSERT_EQ(0, listen(listeners[i].get(), 5));
        }
        for (const UniqueFd &listener : listeners)
            EXPECT_NE(std::string::npos, both(listener).find("[TCP_LISTEN]"));
    });
}

TEST(KnownSockets, TellASocketFromAnotherThatHasTakenItsEnds) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        UniqueFd former = connect_to(listener);
        EXPECT_NE(std::string::npos, both(former).find("[TCP_ESTABLISHED]"));
        sockaddr_in ends[2];
        socklen_t length = sizeof ends[0];
        ASSERT_EQ(0, getsockname(former.get(), reinterpret_cast<sockaddr *>(&ends[0]), &length));
        ASSERT_EQ(0, getpeername(former.get(), reinterpret_cast<sockaddr *>(&ends[1]), &length));
        // Breaks the connection at once; the socket stays.
        sockaddr nowhere = {};
        ASSERT_EQ(0, connect(former.get(), &nowhere, sizeof nowhere)) << strerror(errno);

        UniqueFd successor(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        int on = 1;
        setsockopt(successor.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
        ASSERT_EQ(0, bind(successor.get(), reinterpret_cast<sockaddr *>(&ends[0]), length))
            << strerror(errno);
        ASSERT_EQ(0, connect(successor.get(), reinterpret_cast<sockaddr *>(&ends[1]), length))
            << strerror(errno);
        EXPECT_EQ("0 (nothing)", both(former));
        EXPECT_NE(std::string::npos, both(successor).find("[TCP_ESTABLISHED]"));
    });
}

TEST(KnownSockets, TellAListenerFromTheConnectionThatItWas) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        sockaddr_in peer;
        socklen_t length = sizeof peer;
        ASSERT_EQ(0, getsockname(listener.get(), reinterpret_cast<sockaddr *>(&peer), &length));
        UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in any = {};
        any.sin_family = AF_INET;
        any.sin_port = htons(7777);
        ASSERT_EQ(0, bind(fd.get(), reinterpret_cast<sockaddr *>(&any), sizeof any));
        ASSERT_EQ(0, connect(fd.get(), reinterpret_cast<sockaddr *>(&peer), sizeof peer));
        EXPECT_NE(std::string::npos, both(fd).find("[127.0.0.1:7777 -> 127.0.0.1:"));

        // Breaks the connection; the socket, and its number, stay.
        sockaddr nowhere = {};
        ASSERT_EQ(0, connect(fd.get(), &nowhere, sizeof nowhere)) << strerror(errno);
        ASSERT_EQ(0, listen(fd.get(), 5));
        const std::string shown = both(fd);
        EXPECT_NE(std::string::npos, shown.find("[0.0.0.0:7777 -> ")) << shown;
        EXPECT_NE(std::string::npos, shown.find(":0][TCP_LISTEN]")) << shown;
    });
}

TEST(KnownSockets, ThatGetAUserIdOfSixDigitsShowNoConnection) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        if (fchown(listener.get(), 99999, static_cast<gid_t>(-1)) != 0)
            GTEST_SKIP() << strerror(errno);
        EXPECT_NE(std::string::npos, both(listener).find("[TCP_LISTEN]"));
        ASSERT_EQ(0, fchown(listener.get(), 100000, static_cast<gid_t>(-1)));
        EXPECT_EQ("0 (nothing)", both(listener));
    });
}

TEST(KnownSockets, FollowUnixSocketsThatGetAName) {
    in_new_network([] {
        TempDir dir;
        const std::string names[] = {dir / "plain", dir / "with blank", dir / "a\nb",
                                     std::string("\0abstract\0name\n", 15)};
        for (const std::string &name : names) {
            UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
            EXPECT_EQ("0 (nothing)", both(fd));
            ASSERT_EQ(0, bind_unix(fd, name)) << strerror(errno);
            EXPECT_NE("0 (nothing)", both(fd));
        }
    });
}

TEST(KnownSockets, AreCutWhereTheBufferEnds) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        std::string whole = both(listener);
        for (size_t size = 1; size < 60; ++size) {
            std::string tables(64, '#');
            std::string shown(64, '#');
            unsigned long inode = inode_of(listener);
            EXPECT_EQ(describe_socket_inode_in("/proc/net", inode, tables.data(), size),
                      describe_socket_inode(0, inode, shown.data(), size));
            EXPECT_EQ(tables, shown) << size;
        }
    });
}

TEST(KnownSockets, AreTakenFromMemoryTheSecondTime) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        UniqueFd client = connect_to(listener);
        UniqueFd listener6 = bound_socket(AF_INET6);
        ASSERT_EQ(0, listen(listener6.get(), 5));
        UniqueFd client6 = connect_to(listener6);
        UniqueFd name_less(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        for (const UniqueFd *fd : {&listener, &client, &listener6, &client6, &name_less}) {
            unsigned long inode = inode_of(*fd);
            EXPECT_EQ("-1 (nothing)", from_memory(inode));
            std::string shown = as_shown(inode);
            std::string remembered = from_memory(inode);
            if (remembered == "-1 (nothing)")
                GTEST_SKIP() << "this kernel tells nothing of single sockets";
            EXPECT_EQ(shown, remembered);
        }
    });
}

TEST(KnownSockets, AreForgottenInAnotherNetwork) {
    in_new_network([] {
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        EXPECT_NE("0 (nothing)", both(listener));
        if (unshare(CLONE_NEWNET) != 0)
            GTEST_SKIP() << strerror(errno);
        forget_last_process();
        EXPECT_EQ("0 (nothing)", both(listener));
    });
}

TEST(KnownSockets, AreNotAskedForInVainForEver) {
    in_new_network([] {
        EXPECT_TRUE(sockets_can_be_known(SocketKind::TCP));
        for (unsigned long inode = 1; inode <= 8; ++inode) {
            remember_tcp_socket(inode, {});
            EXPECT_EQ("-1 (nothing)", from_memory(inode));
        }
        EXPECT_FALSE(sockets_can_be_known(SocketKind::TCP));
        EXPECT_TRUE(sockets_can_be_known(SocketKind::UNIX)) << "which is another matter";
        UniqueFd listener = bound_socket(AF_INET);
        ASSERT_EQ(0, listen(listener.get(), 5));
        EXPECT_NE("0 (nothing)", both(listener));
        EXPECT_EQ("-1 (nothing)", from_memory(inode_of(listener)));
        // The next trace tries again.
        forget_last_process();
        EXPECT_TRUE(sockets_can_be_known(SocketKind::TCP));
    });
}

TEST(KnownSockets, AreNotAskedForTheirNamesInVainForEver) {
    for (unsigned long inode = 1; inode <= 8; ++inode) {
        EXPECT_TRUE(sockets_can_be_known(SocketKind::UNIX));
        remember_unix_socket(inode, "", -1, "[@name]");
        EXPECT_EQ("-1 (nothing)", from_memory(inode));
    }
    EXPECT_FALSE(sockets_can_be_known(SocketKind::UNIX));
    EXPECT_TRUE(sockets_can_be_known(SocketKind::TCP));
    forget_last_process();
    EXPECT_TRUE(sockets_can_be_known(SocketKind::UNIX));
}
