#include "util/spawn.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

// Standard streams for a child, as files.
struct Streams {
    TempDir dir;
    UniqueFd in{open(dir.file("in", "input\n").c_str(), O_RDONLY | O_CLOEXEC)};
    UniqueFd out{open((dir / "out").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600)};
    UniqueFd err{open((dir / "err").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600)};

    std::string output() const { return read_whole_file(dir / "out"); }
    std::string errors() const { return read_whole_file(dir / "err"); }
};

int run_shell(const Streams &streams, const char *command) {
    const char *argv[] = {"/bin/sh", "-c", command, nullptr};
    return run_process_wait(argv[0], const_cast<char **>(argv), streams.in.get(), streams.out.get(),
                            streams.err.get(), false);
}

TEST(Spawn, WiresTheThreeDescriptors) {
    Streams streams;
    EXPECT_EQ(7, run_shell(streams, "read a; echo out $a; echo err >&2; exit 7"));
    EXPECT_EQ("out input\n", streams.output());
    EXPECT_EQ("err\n", streams.errors());
}

// Passes on a standard output with these descriptor flags as what it is.
void expect_standard_output_kept(int flags) {
    Streams streams;
    pid_t pid = fork();
    if (pid == 0) {
        dup3(streams.out.get(), 1, flags);
        const char *argv[] = {"/bin/sh", "-c", "echo here", nullptr};
        _exit(run_process_wait(argv[0], const_cast<char **>(argv), 0, 1, 2, false));
    }
    int status;
    waitpid(pid, &status, 0);
    EXPECT_EQ(0, status);
    EXPECT_EQ("here\n", streams.output());
}

TEST(Spawn, PassingTheStandardDescriptorsLeavesThemAsTheyAre) {
    expect_standard_output_kept(0);
}

TEST(Spawn, AStandardDescriptorThatIsCloseOnExecIsKept) {
    expect_standard_output_kept(O_CLOEXEC);
}

TEST(Spawn, OutputAndErrorsMayShareADescriptor) {
    Streams streams;
    const char *argv[] = {"/bin/sh", "-c", "echo one; echo two >&2", nullptr};
    EXPECT_EQ(0, run_process_wait(argv[0], const_cast<char **>(argv), streams.in.get(),
                                  streams.out.get(), streams.out.get(), false));
    EXPECT_EQ("one\ntwo\n", streams.output());
}

TEST(Spawn, AProgramThatDoesNotExistSaysSoOnItsStandardErrorAndExitsWithOne) {
    Streams streams;
    const char *argv[] = {"/nonexistent/program", nullptr};
    pid_t pid = spawn_process_noenv(argv[0], const_cast<char **>(argv), streams.in.get(),
                                    streams.out.get(), streams.err.get(), false);
    ASSERT_GT(pid, 0);
    int status;
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_TRUE(WIFEXITED(status));
    EXPECT_EQ(1, WEXITSTATUS(status));
    EXPECT_EQ("execve: No such file or directory\n", streams.errors());
    EXPECT_EQ(1,
              run_process_wait(argv[0], const_cast<char **>(argv), 0, 1, streams.err.get(), false));
}

TEST(Spawn, TextThatTheCallerHadBufferedComesOutWhenTheProgramCannotBeExecuted) {
    Streams streams;
    (void)fflush(stdout);  // nothing of the test's own
    pid_t pid = fork();
    if (pid == 0) {
        const char *argv[] = {"/nonexistent/program", nullptr};
        printf("buffered\n");
        (void)run_process_wait(argv[0], const_cast<char **>(argv), 0, streams.out.get(),
                               streams.err.get(), false);
        _exit(0);
    }
    waitpid(pid, nullptr, 0);
    EXPECT_EQ("buffered\n", streams.output());
}

TEST(Spawn, NoenvGivesAnEmptyEnvironment) {
    Streams streams;
    const char *argv[] = {"/usr/bin/env", nullptr};
    pid_t pid = spawn_process_noenv(argv[0], const_cast<char **>(argv), streams.in.get(),
                                    streams.out.get(), streams.err.get(), false);
    int status;
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
    EXPECT_EQ("", streams.output());
}

TEST(Spawn, PassesTheGivenEnvironmentUnchanged) {
    Streams streams;
    const char *argv[] = {"/usr/bin/env", nullptr};
    const char *envp[] = {"B=2", "A=1", nullptr};
    pid_t pid = spawn_process(argv[0], const_cast<char **>(argv), const_cast<char **>(envp),
                              streams.in.get(), streams.out.get(), streams.err.get(), false);
    waitpid(pid, nullptr, 0);
    EXPECT_EQ("B=2\nA=1\n", streams.output());
}

TEST(Spawn, TraceMeStopsTheChildWithSigtrapAtItsExecve) {
    Streams streams;
    const char *argv[] = {"/bin/true", nullptr};
    pid_t pid = spawn_process_noenv(argv[0], const_cast<char **>(argv), streams.in.get(),
                                    streams.out.get(), streams.err.get(), true);
    int status;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    ASSERT_TRUE(WIFSTOPPED(status));
    EXPECT_EQ(SIGTRAP, WSTOPSIG(status));
    EXPECT_EQ(0, ptrace(PTRACE_CONT, pid, 0, 0));
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
}

TEST(Spawn, KeepsNoRecordOfATracedChildThatHasOnlyStopped) {
    const char *argv[] = {"/bin/true", nullptr};
    EXPECT_EQ(SIGTRAP, run_process_wait(argv[0], const_cast<char **>(argv), 0, 1, 2, true));
    const std::vector<pid_t> children = children_of(getpid());
    ASSERT_EQ(1u, children.size());
    release_child(children[0]);
    EXPECT_FALSE(claim_child(children[0]));
    EXPECT_EQ(0, kill(children[0], SIGKILL));
    EXPECT_EQ(children[0], waitpid(children[0], nullptr, 0));
}

TEST(Spawn, AChildThatASignalKilledYieldsZero) {
    Streams streams;
    EXPECT_EQ(0, run_shell(streams, "kill -KILL $$"));
}

TEST(Spawn, AFailedForkIsToldAndLeavesOtherChildrenAlone) {
    Streams streams;
    pid_t pid = fork();
    if (pid == 0) {
        pid_t other = fork();
        if (other == 0)
            _exit(9);
        // No further process for a user that is not root.
        rlimit none = {0, 0};
        if (setrlimit(RLIMIT_NPROC, &none) != 0 || (getuid() == 0 && setuid(65534) != 0))
            _exit(77);
        dup2(streams.err.get(), 2);
        const char *argv[] = {"/bin/true", nullptr};
        char **args = const_cast<char **>(argv);
        bool failed = spawn_process(argv[0], args, nullptr, 0, 1, 2, false) == -1 &&
                      run_process_wait(argv[0], args, 0, 1, 2, false) == 0;
        int status;
        _exit(failed && waitpid(other, &status, 0) == other ? 0 : 1);
    }
    int status;
    waitpid(pid, &status, 0);
    if (WEXITSTATUS(status) == 77)
        GTEST_SKIP() << "this machine does not let the process limit be set";
    EXPECT_EQ(0, status);
    EXPECT_EQ("fork: Resource temporarily unavailable\nfork: Resource temporarily unavailable\n",
              streams.errors());
}

}  // namespace
