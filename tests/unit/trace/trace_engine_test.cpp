#include "trace/trace_engine.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <stdio.h>
#include <sys/stat.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "support/process_state.h"
#include "support/sandbox.h"
#include "unit/trace/tracees.h"

namespace {

double seconds() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

bool has_children() {
    return waitpid(-1, nullptr, WNOHANG) != -1 || errno != ECHILD;
}

// How often the descriptors of `pid` were listed.
int listings(const TraceLog &log, pid_t pid) {
    std::string start = "\n[" + std::to_string(pid) + " " + own_name() + "] ";
    std::string end = " open fds:\n";
    int count = 0;
    for (const std::string &text : log.texts)
        count += text.rfind(start, 0) == 0 && text.size() > end.size() &&
                 text.substr(text.size() - end.size()) == end;
    return count;
}

// ---- What ends a trace ----

TEST_F(TraceRun, WithEveryPidRefusedEndsWithoutATimerAndWithoutACallback) {
    pid_t gone;
    {
        Child child(sleep_for_ever);
        gone = child.pid();
    }
    TraceLog log;
    std::vector<pid_t> pids = {gone, -1, getpid(), gone};
    TraceRequest request = request_for(&log, &pids, UINT32_MAX);
    request.timeout_s = 1000;
    trace_run(&request);
    EXPECT_EQ(log.polls, 0);
    EXPECT_EQ(log.all(), "");
    EXPECT_EQ(pids, (std::vector<pid_t>{-1, -1, -1, -1}));
    EXPECT_FALSE(has_children());
}

TEST_F(TraceRun, WithoutAnyPidEndsAtOnce) {
    TraceLog log;
    std::vector<pid_t> pids;
    TraceRequest request = request_for(&log, &pids, UINT32_MAX);
    request.timeout_s = 1000;
    trace_run(&request);
    EXPECT_EQ(log.polls, 0);
    EXPECT_FALSE(has_children());
}

TEST_F(TraceRun, EndsWhenTheTimeLimitHasPassedAndLetsASleepingProcessGoOn) {
    Child child(sleep_for_ever);
    TraceLog log;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.timeout_s = 2;
    double start = seconds();
    trace_run(&request);
    EXPECT_GE(seconds() - start, 1.9);
    EXPECT_LT(seconds() - start, 20);
    EXPECT_EQ(pids[0], child.pid());
    EXPECT_TRUE(runs_free(child.pid()));
}

TEST_F(TraceRun, ACallbackThatRefusesAtItsFirstPollEndsItAfterTheFirstWait) {
    Child child(call_for_ever);
    TraceLog log;
    log.polls_wanted = 1;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.timeout_s = 1000;
    trace_run(&request);
    EXPECT_EQ(log.polls, 1);
    EXPECT_EQ(log.all(), "");
    EXPECT_TRUE(runs_free(child.pid()));
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), 0) << "only the traced process is left as a child";
}

