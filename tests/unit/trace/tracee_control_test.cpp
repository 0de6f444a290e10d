#include "trace/tracee_control.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>

#include <memory>

#include "unit/trace/tracees.h"

namespace {

constexpr char STATUS[] =
    "Name:\tState:\tZ\n"
    "Umask:\t0022\n"
    "State:\tt (tracing stop)\n"
    "Tgid:\t4711\n"
    "TracerPid:\t815\n"
    "Uid:\t0\t0\t0\t0\n";

TEST(ParseTraceeStatus, FindsStateAndTracer) {
    TraceeStatus status = parse_tracee_status(STATUS);
    EXPECT_EQ(status.state, 't');
    EXPECT_EQ(status.tracer, 815);
}

TEST(ParseTraceeStatus, TakesACutLineForAMissingOne) {
    std::string whole = STATUS;
    size_t state_at = whole.find("State:\tt") + 7;
    size_t tracer_ends = whole.find("815\n") + 4;
    for (size_t len = 0; len <= whole.size(); ++len) {
        TraceeStatus status = parse_tracee_status(whole.substr(0, len).c_str());
        EXPECT_EQ(status.state, len > state_at ? 't' : 0) << len;
        EXPECT_EQ(status.tracer, len >= tracer_ends ? 815 : 0) << len;
    }
}

TEST(ParseTraceeStatus, JoinsThePendingSignalsOfThreadAndProcess) {
    EXPECT_EQ(parse_tracee_status("SigPnd:\t0000000000000001\nShdPnd:\t0000000000020000\n").pending,
              0x20001u);
    // Of 128 signals the lower half.
    EXPECT_EQ(
        parse_tracee_status("ShdPnd:\t00000000000000070000000001000000\nSigBlk:\tff\n").pending,
        0x1000000u);
    EXPECT_EQ(parse_tracee_status("SigPnd:\t00000000").pending, 0u) << "a cut line";
}

TEST(ParseTraceeStatus, OfNothingIsUnknown) {
    for (const char *text : {"", "\n", "\n\n\n", "no such\nfields"}) {
        EXPECT_EQ(parse_tracee_status(text).state, 0);
        EXPECT_EQ(parse_tracee_status(text).tracer, 0);
    }
}

TEST(TraceAttach, StopsTheProcessAndDetachLetsItGoOn) {
    Child child(spin_for_ever);
    EXPECT_EQ(trace_attach(child.pid()), child.pid());
    EXPECT_EQ(process_state(child.pid()), 't');
    EXPECT_EQ(status_field(child.pid(), "TracerPid:\t"), std::to_string(getpid()));
    trace_detach(child.pid());
    EXPECT_TRUE(runs_free(child.pid()));
}

TEST(TraceAttach, IsRefusedForAProcessThatIsTracedAlready) {
    Child child(spin_for_ever);
    EXPECT_EQ(trace_attach(child.pid()), child.pid());
    EXPECT_EQ(trace_attach(child.pid()), -1);
    EXPECT_EQ(trace_attach(getpid()), -1);
    trace_detach(child.pid());
    EXPECT_TRUE(runs_free(child.pid()));
}

int taken_pipe[2];

// A process that takes no signal, as it waits for the child of a vfork, until it is let go; then it
// tells of each SIGHUP through taken_pipe.
class Waiting {
  public:
    Waiting() {
        (void)!pipe(go_pipe_);
        (void)!pipe2(taken_pipe, O_NONBLOCK);
        child_ = std::make_unique<Child>([this] {
            signal(SIGHUP, [](int) { (void)!write(taken_pipe[1], "", 1); });
            wait_uninterruptibly(go_pipe_[0]);
            sleep_for_ever();
        });
        EXPECT_TRUE(wait_until([&] { return process_state(pid()) == 'D'; }));
    }
    ~Waiting() {
        for (int fd : {go_pipe_[0], go_pipe_[1], taken_pipe[0], taken_pipe[1]})
            close(fd);
    }
    pid_t pid() const { return child_->pid(); }
    void wait_for_tracer() const {
        wait_until([&] { return status_field(pid(), "TracerPid:\t") != "0"; });
    }
    void let_go() { (void)!write(go_pipe_[1], "", 1); }

