// The trace engine: follows a set of processes from system call to system call.
#pragma once

#include "trace/trace_request.h"

// Traces the processes of `request` until all are gone, output_cb asks for the end, or the time
// limit has passed; then the processes that are left are detached and go on. Blocks meanwhile, and
// first for as long as another trace runs in this process: there is only one at a time. Children of
// the traced processes are not followed.
//
// A process that cannot be attached is dropped (its entry becomes -1), and so is one that has been
// uninterruptible for a while. Of a process with several threads the first one alone is traced; for
// another one give its own id. A trace whose last process was killed by a signal ends when this
// process has no other child, with the time limit, or when output_cb asks for it. Text reaches the
// caller through output_cb only, which is also asked after every wait, and now and then while
// another trace runs, whether to go on; the tracer's own complaints go to standard output. While it
// runs, every child of the calling process may be reaped by it; wait_for_child in other threads
// gets the status all the same. Frees request->buf.
void trace_run(TraceRequest *request);
