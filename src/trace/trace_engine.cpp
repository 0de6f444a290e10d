#include "trace/trace_engine.h"

#include <errno.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "proc/descriptors.h"
#include "proc/process_table.h"
#include "trace/stop_handlers.h"
#include "trace/tracee_control.h"
#include "util/clock.h"
#include "util/spawn.h"
#include "util/unique_fd.h"

namespace {

constexpr uint32_t DEFAULT_BUF_SIZE = 4096;
constexpr uint32_t IN_SYSCALL = 1;            // the bit of TracedProcess::in_syscall
constexpr int SYSCALL_STOP = SIGTRAP | 0x80;  // as PTRACE_O_TRACESYSGOOD marks it
constexpr long HELD_POLL_MS = 50;
constexpr long LOCK_POLL_MS = 200;
constexpr int STUCK_LOOKS = 10;
constexpr useconds_t STUCK_POLL_US = 20000;
constexpr unsigned LOOK_EVENTS = 64;
constexpr int LOOK_PROCESSES = 8;

// One trace at a time: the wait for any child would otherwise take the other trace's events.
pthread_mutex_t trace_mutex = PTHREAD_MUTEX_INITIALIZER;

// A trace under way.
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
bool wanted(const TraceRequest &request) {
    return request.output_cb == nullptr || request.output_cb(request.cookie, request.buf, 0) != 0;
}

void set_held(Trace *trace, int index, bool held) {
    TracedProcess &process = trace->request->records[index];
    trace->held += static_cast<int>(held) - static_cast<int>(process.held);
    process.held = held;
}

// Forgets a process that has ended or been detached.
void drop(Trace *trace, int index) {
    set_held(trace, index, false);
    trace->request->pids[index] = -1;
}

// Lets a process go on to its next system-call stop; one that cannot is dropped. It still counts as
// live: the trace then ends when there is nothing to wait for, and not with the last exit.
bool step(Trace *trace, int index, int sig) {
    pid_t pid = trace->request->pids[index];
    if (trace_syscall(pid, sig) != -1)
        return true;
    printf("WARNING: ptrace SYSCALL failed! %d\n", pid);
    trace_detach(pid);
    drop(trace, index);
    return false;
}

// ---- Set-up ----

// False when another trace has the lock for LOCK_POLL_MS.
bool try_lock() {
    timespec end;
    (void)clock_gettime(CLOCK_REALTIME, &end);
    end.tv_nsec += LOCK_POLL_MS * 1000000;
    if (end.tv_nsec >= 1000000000) {
        end.tv_nsec -= 1000000000;
        ++end.tv_sec;
    }
    return pthread_mutex_timedlock(&trace_mutex, &end) == 0;
}

// Waits for other traces to end. False when this one is not wanted any more before they have.
bool lock_engine(const TraceRequest &request) {
    while (!try_lock()) {
        if (!wanted(request))
            return false;
    }
    return true;
}

bool provide_buffer(TraceRequest *request) {
    if (request->buf != nullptr && request->buf_size != 0)
        return true;
    free(request->buf);
    request->buf = static_cast<char *>(malloc(DEFAULT_BUF_SIZE));
    request->buf_size = request->buf != nullptr ? DEFAULT_BUF_SIZE : 0;
    return request->buf != nullptr;
}

// The last path component of the first command-line word, as far as that fits into the name.
void read_process_name(pid_t pid, char (&name)[TRACED_NAME_SIZE]) {
    char path[30];
    (void)snprintf(path, sizeof path, "/proc/%d/cmdline", pid);
    ssize_t len = read_file(path, name, sizeof name - 1);
    name[len > 0 ? len : 0] = '\0';
    const char *slash = strrchr(name, '/');
    if (slash != nullptr)
        memmove(name, slash + 1, strlen(slash + 1) + 1);
}

// Whether a process has been uninterruptible for some time. (One of the kernel's own may always be
// so, and is refused at once.)
bool is_stuck(pid_t pid) {
    for (int look = 0; look < STUCK_LOOKS; ++look) {
        if (!trace_is_uninterruptible(pid) || is_kernel_thread(pid))
            return false;
        (void)usleep(STUCK_POLL_US);
    }
    return true;
}

// Drops the processes that cannot be stopped: to wait for one of them, perhaps for ever, would hold
// all those that are attached already.
void drop_stuck_processes(Trace *trace) {
    const TraceRequest &request = *trace->request;
    for (int i = 0; i < request.nr_pids; ++i) {
        if (request.pids[i] != -1 && is_stuck(request.pids[i]))
            drop(trace, i);
    }
}

void take_process(Trace *trace, int index) {
    TraceRequest *request = trace->request;
    pid_t pid = request->pids[index];
    if (request->attached == 0 && trace_attach(pid) == -1) {
        drop(trace, index);
        return;
    }
    unsigned long options = PTRACE_O_TRACESYSGOOD;
    if ((request->flags & TRACE_EXIT_EVENT) != 0)
        options |= PTRACE_O_TRACEEXIT;
    trace_set_options(pid, options);
    if (step(trace, index, 0))
        ++trace->live;
    read_process_name(pid, request->records[index].name);
}

// Starts the timer if there is a time limit. A trace that cannot be limited as asked must not run
// without a limit: false.
bool start_timer(Trace *trace) {
    int32_t seconds = trace->request->timeout_s;
    if (seconds <= 0)
        return true;
    char path[] = "/bin/sleep";
    char duration[16];
    (void)snprintf(duration, sizeof duration, "%d", seconds);
    char *argv[] = {path, duration, nullptr};
    trace->timer =
        spawn_process_noenv(path, argv, STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO, false);
    forget_child(trace->timer);  // whose end the loop takes itself
    return trace->timer != -1;
}

// ---- The stops ----

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
    (void)step(trace, index, 0);
}

