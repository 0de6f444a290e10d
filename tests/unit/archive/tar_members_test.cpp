#include "archive/tar_members.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <string>

#include "archive_file.h"
#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

TEST(TarAddFile, AddsAFileOfAnySize) {
    ArchiveFile archive;
    for (size_t size : {0, 1, 512, 40000}) {
        std::string path = archive.dir.file("source", std::string(size, 's'));
        EXPECT_EQ(0, tar_add_file(archive.tw, archive.fd.get(), std::to_string(size).c_str(),
                                  path.c_str()));
    }
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(4u, members.size());
    EXPECT_EQ("top/0", members[0].name);
    EXPECT_EQ("", members[0].data);
    EXPECT_EQ("s", members[1].data);
    EXPECT_EQ("", members[2].padding);
    EXPECT_EQ(std::string(40000, 's'), members[3].data);
}

TEST(TarAddFile, AddsAMemberOfZeroBytesWithAHeaderAndNoData) {
    ArchiveFile archive;
    std::string path = archive.dir.file("source", "");
    EXPECT_EQ(0, tar_add_file(archive.tw, archive.fd.get(), "a", path.c_str()));
    tar_close(archive.tw);
    EXPECT_EQ(512u, archive.bytes().size());
    EXPECT_EQ("00000000000", archive.bytes().substr(124, 11));
}

