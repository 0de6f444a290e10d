#include "support/system_log.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <regex>

#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

int bind_socket(const std::string &path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0)
        ADD_FAILURE() << path << ": " << strerror(errno);
    return fd;
}

}  // namespace

LogLine parse_log_line(std::string_view text) {
    static const std::regex FORM(
        "<([0-9]+)>[A-Z][a-z]{2} [ 0-9][0-9] [0-9:]{8} ([^:\\[]*)(?:\\[([0-9]+)\\])?: ([^]*)");
    std::match_results<std::string_view::const_iterator> parts;
    if (!std::regex_match(text.begin(), text.end(), parts, FORM)) {
        ADD_FAILURE() << "not a line of the system log: " << text;
        return {};
    }
    return {std::stoi(parts.str(1)), parts.str(2), parts.str(3), parts.str(4)};
}

SystemLog::SystemLog() {
    // The socket stays bound when its first name has gone with the directory.
    TempDir dir;
    fd_ = bind_socket(dir / "log");
    sandbox_bind(dir / "log", "/dev/log");
}

SystemLog::SystemLog(const std::string &path) : fd_(bind_socket(path)), path_(path) {}

SystemLog::~SystemLog() {
    close(fd_);
    if (!path_.empty())
        unlink(path_.c_str());
}

bool SystemLog::receive(int timeout_ms, LogLine *line) {
    pollfd ready = {fd_, POLLIN, 0};
    if (poll(&ready, 1, timeout_ms) != 1)
        return false;
    char text[8192];
    const ssize_t length = recv(fd_, text, sizeof text, 0);
    if (length < 0)
        return false;
    *line = parse_log_line({text, static_cast<size_t>(length)});
    return true;
}

LogLine SystemLog::read_line(int timeout_s) {
    LogLine line;
    if (!receive(timeout_s * 1000, &line))
        ADD_FAILURE() << "nothing was logged within " << timeout_s << " s";
    return line;
}

std::vector<LogLine> SystemLog::read_lines() {
    std::vector<LogLine> lines;
    LogLine line;
    while (receive(0, &line))
        lines.push_back(line);
    return lines;
}