void on_event_stop(Trace *trace, int index) {
    pid_t pid = trace->request->pids[index];
    trace_event(trace->request, pid, TRACE_EVENT_STOP, 0, nullptr);
    // Passed on whatever made it, which is why a process that executes another program under a
    // trace is killed unless it ignores SIGTRAP. Readers of traces know that; it must stay.
    (void)step(trace, index, SIGTRAP);
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
        (void)step(trace, index, sig);
}

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

// ---- The loop ----

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
            (void)step(trace, i, 0);
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

// waitpid for any child or tracee.
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

// Acts on the wait status of a process. Returns whether the trace goes on.
bool on_status(Trace *trace, int index, int status) {
    set_held(trace, index, false);
    if (WIFEXITED(status)) {
        drop(trace, index);
        return --trace->live != 0;
    }
    if (WIFSIGNALED(status)) {
        // Also the last one's death leaves the end of the trace to the next wait, which finds no
        // child any more, or else the time limit.
        drop(trace, index);
        --trace->live;
        return true;
    }
    if (WIFSTOPPED(status))
        on_stop(trace, index, status);
    return true;
}

void follow(Trace *trace) {
    for (;;) {
        int status;
        pid_t pid = wait_for_event(trace, &status);
        int error = errno;
        bool expired = trace->timer != -1 && pid == trace->timer;
        if (expired)
            trace->timer = -1;
        if (!wanted(*trace->request) || expired)
            return;
        if (pid == -1) {
            if (error == ECHILD || (error == EINTR && !wanted(*trace->request)))
                return;
            continue;
        }
        // Other children of this process end, too; they are of no interest.
        int index = pid_index(pid, trace->request->pids, trace->request->nr_pids);
        if (index >= 0 && !on_status(trace, index, status))
            return;
    }
}

// ---- Clean-up ----

// The signal that ends the timer. SIGINT would not if it is ignored or blocked here, as below a
// shell's "&": the timer has inherited that.
int timer_signal() {
    struct sigaction action;
    sigset_t blocked;
    bool effective = sigaction(SIGINT, nullptr, &action) == 0 && action.sa_handler != SIG_IGN &&
                     pthread_sigmask(SIG_BLOCK, nullptr, &blocked) == 0 &&
                     sigismember(&blocked, SIGINT) == 0;
    return effective ? SIGINT : SIGKILL;
}

void stop_timer(Trace *trace) {
    if (trace->timer == -1)
        return;
    (void)kill(trace->timer, timer_signal());
    while (waitpid(trace->timer, nullptr, 0) == -1 && errno == EINTR) {
    }
    trace->timer = -1;
}

// Those that are stopped do nothing until they are let go, so they come first. The others have to
// be stopped for it; the last are those that take their time for that.
void release_processes(TraceRequest *request) {
    for (int i = 0; i < request->nr_pids; ++i) {
        if (request->pids[i] == -1)
            continue;
        if ((request->flags & TRACE_LIST_FDS) != 0)
            trace_list_fds(request, request->pids[i]);
        request->records[i].released = trace_detach_stopped(request->pids[i]);
    }
    for (bool uninterruptible : {false, true}) {
        for (int i = 0; i < request->nr_pids; ++i) {
            bool &released = request->records[i].released;
            if (request->pids[i] == -1 || released ||
                (!uninterruptible && trace_is_uninterruptible(request->pids[i])))
                continue;
            trace_detach(request->pids[i]);
            released = true;
        }
    }
}

// Lets go of the processes of a caller who is their tracer already, where there can be no trace.
void refuse(const TraceRequest &request) {
    for (int i = 0; request.attached != 0 && i < request.nr_pids; ++i) {
        if (request.pids[i] != -1)
            trace_detach(request.pids[i]);
    }
}

// The trace proper, with records and buffer in place.
void run_trace(Trace *trace) {
    TraceRequest *request = trace->request;
    if (request->attached == 0)
        drop_stuck_processes(trace);
    for (int i = 0; i < request->nr_pids; ++i) {
        if (request->pids[i] != -1)
            take_process(trace, i);
    }
    if (trace->live == 0)
        return;
    if (start_timer(trace))
        follow(trace);
    stop_timer(trace);
    release_processes(request);
}

void run(TraceRequest *request) {
    Trace trace = {.request = request,
                   .live = 0,
                   .held = 0,
                   .timer = -1,
                   .events = 0,
                   .looks_left = 0,
                   .looked_at = 0,
                   .looked_ms = 0};
    sigset_t child_signal;
    sigset_t before;
    (void)sigemptyset(&child_signal);
    (void)sigaddset(&child_signal, SIGCHLD);
    (void)pthread_sigmask(SIG_BLOCK, &child_signal, &before);
    run_trace(&trace);
    (void)pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

}  // namespace

void trace_run(TraceRequest *request) {
    // One more than there are processes: an empty table is not a failed allocation.
    UniqueBlock<TracedProcess> records(static_cast<TracedProcess *>(
        calloc(static_cast<size_t>(request->nr_pids) + 1, sizeof(TracedProcess))));
    if (records != nullptr && lock_engine(*request)) {
        request->records = records.get();
        if (provide_buffer(request))
            run(request);
        else
            refuse(*request);
        request->records = nullptr;
        forget_last_process();
        (void)pthread_mutex_unlock(&trace_mutex);
    } else {
        refuse(*request);
    }
    free(request->buf);
    request->buf = nullptr;
    request->buf_size = 0;
    // What was complained of must not wait for a child that is forked later, to come out there.
    (void)fflush(stdout);
}
