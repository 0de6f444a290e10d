// How a trace leaves the processes that it has traced: neither stopped nor traced.
#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <thread>
#include <vector>

#include "support/slow_machine.h"
#include "trace/trace_engine.h"
#include "unit/trace/tracees.h"

namespace {

// A process with two threads; the test gets the number of the second.
struct Threaded {
    int pipe_fds[2];

    static void *run_second(void *self) {
        pid_t tid = static_cast<pid_t>(syscall(SYS_gettid));
        (void)!write(static_cast<Threaded *>(self)->pipe_fds[1], &tid, sizeof tid);
        spin_for_ever();
        return nullptr;
    }

    void start() {
        pthread_t thread;
        pthread_create(&thread, nullptr, run_second, this);
    }

    pid_t second() {
        pid_t tid = -1;
        (void)!read(pipe_fds[0], &tid, sizeof tid);
        return tid;
    }

    Threaded() { (void)!pipe(pipe_fds); }
    ~Threaded() {
        close(pipe_fds[0]);
        close(pipe_fds[1]);
    }
};

struct Behaviour {
    const char *name;
    void (*body)();
};

class TraceRunLeaves : public testing::TestWithParam<Behaviour> {};

TEST_P(TraceRunLeaves, TheProcessNeitherStoppedNorTraced) {
    alarm(100);
    Child child(GetParam().body);
    bool sleeps = GetParam().body == sleep_for_ever || GetParam().body == spin_for_ever;
    for (int round = 1; round <= (sleeps ? 1 : 60); ++round) {
        TraceLog log;
        log.polls_wanted = round;
        std::vector<pid_t> pids = {child.pid()};
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
        request.timeout_s = 1;
        trace_run(&request);
        ASSERT_EQ(pids[0], child.pid());
        ASSERT_TRUE(runs_free(child.pid())) << process_state(child.pid()) << " in round " << round;
    }
    alarm(0);
}

INSTANTIATE_TEST_SUITE_P(Processes, TraceRunLeaves,
                         testing::Values(Behaviour{"Sleeping", sleep_for_ever},
                                         Behaviour{"Spinning", spin_for_ever},
                                         Behaviour{"Calling", call_for_ever},
                                         Behaviour{"SleepingAndWaking", yield_and_sleep},
                                         Behaviour{"ReceivingSignals", receive_signals}),
                         [](const auto &test) { return test.param.name; });

TEST_F(TraceRun, LetsGoOfAProcessThatIsNotItsChild) {
    int pipe_fds[2];
    ASSERT_EQ(pipe(pipe_fds), 0);
    Child parent([&] {
        Child grandchild(call_for_ever);
        pid_t pid = grandchild.pid();
        (void)!write(pipe_fds[1], &pid, sizeof pid);
        sleep_for_ever();
    });
    pid_t pid;
    ASSERT_EQ(read(pipe_fds[0], &pid, sizeof pid), static_cast<ssize_t>(sizeof pid));
    for (int round = 1; round <= 20; ++round) {
        TraceLog log;
        log.polls_wanted = round;
        std::vector<pid_t> pids = {pid};
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
        trace_run(&request);
        ASSERT_TRUE(runs_free(pid));
    }
    kill(pid, SIGKILL);
    close(pipe_fds[0]);
    close(pipe_fds[1]);
}

TEST_F(TraceRun, LetsManyProcessesGoAtOnce) {
    Child sleeping(sleep_for_ever), spinning(spin_for_ever), calling(call_for_ever);
    Child waking(yield_and_sleep), signalled(receive_signals);
    TraceLog log;
    log.polls_wanted = 500;
    std::vector<pid_t> pids = {sleeping.pid(), spinning.pid(), calling.pid(), waking.pid(),
                               signalled.pid()};
    TraceRequest request = request_for(&log, &pids, UINT32_MAX);
    trace_run(&request);
    for (pid_t pid : pids)
        EXPECT_TRUE(runs_free(pid)) << process_state(pid);
}

TEST_F(TraceRun, LeavesOutAProcessThatCannotBeStopped) {
    int pipe_fds[2];
    ASSERT_EQ(pipe(pipe_fds), 0);
    Child stuck([&] {
        wait_uninterruptibly(pipe_fds[0]);
        sleep_for_ever();
    });
    ASSERT_TRUE(wait_until([&] { return process_state(stuck.pid()) == 'D'; }));
    Child calling(call_for_ever);
    TraceLog log;
    log.polls_wanted = 100;
    std::vector<pid_t> pids = {calling.pid(), stuck.pid()};
    TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
    trace_run(&request);
    EXPECT_EQ(log.polls, 100);
    EXPECT_EQ(pids, (std::vector<pid_t>{calling.pid(), -1}));
    EXPECT_TRUE(runs_free(calling.pid()));
    EXPECT_EQ(status_field(stuck.pid(), "TracerPid:\t"), "0");
    (void)!write(pipe_fds[1], "", 1);
    EXPECT_TRUE(wait_until([&] { return process_state(stuck.pid()) == 'S'; })) << "as if untouched";
    close(pipe_fds[0]);
    close(pipe_fds[1]);
}

TEST_F(TraceRun, LetsOthersGoBeforeAProcessThatCannotBeStoppedAnyMore) {
    int begin_fds[2], end_fds[2];
    ASSERT_EQ(pipe(begin_fds), 0);
    ASSERT_EQ(pipe(end_fds), 0);
    Child stuck([&] {
        char byte;
        (void)!read(begin_fds[0], &byte, 1);
        wait_uninterruptibly(end_fds[0]);
        sleep_for_ever();
    });
    Child sleeping(sleep_for_ever), calling(call_for_ever);
    TraceLog log;
    log.end_when = [&] {
        if (log.polls == 10)
            (void)!write(begin_fds[1], "", 1);
        return process_state(stuck.pid()) == 'D';
    };
    std::atomic<bool> ended = false;
    std::thread tracer([&] {
        std::vector<pid_t> pids = {stuck.pid(), sleeping.pid(), calling.pid()};
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
        trace_run(&request);
        ended = true;
    });
    EXPECT_TRUE(wait_until([&] { return process_state(stuck.pid()) == 'D'; }));
    EXPECT_TRUE(wait_until([&] { return runs_free(sleeping.pid()) && runs_free(calling.pid()); }));
    EXPECT_FALSE(ended);
    (void)!write(end_fds[1], "", 1);
    tracer.join();
    EXPECT_TRUE(runs_free(stuck.pid()));
    for (int fd : {begin_fds[0], begin_fds[1], end_fds[0], end_fds[1]})
        close(fd);
}

TEST_F(TraceRun, SurvivesProcessesThatEndWhileItLetsThemGo) {
    for (int round = 0; round < 60; round += is_slow_machine() ? 3 : 1) {
        auto body = [round] {
            for (int i = 0; i < round; ++i)
                syscall(SYS_getppid);
            _exit(0);
        };
        Child first(body, Child::HELD), second(body, Child::HELD), third(body, Child::HELD);
        TraceLog log;
        log.polls_wanted = 3 * round;
        std::vector<pid_t> pids = trace_held(&log, {first.pid(), second.pid(), third.pid()},
                                             TRACE_SYSCALLS | TRACE_EXIT_EVENT);
        for (pid_t pid : pids)
            EXPECT_TRUE(pid == -1 ||
                        wait_until([&] { return waitpid(pid, nullptr, WNOHANG) != 0; }))
                << "does not come to its end";
    }
}

TEST_F(TraceRun, SurvivesProcessesThatAreKilledMeanwhile) {
    for (int round = 0; round < 20; ++round) {
        Child child(call_for_ever);
        pid_t pid = child.pid();
        Child killer([pid, round] {
            usleep(static_cast<useconds_t>(round) * 300);
            kill(pid, SIGKILL);
        });
        TraceLog log;
        std::vector<pid_t> pids = {pid};
        TraceRequest request = request_for(&log, &pids, TRACE_EXIT_EVENT);
        trace_run(&request);
        EXPECT_EQ(pids[0], -1);
    }
}

TEST_F(TraceRun, LetsGoAlsoWhileSignalsInterruptIt) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    struct sigaction before;
    sigaction(SIGUSR1, &action, &before);
    Child spinning(spin_for_ever), sleeping(sleep_for_ever);
    pid_t test = getpid();
    Child sender([test] {
        for (;;)
            kill(test, SIGUSR1);
    });
    for (int round = 0; round < 40; ++round) {
        TraceLog log;
        log.polls_wanted = 1;
        std::vector<pid_t> pids = {spinning.pid(), sleeping.pid()};
        TraceRequest request = request_for(&log, &pids);
        trace_run(&request);
        // Whether an interrupted attach is given up or not: nothing is left behind.
        ASSERT_TRUE(runs_free(spinning.pid())) << process_state(spinning.pid());
        ASSERT_TRUE(runs_free(sleeping.pid())) << process_state(sleeping.pid());
    }
    kill(sender.pid(), SIGKILL);
    sigaction(SIGUSR1, &before, nullptr);
}