TEST(TarAddFile, LeavesAMissingFileOut) {
    ArchiveFile archive;
    EXPECT_EQ(0, tar_add_file(archive.tw, archive.fd.get(), "a", (archive.dir / "none").c_str()));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(TarAddFile, SaysWhenTheOutputIsBroken) {
    BrokenArchive archive;
    TempDir dir;
    EXPECT_EQ(1, tar_add_file(archive.tw, archive.fd.get(), "a", dir.file("a", "text").c_str()));
}

TEST(TarAddFile, FillsUpAFileThatShrankButPadsByWhatWasCopied) {
    ArchiveFile archive;
    UniqueFd source(open(archive.dir.file("source", "0123456789").c_str(), O_RDONLY));
    EXPECT_EQ(0, tar_add_open_file(archive.tw, archive.fd.get(), "a", source.get(), 600, true));
    tar_header(archive.tw, "b", 0);
    std::string bytes = archive.bytes();
    // 600 bytes of data, and padding as if there had been 10.
    EXPECT_EQ("0123456789" + std::string(590, '\0'), bytes.substr(512, 600));
    EXPECT_EQ(512u + 600u + 502u + 512u, bytes.size());
    EXPECT_EQ("top/b", std::string(bytes.substr(512 + 600 + 502).c_str()));
    tar_close(archive.tw);
}

TEST(TarAddFile, CopiesAFileThatGrewToItsEnd) {
    ArchiveFile archive;
    UniqueFd source(open(archive.dir.file("source", "0123456789").c_str(), O_RDONLY));
    EXPECT_EQ(0, tar_add_open_file(archive.tw, archive.fd.get(), "a", source.get(), 4, true));
    EXPECT_EQ("0123456789", archive.bytes().substr(512));
    EXPECT_EQ(10u, archive.tw->member_bytes);
    tar_close(archive.tw);
}

TEST(TarAddOpenFile, StartsAtTheBeginningAndFillsOnlyWhenAsked) {
    ArchiveFile archive;
    UniqueFd source(open(archive.dir.file("source", "0123456789").c_str(), O_RDONLY));
    (void)lseek(source.get(), 5, SEEK_SET);
    EXPECT_EQ(0, tar_add_open_file(archive.tw, archive.fd.get(), "a", source.get(), 20, false));
    EXPECT_EQ("0123456789", archive.bytes().substr(512));
    tar_close(archive.tw);
}

TEST(TarAddSmallFile, CutsAFileOf150000BytesTo102400) {
    ArchiveFile archive;
    std::string path = archive.dir.file("source", std::string(150000, 's'));
    EXPECT_EQ(0, tar_add_small_file(archive.tw, archive.fd.get(), "a", path.c_str(), 0));
    EXPECT_EQ(0, tar_add_small_file(archive.tw, archive.fd.get(), "b", path.c_str(), 1000));
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(2u, members.size());
    EXPECT_EQ(std::string(102400, 's'), members[0].data);
    EXPECT_EQ(std::string(1000, 's'), members[1].data);
}

// What tar_add_small_file prints on standard error for `path`.
std::string complaint(ArchiveFile &archive, const std::string &path) {
    testing::internal::CaptureStderr();
    EXPECT_EQ(0, tar_add_small_file(archive.tw, archive.fd.get(), "a", path.c_str(), 0));
    return testing::internal::GetCapturedStderr();
}

TEST(TarAddSmallFile, SkipsEmptyFilesAndDirectoriesSilently) {
    ArchiveFile archive;
    EXPECT_EQ("", complaint(archive, archive.dir.file("empty", "")));
    EXPECT_EQ("", complaint(archive, archive.dir.path()));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(TarAddSmallFile, NamesAFileThatCannotBeRead) {
    ArchiveFile archive;
    EXPECT_EQ("/nonexistent: Bad file descriptor\n", complaint(archive, "/nonexistent"));
    EXPECT_EQ("/proc/self/mem: Input/output error\n", complaint(archive, "/proc/self/mem"));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(TarAddSmallFile, NamesAProcFileWhoseReadFailsWithEinval) {
    // An interface of security modules; the kernel says EINVAL where there is none.
    char byte;
    UniqueFd probe(open("/proc/self/attr/prev", O_RDONLY));
    if (!probe.valid() || read(probe.get(), &byte, 1) != -1 || errno != EINVAL)
        GTEST_SKIP() << "this kernel has no file whose read fails with EINVAL";
    ArchiveFile archive;
    EXPECT_EQ("/proc/self/attr/prev: Invalid argument\n",
              complaint(archive, "/proc/self/attr/prev"));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(TarAddSmallFile, NamesAFileThatMayNotBeOpened) {
    run_in_sandbox([] {
        ArchiveFile archive;
        std::string path = archive.dir.file("secret", "text", 0);
        ASSERT_EQ(0, chmod(archive.dir.path().c_str(), 0755));
        pid_t pid = fork();
        if (pid == 0) {
            if (setuid(65534) != 0)
                _exit(77);
            EXPECT_EQ(path + ": Bad file descriptor\n", complaint(archive, path));
            _exit(testing::Test::HasFailure());
        }
        int status;
        waitpid(pid, &status, 0);
        if (WEXITSTATUS(status) == 77)
            GTEST_SKIP() << "no second user to be here";
        EXPECT_EQ(0, status);
        EXPECT_EQ(0u, archive.close().size());
    });
}

TEST(TarAddSmallFile, ReadsProcFilesWhoseSizeIsNotKnown) {
    ArchiveFile archive;
    EXPECT_EQ(0, tar_add_small_file(archive.tw, archive.fd.get(), "a", "/proc/self/status", 0));
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(1u, members.size());
    EXPECT_EQ("Name:\tunit_archive\n", members[0].data.substr(0, 19));
}

int add_shell_output(ArchiveFile &archive, const char *command, char *name_template) {
    const char *argv[] = {"/bin/sh", "-c", command, nullptr};
    return add_command_output(archive.tw, archive.fd.get(), "output", const_cast<char **>(argv),
                              name_template);
}

TEST(AddCommandOutput, HoldsOutputAndErrorsWhateverTheExitCode) {
    ArchiveFile archive;
    char name[] = "/tmp/.testXXXXXX";
    EXPECT_EQ(0, add_shell_output(archive, "echo out; echo err >&2; exit 3", name));
    EXPECT_NE(0, access(name, F_OK)) << "the temporary file must not be left";
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(1u, members.size());
    EXPECT_EQ("top/output", members[0].name);
    EXPECT_EQ("out\nerr\n", members[0].data);
}

TEST(AddCommandOutput, IsNoOtherDescriptorOfTheCommandThanItsStandardOnes) {
    ArchiveFile archive;
    char name[] = "/tmp/.testXXXXXX";
    EXPECT_EQ(0, add_shell_output(archive, "ls -l /proc/$$/fd | grep -c '/tmp/.test'", name));
    EXPECT_EQ("2\n", archive.close().at(0).data);
}

TEST(AddCommandOutput, OfAProgramThatDoesNotExistHoldsTheReason) {
    ArchiveFile archive;
    char name[] = "/tmp/.testXXXXXX";
    const char *argv[] = {"/nonexistent", nullptr};
    EXPECT_EQ(0, add_command_output(archive.tw, archive.fd.get(), "output",
                                    const_cast<char **>(argv), name));
    EXPECT_EQ("execve: No such file or directory\n", archive.close().at(0).data);
}

TEST(AddCommandOutput, WithoutATemporaryFileRunsTheCommandAndAddsNothing) {
    ArchiveFile archive;
    char name[] = "/nonexistent/XXXXXX";
    std::string mark = archive.dir / "ran";
    EXPECT_EQ(0, add_shell_output(archive, (": >" + mark).c_str(), name));
    EXPECT_EQ(0, access(mark.c_str(), F_OK));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(AddCommandOutput, SaysWhenTheOutputIsBroken) {
    BrokenArchive archive;
    char name[] = "/tmp/.testXXXXXX";
    const char *argv[] = {"/bin/echo", "text", nullptr};
    EXPECT_EQ(1, add_command_output(archive.tw, archive.fd.get(), "output",
                                    const_cast<char **>(argv), name));
}

}  // namespace
