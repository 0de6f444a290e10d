// Taking hold of a process with ptrace, letting it go on, and letting go of it.
//
// The kernel ties a tracee to the thread that attached to it: all calls for one tracee come from
// that thread. The tracer's complaints go to standard output.
#pragma once

#include <stdint.h>
#include <sys/types.h>

// Attaches to `pid` and waits for its stop. Returns -1 when that is refused or interrupted, and
// then nothing is attached; else the result of the last wait.
int trace_attach(pid_t pid);

// Lets go of `pid`, with the signal `sig` delivered, stopping it first if it runs: that takes until
// it can be interrupted. Does nothing to a process that is not the calling thread's tracee.
void trace_detach(pid_t pid, int sig = 0);

// The same of a stopped tracee only. Returns whether it was one.
bool trace_detach_stopped(pid_t pid, int sig = 0);

// Whether `pid` is in the midst of something that no signal interrupts, so that it could not be
// stopped now: a driver or a file server, mostly, that does not answer.
bool trace_is_uninterruptible(pid_t pid);

// Sets ptrace options of `pid`, a stopped tracee.
void trace_set_options(pid_t pid, unsigned long options);

// Let the stopped tracee `pid` go on, to its end or to its next system call, with the signal `sig`
// delivered. Up to 4 attempts; each failure is told. Return the last result of ptrace.
long trace_cont(pid_t pid, int sig);
long trace_syscall(pid_t pid, int sig);

// Whether the tracee `pid`, stopped with the signal `sig`, reports that its process has stopped (as
// job control stops it), rather than that it is about to receive the signal.
bool trace_in_job_stop(pid_t pid, int sig);

// Whether SIGCONT has been sent to the stopped tracee `pid` and has not got through to it.
bool trace_sigcont_pending(pid_t pid);

// What /proc tells about a process that may be a tracee.
struct TraceeStatus {
    char state;    // 'R', 'S', 'T', 't', 'Z' ...; 0 when unknown
    pid_t tracer;  // the thread that traces it; 0 when unknown or none
    uint64_t
        pending;  // its pending signals from 1 (the lowest bit) to 64, of the thread or the process
};

// Parses the text of /proc/PID/status; a line that is missing or cut leaves its field 0.
TraceeStatus parse_tracee_status(const char *text);
