// The debug service behind the web servers that devices have, each with its sample configuration.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "support/far_network.h"
#include "support/packets.h"
#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/temp_dir.h"

namespace {

constexpr char ROOT[] = "/usr/lib/fieldkit";
constexpr char SAMPLES[] = "/usr/share/fieldkit";
constexpr char PAGE[] = "/cgi-bin/nph-debugar";

struct WebServer {
    const char *name;
    std::vector<std::string> programs;  // where it may be
    std::vector<std::string> arguments;
};

void PrintTo(const WebServer &server, std::ostream *out) {
    *out << server.name;
}

// The user mini-httpd is told to be is one that the files of a test do not belong to.
const WebServer LIGHTTPD = {"lighttpd", {"/usr/sbin/lighttpd"}, {"-D", "-f", "lighttpd.conf"}};
const WebServer BUSYBOX = {
    "busybox", {"/usr/bin/busybox", "/bin/busybox"}, {"httpd", "-f", "-c", "busybox-httpd.conf"}};
const WebServer MINI = {
    "mini_httpd", {"/usr/sbin/mini_httpd"}, {"-D", "-C", "mini-httpd.conf", "-u", "root"}};

// The program, or "" where the machine does not have it.
std::string find_program(const WebServer &server) {
    for (const std::string &program : server.programs) {
        if (access(program.c_str(), X_OK) == 0)
            return program;
    }
    return "";
}

sockaddr_in web_address(const char *host) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(80);
    EXPECT_EQ(1, inet_pton(AF_INET, host, &address.sin_addr));
    return address;
}

bool connect_web(int fd, const char *host) {
    const sockaddr_in address = web_address(host);
    return connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof(address)) == 0;
}

void send_request(int fd, const std::string &target) {
    const std::string request = "GET " + target + " HTTP/1.0\r\nHost: device\r\n\r\n";
    EXPECT_EQ(static_cast<ssize_t>(request.size()), send(fd, request.data(), request.size(), 0));
}

Client get(const std::string &target) {
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    EXPECT_TRUE(connect_web(fd, "127.0.0.1"));
    send_request(fd, target);
    return Client(fd);
}

// Puts what a device has installed where it has it; a device itself has FRONT in its environment.
void install_frontend(const TempDir &dir) {
    if (getenv("FRONT") != nullptr)
        return;
    namespace fs = std::filesystem;
    fs::create_directories(dir / "lib/www/cgi-bin");
    fs::copy(SOURCE_DIR "/frontend/index.html", dir / "lib/www/index.html");
    fs::create_symlink(DEBUGAR_FRONT, dir / "lib/debugar-front");
    fs::create_symlink("../../debugar-front", dir / "lib/www/cgi-bin/nph-debugar");
    sandbox_bind(dir / "lib", ROOT);
    sandbox_bind(SOURCE_DIR "/frontend", SAMPLES);
}

// A web server at port 80, killed at the end.
class RunningServer {
  public:
    explicit RunningServer(const WebServer &server) {
        install_frontend(dir_);
        std::vector<std::string> argv = {find_program(server)};
        for (const std::string &argument : server.arguments) {
            const bool is_file = argument.find(".conf") != std::string::npos;
            argv.push_back(is_file ? SAMPLES + ("/" + argument) : argument);
        }
        process_.emplace(argv);
        EXPECT_TRUE(wait_until([] {
            const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
            const bool connected = connect_web(fd, "127.0.0.1");
            close(fd);
            return connected;
        }));
    }

  private:
    TempDir dir_;
    std::optional<Background> process_;
};

// The service at the path at which debugar-front looks for it.
class InstalledService : public Service {
  public:
    explicit InstalledService(const ServiceOptions &options = {}) : Service(options) {
        sandbox_bind(cgi_socket(), "/var/run/dbg-cgi/ctrl-cgi-socket");
    }
};

bool has_line(const std::string &reply, const std::string &line) {
    return reply.find("\r\n" + line + "\r\n") < reply.find("\r\n\r\n") + 2;
}

std::string status_of(const std::string &reply) {
    return reply.substr(0, 5) == "HTTP/" ? reply.substr(9, reply.find("\r\n") - 9) : reply;
}

