// Clients whose network is cut, so that not a word comes from them any more.
#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sched.h>
#include <sockhand.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true, .timeout_s = 110};

constexpr char DEBUG_CGI[] = "/cgi/debug.cgi";

// The other end of eth0, in a network of its own: 10.99.0.2.
class Peer {
  public:
    Peer() {
        ours_ = open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
        EXPECT_EQ(0, unshare(CLONE_NEWNET)) << strerror(errno);
        theirs_ = open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
        {
            Background holder({"/bin/sleep", "1000"});  // in that network
            EXPECT_EQ(0, setns(ours_, CLONE_NEWNET)) << strerror(errno);
            sandbox_shell("ip link set eth1 netns " + std::to_string(holder.pid()));
        }
        run("ip addr add 10.99.0.2/24 dev eth1 && ip link set eth1 up");
    }
    ~Peer() {
        close(ours_);
        close(theirs_);
    }
    Peer(const Peer &) = delete;
    Peer &operator=(const Peer &) = delete;

    // Two ends of a TCP connection; the client's is there.
    void connect_to_us(int *client, int *served) const {
        int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        inet_pton(AF_INET, "10.99.0.1", &address.sin_addr);
        socklen_t length = sizeof address;
        auto *generic = reinterpret_cast<sockaddr *>(&address);
        EXPECT_EQ(0, bind(listener, generic, length)) << strerror(errno);
        EXPECT_EQ(0, listen(listener, 1)) << strerror(errno);
        EXPECT_EQ(0, getsockname(listener, generic, &length)) << strerror(errno);
        enter(theirs_);
        *client = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        enter(ours_);
        EXPECT_EQ(0, connect(*client, generic, length)) << strerror(errno);
        *served = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        EXPECT_GE(*served, 0) << strerror(errno);
        close(listener);
    }

    // Nothing that it sends leaves it any more, and nothing reaches it.
    void cut_off() const { run("ip link set eth1 down"); }

  private:
    static void enter(int network) { EXPECT_EQ(0, setns(network, CLONE_NEWNET)); }

    void run(const std::string &command) const {
        enter(theirs_);
        sandbox_shell(command);
        enter(ours_);
    }

    int ours_;
    int theirs_;
};

int tcp_option(int fd, int name) {
    int value = -1;
    socklen_t length = sizeof value;
    EXPECT_EQ(0, getsockopt(fd, IPPROTO_TCP, name, &value, &length)) << strerror(errno);
    return value;
}

void set_tcp_option(int fd, int name, int value) {
    EXPECT_EQ(0, setsockopt(fd, IPPROTO_TCP, name, &value, sizeof value)) << strerror(errno);
}

// A request from there. The test keeps the served end, too: it is the socket that the service has,
// so that what the service has set can be seen, and made to last for seconds instead of minutes.
class CutClient {
  public:
    CutClient(const Peer &peer, const Service &service, const std::string &path,
              const std::string &query) {
        peer.connect_to_us(&client_, &served_);
        std::string message = path + '\0' + query + '\0';
        EXPECT_EQ(0, sockhand_send(service.cgi_socket().c_str(), message.data(),
                                   static_cast<int>(message.size()), served_));
    }
    ~CutClient() {
        close(client_);
        close(served_);
    }
    CutClient(const CutClient &) = delete;
    CutClient &operator=(const CutClient &) = delete;

    // Waits until so many bytes have come, which stay unread.
    bool has_received(int size) const {
        return wait_until([&] {
            int waiting = 0;
            return ioctl(client_, FIONREAD, &waiting) == 0 && waiting >= size;
        });
    }

    void expect_two_minutes() const {
        int alive = 0;
        socklen_t length = sizeof alive;
        EXPECT_EQ(0, getsockopt(served_, SOL_SOCKET, SO_KEEPALIVE, &alive, &length));
        EXPECT_EQ(1, alive);
        EXPECT_EQ(60, tcp_option(served_, TCP_KEEPIDLE));
        EXPECT_EQ(15, tcp_option(served_, TCP_KEEPINTVL));
        EXPECT_EQ(4, tcp_option(served_, TCP_KEEPCNT));
        EXPECT_EQ(120000, tcp_option(served_, TCP_USER_TIMEOUT));
    }

    // Only the times: whether there are any is up to the service.
    void shorten() const {
        set_tcp_option(served_, TCP_KEEPIDLE, 1);
        set_tcp_option(served_, TCP_KEEPINTVL, 1);
        set_tcp_option(served_, TCP_KEEPCNT, 2);
        if (tcp_option(served_, TCP_USER_TIMEOUT) != 0)
            set_tcp_option(served_, TCP_USER_TIMEOUT, 3000);
    }

  private:
    int client_;
    int served_;
};

TEST(ServiceCut, AnIdleClientThatIsCutOffIsGivenUp) {
    run_in_sandbox(
        [] {
            Background process({fixture_path("behave"), "sleep"});
            process.read_line();
            Peer peer;
            Service service;
            const std::string queries[] = {"cmd=strace&pid=" + std::to_string(process.pid()),
                                           "cmd=pcapdump", "cmd=rtrace&interval=-1",
                                           "cmd=rtrace&interval=1&trace=smapstot"};
            for (const std::string &query : queries) {
                CutClient client(peer, service, DEBUG_CGI, query);
                ASSERT_TRUE(client.has_received(100)) << query;
                client.expect_two_minutes();
            }
            EXPECT_TRUE(service.is_at_rest());
            CutClient trace(peer, service, DEBUG_CGI, queries[0]);
            CutClient capture(peer, service, DEBUG_CGI, queries[1]);
            CutClient samples(peer, service, DEBUG_CGI, queries[2]);
            CutClient silent(peer, service, DEBUG_CGI, queries[3]);
            for (const CutClient *client : {&trace, &capture, &samples, &silent})
                ASSERT_TRUE(client->has_received(100));
            peer.cut_off();
            for (const CutClient *client : {&trace, &capture, &samples, &silent})
                client->shorten();
            EXPECT_TRUE(service.is_at_rest(40));
        },
        WITH_ETH0);
}

TEST(ServiceCut, AClientThatIsCutOffInTheMiddleOfAnArchiveLeavesRoomForTheNextOne) {
    run_in_sandbox(
        [] {
            TempDir dir;
            std::string writer =
                dir.file("writer",
                         "#!/bin/sh\necho CORELEN 41943040 bytes, of processes:$3 >&2\n"
                         "exec /bin/dd if=/dev/urandom bs=65536 count=640 2>/dev/null\n",
                         0755);
            Background process({fixture_path("behave"), "sleep"});
            Peer peer;
            Service service({.core_program = writer});
            CutClient client(peer, service, "/cgi/debug.tar", "");
            ASSERT_TRUE(client.has_received(30000));
            client.expect_two_minutes();
            peer.cut_off();
            client.shorten();
            EXPECT_TRUE(service.is_at_rest(60));
            Client next = service.request("/cgi/debug.tar", "");
            EXPECT_EQ(0u, next.read_until_text("\r\n\r\n").find("HTTP/1.0 200 OK"));
        },
        WITH_ETH0);
}

}  // namespace
