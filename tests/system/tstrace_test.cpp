// The applet tstrace, run as a user would.
#include <errno.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "tracers.h"

namespace {

constexpr char USAGE[] =
    "USAGE: tstrace [ -ppid ] [ command [ arg ... ] ]\n"
    "\n"
    "-p<pid>\tAdd a pid to trace, can be given multiple times.\n";

RunResult trace_fixture(const std::string &name, std::vector<std::string> args = {},
                        const RunOptions &options = {}) {
    args.insert(args.begin(), {"tstrace", fixture_path(name)});
    return run_fieldkit(args, options);
}

// "[PID NAME] [PC RA] CALL" for a call of the fixture.
std::string line_of(const std::string &fixture, const std::string &call) {
    return "[PID " + shown_name(fixture_path(fixture)) + "] [PC RA] " + call + "\n";
}

std::vector<std::string> background(std::vector<std::string> args) {
    args.insert(args.begin(), fieldkit_path());
    return args;
}

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

size_t count_of(const std::string &text, const std::string &part) {
    size_t count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1))
        ++count;
    return count;
}

// ---- Command line ----

TEST(Tstrace, PrintsItsUsageWhenThereIsNothingToTrace) {
    using Words = std::vector<std::string>;
    for (const Words &args : {Words{"tstrace"},
                              {"tstrace", "-x"},
                              {"tstrace", "-"},
                              {"tstrace", "-p"},
                              {"tstrace", "-p1234"},
                              {"tstrace", "-x", "ls"}}) {
        RunResult result = run_fieldkit(args);
        EXPECT_EQ(result.exit_status, 0);
        EXPECT_EQ(result.out, USAGE);
        EXPECT_EQ(result.err, "");
    }
}

TEST(Tstrace, EndsWith1AndSilentlyWhenTheCommandCannotBeFound) {
    for (const char *command : {"nosuchcmd", "/nonexistent/cmd", "./nosuchcmd", "/tmp", ""}) {
        RunResult result = run_fieldkit({"tstrace", command});
        EXPECT_EQ(result.exit_status, 1) << command;
        EXPECT_EQ(result.out, "") << command;
        EXPECT_EQ(result.err, "") << command;
    }
}

TEST(Tstrace, FindsItsCommandInPath) {
    std::string fixture = fixture_path("sample");
    RunOptions options;
    options.env = {"PATH=/nonexistent:" + fixture.substr(0, fixture.rfind('/'))};
    RunResult result = run_fieldkit({"tstrace", "sample"}, options);
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_TRUE(contains(masked(result.out),
                         "[PID sample] [PC RA] write(1 pipe:[INODE], "
                         "\"hi\\n\", 3) = 3\n"))
        << result.out;
}

TEST(Tstrace, ComplainsOfAFileThatCannotBeExecuted) {
    TempDir dir;
    RunOptions options;
    // Where leaks are looked for, the child that cannot execute the file would do so, in vain.
    options.leak_check = false;
    RunResult result = run_fieldkit({"tstrace", dir.file("file", "no program", 0644)}, options);
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.err, "execve: Permission denied\n");
    EXPECT_EQ(std::regex_replace(result.out, std::regex("failed! [0-9]+"), "failed! PID"),
              "PTRACE_CONT failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "SYSCALL failed No such process\n"
              "WARNING: ptrace SYSCALL failed! PID\n");
}

