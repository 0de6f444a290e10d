#include "archive/process_snapshot.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include <string>

#include "archive_file.h"
#include "support/run_program.h"

namespace {

// Snapshots of a process, with a shell script in the place of the core-image writer. In the script
// $3 is the process, and `control LENGTH ID...` writes a control line.
class Snapshot : public testing::Test {
  protected:
    void SetUp() override {
        devnull_.reset(open("/dev/null", O_RDWR | O_CLOEXEC));
        set_core_program(script_path_.c_str(), devnull_.get());
    }

    void script(const std::string &body) {
        archive_.dir.file(
            "writer",
            "#!/bin/sh\n"
            "[ $# = 3 ] && [ $1 = -c ] && [ $2 = /dev/stdout ] || exit 99\n"
            "control() { n=$1; shift; echo \"CORELEN $n bytes, of processes:$*\" >&2; }\n" +
                body + "\n",
            0755);
    }

    // snapshot_process of the first of `pids`; what is printed on standard error goes to `errors_`.
    int take(std::vector<pid_t> pids) {
        pids_ = pids;
        testing::internal::CaptureStderr();
        int result = snapshot_process(archive_.tw, archive_.fd.get(), pids_.data(), 0,
                                      static_cast<int>(pids_.size()));
        errors_ = testing::internal::GetCapturedStderr();
        return result;
    }

    std::string own_dir(const char *name = "unit_archive") const {
        return "top/" + std::string(name) + "." + std::to_string(getpid()) + "/";
    }

