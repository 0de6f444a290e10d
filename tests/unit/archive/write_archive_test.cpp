#include "archive/write_archive.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <string>

#include "archive/gzip_stream.h"
#include "archive/process_snapshot.h"
#include "archive_file.h"
#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

TEST(WriteArchive, NumbersTheArchivesOfOneProcessWhetherCompressedOrNot) {
    run_in_sandbox([] {
        TempDir dir;
        set_core_program("/nonexistent", -1);
        UniqueFd plain(open((dir / "0.tar").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        UniqueFd compressed(open((dir / "1.tgz").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        write_archive_tar(plain.get());
        write_archive_gz(compressed.get());
        std::vector<TarMember> members = read_tar(read_whole_file(dir / "0.tar"));
        ASSERT_FALSE(members.empty());
        EXPECT_EQ("-c0/", members[0].name.substr(21, 4));
        RunResult first =
            run_program({"/bin/sh", "-c", "gzip -dc " + dir / "1.tgz" + " | head -c 100"});
        EXPECT_EQ("-c1/", first.out.substr(21, 4));
        EXPECT_EQ(-1, waitpid(-1, nullptr, WNOHANG)) << "every child is reaped";
    });
}

TEST(WriteArchive, LeavesStandardOutputOpenInTheCompressorWhenItIsTheArchive) {
    run_in_sandbox([] {
        TempDir dir;
        pid_t pid = fork();
        if (pid == 0) {
            set_core_program("/nonexistent", -1);
            dup2(open((dir / "a.tgz").c_str(), O_WRONLY | O_CREAT, 0600), 1);
            write_archive_gz(1);
            _exit(0);
        }
        int status;
        waitpid(pid, &status, 0);
        EXPECT_EQ(0, status);
        RunResult names =
            run_program({"/bin/sh", "-c", "gzip -dc " + dir / "a.tgz" + " | head -c 6"});
        EXPECT_EQ("debug-", names.out);
    });
}

TEST(WriteArchive, OfACaptureThatIsNotAllowedEndsBehindItsHeaderWithNothingMore) {
    run_in_sandbox([] {
        TempDir dir;
        set_core_program("/nonexistent", -1);
        UniqueFd out(open((dir / "a.tar").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        pid_t pid = fork();
        if (pid == 0) {
            if (setuid(65534) != 0)
                _exit(77);
            write_archive_tar(out.get());
            _exit(0);
        }
        int status;
        waitpid(pid, &status, 0);
        if (WEXITSTATUS(status) == 77)
            GTEST_SKIP() << "no second user to be here";
        ASSERT_EQ(0, status);
        std::string stream = read_whole_file(dir / "a.tar");
        ASSERT_GT(stream.size(), 512u);
        std::string last = stream.substr(stream.size() - 512);
        EXPECT_EQ("netdump.cap", std::string(last.c_str()).substr(25));
        EXPECT_EQ(0u, stream.size() % 512);
    });
}

}  // namespace
