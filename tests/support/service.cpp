#include "support/service.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sockhand.h>
#include <stdio.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <utility>

#include "support/process_state.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr char MONITOR_REPORT[] = "/var/run/dbg-cgi/dbg-monitor.txt";

int milliseconds_until(Clock::time_point end) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
    return left > 0 ? static_cast<int>(left) : 0;
}

// Two ends of a TCP connection over loopback.
void connect_tcp(int *ours, int *theirs) {
    int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    auto *generic = reinterpret_cast<sockaddr *>(&address);
    *ours = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    *theirs = -1;
    EXPECT_EQ(0, bind(listener, generic, length)) << strerror(errno);
    EXPECT_EQ(0, listen(listener, 1)) << strerror(errno);
    EXPECT_EQ(0, getsockname(listener, generic, &length)) << strerror(errno);
    EXPECT_EQ(0, connect(*ours, generic, length)) << strerror(errno);
    *theirs = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    EXPECT_GE(*theirs, 0) << strerror(errno);
    close(listener);
}

int connect_unix(const std::string &path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    memcpy(address.sun_path, path.c_str(), path.size());
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof address) == 0)
        return fd;
    close(fd);
    return -1;
}

// Where the descriptors of `pid` lead.
std::vector<std::string> open_files(pid_t pid) {
    std::vector<std::string> targets;
    std::error_code error;
    std::filesystem::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", error), end;
    for (; !error && it != end; it.increment(error)) {
        std::error_code unreadable;
        targets.push_back(std::filesystem::read_symlink(it->path(), unreadable).string());
    }
    return targets;
}

}  // namespace

Client::Client(Client &&other) noexcept
    : fd_(std::exchange(other.fd_, -1)), received_(std::move(other.received_)) {}

Client &Client::operator=(Client &&other) noexcept {
    close();
    fd_ = std::exchange(other.fd_, -1);
    received_ = std::move(other.received_);
    return *this;
}

Client::~Client() {
    close();
}

void Client::close() {
    if (fd_ >= 0)
        ::close(fd_);
    fd_ = -1;
}

std::string Client::read_until(const std::function<bool(const std::string &)> &done,
                               int timeout_s) {
    Clock::time_point end = Clock::now() + std::chrono::seconds(timeout_s);
    while (!done(received_)) {
        pollfd readable = {fd_, POLLIN, 0};
        if (poll(&readable, 1, milliseconds_until(end)) == 0) {
            ADD_FAILURE() << "the reply did not get this far in " << timeout_s
                          << " s; what came: " << received_.substr(0, 2000);
            break;
        }
        char block[65536];
        ssize_t n = read(fd_, block, sizeof block);
        if (n <= 0)
            break;
        received_.append(block, static_cast<size_t>(n));
    }
    return received_;
}

std::string Client::read_until_text(const std::string &text, int timeout_s) {
    return read_until(
        [&](const std::string &received) { return received.find(text) != std::string::npos; },
        timeout_s);
}

std::string Client::read_all(int timeout_s) {
    return read_until([](const std::string &) { return false; }, timeout_s);
}

bool Client::is_waiting() const {
    pollfd readable = {fd_, POLLIN, 0};
    return poll(&readable, 1, 0) == 0;
}

Service::Service(const ServiceOptions &options) {
    dump_dir_ = options.dump_dir;
    if (dump_dir_.empty()) {
        dump_dir_ = dir_.path() + "/dumps";
        mkdir(dump_dir_.c_str(), 0755);
    }
    std::vector<std::string> argv = {
        fieldkit_path(), "debugar.cgi", "-n",      "-c", cgi_socket(),        "-s",
        segf_socket(),   "-k",          dump_dir_, "-p", options.core_program};
    argv.insert(argv.end(), options.options.begin(), options.options.end());
    std::filesystem::create_directories(std::filesystem::path(MONITOR_REPORT).parent_path());
    unlink(MONITOR_REPORT);
    // The service itself is killed in the end. A child of it that could not be executed would
    // search for leaks under a lock that one of the service's threads held at the fork.
    RunOptions run = options.run;
    run.leak_check = false;
    process_ = std::make_unique<Background>(argv, run);
    // The socket for cores is made last. Nothing is sent on it: that is an empty core for nobody.
    EXPECT_TRUE(wait_until([this] {
        int fd = connect_unix(segf_socket());
        char byte;
        bool served = fd >= 0 && read(fd, &byte, 1) == 0;
        close(fd);
        return served;
    })) << "the service does not answer";
    // The monitor's first round comes when the machine has nothing better to do, and takes some
    // descriptors then.
    EXPECT_TRUE(wait_until([] { return access(MONITOR_REPORT, F_OK) == 0; }, 60))
        << "the monitor makes no report";
    EXPECT_TRUE(wait_until([this] {
        std::vector<std::string> targets = open_files(pid());
        descriptors_at_start_ = static_cast<int>(targets.size());
        return std::none_of(targets.begin(), targets.end(), [](const std::string &target) {
            return target.empty() || target.compare(0, 5, "/proc") == 0 ||
                   target.find("dbg-monitor") != std::string::npos;
        });
    }));
    threads_at_start_ = threads();
}

Client Service::send(const std::string &message) {
    int ours, theirs;
    connect_tcp(&ours, &theirs);
    EXPECT_EQ(0, sockhand_send(cgi_socket().c_str(), message.data(),
                               static_cast<int>(message.size()), theirs))
        << strerror(errno);
    close(theirs);
    return Client(ours);
}

Client Service::request(const std::string &path, const std::string &query) {
    return send(path + '\0' + query + '\0');
}

std::string Service::reply(const std::string &path, const std::string &query, int timeout_s) {
    return request(path, query).read_all(timeout_s);
}

int Service::connect_segf() const {
    return connect_unix(segf_socket());
}

int Service::connect_cgi() const {
    return connect_unix(cgi_socket());
}

int Service::descriptors() const {
    return count_descriptors(pid());
}

int Service::threads() const {
    return count_threads(pid());
}

int Service::children() const {
    return static_cast<int>(children_of(pid()).size());
}

void Service::limit_descriptors(unsigned count) const {
    const rlimit limit = {count, 1024};
    EXPECT_EQ(0, prlimit(pid(), RLIMIT_NOFILE, &limit, nullptr)) << strerror(errno);
}

bool Service::is_at_rest(int timeout_s) const {
    const bool rests = wait_until(
        [this] {
            return descriptors() == descriptors_at_start_ && threads() == threads_at_start_ &&
                   children() == 0;
        },
        timeout_s);
    // Who does not wait is asking, and not sure of it.
    if (!rests && timeout_s > 0)
        fprintf(stderr,
                "the service has %d descriptors (%d at its start), %d threads (%d), %d children\n",
                descriptors(), descriptors_at_start_, threads(), threads_at_start_, children());
    return rests;
}

std::string ok_header(const std::string &content_type, const std::string &file_name) {
    return "HTTP/1.0 200 OK\r\nCache-Control: no-cache\r\n"
           "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\nContent-Type: " +
           content_type + "\r\nContent-Disposition: attachment; filename=\"" + file_name +
           "\"\r\n\r\n";
}

std::string body_of(const std::string &reply, const std::string &header) {
    const size_t end = reply.find("\r\n\r\n");
    const size_t size = end == std::string::npos ? reply.size() : end + 4;
    if (!header.empty()) {
        EXPECT_EQ(header, reply.substr(0, size));
    }
    return reply.substr(size);
}
