#include "archive/write_archive.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "archive/gzip_stream.h"
#include "archive/process_snapshot.h"
#include "archive_file.h"
#include "support/gunzip.h"
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

// Runs `write` in a child process of a user who has no rights. Returns whether there is one to be.
bool run_without_rights(const std::function<void()> &write) {
    constexpr int NO_USER = 77;
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(30);
        if (setuid(65534) != 0)
            _exit(NO_USER);
        write();
        _exit(0);
    }
    int status = -1;
    waitpid(pid, &status, 0);
    if (WIFEXITED(status) && WEXITSTATUS(status) == NO_USER)
        return false;
    EXPECT_EQ(0, status);
    return true;
}

TEST(WriteArchive, OfACaptureThatIsNotAllowedEndsBehindItsHeaderWithNothingMore) {
    run_in_sandbox([] {
        TempDir dir;
        set_core_program("/nonexistent", -1);
        UniqueFd out(open((dir / "a.tar").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        if (!run_without_rights([&] { write_archive_tar(out.get()); }))
            GTEST_SKIP() << "no second user to be here";
        std::string stream = read_whole_file(dir / "a.tar");
        ASSERT_GT(stream.size(), 512u);
        std::string last = stream.substr(stream.size() - 512);
        EXPECT_EQ("netdump.cap", std::string(last.c_str()).substr(25));
        EXPECT_EQ(0u, stream.size() % 512);
    });
}

TEST(WriteArchive, OfAProcThatCannotBeReadEndsBehindTheConfigurationWithNoPadding) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("media.conf", "[media]\n");
        sandbox_bind(dir / "media.conf", "/etc/ws/onvif/media/media.conf");
        UniqueFd plain(open((dir / "a.tar").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        UniqueFd compressed(open((dir / "a.tgz").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        TempDir closed;
        ASSERT_EQ(0, chmod(closed.path().c_str(), 0));
        sandbox_bind(closed.path(), "/proc");
        if (!run_without_rights([&] { write_archive_tar(plain.get()); }))
            GTEST_SKIP() << "no second user to be here";
        std::string stream = read_whole_file(dir / "a.tar");
        ASSERT_EQ(512u + 8, stream.size());
        EXPECT_EQ("media.conf", std::string(stream.c_str()).substr(25));
        EXPECT_EQ("[media]\n", stream.substr(512));

        // The compressor ends, too, although it cannot find out which descriptors it has.
        run_without_rights([&] {
            be_an_old_kernel();
            write_archive_gz(compressed.get());
        });
        EXPECT_EQ(512u + 8, gunzip(read_whole_file(dir / "a.tgz")).size());
    });
}

}  // namespace
