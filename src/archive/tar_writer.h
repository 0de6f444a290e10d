// Writes a tar stream straight onto a descriptor that cannot seek: one header layout, regular files
// only, all below one directory, and no end-of-archive blocks.
#pragma once

#include <stdint.h>

// The largest size that a header can announce: eleven octal digits.
constexpr int64_t TAR_SIZE_LIMIT = 077777777777;

// One archive being written. A member's size is announced by its header; whoever adds the member
// writes that much data behind it, through tar_write, or straight to the descriptor with
// tar_account. (The few members that may come out otherwise say so where they are made.)
struct TarWriter {
    char *prefix;  // our own copy, in front of every member name; null for none
    uint32_t prefix_len;
    int32_t fd;             // borrowed
    uint32_t member_bytes;  // data of the current member so far; the padding follows from it
};

// Returns a writer onto `fd` whose members lie below `prefix` (with its own final slash; null or
// empty for none), or null when memory is short. Writes nothing.
TarWriter *tar_open(int fd, const char *prefix);

// Pads the last member and frees the writer.
void tar_close(TarWriter *tw);

// Frees the writer of an archive whose output is broken: nothing more is written.
void tar_abandon(TarWriter *tw);

// Pads the previous member and writes the header of member `name` with `size` bytes of data, from 0
// to TAR_SIZE_LIMIT. A name that does not fit the header's 100 bytes together with the prefix is
// cut. Write errors are not told; they show in the data that follows.
void tar_header(TarWriter *tw, const char *name, int64_t size);

// Writes data of the current member. Returns what write_all returns.
int32_t tar_write(TarWriter *tw, const void *buf, uint32_t len);

// Counts `n` bytes of the current member that were written to the descriptor directly.
void tar_account(TarWriter *tw, uint32_t n);

// Writes zeros to `fd` up to the next multiple of 512 bytes of `count`, and advances `count`.
void tar_pad(int fd, uint32_t *count);

// Writes `n` zero bytes to `fd`; none when `n` is 0 or less. Returns 0, or 1 at the first failure.
int write_zeros(int fd, int64_t n);