bool has_body(const std::string &reply, size_t length) {
    return body_of(reply).size() >= length;
}

void expect_download(const std::string &reply, const std::string &type, const std::string &name) {
    EXPECT_EQ("200 OK", status_of(reply));
    EXPECT_TRUE(has_line(reply, "Cache-Control: no-cache")) << reply;
    EXPECT_TRUE(has_line(reply, "Expires: Thu, 01 Dec 1994 16:00:00 GMT")) << reply;
    EXPECT_TRUE(has_line(reply, "Content-Type: " + type)) << reply;
    EXPECT_TRUE(has_line(reply, "Content-Disposition: attachment; filename=\"" + name + "\""))
        << reply;
}

class BehindWebServer : public testing::TestWithParam<WebServer> {
  protected:
    void SetUp() override {
        if (find_program(GetParam()).empty())
            GTEST_SKIP() << "this machine has no " << GetParam().name;
    }
};

int local_port(int fd) {
    sockaddr_in address = {};
    socklen_t length = sizeof(address);
    EXPECT_EQ(0, getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length));
    return ntohs(address.sin_port);
}

// The ports, source and destination, of a frame that is IPv4 without options.
bool has_port(const std::string &frame, int port) {
    auto value = [&](size_t at) {
        return frame.size() < at + 2 ? 0
                                     : static_cast<unsigned char>(frame[at]) * 256 +
                                           static_cast<unsigned char>(frame[at + 1]);
    };
    return value(12) == 0x0800 && (value(34) == port || value(36) == port);
}

// Captures on eth0 for a client at its other end, until datagrams of a third party have been seen,
// and tells whether the capture shows the client's own connection.
bool is_client_in_its_capture(const WebServer &server) {
    InstalledService service;
    RunningServer web(server);
    FarNetwork far;
    const int fd = far.make_socket(AF_INET, SOCK_STREAM);
    EXPECT_TRUE(connect_web(fd, "10.99.0.1"));
    const int port = local_port(fd);
    Client client(fd);
    send_request(fd, std::string(PAGE) + "/pcapdump.cap?cmd=pcapdump&duration=60&totalsize=0");

    // The header of the capture tells that it has begun. What it shows of each datagram goes the
    // client's way, so there is something of that to show as well.
    client.read_until([](const std::string &reply) { return has_body(reply, 24); });
    const int datagrams = far.make_socket(AF_INET, SOCK_DGRAM);
    sockaddr_in peer = web_address("10.99.0.1");
    peer.sin_port = htons(7777);
    std::string reply;
    for (const char filling : {'a', 'b', 'c'}) {
        const std::string datagram(300, filling);
        EXPECT_EQ(300, sendto(datagrams, datagram.data(), datagram.size(), 0,
                              reinterpret_cast<sockaddr *>(&peer), sizeof(peer)));
        reply = client.read_until_text(datagram);
    }
    close(datagrams);
    expect_download(reply, "application/octet-stream", "pcapdump.cap");
    bool shows_datagram = false;
    bool shows_client = false;
    for (const PcapTestRecord &record : parse_pcap(body_of(reply)).records) {
        shows_datagram = shows_datagram || has_port(record.data, 7777);
        shows_client = shows_client || has_port(record.data, port);
    }
    EXPECT_TRUE(shows_datagram);
    client.close();
    return shows_client;
}

}  // namespace

TEST_P(BehindWebServer, ShowsThePage) {
    run_in_sandbox([] {
        RunningServer web(GetParam());
        const std::string reply = get("/").read_all();
        EXPECT_EQ("200", status_of(reply).substr(0, 3));
        EXPECT_NE(std::string::npos, reply.find(": text/html")) << reply;
        EXPECT_EQ(0u, body_of(reply).find("<!DOCTYPE html>\n")) << reply;
    });
}

TEST_P(BehindWebServer, PassesADownloadOnWithItsHeaders) {
    run_in_sandbox([] {
        InstalledService service;
        RunningServer web(GetParam());
        const std::string reply = get(std::string(PAGE) + "/psdump.txt?cmd=ps").read_all();
        expect_download(reply, "text/plain", "psdump.txt");
        EXPECT_NE(std::string::npos, body_of(reply).find("fieldkit")) << reply;
    });
}

