// Clients whose network is cut, so that not a word comes from them any more.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sockhand.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <string>

#include "support/far_network.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true, .timeout_s = 110};

constexpr char DEBUG_CGI[] = "/cgi/debug.cgi";

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
    CutClient(const FarNetwork &far, const Service &service, const std::string &path,
              const std::string &query) {
        far.connect_to_us(&connection_);
        std::string message = path + '\0' + query + '\0';
        EXPECT_EQ(0, sockhand_send(service.cgi_socket().c_str(), message.data(),
                                   static_cast<int>(message.size()), connection_.server));
    }

    // Waits until so many bytes have come, which stay unread.
    bool has_received(int size) const {
        return wait_until([&] {
            int waiting = 0;
            return ioctl(connection_.client, FIONREAD, &waiting) == 0 && waiting >= size;
        });
    }

    void expect_two_minutes() const {
        int alive = 0;
        socklen_t length = sizeof alive;
        EXPECT_EQ(0, getsockopt(connection_.server, SOL_SOCKET, SO_KEEPALIVE, &alive, &length));
        EXPECT_EQ(1, alive);
        EXPECT_EQ(60, tcp_option(connection_.server, TCP_KEEPIDLE));
        EXPECT_EQ(15, tcp_option(connection_.server, TCP_KEEPINTVL));
        EXPECT_EQ(4, tcp_option(connection_.server, TCP_KEEPCNT));
        EXPECT_EQ(120000, tcp_option(connection_.server, TCP_USER_TIMEOUT));
    }

    // Only the times: whether there are any is up to the service.
    void shorten() const {
        set_tcp_option(connection_.server, TCP_KEEPIDLE, 1);
        set_tcp_option(connection_.server, TCP_KEEPINTVL, 1);
        set_tcp_option(connection_.server, TCP_KEEPCNT, 2);
        if (tcp_option(connection_.server, TCP_USER_TIMEOUT) != 0)
            set_tcp_option(connection_.server, TCP_USER_TIMEOUT, 3000);
    }

  private:
    TcpConnection connection_;
};

TEST(ServiceCut, AnIdleClientThatIsCutOffIsGivenUp) {
    run_in_sandbox(
        [] {
            Background process({fixture_path("behave"), "sleep"});
            process.read_line();
            FarNetwork far;
            Service service;
            const std::string queries[] = {"cmd=strace&pid=" + std::to_string(process.pid()),
                                           "cmd=pcapdump", "cmd=rtrace&interval=-1",
                                           "cmd=rtrace&interval=1&trace=smapstot"};
            for (const std::string &query : queries) {
                CutClient client(far, service, DEBUG_CGI, query);
                ASSERT_TRUE(client.has_received(100)) << query;
                client.expect_two_minutes();
            }
            EXPECT_TRUE(service.is_at_rest());
            CutClient trace(far, service, DEBUG_CGI, queries[0]);
            CutClient capture(far, service, DEBUG_CGI, queries[1]);
            CutClient samples(far, service, DEBUG_CGI, queries[2]);
            CutClient silent(far, service, DEBUG_CGI, queries[3]);
            for (const CutClient *client : {&trace, &capture, &samples, &silent})
                ASSERT_TRUE(client->has_received(100));
            far.cut_off();
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
            FarNetwork far;
            Service service({.core_program = writer});
            CutClient client(far, service, "/cgi/debug.tar", "");
            ASSERT_TRUE(client.has_received(30000));
            client.expect_two_minutes();
            far.cut_off();
            client.shorten();
            EXPECT_TRUE(service.is_at_rest(60));
            Client next = service.request("/cgi/debug.tar", "");
            EXPECT_EQ(0u, next.read_until_text("\r\n\r\n").find("HTTP/1.0 200 OK"));
        },
        WITH_ETH0);
}

}  // namespace