TEST(Tstrace, OfAPidThatDoesNotExistEndsWithoutText) {
    pid_t gone;
    {
        Background sleeper({fixture_path("behave"), "sleep"});
        gone = sleeper.pid();
    }
    RunResult result = run_fieldkit({"tstrace", "-p", std::to_string(gone)});
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

TEST(Tstrace, WithPidsDoesNotStartTheCommand) {
    TempDir dir;
    Background first({fixture_path("behave"), "call"}), second({fixture_path("behave"), "call"});
    char hexadecimal[20];
    snprintf(hexadecimal, sizeof hexadecimal, "0x%x", static_cast<unsigned>(second.pid()));
    Background tracer(background(
        {"tstrace", "-p", std::to_string(first.pid()), "-p", hexadecimal, "touch", dir / "file"}));
    std::string name = shown_name(fixture_path("behave")) + "] [";
    read_line_with(tracer, "[" + std::to_string(first.pid()) + " " + name);
    read_line_with(tracer, "[" + std::to_string(second.pid()) + " " + name);
    tracer.send_signal(SIGINT);
    EXPECT_EQ(tracer.wait().exit_status, 0);
    EXPECT_EQ(access((dir / "file").c_str(), F_OK), -1);
    EXPECT_TRUE(runs_free(first.pid()));
    EXPECT_TRUE(runs_free(second.pid()));
}

// ---- Calls ----

TEST(Tstrace, ShowsEachCallAtItsEntryAndAtItsExit) {
    RunResult result = trace_fixture("sample");
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_EQ(result.err, "");
    std::string text = masked(result.out);
    size_t start = text.find("getppid(");
    ASSERT_NE(start, std::string::npos) << text;
    text = text.substr(start);

    auto both = [](const std::string &call, const std::string &result_text) {
        return line_of("sample", call) + line_of("sample", call + " = " + result_text);
    };
    // The entry, then the program's own output, then the exit.
    EXPECT_TRUE(contains(text, line_of("sample", "write(1 pipe:[INODE], \"hi\\n\", 3)") + "hi\n" +
                                   line_of("sample", "write(1 pipe:[INODE], \"hi\\n\", 3) = 3")))
        << text;
#if defined(__x86_64__) || defined(__mips__)
    EXPECT_TRUE(contains(text, both("open(\"/nonexistent/file\", 0, 420)", failure(ENOENT))))
        << text;
#endif
    EXPECT_TRUE(contains(text, both("read(3 pipe:[INODE], ADDRESS, 1)", "0"))) << text;
    EXPECT_TRUE(contains(
        text, line_of("sample", "close(3 pipe:[INODE])") + line_of("sample", "close(3) = 0")))
        << "the descriptor is gone at the exit" << text;
    EXPECT_TRUE(contains(text, both("close(77)", failure(EBADF)))) << text;
    EXPECT_TRUE(contains(text, both("brk(0x0)", "ADDRESS"))) << text;
#if defined(__mips__)
    EXPECT_TRUE(contains(text, both("mmap2(0x0, 4096, 0x1, 0x802, -1, 0)", "ADDRESS"))) << text;
#else
    EXPECT_TRUE(contains(text, both("mmap(0x0, 4096, 0x1, 0x22, -1, 0)", "ADDRESS"))) << text;
#endif
}

TEST(Tstrace, ListsTheDescriptorsAtTheExitCallAndAtTheExitEvent) {
    RunOptions options;
    // Nothing but the three standard descriptors, and these known.
    options.before_exec = [] {
        for (int fd = 3; fd < 1024; ++fd)
            close(fd);
    };
    RunResult result = trace_fixture("sample", {}, options);
    std::string listing = "\n[PID " + shown_name(fixture_path("sample")) +
                          "] 3 open fds:\n"
                          "0\tpipe:[INODE]\n"
                          "1\tpipe:[INODE]\n"
                          "2\tpipe:[INODE]\n";
    std::string text = masked(result.out);
    EXPECT_EQ(count_of(text, listing), 2u) << text;
    EXPECT_TRUE(text.ends_with(listing)) << text;
    // The line of the exit call comes between the two, its start overwritten by the first listing.
    EXPECT_TRUE(contains(text, "exit_group(5)\n" + listing)) << text;
}

TEST(Tstrace, ShowsTheWholeLifeOfACommand) {
    RunResult result = run_fieldkit({"tstrace", "/bin/true"});
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_TRUE(contains(result.out, "] brk(0x0)\n")) << result.out;
    EXPECT_TRUE(contains(result.out, "exit_group(0)\n")) << result.out;
    std::string text = masked(result.out);
    EXPECT_EQ(count_of(text, "\n[PID true] ") - count_of(text, "\n[PID true] [PC RA]"), 2u)
        << "listings of descriptors" << text;
}

TEST(Tstrace, ShowsBothEndsOfATcpConnection) {
    run_in_sandbox([] {
        std::string text = trace_fixture("sockets", {"tcp", "45678"}).out;
        std::smatch ports;
        ASSERT_TRUE(std::regex_search(
            text, ports,
            std::regex("write\\(4 socket:\\[[0-9]+\\]\\[127\\.0\\.0\\.1:([0-9]+) -> "
                       "127\\.0\\.0\\.1:45678\\]\\[TCP_ESTABLISHED\\], \"x\", 1\\) = 1\n")))
            << text;
        EXPECT_NE(ports[1], "0");
        EXPECT_TRUE(contains(masked(text),
                             "\n3\tsocket:[INODE][127.0.0.1:45678 -> 0.0.0.0:0]"
                             "[TCP_LISTEN]\n"))
            << text;
    });
}

TEST(Tstrace, ShowsThePathOfAUnixSocket) {
    TempDir dir;
    std::string text = masked(trace_fixture("sockets", {"unix", dir / "s"}).out);
    EXPECT_TRUE(contains(
        text, line_of("sockets", "write(5 socket:[INODE][" + dir / "s" + "], \"x\", 1) = 1")))
        << text;
}

TEST(Tstrace, ShowsNoConnectionForASocketPair) {
    std::string text = masked(trace_fixture("sockets", {"pair"}).out);
    EXPECT_TRUE(contains(text, line_of("sockets", "write(3 socket:[INODE], \"x\", 1) = 1")))
        << text;
}

// ---- Signals and ends ----

TEST(Tstrace, ShowsAStopFromOutsideAndTheProcessStaysStoppedUntilContinued) {
    Background sleeper({fixture_path("behave"), "sleep"});
    ASSERT_EQ(sleeper.read_line(), "ready");
    Background tracer(background({"tstrace", "-p", std::to_string(sleeper.pid())}));
    read_line_with(tracer, "pause(");
    sleeper.send_signal(SIGSTOP);
    std::string prefix = "[" + std::to_string(sleeper.pid()) + " " +
                         shown_name(fixture_path("behave")) + "] ---  SIGNAL ";
    EXPECT_EQ(read_line_with(tracer, "SIGNAL"), prefix + std::to_string(SIGSTOP) + " SIGSTOP ---");
    EXPECT_EQ(tracer.read_line(), "");
    // Were it not stopped, pause would be called again.
    EXPECT_TRUE(wait_for_state(sleeper.pid(), 't'));
    sleeper.send_signal(SIGCONT);
    EXPECT_EQ(tracer.read_line(), "") << "of the next SIGNAL line";
    EXPECT_EQ(tracer.read_line(), prefix + std::to_string(SIGCONT) + " SIGCONT ---");
    read_line_with(tracer, "pause(");
    tracer.send_signal(SIGINT);
    EXPECT_EQ(tracer.wait().exit_status, 0);
    EXPECT_TRUE(runs_free(sleeper.pid()));
}

TEST(Tstrace, ShowsTheSignalThatAProcessDiesOf) {
    Background sleeper({fixture_path("behave"), "sleep"});
    ASSERT_EQ(sleeper.read_line(), "ready");
    Background tracer(background({"tstrace", "-p", std::to_string(sleeper.pid())}));
    read_line_with(tracer, "pause(");
    sleeper.send_signal(SIGTERM);
    EXPECT_TRUE(read_line_with(tracer, "SIGNAL").ends_with("SIGNAL 15 SIGTERM ---"));
    EXPECT_EQ(tracer.wait().exit_status, 0);
    EXPECT_EQ(sleeper.wait().signal, SIGTERM);
}

TEST(Tstrace, EndsWithACommandThatIsKilled) {
    EXPECT_EQ(trace_fixture("behave", {"die"}).exit_status, 0);
}

TEST(Tstrace, FollowsACommandThatReplacesItselfUntilTheSigtrapOfItsExecve) {
    RunResult result = trace_fixture("behave", {"exec"});
    EXPECT_EQ(result.exit_status, 0);
    size_t entry = result.out.find("] execve(");
    ASSERT_NE(entry, std::string::npos) << result.out;
    EXPECT_NE(result.out.find("] execve(", entry + 1), std::string::npos) << "its exit";
    EXPECT_FALSE(contains(result.out, "exit_group(4)")) << result.out;
    EXPECT_FALSE(contains(result.out, "SIGNAL")) << result.out;
}

TEST(Tstrace, FollowsACommandThatReplacesItselfAndIgnoresSigtrapToItsEnd) {
    RunResult result = trace_fixture("behave", {"exec-ignoring"});
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_TRUE(contains(result.out, "exit_group(4)\n")) << result.out;
    EXPECT_FALSE(contains(result.out, "SIGNAL")) << result.out;
}

TEST(Tstrace, EndsOnInterruptAndLetsTheProcessGoOn) {
    for (const char *how : {"sleep", "call"}) {
        Background process({fixture_path("behave"), how});
        ASSERT_EQ(process.read_line(), "ready");
        Background tracer(background({"tstrace", "-p", std::to_string(process.pid())}));
        read_line_with(tracer, process.pid() > 0 && how[0] == 's' ? "pause(" : "getppid(");
        tracer.send_signal(SIGINT);
        RunResult result = tracer.wait();
        EXPECT_EQ(result.exit_status, 0);
        EXPECT_TRUE(contains(masked(result.out), " open fds:\n0\t")) << "the listing at the end";
        EXPECT_TRUE(runs_free(process.pid()));
    }
}

TEST(Tstrace, PassesAnInterruptOnToItsCommand) {
    Background tracer(background({"tstrace", fixture_path("behave"), "handle"}));
    std::string line = read_line_with(tracer, "pause(");
    pid_t command = static_cast<pid_t>(strtol(line.c_str() + 1, nullptr, 10));
    tracer.send_signal(SIGINT);
    RunResult result = tracer.wait();
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_TRUE(result.out.ends_with("got it\n")) << result.out;
    EXPECT_EQ(process_state(command), '?') << "it has ended and been reaped";
}

// ---- The traced program does not notice ----

TEST(Tstrace, StartsItsCommandWithoutAnyEnvironment) {
    RunOptions options;
    options.env = {"HOME=/root", "PATH=/bin", "FIELDKIT_TEST=1"};
    EXPECT_TRUE(contains(trace_fixture("behave", {"environment"}, options).out,
                         "\n0 variables, HOME unset, PATH unset\n"));
}

TEST(Tstrace, GivesItsCommandItsOwnStandardStreams) {
    RunOptions options;
    options.input = "some words\n";
    RunResult result = trace_fixture("behave", {"echo"}, options);
    EXPECT_TRUE(contains(result.out, "\nsome words\n")) << result.out;
    EXPECT_EQ(result.err, "to standard error\n");
    EXPECT_TRUE(contains(result.out, "exit_group(21)\n")) << result.out;
}

TEST(Tstrace, LeavesTheAlarmClockToItsCommand) {
    RunOptions options;
    options.timeout_s = 30;
    RunResult result = trace_fixture("behave", {"alarm"}, options);
    EXPECT_EQ(result.exit_status, 0);
    EXPECT_TRUE(contains(result.out, "SIGNAL 14 SIGALRM ---\n")) << result.out;
}

TEST(Tstrace, DoesNotChangeWhatAProcessDoes) {
    for (bool traced : {false, true}) {
        Background process({fixture_path("behave"), "handle"});
        ASSERT_EQ(process.read_line(), "ready");
        std::unique_ptr<Background> tracer;
        if (traced) {
            tracer = std::make_unique<Background>(
                background({"tstrace", "-p", std::to_string(process.pid())}));
            read_line_with(*tracer, "pause(");
        }
        process.send_signal(SIGUSR1);
        RunResult result = process.wait();
        EXPECT_EQ(result.exit_status, 33);
        EXPECT_EQ(result.out, "got it\n");
        if (traced) {
            EXPECT_TRUE(contains(tracer->wait().out, "SIGUSR1 ---\n"));
        }
    }
}

}  // namespace
