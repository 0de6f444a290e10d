#include "trace/tracee_control.h"

#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "proc/process_table.h"
#include "util/children.h"

namespace {

constexpr int RESUME_ATTEMPTS = 4;
constexpr int ATTACH_RETRIES = 4;
constexpr useconds_t ATTACH_PAUSE_US = 10;
constexpr useconds_t STOP_POLL_US = 500;

// Asks for `request`, which takes the signal to deliver.
long signal_request(enum __ptrace_request request, pid_t pid, int sig) {
    return ptrace(request, pid, nullptr, static_cast<long>(sig));
}

long resume(enum __ptrace_request request, pid_t pid, int sig, const char *label) {
    long result = -1;
    for (int attempt = 0; attempt < RESUME_ATTEMPTS && result == -1; ++attempt) {
        result = signal_request(request, pid, sig);
        if (result == -1)
            printf("%s failed %s\n", label, strerror(errno));
    }
    return result;
}

TraceeStatus tracee_status(pid_t pid) {
    char path[64];
    char text[4096];
    (void)snprintf(path, sizeof path, "/proc/%d/status", pid);
    ssize_t len = read_file(path, text, sizeof text - 1);
    text[len > 0 ? len : 0] = '\0';
    return parse_tracee_status(text);
}

// waitpid for a tracee, of any kind: without __WALL, kernels before 4.7 do not report threads.
pid_t wait_tracee(pid_t pid, int *status, int options) {
    return wait_as_tracer(pid, status, options | __WALL);
}

// Waits for a stop or the end of the tracee `pid`, and through signals: if the wait ended with one,
// the SIGSTOP that is under way would stop the process for good. A main thread that has ended
// before the other threads of its process reports nothing until they have: that is ECHILD.
pid_t wait_for_stop(pid_t pid, int *status) {
    for (;;) {
        bool ended = tracee_status(pid).state == 'Z';
        pid_t waited = wait_tracee(pid, status, WNOHANG);
        if (waited != 0)
            return waited;
        if (ended) {
            errno = ECHILD;
            return -1;
        }
        (void)usleep(STOP_POLL_US);
    }
}

// Waits for the stop that PTRACE_ATTACH brings about. `interrupted` tells whether a signal came.
pid_t wait_for_attach(pid_t pid, int *status, bool *interrupted) {
    int retries = ATTACH_RETRIES;
    for (;;) {
        pid_t waited = wait_tracee(pid, status, WUNTRACED);
        if (waited != -1)
            return waited;
        if (errno == EINTR) {
            *interrupted = true;
        } else if (errno == ECHILD && retries > 0) {
            --retries;
            (void)usleep(ATTACH_PAUSE_US);
        } else {
            return -1;
        }
    }
}

// The lower 64 signals of a mask, whose line must be whole: some machines have 128.
uint64_t parse_signal_mask(const char *digits) {
    size_t length = strspn(digits, "0123456789abcdef");
    if (digits[length] != '\n')
        return 0;
    return strtoull(digits + (length > 16 ? length - 16 : 0), nullptr, 16);
}

bool is_job_control_signal(int sig) {
    return sig == SIGSTOP || sig == SIGTSTP || sig == SIGTTIN || sig == SIGTTOU;
}

// Lets go of a tracee that is not stopped, as far as is known.
void stop_and_detach(pid_t pid, int sig) {
    // It runs, or it is not ours: ended and reaped, or replaced by an execve of another thread. A
    // stranger must not be stopped, as nobody would let it go on.
    if (tracee_status(pid).tracer != syscall(SYS_gettid))
        return;
    // To this thread alone: another, untraced one that took the signal would stop the process.
    (void)syscall(SYS_tkill, pid, SIGSTOP);
    for (;;) {
        int status;
        if (wait_for_stop(pid, &status) == -1) {
            if (errno == EINVAL)  // no answer about the process, so it is asked again
                continue;
            return;
        }
        if (!WIFSTOPPED(status))
            return;
        if (WSTOPSIG(status) == SIGSTOP) {
            (void)signal_request(PTRACE_DETACH, pid, sig);
            return;
        }
        // To be left stopped, it is not let go on meanwhile.
        if (sig == SIGSTOP)
            continue;
        // Without the signal that it may have stopped with, which is lost: what arrives in the
        // instant of letting go is not the tracer's to deliver.
        if (signal_request(PTRACE_CONT, pid, 0) == -1)
            return;
    }
}

}  // namespace

int trace_attach(pid_t pid) {
    const bool claimed = claim_child(pid);
    if (ptrace(PTRACE_ATTACH, pid, nullptr, nullptr) == -1) {
        if (claimed)
            release_child(pid);
        return -1;
    }
    bool interrupted = false;
    pid_t waited;
    for (;;) {
        int status;
        waited = wait_for_attach(pid, &status, &interrupted);
        if (waited == -1 || !WIFSTOPPED(status))
            break;
        int sig = WSTOPSIG(status);
        if (sig == SIGSTOP || trace_in_job_stop(pid, sig))
            break;
        // A signal of its own came first. It gets that one, and the SIGSTOP of the attach is waited
        // for: taken later for a signal from outside, it would stop the process for good. A SIGTRAP
        // at this point is the kernel's word of an execve, and no signal of the process.
        if (signal_request(PTRACE_CONT, pid, sig == SIGTRAP ? 0 : sig) == -1)
            break;
    }
    if (waited != -1 && !interrupted)
        return waited;
    trace_detach(pid);
    return -1;
}

void trace_detach(pid_t pid, int sig) {
    if (trace_detach_stopped(pid, sig))
        return;
    stop_and_detach(pid, sig);
    release_child(pid);
}

bool trace_detach_stopped(pid_t pid, int sig) {
    if (signal_request(PTRACE_DETACH, pid, sig) == -1)
        return false;
    release_child(pid);
    return true;
}

bool trace_is_uninterruptible(pid_t pid) {
    return tracee_status(pid).state == 'D';
}

void trace_set_options(pid_t pid, unsigned long options) {
    // The label names another request, but it is the text that readers of traces know.
    if (ptrace(PTRACE_SETOPTIONS, pid, nullptr, options) == -1)
        printf("PTRACE_CONT failed %s\n", strerror(errno));
}

long trace_cont(pid_t pid, int sig) {
    return resume(PTRACE_CONT, pid, sig, "PTRACE_CONT");
}

long trace_syscall(pid_t pid, int sig) {
    return resume(PTRACE_SYSCALL, pid, sig, "SYSCALL");
}

bool trace_in_job_stop(pid_t pid, int sig) {
    siginfo_t info;
    return is_job_control_signal(sig) && ptrace(PTRACE_GETSIGINFO, pid, nullptr, &info) == -1 &&
           errno == EINVAL;
}

bool trace_sigcont_pending(pid_t pid) {
    return (tracee_status(pid).pending >> (SIGCONT - 1) & 1) != 0;
}

TraceeStatus parse_tracee_status(const char *text) {
    TraceeStatus status = {};
    for (const char *line = text; line != nullptr; line = strchr(line, '\n')) {
        line += *line == '\n';
        if (strncmp(line, "State:\t", 7) == 0)
            status.state = line[7];
        else if (strncmp(line, "TracerPid:\t", 11) == 0 && strchr(line, '\n') != nullptr)
            status.tracer = static_cast<pid_t>(strtol(line + 11, nullptr, 10));
        else if (strncmp(line, "SigPnd:\t", 8) == 0 || strncmp(line, "ShdPnd:\t", 8) == 0)
            status.pending |= parse_signal_mask(line + 8);
    }
    return status;
}
