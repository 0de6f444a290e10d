// The plain way to capture: one wait, one read and one write for each frame. What it writes is what
// every faster way has to write, but for the time fields.
#pragma once

#include <arpa/inet.h>
#include <errno.h>
#include <linux/filter.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <poll.h>
#include <stdint.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>

#include "pcap/capture.h"
#include "pcap/pcap_format.h"
#include "util/stream.h"

class PlainCapture {
  public:
    PlainCapture(int out_fd, uint32_t size_limit, uint32_t cut_length, uint32_t time_limit)
        : out_fd_(out_fd),
          watched_out_fd_(is_file(out_fd) ? -1 : out_fd),
          size_limit_(size_limit),
          cut_length_(std::min(cut_length, uint32_t{sizeof frame_})),
          time_limit_(time_limit) {}
    ~PlainCapture() { close(socket_fd_); }
    PlainCapture(const PlainCapture &) = delete;
    PlainCapture &operator=(const PlainCapture &) = delete;

    int64_t run(const char *interface, bool promiscuous, const sock_fprog *filter) {
        if (!open(interface, filter))
            return -EIO;
        set_promiscuous(socket_fd_, interface, promiscuous);
        const auto header = pcap_global_header();
        bool written = put(header.data(), header.size());
        start_ = uptime_seconds();
        while (written && next_frame(&written)) {
        }
        written = written && fill_up();
        set_promiscuous(socket_fd_, interface, false);
        return written ? count_ : -1;
    }

  private:
    // A file is always readable, and no wait would be one.
    static bool is_file(int fd) {
        struct stat status;
        return fstat(fd, &status) == 0 && S_ISREG(status.st_mode);
    }

    bool open(const char *interface, const sock_fprog *filter) {
        socket_fd_ = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 3);
        sockaddr_ll address = {};
        address.sll_family = AF_PACKET;
        address.sll_protocol = htons(ETH_P_ALL);
        address.sll_ifindex = static_cast<int>(if_nametoindex(interface));
        return socket_fd_ >= 0 &&
               bind(socket_fd_, reinterpret_cast<const sockaddr *>(&address), sizeof address) ==
                   0 &&
               (filter == nullptr ||
                setsockopt(socket_fd_, SOL_SOCKET, SO_ATTACH_FILTER, filter, sizeof *filter) == 0);
    }

    bool put(const void *bytes, size_t size) {
        count_ += static_cast<int64_t>(size);
        return write_all(out_fd_, bytes, static_cast<uint32_t>(size)) >= 0;
    }

    // Returns whether there may be another one.
    bool next_frame(bool *written) {
        int timeout_ms = -1;
        if (time_limit_ != 0) {
            const int64_t left = time_limit_ - (uptime_seconds() - start_);
            if (left <= 0)
                return false;
            timeout_ms = static_cast<int>(std::min<int64_t>(left, 1000)) * 1000;
        }
        pollfd fds[] = {{.fd = socket_fd_, .events = POLLIN, .revents = 0},
                        {.fd = watched_out_fd_, .events = POLLIN, .revents = 0}};
        if (poll(fds, 2, timeout_ms) <= 0)
            return true;
        char unwanted[1536];
        if (fds[1].revents != 0 && read(out_fd_, unwanted, sizeof unwanted) <= 0 &&
            size_limit_ == 0 && time_limit_ == 0)
            return false;
        if (fds[0].revents == 0)
            return true;
        const ssize_t length = read(socket_fd_, frame_, sizeof frame_);
        if (length < 1)
            return false;
        const uint32_t captured = cut_length_ != 0 ? cut_length_ : static_cast<uint32_t>(length);
        if (size_limit_ != 0 && count_ + 48 + captured >= size_limit_)
            return false;
        timeval now;
        gettimeofday(&now, nullptr);
        const auto header = pcap_record_header({.seconds = static_cast<uint32_t>(now.tv_sec),
                                                .microseconds = static_cast<uint32_t>(now.tv_usec),
                                                .captured_length = captured,
                                                .original_length = static_cast<uint32_t>(length)});
        *written = put(header.data(), header.size()) && put(frame_, captured);
        return true;
    }

    bool fill_up() {
        const char zeros[32767] = {};
        while (count_ < size_limit_) {
            const auto remainder = static_cast<uint32_t>(size_limit_ - count_);
            const uint32_t size = pcap_filler_size(remainder);
            if (size < 16) {
                if (!put(zeros, size))
                    return false;
                continue;
            }
            const auto header = pcap_filler_header(size - 16);
            if (!put(header.data(), header.size()) || !put(zeros, size - 16))
                return false;
        }
        return true;
    }

    int socket_fd_ = -1;
    int out_fd_;
    int watched_out_fd_;
    uint32_t size_limit_;
    uint32_t cut_length_;
    uint32_t time_limit_;
    long start_ = 0;
    int64_t count_ = 0;
    uint8_t frame_[1536] = {};
};

inline int64_t plain_capture(const char *interface, int out_fd, uint32_t size_limit,
                             uint32_t cut_length, uint32_t time_limit, bool promiscuous,
                             const sock_fprog *filter) {
    PlainCapture capture(out_fd, size_limit, cut_length, time_limit);
    return capture.run(interface, promiscuous, filter);
}
