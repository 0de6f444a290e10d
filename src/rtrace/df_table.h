// How full the mounted file systems are, as a table of text.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "rtrace/record_stream.h"

// What the kernel says of a file system.
struct FilesystemFigures {
    uint64_t block_size;  // in bytes
    uint64_t blocks;
    uint64_t free_blocks;
    uint64_t available_blocks;  // of those, what users other than root may have
};

// Whether the table lists a mount of `source` as file system `type`: not if it is a network's.
bool df_lists(const char *source, const char *type);

// Puts the heading line, or that of one file system, into `buf`, cut to `size` - 1 bytes and
// terminated. Returns the length of the whole line.
int format_df_heading(char *buf, size_t size);
int format_df_line(char *buf, size_t size, const char *source, const FilesystemFigures &figures,
                   const char *mount_point);

// Sends the table of everything in `mounts_path` ("/proc/mounts") as one record of `type`. It is
// cut at RECORD_DATA_SIZE bytes. File systems that give no figures are left out.
bool send_df_table(RecordStream *stream, uint32_t type, const char *mounts_path);
