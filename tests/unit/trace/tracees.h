// Processes to be traced by tests, and a record of what a trace hands out.
#pragma once

#include <errno.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/run_program.h"
#include "support/temp_dir.h"
#include "trace/trace_engine.h"
#include "trace/trace_request.h"

// A child of the test that runs `body` and then exits with 0. With HELD it is already a tracee of
// the test, stopped before `body`. It is killed and reaped in the end.
class Child {
  public:
    enum Start { FREE, HELD };

    explicit Child(const std::function<void()> &body, Start start = FREE) {
        pid_t test = getpid();
        pid_ = fork();
        if (pid_ == 0) {
            // A test that is killed for hanging leaves nothing behind.
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            if (getppid() != test)
                _exit(1);
            if (start == HELD) {
                ptrace(PTRACE_TRACEME, 0, nullptr, nullptr);
                raise(SIGSTOP);
            }
            body();
            _exit(0);
        }
        if (start == HELD)
            waitpid(pid_, nullptr, 0);
    }
    ~Child() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    Child(const Child &) = delete;
    Child &operator=(const Child &) = delete;

    pid_t pid() const { return pid_; }

  private:
    pid_t pid_;
};

inline void sleep_for_ever() {
    for (;;)
        pause();
}

inline void spin_for_ever() {
    for (volatile unsigned long n = 0;;)
        n = n + 1;
}

inline void call_for_ever() {
    for (;;)
        syscall(SYS_getppid);
}

inline void receive_signals() {
    signal(SIGALRM, [](int) { syscall(SYS_getppid); });
    itimerval often = {{0, 300}, {0, 300}};
    setitimer(ITIMER_REAL, &often, nullptr);
    sleep_for_ever();
}

inline void yield_and_sleep() {
    for (;;)
        usleep(50);
}

// Waits in the kernel, for the child of a vfork, where no signal interrupts it, until something can
// be read from `fd`.
inline void wait_uninterruptibly(int fd) {
    if (syscall(SYS_clone, CLONE_VFORK | SIGCHLD, 0, 0, 0, 0) == 0) {
        char byte;
        (void)!read(fd, &byte, 1);
        _exit(0);
    }
}

// The texts and exits that a trace hands out. It ends the trace with the poll number `polls_wanted`
// or when `end_when` says so.
struct TraceLog {
    std::vector<std::string> texts;
    std::vector<std::pair<int, unsigned long>> events;  // kind and value
    int polls = 0;
    int polls_wanted = -1;
    std::function<bool()> end_when;

    std::string all() const {
        std::string text;
        for (const std::string &piece : texts)
            text += piece;
        return text;
    }

    static uint32_t output(intptr_t cookie, const char *text, uint32_t len) {
        TraceLog *log = reinterpret_cast<TraceLog *>(cookie);
        if (static_cast<int32_t>(len) > 0)
            log->texts.emplace_back(text, len);
        if (len != 0)
            return 1;
        ++log->polls;
        return log->polls != log->polls_wanted && !(log->end_when && log->end_when());
    }

    static uint32_t event(TraceRequest *, intptr_t cookie, pid_t, int kind, unsigned long value,
                          const SyscallRecord *) {
        reinterpret_cast<TraceLog *>(cookie)->events.emplace_back(kind, value);
        return 0;
    }
};

// A request for these processes with nothing else asked for.
inline TraceRequest request_for(TraceLog *log, std::vector<pid_t> *pids, uint32_t flags = 0) {
    TraceRequest request = {};
    request.output_cb = TraceLog::output;
    request.event_cb = TraceLog::event;
    request.cookie = reinterpret_cast<intptr_t>(log);
    request.flags = flags;
    request.pids = pids->data();
    request.nr_pids = static_cast<int32_t>(pids->size());
    request.timeout_s = -1;
    return request;
}

// Traces processes that are HELD, and tells what has become of their pids.
inline std::vector<pid_t> trace_held(TraceLog *log, std::vector<pid_t> pids, uint32_t flags = 0,
                                     int32_t timeout_s = -1) {
    TraceRequest request = request_for(log, &pids, flags);
    request.attached = 1;
    request.timeout_s = timeout_s;
    trace_run(&request);
    return pids;
}

// The name that a trace shows for a child of the test: of the word it was started by, what follows
// the last slash in the first 31 characters.
inline std::string own_name() {
    std::string start = std::string(program_invocation_name).substr(0, 31);
    return start.substr(start.rfind('/') + 1);
}

// Keeps a hanging trace from hanging the test run.
class TraceRun : public testing::Test {
  protected:
    void SetUp() override { alarm(100); }
    void TearDown() override { alarm(0); }
};