TEST_F(TraceRun, HearsOfEachOfSeveralBusyProcesses) {
    Child first(call_for_ever), second(call_for_ever), third(call_for_ever);
    TraceLog log;
    log.polls_wanted = 1000;
    // Meanwhile the others get to their next stops: one is always waiting to be heard.
    log.end_when = [] {
        usleep(200);
        return false;
    };
    std::vector<pid_t> pids = {first.pid(), second.pid(), third.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    trace_run(&request);
    for (const pid_t pid : pids) {
        const std::string name = "[" + std::to_string(pid) + " ";
        EXPECT_LT(10, std::count_if(log.texts.begin(), log.texts.end(), [&](const auto &text) {
                      return text.find(name) != std::string::npos;
                  }));
    }
}

TEST_F(TraceRun, StopsItsTimerWithSigint) {
    run_in_sandbox([] {
        TempDir dir;
        mkfifo((dir / "fifo").c_str(), 0600);
        std::string script = dir.file("sleep",
                                      "#!/bin/sh\n"
                                      "trap 'echo INT >> " +
                                          (dir / "signals") +
                                          "; kill $!; exit' INT\n"
                                          "/bin/cat " +
                                          (dir / "fifo") +
                                          " &\n"
                                          "echo \"$@\" > " +
                                          (dir / "started") +
                                          "\n"
                                          "wait\n",
                                      0755);
        sandbox_bind(script, "/bin/sleep");
        Child child(call_for_ever);
        TraceLog log;
        log.end_when = [&] {
            struct stat status;
            return stat((dir / "started").c_str(), &status) == 0 && status.st_size > 0;
        };
        std::vector<pid_t> pids = {child.pid()};
        TraceRequest request = request_for(&log, &pids);
        request.timeout_s = 77;
        trace_run(&request);
        EXPECT_EQ(read_whole_file(dir / "started"), "77\n");
        EXPECT_EQ(read_whole_file(dir / "signals"), "INT\n");
    });
}

TEST_F(TraceRun, StopsItsTimerAlsoWhereSigintIsIgnored) {
    for (bool block : {false, true}) {
        Child tracer([block] {
            sigset_t interrupt;
            sigemptyset(&interrupt);
            sigaddset(&interrupt, SIGINT);
            if (block)
                pthread_sigmask(SIG_BLOCK, &interrupt, nullptr);
            else
                signal(SIGINT, SIG_IGN);
            Child child(call_for_ever);
            TraceLog log;
            log.polls_wanted = 1;
            std::vector<pid_t> pids = {child.pid()};
            TraceRequest request = request_for(&log, &pids);
            request.timeout_s = 1000;
            trace_run(&request);
            _exit(waitpid(-1, nullptr, WNOHANG) == 0 ? 0 : 1);
        });
        int status = -1;
        ASSERT_TRUE(wait_until([&] { return waitpid(tracer.pid(), &status, WNOHANG) != 0; }));
        EXPECT_EQ(status, 0);
    }
}

TEST_F(TraceRun, EndsAtOnceWhenItsTimerCannotBeExecuted) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_bind(dir.file("sleep", "no program\n", 0644), "/bin/sleep");
        Child child(sleep_for_ever);
        TraceLog log;
        std::vector<pid_t> pids = {child.pid()};
        TraceRequest request = request_for(&log, &pids);
        request.timeout_s = 1000;
        double start = seconds();
        trace_run(&request);
        EXPECT_LT(seconds() - start, 20);
        EXPECT_TRUE(runs_free(child.pid()));
    });
}

TEST_F(TraceRun, EndsWithTheExitOfItsLastProcess) {
    Child first([] { _exit(1); }, Child::HELD);
    Child second([] { _exit(2); }, Child::HELD);
    TraceLog log;
    std::vector<pid_t> pids =
        trace_held(&log, {first.pid(), -1, second.pid()}, TRACE_EXIT_EVENT, 1000);
    EXPECT_EQ(pids, (std::vector<pid_t>{-1, -1, -1}));
    EXPECT_FALSE(has_children());
}

TEST_F(TraceRun, EndsAfterADeathBySignalWhenThereIsNothingMoreToWaitFor) {
    Child child([] { raise(SIGKILL); }, Child::HELD);
    TraceLog log;
    std::vector<pid_t> pids = trace_held(&log, {child.pid()});
    EXPECT_EQ(pids[0], -1);
    EXPECT_FALSE(has_children());
}

TEST_F(TraceRun, LeavesTheEndToTheTimerWhenItsLastProcessDiesOfASignal) {
    Child child([] { raise(SIGKILL); }, Child::HELD);
    TraceLog log;
    double start = seconds();
    std::vector<pid_t> pids = trace_held(&log, {child.pid()}, 0, 1);
    EXPECT_EQ(pids[0], -1);
    EXPECT_GE(seconds() - start, 0.9);
    EXPECT_FALSE(has_children());
}

volatile sig_atomic_t interruptions;

TEST_F(TraceRun, AsksTwiceAfterASignalInterruptedItsWait) {
    interruptions = 0;
    struct sigaction action = {};
    action.sa_handler = [](int) { interruptions = interruptions + 1; };
    struct sigaction before;
    sigaction(SIGUSR1, &action, &before);
    Child child(sleep_for_ever);
    ASSERT_TRUE(wait_until([&] { return process_state(child.pid()) == 'S'; }));
    pid_t test = getpid();
    pid_t traced = child.pid();
    Child sender([test, traced] {
        while (status_field(traced, "TracerPid:\t") == "0" || process_state(traced) != 'S' ||
               process_state(test) != 'S')
            usleep(1000);
        for (;;) {
            kill(test, SIGUSR1);
            usleep(20000);
        }
    });
    TraceLog log;
    int interruptions_then = 0;
    log.end_when = [&] {
        interruptions_then = interruptions;
        return log.polls == 11;
    };
    std::vector<pid_t> pids = {traced};
    TraceRequest request = request_for(&log, &pids);
    trace_run(&request);
    EXPECT_EQ(log.polls, 11);
    // One poll for the call that the process sleeps in, and five interruptions make the others; a
    // few may have come between two waits.
    EXPECT_LT(interruptions_then, 9);
    EXPECT_TRUE(runs_free(traced));
    kill(sender.pid(), SIGKILL);
    sigaction(SIGUSR1, &before, nullptr);
}

