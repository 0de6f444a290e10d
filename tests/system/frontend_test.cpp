// The CGI program debugar-front, run as a web server would, with a service of the test's own.
#include <gtest/gtest.h>
#include <poll.h>
#include <sockhand.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

using namespace std::string_literals;

std::string front_path() {
    const char *path = getenv("FRONT");
    return path != nullptr ? path : DEBUGAR_FRONT;
}

// What a web server says of a GET of `path` with `query`.
std::vector<std::string> cgi_environment(const std::string &socket, const std::string &path,
                                         const std::string &query) {
    return {"GATEWAY_INTERFACE=CGI/1.1", "REQUEST_METHOD=GET",    "SCRIPT_NAME=/cgi-bin/debugar",
            "PATH_INFO=" + path,         "QUERY_STRING=" + query, "DEBUGAR_SOCKET=" + socket};
}

RunResult run_front(const std::vector<std::string> &environment,
                    const std::vector<std::string> &arguments = {}) {
    std::vector<std::string> argv = {front_path()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    RunOptions options;
    options.env = environment;
    return run_program(argv, options);
}

std::pair<dev_t, ino_t> identity(int fd) {
    struct stat status = {};
    EXPECT_EQ(0, fstat(fd, &status));
    return {status.st_dev, status.st_ino};
}

// The service's end of the socket at `path`.
class Service {
  public:
    explicit Service(const std::string &path)
        : socket_(sockhand_server_socket(path.c_str(), 0666)) {
        EXPECT_GE(socket_, 0);
    }
    ~Service() { sockhand_close(socket_); }
    Service(const Service &) = delete;
    Service &operator=(const Service &) = delete;

    // Waits for a message; its descriptor, to be closed by the caller, goes to `fd`.
    std::string receive(int *fd) {
        char message[4095];
        int length = -1;
        EXPECT_TRUE(wait_until([&] {
            length = sockhand_recv(socket_, message, sizeof(message), fd);
            return length > 0;
        }));
        return std::string(message, length > 0 ? static_cast<size_t>(length) : 0);
    }

    bool has_something() {
        pollfd waiting = {socket_, POLLIN, 0};
        return poll(&waiting, 1, 0) != 0;
    }

  private:
    int socket_;
};

// A whole reply of its own, with this status.
void expect_page(const RunResult &result, const std::string &status, const std::string &headers,
                 const std::string &text) {
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("HTTP/1.0 " + status + "\r\nCache-Control: no-cache\r\n" + headers +
                  "Content-Type: text/html\r\n\r\n"
                  "<!DOCTYPE html>\n<html lang=\"en\">\n<title>" +
                  status + "</title>\n<h1>" + status + "</h1>\n<p>" + text + "</p>\n</html>\n",
              result.out);
    // With some servers it is the client's connection, too.
    EXPECT_EQ("", result.err);
}

// Nothing has been replied; the service has got this message.
void expect_handed_over(const RunResult &result, Service *service, const std::string &message) {
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("", result.out);
    int fd = -1;
    EXPECT_EQ(message, service->receive(&fd));
    close(fd);
}

void expect_503(const RunResult &result) {
    expect_page(result, "503 Service Unavailable", "",
                "The debug service does not answer. It may not be running, or be about to start.");
}

}  // namespace

TEST(DebugarFront, HandsItsStandardOutputToTheServiceAndEnds) {
    TempDir dir;
    Service service(dir / "socket");
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    RunOptions options;
    options.env = cgi_environment(dir / "socket", "/debug/debug.tgz", "cmd=strace&pid=1%2Cinit");
    options.before_exec = [&] { dup2(ends[1], STDOUT_FILENO); };
    RunResult result = run_program({front_path()}, options);
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("", result.err);

    int fd = -1;
    EXPECT_EQ("/cgi-bin/debugar/debug/debug.tgz\0cmd=strace&pid=1%2Cinit\0"s, service.receive(&fd));
    EXPECT_EQ(identity(ends[1]), identity(fd));
    // The service's is the last copy of it: the client sees the reply, all of it, and its end.
    close(ends[1]);
    EXPECT_EQ(5, write(fd, "reply", 5));
    close(fd);
    char reply[100];
    EXPECT_EQ(5, recv(ends[0], reply, sizeof(reply), MSG_WAITALL));
    EXPECT_EQ("reply", std::string(reply, 5));
    close(ends[0]);
}

