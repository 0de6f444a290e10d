// The core-dump handler as the kernel starts it, with what stands around it on a device.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/temp_dir.h"

inline const char *const SERVICE_SOCKET = "/var/run/dbg-cgi/ctrl-segf-socket";

// Bytes of which no two blocks are the same, zeros included.
inline std::string made_up_core(size_t size) {
    std::vector<uint32_t> words(size / 4 + 1);
    uint32_t state = 1;
    for (uint32_t &word : words)
        word = state = state * 1664525 + 1013904223;
    std::string core(reinterpret_cast<const char *>(words.data()), size);
    return core.replace(0, std::min<size_t>(size, 4),
                        "\x7f"
                        "ELF");
}

inline double now_s() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// A sandbox's own device, one for each sandbox: the system log, the configuration and the folder of
// the service's socket.
struct CoreDevice {
    CoreDevice() {
        sandbox_bind(config_dir.path(), "/etc/conf.d");
        sandbox_bind(socket_dir.path(), "/var/run/dbg-cgi");
    }
    void configure(const std::string &text) { config_dir.file("debugar.cgi", text); }

    SystemLog log;
    TempDir config_dir;
    TempDir socket_dir;
};

// One run of the handler with `core` on its standard input.
class HandlerRun {
  public:
    explicit HandlerRun(const std::string &core, const std::vector<std::string> &args = {},
                        const std::function<void()> &before_exec = {}) {
        const std::string path = dir_.file("core", core);
        core_fd_ = open(path.c_str(), O_RDONLY | O_CLOEXEC);
        std::vector<std::string> words = {fieldkit_path()};
        words.insert(words.end(), args.begin(), args.end());
        RunOptions options;
        options.argv0 = "/usr/sbin/coredump-handler";
        options.before_exec = [this, before_exec] {
            dup2(core_fd_, STDIN_FILENO);
            if (before_exec)
                before_exec();
        };
        program_ = std::make_unique<Background>(words, options);
    }
    ~HandlerRun() { close(core_fd_); }

    pid_t pid() const { return program_->pid(); }
    RunResult wait() { return program_->wait(); }
    // Its end, which must be silent.
    void expect_end(int exit_status) {
        const RunResult result = wait();
        EXPECT_EQ(exit_status, result.exit_status) << "signal " << result.signal;
        EXPECT_EQ("", result.out);
        EXPECT_EQ("", result.err);
    }
    // How much of the core it has taken.
    off_t taken() const { return lseek(core_fd_, 0, SEEK_CUR); }

  private:
    TempDir dir_;
    int core_fd_ = -1;
    std::unique_ptr<Background> program_;
};

// What the kernel gives a handler: nothing but standard input, no environment, "/" as directory.
inline void start_as_the_kernel_does() {
    close(STDOUT_FILENO);
    close(STDERR_FILENO);
    (void)clearenv();
    if (chdir("/") != 0)
        abort();
}

// A connection, with what has come over it and not been looked at.
class Connection {
  public:
    explicit Connection(int fd) : fd_(fd) {}
    ~Connection() { hang_up(); }
    Connection(Connection &&other) noexcept : fd_(other.fd_), text_(std::move(other.text_)) {
        other.fd_ = -1;
    }

    bool valid() const { return fd_ >= 0; }
    void hang_up() {
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }
    void say(const std::string &text) {
        EXPECT_EQ(static_cast<ssize_t>(text.size()),
                  send(fd_, text.data(), text.size(), MSG_NOSIGNAL));
    }
    // The next `size` bytes; less when the other side ends before, or after `timeout_s`.
    std::string take(size_t size, int timeout_s = 20) {
        while (text_.size() < size && receive(timeout_s)) {
        }
        const std::string taken = text_.substr(0, size);
        text_.erase(0, size);
        return taken;
    }
    std::string take_all() { return take(SIZE_MAX); }
    // The next line, without its end.
    std::string take_line() {
        size_t end;
        while ((end = text_.find("\r\n")) == std::string::npos) {
            if (!receive(20)) {
                ADD_FAILURE() << "no whole line; so far: " << text_;
                return "";
            }
        }
        const std::string line = text_.substr(0, end);
        text_.erase(0, end + 2);
        return line;
    }
    // Whether anything, an end as well, comes within the time.
    bool stirs(int timeout_ms) {
        pollfd ready = {fd_, POLLIN, 0};
        return poll(&ready, 1, timeout_ms) != 0;
    }

  private:
    bool receive(int timeout_s) {
        if (!stirs(timeout_s * 1000)) {
            ADD_FAILURE() << "nothing came within " << timeout_s << " s";
            return false;
        }
        char block[65536];
        const ssize_t n = recv(fd_, block, sizeof block, 0);
        if (n <= 0)
            return false;
        text_.append(block, static_cast<size_t>(n));
        return true;
    }
    int fd_;
    std::string text_;
};

// Somebody who waits for connections.
class Listener {
  public:
    Listener(int domain, const sockaddr *address, socklen_t length)
        : fd_(socket(domain, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        // Little on the way, so that whoever is not read from notices.
        const int size = 65536;
        setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
        if (bind(fd_, address, length) != 0 || listen(fd_, 5) != 0)
            ADD_FAILURE() << "no listener: " << strerror(errno);
    }
    ~Listener() { close(fd_); }
    Listener(const Listener &) = delete;
    Listener &operator=(const Listener &) = delete;

    bool has_caller(int timeout_ms) const {
        pollfd ready = {fd_, POLLIN, 0};
        return poll(&ready, 1, timeout_ms) == 1;
    }
    Connection take_caller() const {
        EXPECT_TRUE(has_caller(20000)) << "nobody has called";
        return Connection(has_caller(0) ? accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC) : -1);
    }
    int fd() const { return fd_; }

  private:
    int fd_;
};

// In the place of the debug service.
class FakeService : public Listener {
  public:
    FakeService() : Listener(AF_UNIX, address(), sizeof(sockaddr_un)) {}
    ~FakeService() {
        if (!left_behind_)
            unlink(SERVICE_SOCKET);
    }
    // Its socket stays when it has gone.
    void leave_behind() { left_behind_ = true; }

  private:
    static const sockaddr *address() {
        static sockaddr_un result = {};
        result.sun_family = AF_UNIX;
        strcpy(result.sun_path, SERVICE_SOCKET);
        return reinterpret_cast<const sockaddr *>(&result);
    }
    bool left_behind_ = false;
};
