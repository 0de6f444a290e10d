// A capture that runs while the test looks at what it writes.
#pragma once

#include <gtest/gtest.h>
#include <linux/filter.h>
#include <poll.h>
#include <stdint.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "pcap/capture.h"
#include "support/refused_calls.h"
#include "support/sandbox.h"

const SandboxOptions WITH_ETH0 = {.eth0 = true};

struct CaptureOptions {
    std::string interface = "eth0";
    uint32_t size_limit = 0;
    uint32_t cut_length = 0;
    uint32_t time_limit = 0;
    bool promiscuous = true;
    const sock_fprog *filter = nullptr;
    // What captures: the code under test, or a plain way that is known to be right.
    decltype(&capture_packets) capture = capture_packets;
};

inline int64_t capture_into(int out_fd, const CaptureOptions &options) {
    return options.capture(options.interface.c_str(), out_fd, options.size_limit,
                           options.cut_length, options.time_limit, options.promiscuous,
                           options.filter);
}

// Runs in a thread of its own, to be used inside a sandbox only. The stream goes to a client at the
// other end of a socket. When the constructor is done, the capture sees every frame.
class CaptureRun {
  public:
    // Onto a new local socket, or onto `server`, an end of a connection with the end `client`; both
    // are then the object's.
    explicit CaptureRun(const CaptureOptions &options, int server = -1, int client = -1)
        : client_(client), server_(server) {
        int ends[2];
        if (server_ < 0) {
            EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
            client_ = ends[0];
            server_ = ends[1];
        }
        thread_ = std::thread([this, options] {
            result_ = capture_into(server_, options);
            shutdown(server_, SHUT_RDWR);
        });
        EXPECT_LE(24u, read_until(24).size());
    }
    ~CaptureRun() {
        close_client();
        if (thread_.joinable())
            thread_.join();
        close(server_);
    }
    CaptureRun(const CaptureRun &) = delete;
    CaptureRun &operator=(const CaptureRun &) = delete;

    int client() const { return client_; }
    int server() const { return server_; }
    std::thread &thread() { return thread_; }

    // The stream from its beginning, as soon as it has at least `size` bytes or has ended.
    const std::string &read_until(size_t size) {
        char block[4096];
        while (stream_.size() < size) {
            ssize_t n = read(client_, block, sizeof block);
            if (n < 0 && errno == EINTR)
                continue;
            if (n <= 0)
                break;
            stream_.append(block, static_cast<size_t>(n));
        }
        return stream_;
    }

    // The whole stream, when the capture has ended.
    const std::string &read_all() { return read_until(SIZE_MAX); }

    void close_client() {
        if (client_ >= 0)
            close(client_);
        client_ = -1;
    }

    // What the capture returned, when it has ended.
    int64_t result() {
        thread_.join();
        return result_;
    }

  private:
    int client_;
    int server_;
    int64_t result_ = 0;
    std::string stream_;
    std::thread thread_;
};