TEST_F(TraceRun, TakesNoNoticeOfOtherChildren) {
    Child child(
        [] {
            for (int i = 0; i < 200; ++i)
                syscall(SYS_getppid);
            _exit(0);
        },
        Child::HELD);
    Child stranger([] { _exit(3); });
    TraceLog log;
    std::vector<pid_t> pids = trace_held(&log, {child.pid()});
    EXPECT_EQ(pids[0], -1);
}

// ---- Text and records ----

TEST_F(TraceRun, TellsAnExitCallAndTheExitEventAndListsDescriptorsAtBoth) {
    Child child([] { syscall(SYS_exit_group, 3); }, Child::HELD);
    TraceLog log;
    trace_held(&log, {child.pid()}, TRACE_SYSCALLS | TRACE_EXIT_EVENT | TRACE_LIST_FDS);
    using Event = std::pair<int, unsigned long>;
    EXPECT_EQ(log.events, (std::vector<Event>{{2, 3}, {1, 768}}));
    EXPECT_EQ(listings(log, child.pid()), 2);
}

TEST_F(TraceRun, ListsTheDescriptorsOfEveryProcessThatIsLeft) {
    Child first(sleep_for_ever), second(sleep_for_ever);
    TraceLog log;
    std::vector<pid_t> pids = {first.pid(), second.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_LIST_FDS);
    request.timeout_s = 1;
    trace_run(&request);
    EXPECT_EQ(listings(log, first.pid()), 1);
    EXPECT_EQ(listings(log, second.pid()), 1);
    std::string text = log.all();
    EXPECT_LT(text.find("\n[" + std::to_string(first.pid())),
              text.find("\n[" + std::to_string(second.pid())));
}

TEST_F(TraceRun, HandsOutNoMoreThanTheBufferHolds) {
    Child child([] { syscall(SYS_getppid); }, Child::HELD);
    TraceLog log;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.attached = 1;
    request.buf_size = 12;
    request.buf = static_cast<char *>(malloc(12));
    trace_run(&request);
    EXPECT_EQ(request.buf, nullptr) << "the caller's buffer has been freed";
    ASSERT_FALSE(log.texts.empty());
    for (const std::string &text : log.texts) {
        EXPECT_EQ(text.size(), 11u) << text;
        EXPECT_EQ(text.rfind("[" + std::to_string(child.pid()) + " ", 0), 0u) << text;
    }
}

TEST_F(TraceRun, ProvidesABufferWhenEitherHalfOfItIsMissing) {
    for (bool with_memory : {false, true}) {
        Child child([] { syscall(SYS_getppid); }, Child::HELD);
        TraceLog log;
        std::vector<pid_t> pids = {child.pid()};
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
        request.attached = 1;
        request.buf = with_memory ? static_cast<char *>(malloc(8)) : nullptr;
        request.buf_size = with_memory ? 0 : 8;
        trace_run(&request);
        EXPECT_NE(log.all().find(" getppid("), std::string::npos);
    }
}

TEST_F(TraceRun, ShowsAnEntryThatCannotBeReadAsAnExitWithoutItsNewline) {
    static TraceBackend backend;
    backend = native_backend();
    backend.read_entry = [](pid_t, TraceRegisters *) { return -1; };
    Child child(
        [] {
            syscall(SYS_getppid);
            syscall(SYS_exit_group, 0);
        },
        Child::HELD);
    TraceLog log;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.attached = 1;
    request.backend = &backend;
    trace_run(&request);
    for (const std::string &text : log.texts) {
        EXPECT_NE(text.find(") = "), std::string::npos) << text;
        EXPECT_EQ(text.find('\n'), std::string::npos) << text;
    }
#if defined(__x86_64__)
    // Call 0 is one that exists: both stops of getppid and the entry of exit_group show it.
    EXPECT_EQ(log.texts.size(), 3u);
#endif
}

TEST_F(TraceRun, ShowsNothingOfACallThatItHasNoNameFor) {
    static SyscallAbi abi;
    static TraceBackend backend;
    abi = *native_backend().abi;
    abi.count = 0;
    backend = native_backend();
    backend.abi = &abi;
    Child child([] { syscall(SYS_getppid); }, Child::HELD);
    TraceLog log;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.attached = 1;
    request.backend = &backend;
    trace_run(&request);
    EXPECT_EQ(log.texts, std::vector<std::string>());
    EXPECT_GE(log.polls, 3);
}

