#include "util/await_reader.h"

#include <poll.h>
#include <sys/ioctl.h>

namespace {

// Bytes that the reader has not taken yet, of a socket or else a pipe; -1: not known.
int untaken_bytes(int fd) {
    int count;
    return ioctl(fd, TIOCOUTQ, &count) == 0 || ioctl(fd, FIONREAD, &count) == 0 ? count : -1;
}

}  // namespace

bool await_reader(int fd, int patience_s, const std::atomic<uint32_t> *wanted) {
    int untaken = -1;
    for (int patience = patience_s; patience > 0; --patience) {
        pollfd output = {.fd = fd, .events = POLLOUT, .revents = 0};
        const int ready = poll(&output, 1, 1000);
        if (ready > 0)
            return true;
        if (ready < 0 && wanted != nullptr && *wanted == 0)
            return false;
        const int now = untaken_bytes(fd);
        if (now != untaken)
            patience = patience_s;
        untaken = now;
    }
    return false;
}
