#include "util/await_reader.h"

#include <poll.h>
#include <sys/ioctl.h>

#include "util/clock.h"

namespace {

constexpr int LOOK_INTERVAL_MS = 1000;

// Bytes that the reader has not taken yet, of a socket or else a pipe; -1: not known.
int untaken_bytes(int fd) {
    int count;
    return ioctl(fd, TIOCOUTQ, &count) == 0 || ioctl(fd, FIONREAD, &count) == 0 ? count : -1;
}

}  // namespace

bool await_reader(int fd, int patience_s, const std::atomic<uint32_t> *wanted) {
    pollfd output = {.fd = fd, .events = POLLOUT, .revents = 0};
    if (poll(&output, 1, 0) > 0)
        return true;
    int untaken = untaken_bytes(fd);
    int64_t taken_ms = monotonic_ms();  // when the reader last took something
    for (;;) {
        const int ready = poll(&output, 1, LOOK_INTERVAL_MS);
        if (ready > 0)
            return true;
        if (ready < 0 && wanted != nullptr && *wanted == 0)
            return false;
        const int left = untaken_bytes(fd);
        if (left != untaken)
            taken_ms = monotonic_ms();
        else if (monotonic_ms() - taken_ms >= int64_t{patience_s} * 1000)
            return false;
        untaken = left;
    }
}
