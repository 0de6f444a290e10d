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

#include "proc/descriptors.h"
#include "proc/process_table.h"
#include "trace/trace_events.h"
#include "trace/trace_state.h"
#include "trace/trace_stops.h"
#include "trace/tracee_control.h"
#include "util/spawn.h"
#include "util/unique_fd.h"

namespace {

constexpr uint32_t DEFAULT_BUF_SIZE = 4096;
constexpr long LOCK_POLL_MS = 200;
constexpr int STUCK_LOOKS = 10;
constexpr useconds_t STUCK_POLL_US = 20000;

// One trace at a time: the wait for any child would otherwise take the other trace's events.
pthread_mutex_t trace_mutex = PTHREAD_MUTEX_INITIALIZER;

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
        if (!still_wanted(request))
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
            drop_process(trace, i);
    }
}

void take_process(Trace *trace, int index) {
    TraceRequest *request = trace->request;
    pid_t pid = request->pids[index];
    if (request->attached == 0 && trace_attach(pid) == -1) {
        drop_process(trace, index);
        return;
    }
    unsigned long options = PTRACE_O_TRACESYSGOOD;
    if ((request->flags & TRACE_EXIT_EVENT) != 0)
        options |= PTRACE_O_TRACEEXIT;
    trace_set_options(pid, options);
    if (step_process(trace, index, 0))
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

// ---- The loop ----

// Acts on the wait status of a process. Returns whether the trace goes on.
bool on_status(Trace *trace, int index, int status) {
    set_held(trace, index, false);
    if (WIFEXITED(status)) {
        drop_process(trace, index);
        return --trace->live != 0;
    }
    if (WIFSIGNALED(status)) {
        // Also the last one's death leaves the end of the trace to the next wait, which finds no
        // child any more, or else the time limit.
        drop_process(trace, index);
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
        if (!still_wanted(*trace->request) || expired)
            return;
        if (pid == -1) {
            if (error == ECHILD || (error == EINTR && !still_wanted(*trace->request)))
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
