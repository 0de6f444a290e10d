#include "trace/trace_stops.h"

#include <signal.h>
#include <sys/wait.h>

#include <algorithm>

#include "trace/stop_handlers.h"
#include "trace/tracee_control.h"

namespace {

constexpr uint32_t IN_SYSCALL = 1;            // the bit of TracedProcess::in_syscall
constexpr int SYSCALL_STOP = SIGTRAP | 0x80;  // as PTRACE_O_TRACESYSGOOD marks it

// Hands out the line of a system-call entry or exit.
void show_syscall(Trace *trace, int index) {
    TraceRequest *request = trace->request;
    TracedProcess &process = request->records[index];
    pid_t pid = request->pids[index];
    SyscallRecord record = {};
    int length;
    if ((process.in_syscall & IN_SYSCALL) != 0) {
        length = syscall_exit_stop(request, pid, &record, request->buf, request->buf_size,
                                   &process.regs, &process.exit_record);
        if (length != 0)
            process.in_syscall &= ~IN_SYSCALL;
    } else {
        length = syscall_entry_stop(request, pid, &record, request->buf, request->buf_size,
                                    &process.regs);
        if (length != -1) {
            process.in_syscall |= IN_SYSCALL;
        } else {
            // An entry whose registers cannot be read is shown as the exit of the call before, less
            // its newline; of a number out of range nothing is shown. The exit that follows is
            // taken for an entry.
            length = syscall_exit_stop(request, pid, &record, request->buf, request->buf_size,
                                       &process.regs, &process.exit_record) -
                     1;
        }
    }
    if (request->output_cb == nullptr)
        return;
    // The length is that of the whole line, of which the buffer holds what fitted.
    uint32_t shown = std::min(static_cast<uint32_t>(std::max(length, 0)), request->buf_size - 1);
    (void)request->output_cb(request->cookie, request->buf, shown);
}

void on_syscall_stop(Trace *trace, int index) {
    if ((trace->request->flags & TRACE_SYSCALLS) != 0)
        show_syscall(trace, index);
    (void)step_process(trace, index, 0);
}

void on_event_stop(Trace *trace, int index) {
    pid_t pid = trace->request->pids[index];
    trace_event(trace->request, pid, TRACE_EVENT_STOP, 0, nullptr);
    // Passed on whatever made it, which is why a process that executes another program under a
    // trace is killed unless it ignores SIGTRAP. Readers of traces know that; it must stay.
    (void)step_process(trace, index, SIGTRAP);
}

void on_signal_stop(Trace *trace, int index, int sig) {
    TraceRequest *request = trace->request;
    TracedProcess &process = request->records[index];
    pid_t pid = request->pids[index];
    bool stopped = trace_in_job_stop(pid, sig);
    // A stop that is the effect of the signal shown before is not told again.
    bool told = stopped && process.stop_told;
    process.stop_told = !stopped;
    if ((request->flags & TRACE_SIGNALS) != 0 && !told)
        trace_printf(request, "\n[%d %s] ---  SIGNAL %d %s ---\n\n", pid, process.name, sig,
                     signal_name(*trace_backend(request).abi, sig));
    if (stopped)
        set_held(trace, index, true);
    else
        (void)step_process(trace, index, sig);
}

}  // namespace

void on_stop(Trace *trace, int index, int status) {
    int sig = WSTOPSIG(status);
    // The bits of the second test lie in the signal's own byte, where SIGTRAP has one of them: so
    // every SIGTRAP is told as an event, a breakpoint's too, and not only the exit event.
    bool event = sig == SIGTRAP && (status & 0x600) != 0;
    if (sig == SYSCALL_STOP || event)
        trace->request->records[index].stop_told = false;
    if (sig == SYSCALL_STOP)
        on_syscall_stop(trace, index);
    else if (event)
        on_event_stop(trace, index);
    else
        on_signal_stop(trace, index, sig);
}
