// Puts a debug archive together.
#pragma once

#include <sys/types.h>

// Writes one debug archive of the running system to `fd` as a tar stream without end blocks. The
// process `exclude_pid` (-1: none) is neither traced nor snapshotted. Blocks for some 10 seconds
// and longer. Ends early, and quietly, when the output breaks. One at a time.
void write_archive(int fd, pid_t exclude_pid);

// The plain form: write_archive without a process to leave out.
void write_archive_tar(int fd);
