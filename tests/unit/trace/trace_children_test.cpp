// Traces of children that other threads wait for.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <latch>
#include <memory>
#include <thread>
#include <utility>

#include "support/slow_machine.h"
#include "trace/trace_engine.h"
#include "unit/trace/tracees.h"
#include "util/children.h"
#include "util/spawn.h"
#include "util/unique_fd.h"

namespace {

// A pipe for which a child waits before it goes on.
struct Gate {
    Gate() {
        int ends[2];
        EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
        in.reset(ends[0]);
        out.reset(ends[1]);
    }
    void open() { EXPECT_EQ(1, write(out.get(), "\n", 1)); }
    // In the child.
    void pass() {
        char byte;
        (void)!read(in.get(), &byte, 1);
    }
    UniqueFd in, out;
};

// A child that goes through the gate, makes `calls` system calls and exits with `exit_status`.
pid_t start_caller(Gate *gate, int calls, int exit_status) {
    pid_t pid = fork_child(false);
    if (pid == 0) {
        gate->pass();
        for (int i = 0; i < calls; ++i)
            syscall(SYS_getppid);
        _exit(exit_status);
    }
    return pid;
}

std::pair<pid_t, int> wait_for(pid_t pid) {
    int status = -1;
    pid_t result = wait_for_child(pid, &status);
    return {result, status};
}

// wait_for_child in a thread that is in its wait already, as far as can be seen.
std::future<std::pair<pid_t, int>> wait_in_thread(pid_t pid) {
    auto tid = std::make_shared<std::atomic<pid_t>>(0);
    auto result = std::async(std::launch::async, [pid, tid] {
        *tid = gettid();
        return wait_for(pid);
    });
    wait_until([&] { return *tid != 0 && process_state(*tid) == 'S'; }, 2);
    return result;
}

int count_of(const std::string &text, const std::string &part) {
    int count = 0;
    for (size_t at = 0; (at = text.find(part, at)) != std::string::npos; ++at)
        ++count;
    return count;
}

// Sends a signal that stops a traced process, and is nothing to others, now and then.
class Poker {
  public:
    explicit Poker(pid_t pid)
        : thread_([this, pid] {
              while (!stop_) {
                  kill(pid, SIGWINCH);
                  usleep(5000);
              }
          }) {}
    ~Poker() {
        stop_ = true;
        thread_.join();
    }

  private:
    std::atomic<bool> stop_ = false;
    std::thread thread_;
};

class TraceOfChildren : public TraceRun {
  protected:
    // Lets the child through its gate once the trace has begun, which polls after each wait.
    static void open_after_first_stop(TraceLog *log, Gate *gate) {
        log->end_when = [log, gate] {
            if (log->polls == 1)
                gate->open();
            return false;
        };
    }
};

TEST_F(TraceOfChildren, SeesAllOfAChildThatAnotherThreadWaitsForAndLeavesItTheStatus) {
    for (int round = 0; round < 20; ++round) {
        Gate gate;
        pid_t pid = start_caller(&gate, 50, 3);
        auto waiter = wait_in_thread(pid);
        TraceLog log;
        open_after_first_stop(&log, &gate);
        std::vector<pid_t> pids = {pid};
        TraceRequest request =
            request_for(&log, &pids, TRACE_SYSCALLS | TRACE_SIGNALS | TRACE_EXIT_EVENT);
        request.timeout_s = 60;
        trace_run(&request);
        ASSERT_EQ(-1, pids[0]) << round;
        // An entry and an exit each.
        ASSERT_EQ(100, count_of(log.all(), "getppid("));
        ASSERT_EQ(1, count_of(log.all(), "exit_group("));
        // The exit call, and the kernel's word of the exit.
        ASSERT_EQ(2u, log.events.size());
        ASSERT_EQ(3ul << 8, log.events[1].second);
        ASSERT_EQ(std::pair(pid, 3 << 8), waiter.get()) << round;
    }
}

TEST_F(TraceOfChildren, EndsWithTheExitOfItsLastProcessThoughThatIsWaitedFor) {
    // Without a time limit, and with another child that lives on.
    Child stranger(sleep_for_ever);
    for (int round = 0; round < 20; ++round) {
        Gate gate;
        pid_t pid = start_caller(&gate, 5, round);
        auto waiter = wait_in_thread(pid);
        TraceLog log;
        open_after_first_stop(&log, &gate);
        std::vector<pid_t> pids = {pid};
        TraceRequest request = request_for(&log, &pids);
        trace_run(&request);
        ASSERT_EQ(std::pair(pid, round << 8), waiter.get()) << round;
    }
}

TEST_F(TraceOfChildren, LetsGoOfAChildWhoseWaiterThenReapsIt) {
    Gate gate;
    pid_t pid = start_caller(&gate, 5, 6);
    auto waiter = wait_in_thread(pid);
    TraceLog log;
    log.polls_wanted = 1;
    std::vector<pid_t> pids = {pid};
    TraceRequest request = request_for(&log, &pids);
    {
        Poker poker(pid);
        trace_run(&request);
    }
    EXPECT_EQ(pid, pids[0]);
    EXPECT_TRUE(wait_until([pid] { return runs_free(pid); }));
    gate.open();
    EXPECT_EQ(std::pair(pid, 6 << 8), waiter.get());
}

TEST_F(TraceOfChildren, LeavesTheStatusOfAChildThatItDoesNotTrace) {
    Gate gate;
    // With pauses: on a single processor a busy child hides the younger ones from the tracer's
    // wait.
    Child traced([] {
        for (;;)
            usleep(1000);
    });
    pid_t pid = start_caller(&gate, 0, 8);
    auto waiter = wait_in_thread(pid);
    pid_t unwaited = start_caller(&gate, 0, 9);
    TraceLog log;
    siginfo_t info;
    // Until both have been reaped, by whomever.
    log.end_when = [&] {
        if (log.polls == 1) {
            gate.open();
            gate.open();
        }
        return waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) == -1 &&
               waitid(P_PID, static_cast<id_t>(unwaited), &info, WEXITED | WNOHANG | WNOWAIT) == -1;
    };
    std::vector<pid_t> pids = {traced.pid()};
    TraceRequest request = request_for(&log, &pids);
    trace_run(&request);
    EXPECT_EQ(std::pair(pid, 8 << 8), waiter.get());
    // Nobody but the trace could reap that one.
    EXPECT_EQ(std::pair(unwaited, 9 << 8), wait_for(unwaited));
}

