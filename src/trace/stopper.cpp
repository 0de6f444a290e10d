// The applet `stopper`.
#include <stdio.h>

#include "trace/trace_request.h"
#include "trace/tracer_applets.h"
#include "trace/tracer_command_line.h"

namespace {

constexpr char USAGE[] =
    "USAGE: stopper [ -ppid ] [ command [ arg ... ] ]\n"
    "\n"
    "-p<pid>\tAdd a pid to stop at exit";

uint32_t stopper_output_cb(intptr_t, const char *, uint32_t) {
    return stop_requested() ? 0 : 1;
}

// Tells of the exit and, at the exit event, holds the process there until SIGINT: it is stopped
// with all that it has for as long as the engine waits for this to return.
uint32_t stopper_event_cb(TraceRequest *, intptr_t, pid_t pid, int kind, unsigned long value,
                          const SyscallRecord *) {
    if (stop_requested())
        return 0;
    printf("stopper: Trapped pid=%d exit code %d\n", pid, static_cast<int>(value));
    // Into a pipe it would otherwise stay in the buffer while the process is held.
    (void)fflush(stdout);
    if (kind == TRACE_EVENT_STOP)
        sleep_until_stop_requested();
    return 0;
}

}  // namespace

int run_stopper(int argc, char **argv) {
    TraceRequest request = {};
    request.output_cb = stopper_output_cb;
    request.event_cb = stopper_event_cb;
    // System calls are followed for the exit call that shows its exit code; the text is dropped.
    request.flags = TRACE_SYSCALLS | TRACE_EXIT_EVENT;
    return run_tracer(argc, argv, USAGE, &request);
}
