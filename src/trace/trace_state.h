// A trace under way: what the files of the engine share.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "trace/trace_request.h"

struct Trace {
    TraceRequest *request;
    int live;           // processes that have not been seen to end
    int held;           // processes with TracedProcess::held
    pid_t timer;        // the child that measures the time limit, or -1
    unsigned events;    // that were waited for so far
    int looks_left;     // how many processes are to be asked by themselves
    int looked_at;      // index of the last one that was
    int64_t looked_ms;  // when held processes were last looked after
};

// Whether the caller wants the trace to go on.
bool still_wanted(const TraceRequest &request);

// Says whether the process at `index` is left in the stop that a signal has made.
void set_held(Trace *trace, int index, bool held);

// Forgets a process that has ended or been detached.
void drop_process(Trace *trace, int index);

// Lets a process go on to its next system-call stop, with the signal `sig` delivered; one that
// cannot is told of, let go of and dropped. It still counts as live: the trace then ends when there
// is nothing to wait for, and not with the last exit. Returns whether it goes on.
bool step_process(Trace *trace, int index, int sig);
