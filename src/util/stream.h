// Blocking reads and writes of whole buffers on raw descriptors.
//
// None of these functions allocates, prints, or keeps a descriptor that it is given. All may be
// called from any thread. They expect SIGPIPE to be ignored, as the dispatcher does for every
// applet: a receiver that has gone away is then the error EPIPE.
#pragma once

#include <stdint.h>

// Writes all `len` bytes of `buf` to `fd`. Returns `len`, or -1 with errno set; how much had gone
// out by then is not told. EINTR and EAGAIN are retried at once, so a non-blocking descriptor that
// stays full keeps the processor busy. A `len` of 0 still makes one write call of 0 bytes.
int32_t write_all(int fd, const void *buf, uint32_t len);

// Reads from `fd` until `len` bytes have come or the input ends. Returns the number of bytes read,
// less than `len` only at the end of the input, or -1 with errno set. EINTR and EAGAIN are retried
// at once.
int32_t read_all(int fd, void *buf, uint32_t len);

// Copies from `in_fd` to `out_fd` until the input ends. Returns the number of bytes that went out,
// or -1 when the output's receiver has gone (EPIPE). After any other output error the rest of the
// block of at most 16384 bytes is dropped and the copy goes on, so the count may fall short of the
// input. Read errors are retried for ever: the caller has opened and examined the input before.
int64_t copy_fd(int in_fd, int out_fd);

// A descriptor with a byte budget, for producers that must fill an archive member of fixed size.
struct BoundedWriter {
    int32_t fd;         // borrowed
    int32_t remaining;  // bytes that may still be written; set by the owner, never below 0
    uint32_t failed;    // 0 at first, 1 from the first failed write on
};

// Writes `buf` to the BoundedWriter `state`, cut to what remains of its budget; a `len` that is
// negative as a signed number is no text. Returns 1 while more is wanted, 0 when the budget is used
// up or a write failed.
uint32_t bounded_write_cb(BoundedWriter *state, const void *buf, uint32_t len);
