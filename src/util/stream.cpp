#include "util/stream.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include "util/unique_fd.h"

namespace {

constexpr uint32_t COPY_BLOCK = 16384;  // what is dropped of where an error was

constexpr uint32_t READ_SIZE = 4 * COPY_BLOCK;  // the whole of a full pipe, with pages of 4 KiB

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

// Writes `length` bytes, but for the rest of each block that fails, and adds what went out to
// `total`. False when the receiver has gone.
bool write_blocks(int fd, const char *bytes, uint32_t length, int64_t *total) {
    for (uint32_t done = 0; done < length;) {
        uint32_t written;
        const bool whole = write_counted(fd, bytes + done, length - done, &written);
        if (!whole && errno == EPIPE)
            return false;
        *total += written;
        done += written;
        if (!whole)
            done += COPY_BLOCK - done % COPY_BLOCK;
    }
    return true;
}

// Moves the pages of the pipe `in_fd` to `out_fd` instead of copying what is in them, until the
// input ends: a core on its way to the service costs a third less so. Returns false when copying
// has to go on, because the two are of other kinds or because of an error, which will show again
// there; the `length` bytes at `bytes` are then to be written first.
//
// The way leads through a pipe of our own: the kernel locks the one that the pages are taken from
// for as long as the output is stuck, and who wanted to fill it then could not even be killed.
bool move_pages(int in_fd, int out_fd, char *bytes, uint32_t *length, int64_t *total) {
    *length = 0;
    struct stat status;
    int ends[2];
    if (fstat(in_fd, &status) != 0 || !S_ISFIFO(status.st_mode) || pipe2(ends, O_CLOEXEC) != 0)
        return false;
    const UniqueFd taken(ends[0]);
    const UniqueFd entry(ends[1]);
    for (;;) {
        ssize_t left = splice(in_fd, nullptr, entry.get(), nullptr, READ_SIZE, 0);
        if (left == 0)
            return true;
        if (left < 0 && errno != EINTR)
            return false;
        while (left > 0) {
            const size_t wanted = static_cast<size_t>(left);
            const ssize_t n = splice(taken.get(), nullptr, out_fd, nullptr, wanted, 0);
            if (n > 0) {
                left -= n;
                *total += n;
            } else if (n == 0 || errno != EINTR) {
                const int32_t rest = read_all(taken.get(), bytes, static_cast<uint32_t>(left));
                *length = rest > 0 ? static_cast<uint32_t>(rest) : 0;
                return false;
            }
        }
    }
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
    char bytes[READ_SIZE];
    uint32_t length;
    int64_t total = 0;
    if (move_pages(in_fd, out_fd, bytes, &length, &total))
        return total;
    for (;;) {
        if (!write_blocks(out_fd, bytes, length, &total))
            return -1;
        const ssize_t n = read(in_fd, bytes, sizeof bytes);
        if (n == 0)
            return total;
        // Every read error counts as passing, EIO too: the output's size has been announced, and
        // callers have made sure that the input can be read at all.
        length = n > 0 ? static_cast<uint32_t>(n) : 0;
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
