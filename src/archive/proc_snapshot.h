// A flat copy of /proc and of chosen directories below it.
#pragma once

#include "archive/tar_writer.h"

// Adds the files directly in /proc, in a directory named after the local time, and those of some
// directories below it under their own names. Returns 0, or 1 when /proc cannot be opened.
int snapshot_proc(TarWriter *tw, int fd);

// Adds every file directly in `fs_dir` (with its final slash) as `archive_dir` and its name, except
// those in the null-terminated list `skip`, which may be null. Returns 0, or 1 when the directory
// cannot be opened.
int copy_dir_files(TarWriter *tw, int fd, const char *archive_dir, const char *fs_dir,
                   const char *const *skip);
