#include "util/children.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <latch>
#include <thread>
#include <utility>
#include <vector>

#include "support/process_state.h"
#include "support/run_program.h"
#include "support/slow_machine.h"
#include "util/spawn.h"
#include "util/unique_fd.h"

namespace {

// Keeps a hanging wait from hanging the test run.
class WaitForChild : public testing::Test {
  protected:
    void SetUp() override { alarm(100); }
    void TearDown() override { alarm(0); }
};

// A child that lives until end() and then exits with 7.
class Sleeper {
  public:
    Sleeper() {
        int ends[2];
        EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
        pid_ = fork_child(false);
        if (pid_ == 0) {
            char byte;
            close(ends[1]);
            (void)!read(ends[0], &byte, 1);
            _exit(7);
        }
        close(ends[0]);
        end_.reset(ends[1]);
    }
    pid_t pid() const { return pid_; }
    void end() { end_.reset(); }

  private:
    pid_t pid_;
    UniqueFd end_;
};

pid_t start_child(int exit_status) {
    pid_t pid = fork_child(false);
    if (pid == 0)
        _exit(exit_status);
    return pid;
}

// wait_for_child in a thread of its own, which begins before the constructor returns.
class Waiter {
  public:
    explicit Waiter(pid_t pid) : thread_([this, pid] { result_ = run(pid); }) {
        // Asleep in the kernel: it waits. The test holds also if it does not yet.
        wait_until([this] { return tid_ != 0 && process_state(tid_) == 'S'; }, 2);
    }
    // Its result and the status.
    std::pair<pid_t, int> join() {
        thread_.join();
        return {result_, status_};
    }
    bool done() const { return done_; }

  private:
    pid_t run(pid_t pid) {
        tid_ = gettid();
        pid_t result = wait_for_child(pid, &status_);
        done_ = true;
        return result;
    }
    std::atomic<pid_t> tid_ = 0;
    std::atomic<bool> done_ = false;
    int status_ = -1;
    pid_t result_ = 0;
    std::thread thread_;
};

bool is_forgotten(pid_t pid) {
    bool known = claim_child(pid);
    if (known)
        release_child(pid);
    return !known;
}

TEST_F(WaitForChild, GivesTheStatusOfAnEndAndForgetsTheChild) {
    pid_t pid = start_child(7);
    EXPECT_FALSE(is_forgotten(pid));
    int status = -1;
    EXPECT_EQ(pid, wait_for_child(pid, &status));
    EXPECT_EQ(7 << 8, status);
    EXPECT_TRUE(is_forgotten(pid));
    errno = 0;
    EXPECT_EQ(-1, wait_for_child(pid, &status));
    EXPECT_EQ(ECHILD, errno);
    EXPECT_TRUE(is_forgotten(pid));
}

TEST_F(WaitForChild, TellsTheSignalThatKilledAChildAndTakesNullForTheStatus) {
    Sleeper killed;
    kill(killed.pid(), SIGKILL);
    int status = -1;
    EXPECT_EQ(killed.pid(), wait_for_child(killed.pid(), &status));
    EXPECT_EQ(SIGKILL, status);
    pid_t pid = start_child(1);
    EXPECT_EQ(pid, wait_for_child(pid, nullptr));
}

TEST_F(WaitForChild, TakesMinusOneForNoChild) {
    pid_t pid = start_child(2);
    EXPECT_EQ(-1, wait_for_child(-1, nullptr));
    EXPECT_EQ(pid, wait_for_child(pid, nullptr));
}

TEST_F(WaitForChild, WorksForAChildThatWasForkedInAnotherWay) {
    pid_t pid = fork();
    if (pid == 0)
        _exit(3);
    int status = -1;
    EXPECT_EQ(pid, wait_for_child(pid, &status));
    EXPECT_EQ(3 << 8, status);
    EXPECT_TRUE(is_forgotten(pid));
}

TEST_F(WaitForChild, ResumesAfterSignals) {
    struct sigaction action = {}, before;
    action.sa_handler = [](int) {};
    sigaction(SIGUSR1, &action, &before);
    Sleeper child;
    pthread_t self = pthread_self();
    std::thread sender([&] {
        for (int i = 0; i < 100; ++i) {
            pthread_kill(self, SIGUSR1);
            usleep(100);
        }
        child.end();
    });
    int status = -1;
    EXPECT_EQ(child.pid(), wait_for_child(child.pid(), &status));
    EXPECT_EQ(7 << 8, status);
    sender.join();
    sigaction(SIGUSR1, &before, nullptr);
}

TEST_F(WaitForChild, GivesTheStatusOfAChildThatATracerHasReapedBefore) {
    pid_t pid = start_child(7);
    int status = -1;
    EXPECT_EQ(pid, wait_as_tracer(-1, &status, __WALL));
    EXPECT_EQ(7 << 8, status);
    status = -1;
    EXPECT_EQ(pid, wait_for_child(pid, &status));
    EXPECT_EQ(7 << 8, status);
    EXPECT_TRUE(is_forgotten(pid));
}

TEST_F(WaitForChild, GivesTheStatusOfAChildThatATracerReapsMeanwhile) {
    // Whichever of the two waits the kernel wakes first.
    for (int round = 0; round < rounds(300); ++round) {
        Sleeper child;
        std::thread tracer([] {
            int status;
            while (wait_as_tracer(-1, &status, __WALL) != -1) {
            }
        });
        Waiter waiter(child.pid());
        child.end();
        ASSERT_EQ(std::pair(child.pid(), 7 << 8), waiter.join()) << round;
        tracer.join();
    }
}

TEST_F(WaitForChild, GivesEachThreadItsOwnChildUnderATracerThatReapsAll) {
    std::atomic<bool> stop = false;
    std::atomic<int> reaped = 0;
    std::thread tracer([&] {
        int status;
        while (!stop)
            reaped += wait_as_tracer(-1, &status, __WALL) > 0;
    });
    // No thread has ended while another one forks: a child with a sanitizer would complain.
    std::latch all_done(4);
    std::vector<std::thread> threads;
    std::atomic<int> wrong = 0;
    for (int number = 0; number < 4; ++number) {
        threads.emplace_back([&, number] {
            for (int round = 0; round < rounds(200); ++round) {
                int exit_status = number * 50 + round % 50;
                int status = -1;
                pid_t pid = start_child(exit_status);
                wrong += wait_for_child(pid, &status) != pid || status != exit_status << 8;
            }
            all_done.arrive_and_wait();
        });
    }
    for (std::thread &thread : threads)
        thread.join();
    stop = true;
    tracer.join();
    EXPECT_EQ(0, wrong);
    EXPECT_LT(0, reaped);
}

TEST_F(WaitForChild, LeavesAClaimedChildsEndToTheTracer) {
    Sleeper child;
    ASSERT_TRUE(claim_child(child.pid()));
    EXPECT_FALSE(claim_child(child.pid()));
    Waiter waiter(child.pid());
    child.end();
    siginfo_t info;
    ASSERT_EQ(0, waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | WNOWAIT));
    int status = -1;
    EXPECT_FALSE(waiter.done());
    EXPECT_EQ(child.pid(), wait_as_tracer(child.pid(), &status, 0));
    EXPECT_EQ(7 << 8, status);
    EXPECT_EQ(std::pair(child.pid(), 7 << 8), waiter.join());
}