TEST_P(BehindWebServer, PassesTheServicesErrorOnWithItsStatus) {
    run_in_sandbox([] {
        InstalledService service;
        RunningServer web(GetParam());
        const std::string reply = get(std::string(PAGE) + "/x?cmd=pcap").read_all();
        EXPECT_EQ("400 Bad Request", status_of(reply));
        EXPECT_TRUE(has_line(reply, "Content-Type: text/plain")) << reply;
        EXPECT_EQ("The request has bad syntax or was inherently impossible to satisfy\n",
                  body_of(reply));
    });
}

TEST_P(BehindWebServer, BeginsAnArchiveOfTheNameInThePath) {
    run_in_sandbox([] {
        InstalledService service;
        RunningServer web(GetParam());
        Client compressed = get(std::string(PAGE) + "/debug.tgz");
        std::string reply =
            compressed.read_until([](const std::string &text) { return has_body(text, 2); });
        expect_download(reply, "application/x-tar", "debug.tgz");
        EXPECT_EQ("\x1f\x8b", body_of(reply).substr(0, 2));

        reply = get(std::string(PAGE) + "/debug.tar").read_all();
        EXPECT_EQ("503 Service Unavailable", status_of(reply));
        EXPECT_NE(std::string::npos, reply.find("Another Crash Report generation is in progress."))
            << reply;
    });
}

TEST_P(BehindWebServer, AnswersWith503WithoutTheService) {
    run_in_sandbox([] {
        RunningServer web(GetParam());
        const std::string reply = get(std::string(PAGE) + "/debug.tgz").read_all();
        EXPECT_EQ("503 Service Unavailable", status_of(reply));
        EXPECT_NE(std::string::npos, body_of(reply).find("The debug service does not answer."))
            << reply;
    });
}

TEST_P(BehindWebServer, KeepsTheConnectionWhenTheProgramHasEndedBeforeTheReplyBegins) {
    run_in_sandbox([] {
        InstalledService service;
        RunningServer web(GetParam());
        Client client = get(std::string(PAGE) + "/core?cmd=coredump");
        // A core that comes before the request is dropped.
        EXPECT_TRUE(wait_until([&] {
            const int core = service.connect_segf();
            (void)send(core, "core of a process", 17, MSG_NOSIGNAL);
            close(core);
            pollfd readable = {client.fd(), POLLIN, 0};
            return poll(&readable, 1, 50) > 0;
        }));
        const std::string reply = client.read_all();
        expect_download(reply, "application/octet-stream", "core");
        EXPECT_EQ("core of a process", body_of(reply));
    });
}

TEST_P(BehindWebServer, EndsATraceWhenTheClientLeaves) {
    run_in_sandbox([] {
        InstalledService service;
        RunningServer web(GetParam());
        Background busy({"/bin/sh", "-c", "while :; do sleep 0.02; done"});
        Client client = get(std::string(PAGE) + "/x?cmd=strace&pid=" + std::to_string(busy.pid()) +
                            "%2Cnobody");
        const std::string reply =
            client.read_until([](const std::string &text) { return has_body(text, 1000); });
        expect_download(reply, "text/plain", "stracedump.txt");
        EXPECT_FALSE(runs_free(busy.pid()));
        client.close();
        EXPECT_TRUE(wait_until([&] { return runs_free(busy.pid()); }));
    });
}

INSTANTIATE_TEST_SUITE_P(Each, BehindWebServer, testing::Values(LIGHTTPD, BUSYBOX, MINI),
                         [](const auto &test) { return std::string(test.param.name); });

TEST(AsNphScript, GivesTheServiceTheClientsOwnConnection) {
    if (find_program(MINI).empty())
        GTEST_SKIP() << "this machine has no " << MINI.name;
    run_in_sandbox([] { EXPECT_FALSE(is_client_in_its_capture(MINI)); }, {.eth0 = true});
}

TEST(AsNphScript, AloneHidesTheClientFromItsCapture) {
    if (find_program(LIGHTTPD).empty())
        GTEST_SKIP() << "this machine has no " << LIGHTTPD.name;
    run_in_sandbox([] { EXPECT_TRUE(is_client_in_its_capture(LIGHTTPD)); }, {.eth0 = true});
}
