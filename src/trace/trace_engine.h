// The trace engine: follows a set of processes from system call to system call.
#pragma once

#include <sys/types.h>

#include "trace/trace_request.h"

// Traces the processes of `request` until all are gone, output_cb asks for the end, or the time
// limit has passed; then the processes that are left are detached and go on. Blocks meanwhile, and
// first for as long as another trace runs in this process: there is only one at a time. Children of
// the traced processes are not followed.
//
// A process that cannot be attached is dropped (its entry becomes -1). Text reaches the caller
// through output_cb only; the tracer's own complaints go to standard output. While it runs, every
// child of the calling process may be reaped by it. Frees request->buf.
void trace_run(TraceRequest *request);

// Attaches to `pid` and waits for its stop. Returns -1 when that is refused, else the result of the
// last wait.
int trace_attach(pid_t pid);

// Lets go of `pid`, with the signal `sig` delivered, stopping it first if it runs.
void trace_detach(pid_t pid, int sig = 0);

// Sets ptrace options of `pid`, a stopped tracee.
void trace_set_options(pid_t pid, unsigned long options);

// Let the stopped tracee `pid` go on, to its end or to its next system call, with the signal `sig`
// delivered. Up to 4 attempts; each failure is told. Return the last result of ptrace.
long trace_cont(pid_t pid, int sig);
long trace_syscall(pid_t pid, int sig);