TEST(DebugarFront, GivesAScriptNamedForTheArchiveAsThePath) {
    TempDir dir;
    Service service(dir / "socket");
    for (const std::string name : {"/cgi-bin/debug.tgz", "/cgi-bin/nph-debug.tgz"}) {
        SCOPED_TRACE(name);
        expect_handed_over(run_front({"REQUEST_METHOD=GET", "SCRIPT_NAME=" + name,
                                      "DEBUGAR_SOCKET=" + (dir / "socket")}),
                           &service, "/cgi-bin/debug.tgz\0\0"s);
    }
}

TEST(DebugarFront, IgnoresArgumentsThatAServerMakesOfTheQuery) {
    TempDir dir;
    Service service(dir / "socket");
    expect_handed_over(
        run_front(cgi_environment(dir / "socket", "/debug.tgz", "listen+now"), {"listen", "now"}),
        &service, "/cgi-bin/debugar/debug.tgz\0listen+now\0"s);
}

TEST(DebugarFront, AnswersWith503WhenThereIsNoService) {
    TempDir dir;
    expect_503(run_front(cgi_environment(dir / "socket", "/debug.tgz", "")));
}

TEST(DebugarFront, AnswersWith503WhenTheServiceHasLeftItsSocketBehind) {
    TempDir dir;
    { Service gone(dir / "socket"); }
    ASSERT_EQ(0, access((dir / "socket").c_str(), F_OK));
    expect_503(run_front(cgi_environment(dir / "socket", "/debug.tgz", "")));
}

TEST(DebugarFront, LogsWhyTheServiceCouldNotBeReached) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "log";
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        ASSERT_LT(path.size(), sizeof(address.sun_path));
        path.copy(address.sun_path, path.size());
        const int log = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        ASSERT_EQ(0, bind(log, reinterpret_cast<sockaddr *>(&address), sizeof(address)));
        sandbox_bind(path, "/dev/log");

        expect_503(run_front(cgi_environment("/nowhere/socket", "/debug.tgz", "")));
        char line[1000];
        const ssize_t length = recv(log, line, sizeof(line), MSG_DONTWAIT);
        ASSERT_GT(length, 0);
        const std::string text(line, static_cast<size_t>(length));
        EXPECT_EQ(0u, text.find("<27>")) << text;  // daemon, error
        EXPECT_NE(std::string::npos, text.find(" debugar-front[")) << text;
        EXPECT_NE(std::string::npos, text.find("]: /nowhere/socket: No such file or directory"))
            << text;
        close(log);
    });
}

TEST(DebugarFront, LooksForTheServiceAtItsUsualPath) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_bind(dir.path(), "/var/run/dbg-cgi");
        Service service("/var/run/dbg-cgi/ctrl-cgi-socket");
        expect_handed_over(run_front({"REQUEST_METHOD=GET", "SCRIPT_NAME=/debug.tar"}), &service,
                           "/debug.tar\0\0"s);
    });
}

TEST(DebugarFront, RefusesAllButGet) {
    TempDir dir;
    Service service(dir / "socket");
    for (const std::string method : {"POST", "HEAD", "get", ""}) {
        std::vector<std::string> environment = cgi_environment(dir / "socket", "/debug.tgz", "");
        environment[1] = "REQUEST_METHOD=" + method;
        expect_page(run_front(environment), "405 Method Not Allowed", "Allow: GET\r\n",
                    "Ask with GET. A HEAD request is refused as well: answering it would take the "
                    "same work.");
    }
    std::vector<std::string> environment = cgi_environment(dir / "socket", "/debug.tgz", "");
    environment.erase(environment.begin() + 1);
    EXPECT_EQ(0u, run_front(environment).out.find("HTTP/1.0 405 Method Not Allowed\r\n"));
    EXPECT_FALSE(service.has_something());
}

TEST(DebugarFront, RefusesARequestThatIsLongerThanTheServiceTakes) {
    TempDir dir;
    Service service(dir / "socket");
    // "/cgi-bin/debugar/debug.tgz" has 26 bytes, the two zero bytes make it 28.
    const std::string fits(4095 - 28, 'q');
    RunResult result = run_front(cgi_environment(dir / "socket", "/debug.tgz", fits));
    EXPECT_EQ("", result.out);
    int fd = -1;
    EXPECT_EQ(4095u, service.receive(&fd).size());
    close(fd);
    expect_page(run_front(cgi_environment(dir / "socket", "/debug.tgz", fits + "q")),
                "414 URI Too Long", "", "The request is longer than the debug service takes.");
    EXPECT_FALSE(service.has_something());
}