TEST_F(TraceRun, LeavesTheUntracedThreadsOfAProcessRunning) {
    Threaded threaded;
    Child child([&] {
        threaded.start();
        spin_for_ever();
    });
    pid_t second = threaded.second();
    for (int round = 0; round < 60; round += is_slow_machine() ? 3 : 1) {
        TraceLog log;
        std::vector<pid_t> pids = {round % 2 == 0 ? child.pid() : second};
        TraceRequest request = request_for(&log, &pids);
        // A process that only spins brings no event: the trace ends with that of another child.
        Child other([] { _exit(0); });
        log.polls_wanted = 1;
        trace_run(&request);
        ASSERT_NE(pids[0], -1);
        ASSERT_TRUE(runs_free(child.pid())) << process_state(child.pid());
        ASSERT_TRUE(runs_free(second)) << process_state(second);
    }
}

TEST_F(TraceRun, EndsInTimeThoughAMainThreadHasEndedBeforeItsProcess) {
    Threaded threaded;
    Child child(
        [&] {
            threaded.start();
            syscall(SYS_exit, 0);
        },
        Child::HELD);
    TraceLog log;
    trace_held(&log, {child.pid()}, TRACE_SYSCALLS, 1);
    EXPECT_EQ(process_state(child.pid()), 'Z');
    EXPECT_TRUE(runs_free(threaded.second()));
}

TEST_F(TraceRun, DoesNotStopAProcessThatAnotherThreadReplaced) {
    Threaded threaded;
    static int pipe_fds[2];
    ASSERT_EQ(pipe2(pipe_fds, 0), 0);
    Child child(
        [] {
            pthread_t thread;
            pthread_create(
                &thread, nullptr,
                [](void *) -> void * {
                    signal(SIGTRAP, SIG_IGN);
                    execl("/bin/sh", "sh", "-c", "echo; while :; do :; done", nullptr);
                    _exit(1);
                },
                nullptr);
            dup2(pipe_fds[1], 1);
            sleep_for_ever();
        },
        Child::HELD);
    TraceLog log;
    trace_held(&log, {child.pid()}, 0, 1);
    EXPECT_TRUE(runs_free(child.pid())) << process_state(child.pid());
    close(pipe_fds[0]);
    close(pipe_fds[1]);
}

}  // namespace
