// Signals and stops of traced processes.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "trace/trace_engine.h"
#include "unit/trace/tracees.h"

namespace {

size_t count_of(const std::string &text, const std::string &part) {
    size_t count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1))
        ++count;
    return count;
}

TEST_F(TraceRun, ShowsAStopFromOutsideOnceAndLeavesTheProcessStopped) {
    Child child(yield_and_sleep, Child::HELD);
    pid_t pid = child.pid();
    Child outsider([pid] { kill(pid, SIGSTOP); });
    TraceLog log;
    trace_held(&log, {pid}, TRACE_SIGNALS, 1);
    EXPECT_EQ(log.all(), "\n[" + std::to_string(pid) + " " + own_name() + "] ---  SIGNAL " +
                             std::to_string(SIGSTOP) + " SIGSTOP ---\n\n");
    EXPECT_TRUE(wait_until([&] { return process_state(pid) == 'T'; })) << process_state(pid);
    EXPECT_EQ(status_field(pid, "TracerPid:\t"), "0");
    kill(pid, SIGCONT);
    EXPECT_TRUE(runs_free(pid));
}

TEST_F(TraceRun, KeepsAStoppedProcessStoppedUntilItIsContinued) {
    int pipe_fds[2];
    ASSERT_EQ(pipe(pipe_fds), 0);
    Child child(
        [&] {
            kill(getpid(), SIGSTOP);
            char go = 1;
            (void)!write(pipe_fds[1], &go, 1);
            _exit(0);
        },
        Child::HELD);
    pid_t pid = child.pid();
    int told_fds[2];
    ASSERT_EQ(pipe(told_fds), 0);
    Child outsider([&] {
        // Once the stop has been told, long enough for a process that is not stopped to go on.
        char went_on;
        (void)!read(told_fds[0], &went_on, 1);
        usleep(300000);
        fcntl(pipe_fds[0], F_SETFL, O_NONBLOCK);
        bool stopped = read(pipe_fds[0], &went_on, 1) == -1;
        kill(pid, stopped ? SIGCONT : SIGKILL);
    });
    TraceLog log;
    bool told = false;
    log.end_when = [&] {
        if (!told && log.all().find("SIGSTOP") != std::string::npos) {
            (void)!write(told_fds[1], "", 1);
            told = true;
        }
        return false;
    };
    std::vector<pid_t> pids = trace_held(&log, {pid}, TRACE_SIGNALS | TRACE_EXIT_EVENT, 20);
    EXPECT_EQ(pids[0], -1) << "it has come to its end";
    ASSERT_EQ(log.events.size(), 1u);
    EXPECT_EQ(log.events[0].second, 0u) << "of its own";
    EXPECT_EQ(count_of(log.all(), "SIGNAL"), 2u) << log.all();
    EXPECT_EQ(count_of(log.all(), "SIGCONT"), 1u) << log.all();
    for (int fd : {pipe_fds[0], pipe_fds[1], told_fds[0], told_fds[1]})
        close(fd);
}

TEST_F(TraceRun, IsNotSlowedByAStoppedProcess) {
    Child stopped(yield_and_sleep);
    kill(stopped.pid(), SIGSTOP);
    ASSERT_TRUE(wait_until([&] { return process_state(stopped.pid()) == 'T'; }));
    Child busy([] {
        for (;;)
            syscall(SYS_getppid);
    });
    TraceLog log;
    std::vector<pid_t> pids = {stopped.pid(), busy.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    request.timeout_s = 2;
    trace_run(&request);
    // Polling would allow some 20 stops a second.
    EXPECT_GT(count_of(log.all(), "getppid("), 100u);
    EXPECT_EQ(process_state(stopped.pid()), 'T');
}

TEST_F(TraceRun, AttachesToAStoppedProcessAndLeavesItStopped) {
    Child child(yield_and_sleep);
    kill(child.pid(), SIGSTOP);
    ASSERT_TRUE(wait_until([&] { return process_state(child.pid()) == 'T'; }));
    TraceLog log;
    std::vector<pid_t> pids = {child.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SIGNALS);
    request.timeout_s = 1;
    trace_run(&request);
    EXPECT_TRUE(wait_until([&] { return process_state(child.pid()) == 'T'; }));
    EXPECT_EQ(status_field(child.pid(), "TracerPid:\t"), "0");
    kill(child.pid(), SIGCONT);
    EXPECT_TRUE(runs_free(child.pid()));
}

TEST_F(TraceRun, DeliversSignals) {
    Child child(
        [] {
            signal(SIGUSR1, [](int) { _exit(42); });
            raise(SIGUSR1);
        },
        Child::HELD);
    TraceLog log;
    trace_held(&log, {child.pid()}, TRACE_EXIT_EVENT);
    ASSERT_EQ(log.events.size(), 1u);
    EXPECT_EQ(log.events[0].second, 42u << 8);
    EXPECT_EQ(log.all(), "") << "no text without its flag";
}

TEST_F(TraceRun, TellsASigtrapAsAnEventAndDeliversIt) {
    Child child(
        [] {
            signal(SIGTRAP, [](int) { _exit(9); });
            raise(SIGTRAP);
        },
        Child::HELD);
    TraceLog log;
    trace_held(&log, {child.pid()}, TRACE_EXIT_EVENT | TRACE_SIGNALS);
    ASSERT_EQ(log.events.size(), 2u) << "the SIGTRAP and the exit";
    EXPECT_EQ(log.events[0].first, TRACE_EVENT_STOP);
    EXPECT_EQ(log.events[1].second, 9u << 8);
    EXPECT_EQ(log.all(), "") << "no SIGNAL line";
}

TEST_F(TraceRun, PassesTheSigtrapOfAnExecveOnAndSoKillsAProcessThatDoesNotIgnoreIt) {
    for (bool ignored : {false, true}) {
        Child child(ignored ? +[] {
                       signal(SIGTRAP, SIG_IGN);
                       execl("/bin/sh", "sh", "-c", "exit 6", nullptr);
                   }
                            : +[] { execl("/bin/sh", "sh", "-c", "exit 6", nullptr); },
                    Child::HELD);
        TraceLog log;
        trace_held(&log, {child.pid()}, TRACE_EXIT_EVENT);
        ASSERT_FALSE(log.events.empty());
        unsigned long core = log.events.back().second & 0x80;
        EXPECT_EQ(log.events.back().second, ignored ? 6ul << 8 : SIGTRAP | core);
    }
}

}  // namespace
