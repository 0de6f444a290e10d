// Starting other programs.
#pragma once

#include <sys/types.h>

#include "util/children.h"

// Starts the executable `path` (a full path: PATH is not searched) with the null-terminated vectors
// `argv` and `envp` (null: no environment). The three descriptors become 0, 1 and 2 of the child,
// in this order: 0, 1 or 2 in the place of another is what it has become by then. The child
// inherits everything else that is not marked close-on-exec as well; the caller keeps its own. With
// `trace_me` the child becomes a ptrace tracee of the caller and stops with SIGTRAP at its
// successful execve.
//
// Returns the child's pid, to be reaped with wait_for_child (or after forget_child), or -1 with
// "fork: ..." printed on standard error. A program that cannot be executed is not a failure here:
// the child prints "execve: ..." on `err_fd` and exits with 1.
pid_t spawn_process(const char *path, char *const argv[], char *const envp[], int in_fd, int out_fd,
                    int err_fd, bool trace_me);

// The same with an empty environment, as nearly everything is started.
pid_t spawn_process_noenv(const char *path, char *const argv[], int in_fd, int out_fd, int err_fd,
                          bool trace_me);

// Starts `path` with an empty environment, waits for it once and returns bits 8 to 15 of its wait
// status: the exit code, or 0 for a child that a signal killed (with `trace_me`: the signal of its
// first stop). Also 0 when it cannot be started or waited for.
int run_process_wait(const char *path, char *const argv[], int in_fd, int out_fd, int err_fd,
                     bool trace_me);
