// The device on which the oops log lies: raw flash, or a block device that stands for it.
#pragma once

#include <stdint.h>

#include "oops/log_scan.h"
#include "util/unique_fd.h"

struct OopsDevice {
    UniqueFd fd;
    bool is_block_device;
    uint64_t size;  // in bytes
};

// The size in bytes of a block device of so many sectors of 512 bytes, 4 GiB and more included
// where a long has 32 bits.
constexpr uint64_t block_device_size(unsigned long sectors) {
    return uint64_t{sectors} * 512;
}

// Opens `path` for reading and asks for its size. Returns false with the system's error printed on
// standard error behind the name of what failed: "open", "stat", "BLKGETSIZE" or, for whatever is
// no block device, "MEMGETINFO".
bool open_oops_device(const char *path, OopsDevice *device);

// The log on `device`, which must outlive it and stay where it is.
LogSource log_source(OopsDevice *device);
