#include "archive/gzip_stream.h"

#include <dirent.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <zlib.h>

#include "archive/write_archive.h"
#include "util/children.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr uint32_t BLOCK_SIZE = 16384;

// The fastest level, so that an archive streams at the speed of its collectors on a small device.
constexpr int COMPRESSION_LEVEL = 1;
constexpr int WINDOW_BITS = -15;  // raw deflate: the gzip framing is ours
constexpr int MEMORY_LEVEL = 8;

// ID1, ID2, deflate, no flags, no time, no extra flags, Unix (RFC 1952). The extra flags could tell
// of the fastest level, but these bytes are fixed: readers compare them.
constexpr unsigned char GZIP_HEADER[10] = {0x1f, 0x8b, 8, 0, 0, 0, 0, 0, 0, 3};

struct Compressor {
    z_stream stream;
    uint32_t crc;
    uint32_t size;  // bytes taken in, modulo 2^32
    unsigned char input[BLOCK_SIZE];
    unsigned char output[BLOCK_SIZE];
};

enum class Step { MORE, END, FAILED };

// Calls deflate once and writes what it gave.
Step deflate_some(Compressor *c, int flush) {
    c->stream.next_out = c->output;
    c->stream.avail_out = BLOCK_SIZE;
    int result = deflate(&c->stream, flush);
    uint32_t produced = BLOCK_SIZE - c->stream.avail_out;
    if (produced > 0 && write_all(STDOUT_FILENO, c->output, produced) < 0)
        return Step::FAILED;
    if (result == Z_STREAM_END)
        return Step::END;
    return result == Z_OK ? Step::MORE : Step::FAILED;
}

bool compress_block(Compressor *c, uint32_t length) {
    c->size += length;
    c->crc = static_cast<uint32_t>(crc32(c->crc, c->input, length));
    c->stream.next_in = c->input;
    c->stream.avail_in = length;
    while (c->stream.avail_in > 0) {
        if (deflate_some(c, Z_NO_FLUSH) == Step::FAILED)
            return false;
    }
    return true;
}

bool finish(Compressor *c) {
    Step step;
    do {
        step = deflate_some(c, Z_FINISH);
    } while (step == Step::MORE);
    return step == Step::END;
}

bool write_little_endian(uint32_t value) {
    unsigned char bytes[4];
    for (unsigned i = 0; i < 4; ++i)
        bytes[i] = static_cast<unsigned char>(value >> (8 * i));
    return write_all(STDOUT_FILENO, bytes, sizeof bytes) >= 0;
}

bool compress_all(Compressor *c) {
    (void)write_all(STDOUT_FILENO, GZIP_HEADER, sizeof GZIP_HEADER);
    // A read error counts as the end of the input: what came is framed as usual.
    for (int32_t n; (n = read_all(STDIN_FILENO, c->input, BLOCK_SIZE)) > 0;) {
        if (!compress_block(c, static_cast<uint32_t>(n)))
            return false;
    }
    return finish(c) && write_little_endian(c->crc) && write_little_endian(c->size);
}

void close_descriptors_from(int first) {
#ifdef SYS_close_range
    if (syscall(SYS_close_range, first, ~0u, 0) == 0)
        return;
#endif
    // Linux before 5.9.
    UniqueDir dir(opendir("/proc/self/fd"));
    while (const dirent *entry = dir != nullptr ? readdir(dir.get()) : nullptr) {
        int fd = atoi(entry->d_name);
        if (fd >= first && fd != dirfd(dir.get()))
            (void)close(fd);
    }
}

}  // namespace

void gzip_filter() {
    Compressor c;
    c.stream = {};
    c.crc = static_cast<uint32_t>(crc32(0, nullptr, 0));
    c.size = 0;
    (void)deflateInit2(&c.stream, COMPRESSION_LEVEL, Z_DEFLATED, WINDOW_BITS, MEMORY_LEVEL,
                       Z_DEFAULT_STRATEGY);
    // Nothing more will be read.
    if (!compress_all(&c))
        (void)close(STDIN_FILENO);
    (void)deflateEnd(&c.stream);
}

void run_gzip_child(int in_fd, int out_fd) {
    if (out_fd != STDOUT_FILENO) {
        (void)close(STDOUT_FILENO);
        (void)dup2(out_fd, STDOUT_FILENO);
    }
    if (in_fd != STDIN_FILENO) {
        (void)close(STDIN_FILENO);
        (void)dup2(in_fd, STDIN_FILENO);
    }
    // There is no execve to close them.
    close_descriptors_from(STDERR_FILENO + 1);
    gzip_filter();
    // Not exit: it would write out what the service has buffered for its own standard output.
    _exit(0);
}

void write_archive_gz(int out_fd) {
    int ends[2] = {-1, -1};
    // Not for the programs that the collectors start: the compressor must see the end of its input
    // even if one of them lives on.
    if (pipe2(ends, O_CLOEXEC) != 0) {
        perror("pipes");
        return;
    }
    pid_t pid = fork_child(false);
    if (pid == -1) {
        perror("fork");
        (void)close(ends[0]);
        (void)close(ends[1]);
        return;
    }
    if (pid == 0) {
        // By its number, whatever becomes of the others: with it open the input would never end.
        (void)close(ends[1]);
        run_gzip_child(ends[0], out_fd);
    }
    (void)close(ends[0]);
    write_archive(ends[1], pid);
    (void)close(ends[1]);
    (void)wait_for_child(pid, nullptr);
}
