// The gzip form of a debug archive.
#pragma once

// Writes one debug archive to `out_fd`, compressed by a child process that is reaped before this
// returns. Prints "pipes: ..." or "fork: ..." on standard error, with nothing written, when it
// cannot begin.
void write_archive_gz(int out_fd);

// Compresses descriptor 0 into a gzip file on descriptor 1, until the input ends or the output
// breaks.
void gzip_filter();

// What the compressing child does, right after the fork: runs gzip_filter from `in_fd` to `out_fd`,
// and exits with 0. It keeps no other descriptor than 0, 1 and 2, so that the connections of other
// requests end when they should, and not with this archive.
[[noreturn]] void run_gzip_child(int in_fd, int out_fd);
