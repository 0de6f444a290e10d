// What a trace waits for: stops and ends of the processes that it traces, and the end of its timer.
#pragma once

#include <sys/types.h>

#include "trace/trace_state.h"

// waitpid for any child or tracee of the calling thread, which has SIGCHLD blocked. Hears of each
// of them, however busy the others are, and lets processes go on that were held and have been
// continued.
pid_t wait_for_event(Trace *trace, int *status);
