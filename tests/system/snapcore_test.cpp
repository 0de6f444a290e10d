// contrib/snapcore, run as the archive runs it: with an empty environment.
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

std::string snapcore() {
    const char *dir = getenv("CONTRIB");
    return std::string(dir != nullptr ? dir : SOURCE_DIR "/contrib") + "/snapcore";
}

class Snapcore : public testing::Test {
  protected:
    void SetUp() override {
        if (access("/usr/bin/gdb", X_OK) != 0)
            GTEST_SKIP() << "there is no gdb here, which writes the cores";
    }

    static RunResult run(const std::string &pid, const std::string &program = snapcore()) {
        RunOptions options;
        options.before_exec = [] { clearenv(); };
        return run_program({program, "-c", "/dev/stdout", pid}, options);
    }
};

// A process that says a line for each line that it is told.
class Echo {
  public:
    Echo() : process_({"/bin/cat"}) { expect_answers(); }

    std::string pid() const { return std::to_string(process_.pid()); }
    char state() const { return process_state(process_.pid()); }
    void expect_answers() {
        process_.write_input("hello\n");
        EXPECT_EQ("hello", process_.read_line());
    }
    void stop() {
        process_.send_signal(SIGSTOP);
        EXPECT_TRUE(wait_until([&] { return state() == 'T'; }));
    }
    void resume() { process_.send_signal(SIGCONT); }

  private:
    Background process_;
};

TEST_F(Snapcore, AnnouncesTheLengthAndTheProcessAndThenWritesTheCore) {
    Echo target;
    const RunResult result = run(target.pid());
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("core is " + std::to_string(result.out.size()) + " bytes long, holding " +
                  target.pid() + "\n",
              result.err);
    ASSERT_GT(result.out.size(), 10000U);
    EXPECT_EQ(
        "\x7f"
        "ELF",
        result.out.substr(0, 4));
    EXPECT_EQ(4, result.out[16]) << "the type of a core file";
}

TEST_F(Snapcore, TheProcessRunsOn) {
    Echo target;
    EXPECT_EQ(0, run(target.pid()).exit_status);
    target.expect_answers();
}

TEST_F(Snapcore, AStoppedProcessStaysStopped) {
    Echo target;
    target.stop();
    EXPECT_EQ(0, run(target.pid()).exit_status);
    EXPECT_EQ('T', target.state());
    target.resume();
    target.expect_answers();
}

TEST_F(Snapcore, AProcessThatIsGoneHasNoCore) {
    const std::string gone = "4194304";  // one more than the kernel ever gives
    const RunResult result = run(gone);
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ("core is 0 bytes long, holding 4194304\n", result.err);
}

TEST_F(Snapcore, AProcessThatIsTracedAlreadyHasNoCoreAndRunsOn) {
    Echo target;
    Background tracer({fieldkit_path(), "tstrace", "-p", target.pid()});
    (void)tracer.read_line();
    const RunResult result = run(target.pid());
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ("core is 0 bytes long, holding " + target.pid() + "\n", result.err);
    tracer.send_signal(SIGINT);
    target.expect_answers();
}

TEST_F(Snapcore, AFullDiskGivesNoHalfCore) {
    run_in_sandbox([] {
        // The sources may lie below /tmp.
        std::filesystem::copy_file(snapcore(), "/run/snapcore");
        sandbox_shell("mount -t tmpfs -o size=64k tmpfs /tmp");
        Echo target;
        const RunResult result = run(target.pid(), "/run/snapcore");
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ("core is 0 bytes long, holding " + target.pid() + "\n", result.err);
        target.expect_answers();
        sandbox_shell("test -z \"$(ls -A /tmp)\"");
    });
}

TEST_F(Snapcore, LeavesNothingBehindWhenItsReaderGoesAway) {
    run_in_sandbox([] {
        Echo target;
        TempDir dir;
        sandbox_shell("env -i TMPDIR='" + dir.path() + "' '" + snapcore() + "' -c /dev/stdout " +
                      target.pid() + " 2>/dev/null | head -c 100 >/dev/null");
        target.expect_answers();
        EXPECT_TRUE(std::filesystem::is_empty(dir.path()));
    });
}

TEST_F(Snapcore, RefusesOtherArguments) {
    for (const char *pid : {"", "x", "1x", "-1"})
        EXPECT_EQ(2, run(pid).exit_status) << pid;
    EXPECT_EQ(2, run_program({snapcore()}).exit_status);
}

}  // namespace
