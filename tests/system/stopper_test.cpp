// The applet stopper, run as a user would.
#include <dirent.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "support/temp_dir.h"
#include "tracers.h"

namespace {

constexpr char USAGE[] =
    "USAGE: stopper [ -ppid ] [ command [ arg ... ] ]\n"
    "\n"
    "-p<pid>\tAdd a pid to stop at exit\n";

std::string trapped(pid_t pid, int code) {
    return "stopper: Trapped pid=" + std::to_string(pid) + " exit code " + std::to_string(code);
}

std::vector<std::string> stopper_of(const Background &process) {
    return {fieldkit_path(), "stopper", "-p", std::to_string(process.pid())};
}

// Waits until `tracer` has attached to the process and let it go on into its sleep.
void wait_for_attach(const Background &process, const Background &tracer) {
    ASSERT_TRUE(wait_until([&] {
        return status_field(process.pid(), "TracerPid:\t") == std::to_string(tracer.pid()) &&
               process_state(process.pid()) == 'S';
    }));
}

TEST(Stopper, PrintsItsUsageWhenThereIsNothingToHold) {
    using Words = std::vector<std::string>;
    for (const Words &args : {Words{"stopper"}, {"stopper", "-x"}, {"stopper", "-p"}}) {
        RunResult result = run_fieldkit(args);
        EXPECT_EQ(result.exit_status, 0);
        EXPECT_EQ(result.out, USAGE);
    }
}

TEST(Stopper, EndsWith1AndSilentlyWhenTheCommandCannotBeFound) {
    RunResult result = run_fieldkit({"stopper", "nosuchcmd"});
    EXPECT_EQ(result.exit_status, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

TEST(Stopper, TellsOfAnExitTwiceAndHoldsTheProcessUntilInterrupted) {
    Background process({fixture_path("behave"), "exit", "3", "wait"});
    ASSERT_EQ(process.read_line(), "ready");
    Background stopper(stopper_of(process));
    wait_for_attach(process, stopper);
    process.write_input("go on\n");
    EXPECT_EQ(stopper.read_line(), trapped(process.pid(), 3));
    EXPECT_EQ(stopper.read_line(), trapped(process.pid(), 768));

    // The process is still there with all that it has.
    EXPECT_TRUE(wait_for_state(process.pid(), 't'));
    std::string proc = "/proc/" + std::to_string(process.pid());
    char target[256];
    ssize_t len = readlink((proc + "/fd/0").c_str(), target, sizeof target);
    ASSERT_GT(len, 0);
    EXPECT_EQ(std::string(target, 6), "pipe:[");
    EXPECT_NE(read_whole_file(proc + "/maps").find("behave"), std::string::npos);
    ASSERT_TRUE(wait_for_state(stopper.pid(), 'S'));

    stopper.send_signal(SIGINT);
    RunResult result = stopper.wait();
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(process.wait().exit_status, 3);
}

TEST(Stopper, HoldsACommandThatItStarted) {
    Background stopper({fieldkit_path(), "stopper", fixture_path("behave"), "exit", "0"});
    EXPECT_EQ(stopper.read_line(), "ready");
    std::string line = stopper.read_line();
    pid_t pid = 0;
    ASSERT_EQ(sscanf(line.c_str(), "stopper: Trapped pid=%d", &pid), 1) << line;
    EXPECT_EQ(line, trapped(pid, 0));
    EXPECT_EQ(stopper.read_line(), trapped(pid, 0)) << "the status of an exit with 0";
    EXPECT_TRUE(wait_for_state(pid, 't'));
    stopper.send_signal(SIGINT);
    EXPECT_EQ(stopper.wait().exit_status, 0);
    EXPECT_EQ(process_state(pid), '?') << "it has ended and been reaped";
}

TEST(Stopper, HoldsAProcessThatASignalEnds) {
    Background process({fixture_path("behave"), "sleep"});
    ASSERT_EQ(process.read_line(), "ready");
    Background stopper(stopper_of(process));
    wait_for_attach(process, stopper);
    process.send_signal(SIGTERM);
    EXPECT_EQ(stopper.read_line(), trapped(process.pid(), 15));
    EXPECT_TRUE(wait_for_state(process.pid(), 't'));
    stopper.send_signal(SIGINT);
    EXPECT_EQ(stopper.wait().exit_status, 0);
    EXPECT_EQ(process.wait().signal, SIGTERM);
}

TEST(Stopper, NeverMissesAnInterruptAtTheStartOfItsHold) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "the thread sanitizer may put a signal handler off until a sleep has ended";
#endif
    for (int round = 0; round < 40; ++round) {
        Background stopper({fieldkit_path(), "stopper", fixture_path("behave"), "exit", "1"});
        read_line_with(stopper, "exit code 256");
        stopper.send_signal(SIGINT);
        ASSERT_EQ(stopper.wait(20).exit_status, 0) << "in round " << round;
    }
}

TEST(Stopper, InterruptedBeforeAnyExitLetsTheProcessGoOnAndSaysNothing) {
    Background process({fixture_path("behave"), "sleep"});
    ASSERT_EQ(process.read_line(), "ready");
    Background stopper(stopper_of(process));
    wait_for_attach(process, stopper);
    stopper.send_signal(SIGINT);
    RunResult result = stopper.wait();
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_TRUE(runs_free(process.pid()));
}

}  // namespace
