// A connection to a client, both ends of which the test holds.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <utility>

class ClientPair {
  public:
    ClientPair() { EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds_)); }
    ~ClientPair() {
        close_server();
        close_client();
    }
    ClientPair(const ClientPair &) = delete;
    ClientPair &operator=(const ClientPair &) = delete;

    // The service's end, and the same for who takes it over.
    int server() const { return fds_[0]; }
    int release_server() { return std::exchange(fds_[0], -1); }
    int client() const { return fds_[1]; }

    void close_server() { close_end(&fds_[0]); }
    void close_client() { close_end(&fds_[1]); }

    // All that the service sends until it closes its end, which it has done in these tests.
    std::string reply() {
        std::string text;
        char block[4096];
        for (;;) {
            pollfd readable = {fds_[1], POLLIN, 0};
            if (poll(&readable, 1, 10000) != 1) {
                ADD_FAILURE() << "the connection is still open";
                return text;
            }
            ssize_t n = read(fds_[1], block, sizeof block);
            if (n <= 0)
                return text;
            text.append(block, static_cast<size_t>(n));
        }
    }

    // Whether the connection is open and nothing has been sent.
    bool is_waiting() const {
        pollfd readable = {fds_[1], POLLIN, 0};
        return poll(&readable, 1, 0) == 0;
    }

  private:
    static void close_end(int *fd) {
        if (*fd >= 0)
            close(*fd);
        *fd = -1;
    }
    int fds_[2] = {-1, -1};
};
