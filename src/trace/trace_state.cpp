#include "trace/trace_state.h"

#include <stdio.h>

#include "trace/tracee_control.h"

bool still_wanted(const TraceRequest &request) {
    return request.output_cb == nullptr || request.output_cb(request.cookie, request.buf, 0) != 0;
}

void set_held(Trace *trace, int index, bool held) {
    TracedProcess &process = trace->request->records[index];
    trace->held += static_cast<int>(held) - static_cast<int>(process.held);
    process.held = held;
}

void drop_process(Trace *trace, int index) {
    set_held(trace, index, false);
    trace->request->pids[index] = -1;
}

bool step_process(Trace *trace, int index, int sig) {
    pid_t pid = trace->request->pids[index];
    if (trace_syscall(pid, sig) != -1)
        return true;
    printf("WARNING: ptrace SYSCALL failed! %d\n", pid);
    trace_detach(pid);
    drop_process(trace, index);
    return false;
}
