// Core images and descriptor maps of live processes, made by an external core-image writer.
#pragma once

#include <sys/types.h>

#include "archive/tar_writer.h"

constexpr int SNAPSHOT_BROKEN = 32;  // EPIPE: the archive's reader has gone

// Names the program that writes core images ("PROGRAM -c /dev/stdout PID") and a descriptor of
// /dev/null for what is thrown away. Both are kept, not copied; set once at start-up.
void set_core_program(const char *program, int devnull_fd);

// Adds a snapshot of every process in `pids`; entries of -1 are skipped, and the processes that are
// covered by another one's core become -1. Ends early when the archive's reader has gone.
void snapshot_processes(TarWriter *tw, int fd, pid_t *pids, int count);

// Adds the members "NAME.PID/core" and "NAME.PID/fdmap" for the process `pids[i]`. The writer names
// on its standard error, in one line before the core, its length and the processes that it covers:
// eight characters, the length, 21 characters, and process ids with blanks between them. Complaints
// go to standard error. Returns 0, or SNAPSHOT_BROKEN.
int snapshot_process(TarWriter *tw, int fd, pid_t *pids, int i, int count);

// Writes the core image of process `pid` to `out_fd`. Returns 0, whatever came of it.
int dump_core_to_fd(int out_fd, pid_t pid);

// Adds a long listing of the descriptors of `pid`, or what /bin/ls complains of, as member `name`.
void add_fdmap(TarWriter *tw, const char *name, pid_t pid, int fd);