    ArchiveFile archive_;
    std::string script_path_ = archive_.dir / "writer";
    UniqueFd devnull_;
    std::vector<pid_t> pids_;
    std::string errors_;
};

TEST_F(Snapshot, HoldsTheCoreAndTheDescriptorMap) {
    script("control 10 $3; printf 0123456789");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("", errors_);
    std::vector<TarMember> members = archive_.close();
    ASSERT_EQ(2u, members.size());
    EXPECT_EQ(own_dir() + "core", members[0].name);
    EXPECT_EQ("0123456789", members[0].data);
    EXPECT_EQ(own_dir() + "fdmap", members[1].name);
    EXPECT_NE(std::string::npos, members[1].data.find(" -> " + (archive_.dir / "archive")))
        << members[1].data;
}

TEST_F(Snapshot, CopiesALargeCoreWhole) {
    script("control 3000000; head -c 3000000 /dev/zero");
    EXPECT_EQ(0, take({getpid()}));
    std::vector<TarMember> members = archive_.close();
    ASSERT_EQ(2u, members.size());
    EXPECT_EQ(std::string(3000000, '\0'), members[0].data);
}

TEST_F(Snapshot, TakesTheProcessesThatACoreCoversOutOfTheList) {
    script("control 1 $3 500 501; printf x");
    pid_t self = getpid();
    EXPECT_EQ(0, take({self, 400, 500, 501, 500}));
    EXPECT_EQ((std::vector<pid_t>{-1, 400, -1, -1, 500}), pids_);
    archive_.close();
}

TEST_F(Snapshot, OfAProcessCoveredByAnEarlierOneHasNoDirectoryOfItsOwn) {
    script("echo $3 >>" + archive_.dir / "calls" + "; control 1 $3 500; printf x");
    pid_t pids[] = {-1, getpid(), 500, getpid()};
    snapshot_processes(archive_.tw, archive_.fd.get(), pids, 4);
    // The core of the second entry covers the third; the fourth is not the first match for itself.
    std::string self = std::to_string(getpid()) + "\n";
    EXPECT_EQ(self + self, read_whole_file(archive_.dir / "calls"));
    EXPECT_EQ(4u, archive_.close().size());
}

TEST_F(Snapshot, WithALengthOfZeroHasNoMembers) {
    script("control 0 $3; printf thrown-away");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("", errors_);
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, WithoutAControlLineHasNoMembers) {
    script("exec 2>&-; head -c 100000 /dev/zero");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("", errors_);
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, TreatsAnUnfinishedControlLineAsNoCore) {
    script("printf 'CORELEN 5 bytes' >&2; printf 01234");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, GathersAControlLineThatComesInPieces) {
    script(
        "printf COREL >&2; sleep 0.05; printf 'EN 3 bytes, of processes:' >&2; sleep 0.05; "
        "echo $3 >&2; printf abc");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("abc", archive_.close().at(0).data);
}

TEST_F(Snapshot, ComplainsOfAControlLineThatIsTooLong) {
    script("head -c 300 /dev/zero | tr '\\0' x >&2; printf data");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("failed to read ctl line.\n", errors_);
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, TakesAControlLineOf256Bytes) {
    script("printf 'CORELEN 3 bytes, of processes:%0225d\\n' 77 >&2; printf abc");
    EXPECT_EQ(0, take({getpid(), 77}));
    EXPECT_EQ(-1, pids_[1]);
    EXPECT_EQ("abc", archive_.close().at(0).data);
}

TEST_F(Snapshot, WarnsOfAShortCoreAndLeavesItShort) {
    // More than the pipe holds, so that the control line has been read before there is another.
    script(
        "control 200010 $3; head -c 199950 /dev/zero | tr '\\0' x; echo more on the control pipe "
        ">&2");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("WARNING: err=199950 clen=200010 pid=" + std::to_string(getpid()) +
                  "\nmore on the control pipe\n",
              errors_);
    std::string bytes = archive_.bytes();
    EXPECT_EQ("00000606512", bytes.substr(124, 11));
    EXPECT_EQ(std::string(199950, 'x'), bytes.substr(512, 199950));
    // Padded as 200010 bytes are, to the header of the descriptor map.
    EXPECT_EQ(own_dir() + "fdmap", bytes.substr(512 + 199950 + 182, 100).c_str());
    tar_close(archive_.tw);
}

TEST_F(Snapshot, WarnsOfALongCore) {
    script("control 4 $3; printf 0123456789");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("WARNING: err=10 clen=4 pid=" + std::to_string(getpid()) + "\n", errors_);
    tar_close(archive_.tw);
}

TEST_F(Snapshot, OfAWriterThatFailsHasNoDescriptorMap) {
    script("control 3 $3; printf abc; exit 5");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("dump error for pid " + std::to_string(getpid()), errors_);
    std::vector<TarMember> members = archive_.close();
    ASSERT_EQ(1u, members.size());
    EXPECT_EQ(own_dir() + "core", members[0].name);
}

TEST_F(Snapshot, SurvivesAWriterThatASignalKills) {
    script("kill -KILL $$");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("dump error for pid " + std::to_string(getpid()), errors_);
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, SurvivesAWriterThatDoesNotExist) {
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ("dump error for pid " + std::to_string(getpid()), errors_);
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, OfAProcessThatHasGoneIsInADirectoryNamedUnknown) {
    script("control 3; printf abc; exit 1");
    EXPECT_EQ(0, take({0x7ffffff}));
    EXPECT_EQ("dump error for pid 134217727", errors_);
    EXPECT_EQ("top/unknown.134217727/core", archive_.close().at(0).name);
}

TEST_F(Snapshot, OfAProcessWithAnEmptyCommandLineIsInADirectoryOfADotAndItsId) {
    // A zombie's command line is empty, as a kernel thread's is.
    pid_t zombie = fork();
    if (zombie == 0)
        _exit(0);
    siginfo_t info;
    ASSERT_EQ(0, waitid(P_PID, static_cast<id_t>(zombie), &info, WEXITED | WNOWAIT));
    script("control 3; printf abc");
    EXPECT_EQ(0, take({zombie}));
    EXPECT_EQ("top/." + std::to_string(zombie) + "/core", archive_.close().at(0).name);
    waitpid(zombie, nullptr, 0);
}

TEST_F(Snapshot, NamesADirectoryAfterTheFirst80BytesOfTheCommandLine) {
    script("control 1; printf x");
    std::string long_name(120, 'n');
    // Not a program like busybox, which is nothing without its own name.
    Background program({fixture_path("behave"), "sleep"}, {.argv0 = long_name});
    ASSERT_EQ("ready", program.read_line());
    EXPECT_EQ(0, take({program.pid()}));
    EXPECT_EQ("top/" + long_name.substr(0, 80) + "." + std::to_string(program.pid()) + "/",
              archive_.close().at(0).name.substr(0, 86 + std::to_string(program.pid()).size()));
}

TEST_F(Snapshot, EndsTheLoopWhenTheArchivesReaderHasGone) {
    BrokenArchive broken;
    script("echo $3 >>" + archive_.dir / "calls" + "; control 10 $3; printf 0123456789");
    pid_t pids[] = {getpid(), getppid()};
    testing::internal::CaptureStderr();
    snapshot_processes(broken.tw, broken.fd.get(), pids, 2);
    EXPECT_EQ("ABORT!\n", testing::internal::GetCapturedStderr());
    EXPECT_EQ(std::to_string(getpid()) + "\n", read_whole_file(archive_.dir / "calls"));
    tar_close(archive_.tw);
}

TEST_F(Snapshot, EndsTheLoopWhenTheArchivesReaderGoesAwayInTheMidstOfACore) {
    signal(SIGPIPE, SIG_IGN);
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    const pid_t reader = fork();
    if (reader == 0) {
        char bytes[1000];
        close(ends[1]);
        for (int i = 0; i < 200; ++i)
            (void)!read(ends[0], bytes, sizeof bytes);
        _exit(0);
    }
    close(ends[0]);
    const UniqueFd out(ends[1]);
    TarWriter *tw = tar_open(out.get(), nullptr);
    script("echo $3 >>" + archive_.dir / "calls" + "; control 1000000; head -c 1000000 /dev/zero");
    pid_t pids[] = {getpid(), getppid()};
    testing::internal::CaptureStderr();
    snapshot_processes(tw, out.get(), pids, 2);
    EXPECT_EQ("ABORT!\n", testing::internal::GetCapturedStderr());
    EXPECT_EQ(std::to_string(getpid()) + "\n", read_whole_file(archive_.dir / "calls"));
    tar_abandon(tw);
    tar_close(archive_.tw);
    waitpid(reader, nullptr, 0);
}

TEST_F(Snapshot, HasNoCoreOfALengthThatNoHeaderCanAnnounce) {
    script("control 8589934592 $3; printf abc");
    EXPECT_EQ(0, take({getpid()}));
    EXPECT_EQ(0u, archive_.close().size());
}

TEST_F(Snapshot, ReportsABrokenOutputAsEpipe) {
    BrokenArchive broken;
    script("control 10 $3; head -c 1000000 /dev/zero");
    pid_t pid = getpid();
    testing::internal::CaptureStderr();
    EXPECT_EQ(32, snapshot_process(broken.tw, broken.fd.get(), &pid, 0, 1));
    testing::internal::GetCapturedStderr();
    tar_close(archive_.tw);
}

TEST_F(Snapshot, LeavesNoDescriptorOrChildBehind) {
    script("control 3 $3; printf abc");
    take({getpid()});
    int next = dup(0);
    close(next);
    for (int i = 0; i < 5; ++i)
        take({getpid()});
    int after = dup(0);
    close(after);
    EXPECT_EQ(next, after);
    EXPECT_EQ(-1, waitpid(-1, nullptr, WNOHANG));
    archive_.close();
}

TEST_F(Snapshot, SurvivesATableOfDescriptorsThatIsFull) {
    script("control 3 $3; printf abc");
    rlimit before;
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &before));
    int next = dup(0);
    close(next);
    testing::internal::CaptureStderr();
    for (rlim_t spare = 0; spare < 6; ++spare) {
        rlimit tight = {static_cast<rlim_t>(next) + spare, before.rlim_max};
        ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &tight));
        pid_t pid = getpid();
        EXPECT_EQ(0, snapshot_process(archive_.tw, archive_.fd.get(), &pid, 0, 1));
    }
    setrlimit(RLIMIT_NOFILE, &before);
    std::string errors = testing::internal::GetCapturedStderr();
    EXPECT_EQ(0u, errors.find("pipes: Too many open files\n")) << errors;
    archive_.close();
}

TEST_F(Snapshot, DumpCoreToFdCopiesTheCoreAlone) {
    script("control 3 $3; printf abcdef");
    testing::internal::CaptureStderr();
    EXPECT_EQ(0, dump_core_to_fd(archive_.fd.get(), getpid()));
    EXPECT_EQ("", testing::internal::GetCapturedStderr());
    EXPECT_EQ("abcdef", archive_.bytes());
    tar_close(archive_.tw);
}

TEST_F(Snapshot, DumpCoreToFdTellsOfAFailure) {
    script("exit 1");
    testing::internal::CaptureStderr();
    EXPECT_EQ(0, dump_core_to_fd(archive_.fd.get(), 4711));
    EXPECT_EQ("dump error for pid 4711\n", testing::internal::GetCapturedStderr());
    tar_close(archive_.tw);
}

TEST_F(Snapshot, TheWriterHasNoEnvironment) {
    script("control 3 $3; env | grep -v -e ^PWD= -e ^_= -e ^SHLVL= >" + archive_.dir / "env" +
           "; printf abc");
    take({getpid()});
    EXPECT_EQ("", read_whole_file(archive_.dir / "env"));
    archive_.close();
}

}  // namespace