TEST_F(WaitForChild, ReapsAChildItselfThatATracerReleasesUnreaped) {
    Sleeper child;
    ASSERT_TRUE(claim_child(child.pid()));
    Waiter waiter(child.pid());
    child.end();
    siginfo_t info;
    ASSERT_EQ(0, waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | WNOWAIT));
    release_child(child.pid());
    EXPECT_EQ(std::pair(child.pid(), 7 << 8), waiter.join());
    EXPECT_EQ(-1, waitpid(child.pid(), nullptr, 0));
}

TEST_F(WaitForChild, IsNotReleasedByAnotherThreadThanTheOneThatClaims) {
    Sleeper child;
    ASSERT_TRUE(claim_child(child.pid()));
    std::thread([&] { release_child(child.pid()); }).join();
    EXPECT_FALSE(claim_child(child.pid()));
    release_child(child.pid());
    EXPECT_TRUE(claim_child(child.pid()));
    release_child(child.pid());
    child.end();
    EXPECT_EQ(child.pid(), wait_for_child(child.pid(), nullptr));
}

// Steps `pid`, just attached, through `stops` stops, and lets go of it. Returns how many it saw.
int step_through(pid_t pid, int stops) {
    int seen = 0;
    for (int status; seen < stops; ++seen) {
        if (wait_as_tracer(pid, &status, __WALL) != pid || !WIFSTOPPED(status))
            return seen;
        if (ptrace(seen + 1 < stops ? PTRACE_SYSCALL : PTRACE_DETACH, pid, nullptr, nullptr) == -1)
            return seen;
    }
    return seen;
}

