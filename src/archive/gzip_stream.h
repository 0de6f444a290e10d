// The gzip form of a debug archive.
#pragma once

// Writes one debug archive to `out_fd`, compressed by a child process that is reaped before this
// returns. Prints "pipes: ..." or "fork: ..." on standard error, with nothing written, when it
// cannot begin.
void write_archive_gz(int out_fd);

// Compresses descriptor 0 into a gzip file on descriptor 1, until the input ends or the output
// breaks.
void gzip_filter();