  private:
    int go_pipe_[2];
    std::unique_ptr<Child> child_;
};

TEST(TraceAttach, GivesAnotherSignalThatComesFirstToTheProcess) {
    Waiting process;
    // Both signals then wait in the same queue, from which the lower number is taken first.
    ASSERT_EQ(syscall(SYS_tkill, process.pid(), SIGHUP), 0);
    Child outsider([&] {
        process.wait_for_tracer();
        process.let_go();
    });
    EXPECT_EQ(trace_attach(process.pid()), process.pid());
    trace_detach(process.pid());
    char byte;
    EXPECT_TRUE(wait_until([&] { return read(taken_pipe[0], &byte, 1) == 1; })) << "lost";
    EXPECT_TRUE(runs_free(process.pid())) << process_state(process.pid());
}

TEST(TraceAttach, ThatIsInterruptedIsGivenUpAndLeavesTheProcessAlone) {
    struct sigaction before;
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    sigaction(SIGUSR1, &action, &before);
    Waiting process;
    pid_t test = getpid();
    Child outsider([&] {
        process.wait_for_tracer();
        // By now it waits for the stop, which cannot come before the process is let go.
        wait_until([&] { return process_state(test) == 'S'; });
        for (int i = 0; i < 5; ++i) {
            kill(test, SIGUSR1);
            usleep(20000);
        }
        process.let_go();
    });
    EXPECT_EQ(trace_attach(process.pid()), -1);
    EXPECT_TRUE(runs_free(process.pid())) << process_state(process.pid());
    sigaction(SIGUSR1, &before, nullptr);
}

TEST(TraceDetach, DeliversItsSignal) {
    struct sigaction before;
    struct sigaction action = {};
    action.sa_handler = [](int) { _exit(5); };
    sigaction(SIGUSR2, &action, &before);
    Child child(sleep_for_ever);
    sigaction(SIGUSR2, &before, nullptr);
    ASSERT_EQ(trace_attach(child.pid()), child.pid());
    trace_detach(child.pid(), SIGUSR2);
    int status = 0;
    ASSERT_EQ(waitpid(child.pid(), &status, 0), child.pid());
    EXPECT_EQ(status, 5 << 8);
}

TEST(TraceDetach, StopsARunningProcessFirst) {
    Child child(call_for_ever);
    ASSERT_EQ(trace_attach(child.pid()), child.pid());
    ASSERT_EQ(trace_cont(child.pid(), 0), 0);
    ASSERT_EQ(status_field(child.pid(), "TracerPid:\t"), std::to_string(getpid()));
    trace_detach(child.pid());
    EXPECT_TRUE(runs_free(child.pid()));
}

TEST(TraceDetach, LeavesAProcessAloneThatItDoesNotTrace) {
    Child child(sleep_for_ever);
    trace_detach(child.pid());
    EXPECT_TRUE(runs_free(child.pid()));
}

TEST(TraceDetach, ReturnsWhenTheProcessHasEnded) {
    Child child([] { _exit(0); }, Child::HELD);
    ASSERT_EQ(trace_cont(child.pid(), 0), 0);
    siginfo_t info;
    ASSERT_EQ(waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | WNOWAIT), 0);
    trace_detach(child.pid());
    EXPECT_EQ(waitpid(child.pid(), nullptr, 0), -1) << "it has been reaped";
}

class Complaints : public testing::Test {
  protected:
    void SetUp() override {
        Child child(sleep_for_ever);
        gone_ = child.pid();
    }
    pid_t gone_;
};

TEST_F(Complaints, OfContinuingComeAfterEachOfFourAttempts) {
    testing::internal::CaptureStdout();
    EXPECT_EQ(trace_cont(gone_, 0), -1);
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "PTRACE_CONT failed No such process\n"
              "PTRACE_CONT failed No such process\n"
              "PTRACE_CONT failed No such process\n"
              "PTRACE_CONT failed No such process\n");
}

TEST_F(Complaints, OfSteppingComeAfterEachOfFourAttempts) {
    testing::internal::CaptureStdout();
    EXPECT_EQ(trace_syscall(gone_, 0), -1);
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n");
}

TEST_F(Complaints, OfOptionsNameAContinue) {
    testing::internal::CaptureStdout();
    trace_set_options(gone_, 1);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "PTRACE_CONT failed No such process\n");
}

}  // namespace