TEST_F(TraceRun, GoesOnWithoutAnyCallback) {
    Child child([] { _exit(0); }, Child::HELD);
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = {};
    request.pids = pids.data();
    request.nr_pids = 1;
    request.attached = 1;
    request.flags = UINT32_MAX;
    trace_run(&request);
    EXPECT_EQ(pids[0], -1);
    EXPECT_EQ(request.records, nullptr);
}

TEST_F(TraceRun, ComplainsOfAProcessThatCannotBeResumed) {
    pid_t gone;
    {
        Child child(sleep_for_ever);
        gone = child.pid();
    }
    TraceLog log;
    testing::internal::CaptureStdout();
    std::vector<pid_t> pids = trace_held(&log, {gone});
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "PTRACE_CONT failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "WARNING: ptrace SYSCALL failed! " +
                  std::to_string(gone) + "\n");
    EXPECT_EQ(pids[0], -1);
    EXPECT_EQ(log.polls, 0);
}

// ---- The calling process ----

TEST_F(TraceRun, LeavesNoDescriptorBehind) {
    int before = count_descriptors(getpid());
    for (int round = 0; round < 5; ++round) {
        Child ending([] { _exit(0); }, Child::HELD);
        Child going_on(call_for_ever, Child::HELD);
        TraceLog log;
        log.polls_wanted = 100;
        trace_held(&log, {ending.pid(), going_on.pid()}, UINT32_MAX, 1000);
    }
    EXPECT_EQ(count_descriptors(getpid()), before);
    EXPECT_FALSE(has_children());
}

// How many of two traces are under way, and whether both ever were.
std::atomic<int> traces_called, traces_active;
std::atomic<bool> overlapped;

struct OwnTrace {
    int lines_left;
    bool active;
};

uint32_t watch_for_overlap(intptr_t cookie, const char *, uint32_t len) {
    OwnTrace *own = reinterpret_cast<OwnTrace *>(cookie);
    if (len != 0) {
        if (!own->active && traces_active.fetch_add(1) != 0)
            overlapped = true;
        own->active = true;
        --own->lines_left;
        return 1;
    }
    // Asked whether to go on: yes while it may still have to wait, and then for long enough for the
    // other one to begin as well, if it could.
    if (!own->active || traces_called < 2 || own->lines_left > 0)
        return 1;
    traces_active.fetch_sub(1);
    return 0;
}

TEST_F(TraceRun, WaitsForATraceOfAnotherThreadToEnd) {
    Child first(call_for_ever), second(call_for_ever);
    auto trace = [](pid_t pid) {
        OwnTrace own = {.lines_left = 2000, .active = false};
        TraceRequest request = {};
        request.output_cb = watch_for_overlap;
        request.cookie = reinterpret_cast<intptr_t>(&own);
        request.flags = TRACE_SYSCALLS;
        request.pids = &pid;
        request.nr_pids = 1;
        ++traces_called;
        trace_run(&request);
    };
    std::thread one(trace, first.pid()), other(trace, second.pid());
    one.join();
    other.join();
    EXPECT_FALSE(overlapped);
    EXPECT_EQ(traces_active, 0);
    EXPECT_TRUE(runs_free(first.pid()));
    EXPECT_TRUE(runs_free(second.pid()));
}

TEST_F(TraceRun, DoesNotWaitForAnotherOneToEndWhenItIsNotWantedAnyMore) {
    Child traced(call_for_ever), other(call_for_ever);
    auto trace = [](TraceLog *log, pid_t pid) {
        std::vector<pid_t> pids = {pid};
        TraceRequest request = request_for(log, &pids);
        trace_run(&request);
    };
    std::atomic<bool> under_way = false, ended = false;
    TraceLog first;
    first.end_when = [&] {
        under_way = true;
        return ended.load();
    };
    std::thread thread([&] { trace(&first, traced.pid()); });
    EXPECT_TRUE(wait_until([&] { return under_way.load(); }));
    TraceLog second;
    second.polls_wanted = 1;
    trace(&second, other.pid());
    EXPECT_EQ(1, second.polls);
    EXPECT_FALSE(ended);
    ended = true;
    thread.join();
    EXPECT_TRUE(runs_free(other.pid()));
}

}  // namespace