TEST_F(TraceOfChildren, LeavesTheStatusOfAChildThatEndsWhileItIsAttached) {
    // Between the kernel's answer and the stop: whatever the attach finds.
    for (int round = 0; round < rounds(300); ++round) {
        Gate gate;
        pid_t pid = start_caller(&gate, 0, 4);
        auto waiter = std::async(std::launch::async, wait_for, pid);
        std::thread opener([&] { gate.open(); });
        std::vector<pid_t> pids = {pid};
        TraceLog log;
        TraceRequest request = request_for(&log, &pids);
        trace_run(&request);
        opener.join();
        ASSERT_EQ(std::pair(pid, 4 << 8), waiter.get()) << round;
    }
}

TEST_F(TraceOfChildren, ForgetsItsTimerHoweverItEnds) {
    Child sleeper(sleep_for_ever);
    for (bool expires : {true, false}) {
        pid_t timer = 0;
        TraceLog log;
        log.end_when = [&] {
            // The only other child; it has been started by the first poll, and may have been
            // reaped.
            for (pid_t pid : children_of(getpid()))
                timer = pid != sleeper.pid() ? pid : timer;
            return !expires && timer != 0;
        };
        std::vector<pid_t> pids = {sleeper.pid()};
        TraceRequest request = request_for(&log, &pids);
        request.timeout_s = expires ? 1 : 1000;
        {
            Poker poker(sleeper.pid());
            trace_run(&request);
        }
        EXPECT_TRUE(runs_free(sleeper.pid()));
        EXPECT_NE(0, timer);
        EXPECT_EQ(-1, waitpid(timer, nullptr, 0));
        EXPECT_FALSE(claim_child(timer)) << "its entry is still there";
    }
}

// Threads that start short-lived children and wait for them, under one trace after another of
// whatever lives just then.
TEST_F(TraceOfChildren, DisturbsNoneOfManyThreadsThatStartThem) {
    constexpr int THREADS = 4;
    const int ROUNDS = rounds(150);
    std::atomic<pid_t> current[THREADS] = {};
    std::atomic<int> wrong = 0, left = THREADS;
    // No thread has ended while another one forks: a child with a sanitizer would complain.
    std::latch all_done(THREADS);
    std::vector<std::thread> threads;
    for (int number = 0; number < THREADS; ++number) {
        threads.emplace_back([&, number] {
            for (int round = 0; round < ROUNDS; ++round) {
                int exit_status = number * 50 + round % 50;
                pid_t pid = fork_child(false);
                if (pid == 0) {
                    for (int i = 0; i < 20 * (round % 10); ++i)
                        syscall(SYS_getppid);
                    _exit(exit_status);
                }
                current[number] = pid;
                wrong += wait_for(pid) != std::pair(pid, exit_status << 8);
            }
            --left;
            all_done.arrive_and_wait();
        });
    }
    int traced = 0;
    while (left > 0) {
        std::vector<pid_t> pids(std::begin(current), std::end(current));
        for (pid_t &pid : pids)
            pid = pid == 0 ? -1 : pid;
        TraceLog log;
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS | TRACE_EXIT_EVENT);
        trace_run(&request);
        traced += log.polls > 0;
    }
    for (std::thread &thread : threads)
        thread.join();
    EXPECT_EQ(0, wrong);
    EXPECT_LT(0, traced);
}

TEST_F(TraceOfChildren, LeavesRunProcessWaitItsExitStatus) {
    Gate gate, words;
    std::atomic<int> wrong = 0;
    constexpr int ROUNDS = 20;
    std::thread runner([&] {
        char path[] = "/bin/sh", option[] = "-c", command[] = "echo $$; read word; exit 5";
        char *argv[] = {path, option, command, nullptr};
        for (int round = 0; round < ROUNDS; ++round)
            wrong += run_process_wait(path, argv, gate.in.get(), words.out.get(), 2, false) != 5;
    });
    for (int round = 0; round < ROUNDS; ++round) {
        char word[32] = "";
        ASSERT_LT(0, read(words.in.get(), word, sizeof word - 1));
        // It has told its number, and so has been executed: it may be traced.
        const pid_t pid = atoi(word);
        TraceLog log;
        open_after_first_stop(&log, &gate);
        std::vector<pid_t> pids = {pid};
        TraceRequest request = request_for(&log, &pids, TRACE_SYSCALLS);
        request.timeout_s = 60;
        trace_run(&request);
        EXPECT_EQ(-1, pids[0]);
        EXPECT_EQ(1, count_of(log.all(), "exit_group("));
    }
    runner.join();
    EXPECT_EQ(0, wrong);
}

}  // namespace