TEST_F(WaitForChild, LeavesEveryStopToTheTracer) {
    for (bool claimed : {true, false}) {
        pid_t pid = fork_child(false);
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (;;)
                getppid();
        }
        Waiter waiter(pid);
        // Also one that came before the waiter could be told.
        if (claimed) {
            EXPECT_TRUE(claim_child(pid));
        }
        ASSERT_EQ(0, ptrace(PTRACE_ATTACH, pid, nullptr, nullptr));
        EXPECT_EQ(500, step_through(pid, 500));
        EXPECT_FALSE(waiter.done());
        release_child(pid);
        kill(pid, SIGKILL);
        EXPECT_EQ(std::pair(pid, SIGKILL), waiter.join());
    }
}

TEST_F(WaitForChild, GivesTheThreadThatTracesAChildItsStops) {
    char path[] = "/bin/true";
    char *argv[] = {path, nullptr};
    pid_t pid = spawn_process_noenv(path, argv, 0, 1, 2, true);
    int status = -1;
    EXPECT_EQ(pid, wait_for_child(pid, &status));
    EXPECT_EQ(SIGTRAP << 8 | 0x7f, status);
    Waiter waiter(pid);
    EXPECT_EQ(0, ptrace(PTRACE_CONT, pid, nullptr, nullptr));
    EXPECT_EQ(pid, wait_as_tracer(pid, &status, 0));
    EXPECT_EQ(std::pair(pid, 0), waiter.join());
}

TEST_F(WaitForChild, EndsThoughTheKernelKeepsNoStatusAndATracerWaits) {
    signal(SIGCHLD, SIG_IGN);
    Sleeper longer;
    std::thread tracer([] {
        int status;
        EXPECT_EQ(-1, wait_as_tracer(-1, &status, __WALL));
    });
    pid_t pid = start_child(0);
    EXPECT_EQ(-1, wait_for_child(pid, nullptr));
    EXPECT_TRUE(is_forgotten(pid));
    longer.end();
    EXPECT_EQ(-1, wait_for_child(longer.pid(), nullptr));
    tracer.join();
    signal(SIGCHLD, SIG_DFL);
}

TEST_F(WaitForChild, WorksInAForkedChildWhileOtherThreadsForkAndWait) {
    std::atomic<bool> stop = false;
    std::latch all_done(2);
    std::vector<std::thread> threads;
    for (int i = 0; i < 2; ++i) {
        threads.emplace_back([&] {
            while (!stop)
                (void)wait_for_child(start_child(0), nullptr);
            all_done.arrive_and_wait();
        });
    }
    for (int round = 0; round < rounds(100); ++round) {
        pid_t pid = fork_child(false);
        if (pid == 0) {
            int status = -1;
            pid_t grandchild = start_child(5);
            _exit(wait_for_child(grandchild, &status) == grandchild && status == 5 << 8 ? 0 : 1);
        }
        int status = -1;
        ASSERT_EQ(pid, wait_for_child(pid, &status));
        ASSERT_EQ(0, status);
    }
    stop = true;
    for (std::thread &thread : threads)
        thread.join();
}

TEST_F(WaitForChild, OfAForgottenChildFindsNothingThatATracerTook) {
    pid_t pid = start_child(4);
    forget_child(pid);
    EXPECT_TRUE(is_forgotten(pid));
    int status;
    EXPECT_EQ(pid, wait_as_tracer(pid, &status, 0));
    EXPECT_EQ(-1, wait_for_child(pid, &status));
}

TEST_F(WaitForChild, AsTracerHandsOnErrorsAndStopsUnchanged) {
    int status;
    errno = 0;
    EXPECT_EQ(-1, wait_as_tracer(-1, &status, __WALL));
    EXPECT_EQ(ECHILD, errno);
    Sleeper child;
    EXPECT_EQ(0, wait_as_tracer(child.pid(), &status, WNOHANG));
    kill(child.pid(), SIGSTOP);
    EXPECT_EQ(child.pid(), wait_as_tracer(child.pid(), &status, WUNTRACED));
    EXPECT_EQ(SIGSTOP << 8 | 0x7f, status);
    EXPECT_FALSE(is_forgotten(child.pid()));
    kill(child.pid(), SIGCONT);
    child.end();
    EXPECT_EQ(child.pid(), wait_for_child(child.pid(), nullptr));
}

TEST_F(WaitForChild, IsWhatRunProcessWaitWaitsWith) {
    std::atomic<bool> stop = false;
    std::thread tracer([&] {
        int status;
        while (!stop)
            (void)wait_as_tracer(-1, &status, __WALL);
    });
    char path[] = "/bin/sh", option[] = "-c", command[] = "exit 9";
    char *argv[] = {path, option, command, nullptr};
    for (int round = 0; round < rounds(50); ++round)
        ASSERT_EQ(9, run_process_wait(path, argv, 0, 1, 2, false)) << round;
    stop = true;
    ASSERT_EQ(9, run_process_wait(path, argv, 0, 1, 2, false));
    tracer.join();
}

}  // namespace
