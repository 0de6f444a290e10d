#include "util/stream.h"

#include <errno.h>
#include <unistd.h>

#include <algorithm>

namespace {

constexpr uint32_t COPY_BLOCK = 16384;

// At once and without end, a full non-blocking descriptor included: the toolbox writes to blocking
// ones, and giving up would cut its output.
bool worth_retrying(int error) {
    return error == EINTR || error == EAGAIN;
}

// write_all that also tells how many bytes went out, failed or not.
bool write_counted(int fd, const void *buf, uint32_t len, uint32_t *done) {
    const char *bytes = static_cast<const char *>(buf);
    *done = 0;
    do {
        ssize_t n = write(fd, bytes + *done, len - *done);
        if (n >= 0)
            *done += static_cast<uint32_t>(n);
        else if (!worth_retrying(errno))
            return false;
    } while (*done < len);
    return true;
}

}  // namespace

int32_t write_all(int fd, const void *buf, uint32_t len) {
    uint32_t done;
    return write_counted(fd, buf, len, &done) ? static_cast<int32_t>(done) : -1;
}

int32_t read_all(int fd, void *buf, uint32_t len) {
    char *bytes = static_cast<char *>(buf);
    uint32_t done = 0;
    do {
        ssize_t n = read(fd, bytes + done, len - done);
        if (n == 0)
            break;
        if (n > 0)
            done += static_cast<uint32_t>(n);
        else if (!worth_retrying(errno))
            return -1;
    } while (done < len);
    return static_cast<int32_t>(done);
}

int64_t copy_fd(int in_fd, int out_fd) {
    char block[COPY_BLOCK];
    int64_t total = 0;
    for (;;) {
        ssize_t n = read(in_fd, block, sizeof block);
        if (n == 0)
            return total;
        // Every read error counts as passing, EIO too: the output's size has been announced, and
        // callers have made sure that the input can be read at all.
        if (n < 0)
            continue;
        uint32_t written;
        if (!write_counted(out_fd, block, static_cast<uint32_t>(n), &written) && errno == EPIPE)
            return -1;
        total += written;
    }
}

uint32_t bounded_write_cb(BoundedWriter *state, const void *buf, uint32_t len) {
    // A poll (no text) on a broken pipe succeeds, so the failure has to be remembered.
    if (state->failed)
        return 0;
    // A producer may hand on a failed call's -1 as its length: that is no text.
    if (len > INT32_MAX)
        len = 0;
    uint32_t n = std::min(len, static_cast<uint32_t>(state->remaining));
    if (write_all(state->fd, buf, n) < 0) {
        state->failed = 1;
        return 0;
    }
    state->remaining -= static_cast<int32_t>(n);
    return state->remaining > 0;
}
