#include "cgi/spool.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "cgi/dump_listener.h"
#include "client_pair.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/system_log.h"
#include "support/temp_dir.h"

namespace {

// The entries of a folder in the order of the directory.
std::vector<std::string> entries(const std::string &path) {
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(path))
        names.push_back(entry.path().filename());
    return names;
}

// One look at the spool; whether it found that nothing is left.
bool look(const std::string &dir) {
    bool drained = false;
    check_dumps(dir.c_str(), &drained);
    return drained;
}

// One look while a client waits, and what that gets.
std::string look_for_client(const std::string &dir, bool *drained) {
    ClientPair pair;
    set_dump_listener(pair.release_server());
    check_dumps(dir.c_str(), drained);
    return pair.reply();
}

std::string complaint_of_look(const std::string &dir, bool *drained) {
    testing::internal::CaptureStderr();
    check_dumps(dir.c_str(), drained);
    return testing::internal::GetCapturedStderr();
}

std::string download(const std::string &name, const std::string &contents) {
    return ok_header("application/octet-stream", name) + contents;
}

TEST(Spool, AnEmptyOneIsDrained) {
    TempDir dir;
    EXPECT_TRUE(look(dir.path()));
}

TEST(Spool, OneThatDoesNotExistIsSilentlyLookedAtAgain) {
    TempDir dir;
    bool drained = false;
    EXPECT_EQ("", complaint_of_look(dir / "none", &drained));
    EXPECT_FALSE(drained);
}

TEST(Spool, OneThatIsNoFolderIsComplainedOf) {
    TempDir dir;
    bool drained = false;
    EXPECT_EQ("check_dumps: Not a directory\n", complaint_of_look(dir.file("file", ""), &drained));
    EXPECT_FALSE(drained);
}

TEST(Spool, TheFirstEntryInTheOrderOfTheDirectoryIsSentAndRemoved) {
    TempDir dir;
    for (const char *name : {"b", "a", "d", "c"})
        dir.file(std::string("dumps/") + name, std::string("dump ") + name);
    for (int left = 4; left > 0; --left) {
        std::vector<std::string> before = entries(dir / "dumps");
        bool drained = false;
        EXPECT_EQ(download(before[0], "dump " + before[0]),
                  look_for_client(dir / "dumps", &drained));
        before.erase(before.begin());
        EXPECT_EQ(before, entries(dir / "dumps"));
        // Whether the last look has drained it is up to where "." and ".." stand.
        EXPECT_FALSE(drained && left > 1);
    }
    EXPECT_TRUE(look(dir / "dumps"));
}

TEST(Spool, WithoutAClientTheEntryStaysAndTheLogSaysSo) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        dir.file("dumps/kept", "material");
        EXPECT_FALSE(look(dir / "dumps"));
        LogLine line = log.read_line();
        EXPECT_EQ("Failed to send dump: kept", line.message);
        EXPECT_EQ(3, line.priority & 7);
        EXPECT_EQ("material", read_whole_file(dir / "dumps/kept"));
        bool drained = false;
        EXPECT_EQ(download("kept", "material"), look_for_client(dir / "dumps", &drained));
        EXPECT_EQ(std::vector<std::string>{}, entries(dir / "dumps"));
        EXPECT_TRUE(log.read_lines().empty());
    });
}

TEST(Spool, WithoutAFolderTheLogSaysSo) {
    run_in_sandbox([] {
        SystemLog log;
        bool drained = false;
        check_dumps(nullptr, &drained);
        EXPECT_FALSE(drained);
        LogLine line = log.read_line();
        EXPECT_EQ("Invalid dump directory", line.message);
        EXPECT_EQ(3, line.priority & 7);
    });
}

TEST(Spool, AFileThatAClientDoesNotTakeWholeStays) {
    run_in_sandbox([] {
        signal(SIGPIPE, SIG_IGN);
        SystemLog log;
        TempDir dir;
        dir.file("dumps/kept", "material");
        ClientPair pair;
        set_dump_listener(pair.release_server());
        pair.close_client();
        EXPECT_FALSE(look(dir / "dumps"));
        EXPECT_EQ("Failed to send dump: kept", log.read_line().message);
        EXPECT_EQ("material", read_whole_file(dir / "dumps/kept"));
    });
}

TEST(Spool, AnUnreadableEntryIsComplainedOfAndStays) {
    TempDir dir;
    mkdir((dir / "dumps").c_str(), 0755);
    ASSERT_EQ(0, symlink("nowhere", (dir / "dumps/link").c_str()));
    ClientPair pair;
    set_dump_listener(pair.release_server());
    bool drained = false;
    EXPECT_EQ("check_dumps: No such file or directory\n",
              complaint_of_look(dir / "dumps", &drained));
    EXPECT_FALSE(drained);
    EXPECT_EQ(std::vector<std::string>{"link"}, entries(dir / "dumps"));
    // The client goes on waiting.
    EXPECT_TRUE(pair.is_waiting());
    EXPECT_EQ(1, send_dump(-1, "core"));
}

TEST(Spool, AFifoHoldsNobody) {
    TempDir dir;
    mkdir((dir / "dumps").c_str(), 0755);
    ASSERT_EQ(0, mkfifo((dir / "dumps/fifo").c_str(), 0644));
    bool drained = false;
    EXPECT_EQ(download("fifo", ""), look_for_client(dir / "dumps", &drained));
    EXPECT_EQ(std::vector<std::string>{}, entries(dir / "dumps"));
}

TEST(Spool, AFolderInItCannotBeSentAndStays) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        dir.file("dumps/folder/file", "");
        bool drained = false;
        EXPECT_EQ(download("folder", ""), look_for_client(dir / "dumps", &drained));
        EXPECT_FALSE(drained);
        EXPECT_EQ("Failed to send dump: folder", log.read_line().message);
        EXPECT_EQ(std::vector<std::string>{"folder"}, entries(dir / "dumps"));
    });
}

TEST(Spool, AnEntryThatCannotBeRemovedIsComplainedOf) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("dumps/dump", "material");
        // What something is mounted on is busy in its own namespace, even for root.
        sandbox_bind(dir / "dumps/dump", dir / "dumps/dump");
        ClientPair pair;
        set_dump_listener(pair.release_server());
        bool drained = false;
        EXPECT_EQ("check_dumps: Device or resource busy\n",
                  complaint_of_look(dir / "dumps", &drained));
        EXPECT_EQ(download("dump", "material"), pair.reply());
        EXPECT_FALSE(drained);
        EXPECT_EQ("material", read_whole_file(dir / "dumps/dump"));
    });
}

TEST(Spool, TheNameOfAFileCannotForgeAHeader) {
    TempDir dir;
    dir.file("dumps/x\"\r\nSet-Cookie: a=b\r\n\x7f", "material");
    bool drained = false;
    EXPECT_EQ(download("x___Set-Cookie: a=b___", "material"),
              look_for_client(dir / "dumps", &drained));
}

TEST(Spool, ALookLeavesNoDescriptorBehind) {
    TempDir dir;
    dir.file("dumps/one", "1");
    const size_t before = entries("/proc/self/fd").size();
    bool drained = false;
    (void)look(dir / "dumps");
    (void)look_for_client(dir / "dumps", &drained);
    (void)look(dir / "dumps");
    (void)look(dir / "none");
    (void)complaint_of_look(dir.file("file", ""), &drained);
    EXPECT_EQ(before, entries("/proc/self/fd").size());
}

}  // namespace
