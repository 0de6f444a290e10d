#include "trace/tracee_control.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>

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

TEST(TraceAttach, GivesAnotherSignalThatComesFirstToTheProcess) {
    int go_pipe[2];
    ASSERT_EQ(pipe(go_pipe), 0);
    ASSERT_EQ(pipe2(taken_pipe, O_NONBLOCK), 0);
    // While it waits for the child of a vfork, a process takes no signal.
    Child child([&] {
        signal(SIGHUP, [](int) { (void)!write(taken_pipe[1], "", 1); });
        if (vfork() == 0) {
            char byte;
            (void)!read(go_pipe[0], &byte, 1);
            _exit(0);
        }
        sleep_for_ever();
    });
    pid_t pid = child.pid();
    ASSERT_TRUE(wait_until([&] { return process_state(pid) == 'D'; }));
    // Both signals then wait in the same queue, from which the lower number is taken first.
    ASSERT_EQ(syscall(SYS_tkill, pid, SIGHUP), 0);
    Child outsider([&] {
        wait_until([&] { return status_field(pid, "TracerPid:\t") != "0"; });
        (void)!write(go_pipe[1], "", 1);
    });
    EXPECT_EQ(trace_attach(pid), pid);
    trace_detach(pid);
    char byte;
    EXPECT_TRUE(wait_until([&] { return read(taken_pipe[0], &byte, 1) == 1; })) << "lost";
    EXPECT_TRUE(runs_free(pid)) << process_state(pid);
    for (int fd : {go_pipe[0], go_pipe[1], taken_pipe[0], taken_pipe[1]})
        close(fd);
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
    ASSERT_TRUE(wait_until([&] { return process_state(child.pid()) == 'Z'; }));
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
