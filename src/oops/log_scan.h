// Finding the newest entry of an oops log, and printing all entries round the ring.
#pragma once

#include <stdint.h>
#include <stdio.h>

// Where the pages come from: a device, or a test's piece of memory.
struct LogSource {
    uint64_t size;  // of the partition, in bytes

    // Whether the block around `offset` is bad; null where there are no bad blocks.
    bool (*is_bad_block)(void *context, uint64_t offset);

    // Reads the LOG_PAGE_SIZE bytes at `offset` into `buf`. What cannot be read, all of it perhaps,
    // is left as it was; nobody is told.
    void (*read_page)(void *context, uint64_t offset, uint8_t *buf);

    void *context;  // for the two
};

struct NewestEntry {
    int64_t position;  // page number
    uint32_t count;
};

enum class LogDirection { FORWARD, BACKWARD };

// Looks through all pages. Returns false, and leaves `newest` alone, if there is no entry.
bool find_newest_entry(const LogSource &source, NewestEntry *newest);

// The page after `position` in a log of `size` bytes, round the ring.
int64_t next_log_position(int64_t position, LogDirection direction, uint64_t size);

// Prints every entry on `out`, beginning behind page `newest` so that its entry comes last;
// forwards in a log that ends with a part of a page that one is left out. Write errors are left in
// `out`.
void print_log(const LogSource &source, int64_t newest, LogDirection direction, FILE *out);
