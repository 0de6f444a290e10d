#include "trace/trace_events.h"

#include <errno.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>

#include "trace/tracee_control.h"
#include "util/children.h"
#include "util/clock.h"

namespace {

constexpr long HELD_POLL_MS = 50;
constexpr unsigned LOOK_EVENTS = 64;
constexpr int LOOK_PROCESSES = 8;

// Lets processes go on that were held and have been sent SIGCONT. The kernel wakes a tracee for no
// signal but SIGKILL, and does not tell its tracer either, so this is looked for now and then.
void step_continued(Trace *trace) {
    int64_t now = monotonic_ms();
    if (now - trace->looked_ms < HELD_POLL_MS)
        return;
    trace->looked_ms = now;
    TraceRequest *request = trace->request;
    for (int i = 0; i < request->nr_pids; ++i) {
        if (request->records[i].held && trace_sigcont_pending(request->pids[i])) {
            set_held(trace, i, false);
            (void)step_process(trace, i, 0);
        }
    }
}

// Blocks until a child or tracee may have something to tell, at most HELD_POLL_MS. SIGCHLD is
// blocked, so that none is lost between the look and this. False when another signal came.
bool await_child_signal() {
    sigset_t child_signal;
    (void)sigemptyset(&child_signal);
    (void)sigaddset(&child_signal, SIGCHLD);
    timespec limit = {.tv_sec = 0, .tv_nsec = HELD_POLL_MS * 1000000L};
    return sigtimedwait(&child_signal, nullptr, &limit) != -1 || errno == EAGAIN;
}

// Asks the next ones of the processes that are still to be asked by themselves; 0 when none of them
// has something to tell.
pid_t look_at_next(Trace *trace, int *status) {
    const TraceRequest &request = *trace->request;
    while (trace->looks_left > 0) {
        --trace->looks_left;
        trace->looked_at = (trace->looked_at + 1) % request.nr_pids;
        pid_t pid = request.pids[trace->looked_at];
        if (pid != -1 && wait_as_tracer(pid, status, WNOHANG | __WALL) == pid)
            return pid;
    }
    return 0;
}

}  // namespace

pid_t wait_for_event(Trace *trace, int *status) {
    // The kernel looks at them in an order of its own. Where busy ones come first, which always
    // have something to tell, nothing would be heard of the others, nor of the end of the timer: so
    // these are asked by themselves now and then, some processes at a time.
    if (++trace->events % LOOK_EVENTS == 0) {
        trace->looks_left = trace->request->nr_pids > 1 ? LOOK_PROCESSES : 0;
        if (trace->timer != -1 && wait_as_tracer(trace->timer, status, WNOHANG) == trace->timer)
            return trace->timer;
        if (trace->held > 0)
            step_continued(trace);
    }
    pid_t next = look_at_next(trace, status);
    if (next != 0)
        return next;
    while (trace->held > 0) {
        pid_t pid = wait_as_tracer(-1, status, WNOHANG | __WALL);
        if (pid != 0)
            return pid;
        step_continued(trace);
        if (!await_child_signal())
            return -1;
    }
    return wait_as_tracer(-1, status, __WALL);
}
