#include "rtrace/df_table.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

#include "support/guarded_buffer.h"
#include "support/rtrace_stream.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

const char HEADING[] = "Filesystem          \tUsed\tAvail\tMounted on\n";

std::string line_of(const char *source, const FilesystemFigures &figures, const char *mount_point) {
    char line[512];
    format_df_line(line, sizeof line, source, figures, mount_point);
    return line;
}

// What a table of `mounts`, in the form of /proc/mounts, is sent as; without a file for null.
std::string table_of(const char *mounts) {
    TempDir dir;
    dir.file("stream", "");
    const std::string path = mounts != nullptr ? dir.file("mounts", mounts) : dir / "none";
    RecordStream stream = {.fd = open((dir / "stream").c_str(), O_WRONLY | O_CLOEXEC)};
    EXPECT_TRUE(send_df_table(&stream, 9, path.c_str()));
    close(stream.fd);
    const RtraceTestStream parsed = parse_rtrace(read_whole_file(dir / "stream"));
    EXPECT_EQ("", parsed.rest);
    EXPECT_EQ(1U, parsed.records.size()) << "there is no end record";
    if (parsed.records.empty())
        return "";
    EXPECT_EQ(9U, parsed.records[0].type);
    EXPECT_EQ(0U, parsed.records[0].flag);
    return parsed.records[0].payload;
}

// The last column, without its heading.
std::string mount_points(const std::string &table) {
    std::string found;
    size_t at = table.find('\n') + 1;
    while (at < table.size()) {
        const size_t end = table.find('\n', at);
        const std::string line = table.substr(at, end - at);
        found += line.substr(line.rfind('\t') + 1) + " ";
        at = end + 1;
    }
    return found;
}

TEST(DfHeading, Has43Characters) {
    char heading[64];
    EXPECT_EQ(43, format_df_heading(heading, sizeof heading));
    EXPECT_STREQ(HEADING, heading);
}

TEST(DfLine, ShowsUsedAndAvailableInKib) {
    EXPECT_EQ("/dev/sda1           \t3000\t800\t/data\n",
              line_of("/dev/sda1", {4096, 1000, 250, 200}, "/data"));
}

TEST(DfLine, RoundsDown) {
    EXPECT_EQ("a                   \t1\t0\t/\n", line_of("a", {512, 10, 7, 1}, "/"));
}

TEST(DfLine, ALongSourcePushesTheColumns) {
    EXPECT_EQ("/dev/mapper/a-longer-name\t0\t0\t/\n",
              line_of("/dev/mapper/a-longer-name", {4096, 0, 0, 0}, "/"));
}

TEST(DfLine, FiguresWrapAt4Gib) {
    EXPECT_EQ("a                   \t4194303\t0\t/\n",
              line_of("a", {1024, 5000000, 5000000 - 4194303, 4194304}, "/"));
    // 6 and 9 GiB
    EXPECT_EQ("a                   \t2097152\t1048576\t/\n",
              line_of("a", {4096, 10000000, 10000000 - 1572864, 2359296}, "/"));
    // 3 GiB do not wrap: all 32 bits of the bytes count.
    EXPECT_EQ("a                   \t3145728\t4194300\t/\n",
              line_of("a", {4096, 786432, 0, 1048575}, "/"));
}

TEST(DfLine, IsCutToItsRoom) {
    expect_prefix_at_every_size("a                   \t4\t0\t/mnt\n", [](char *buf, size_t size) {
        return format_df_line(buf, size, "a", {4096, 1, 0, 0}, "/mnt");
    });
    expect_prefix_at_every_size(HEADING, format_df_heading);
}

TEST(DfLists, LeavesOutNetworkFileSystems) {
    EXPECT_FALSE(df_lists("server:/share", "nfs"));
    EXPECT_FALSE(df_lists(":", "ext4"));
    EXPECT_FALSE(df_lists("/dev/disk/by-path/pci-0:1", "ext4"));
    EXPECT_FALSE(df_lists("//server/share", "cifs"));
    EXPECT_FALSE(df_lists("//server/share", "smbfs"));
    EXPECT_FALSE(df_lists("//", "cifs"));
}

TEST(DfLists, TakesTheSameSourceWithAnotherTypeForALocalOne) {
    EXPECT_TRUE(df_lists("//server/share", "fuse"));
    EXPECT_TRUE(df_lists("//server/share", "cifs2"));
    EXPECT_TRUE(df_lists("//server/share", "smb3"));
    EXPECT_TRUE(df_lists("/server/share", "cifs"));
    EXPECT_TRUE(df_lists("share//", "cifs"));
    EXPECT_TRUE(df_lists("/dev/root", "ext4"));
    EXPECT_TRUE(df_lists("", ""));
}

TEST(SendDfTable, ListsWhatIsMountedWithTheKernelsFigures) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_shell("mount -t tmpfs -o size=1m,mode=0700 tmpfs " + dir.path());
        dir.file("file", std::string(40960, 'x'));
        EXPECT_EQ(
            std::string(HEADING) + "tmpfs               \t40\t984\t" + dir.path() +
                "\nproc                \t0\t0\t/proc\n",
            table_of(("tmpfs " + dir.path() + " tmpfs rw 0 0\n" + "proc /proc proc rw,nosuid 0 0\n")
                         .c_str()));
        sandbox_shell("umount " + dir.path());
    });
}

TEST(SendDfTable, LeavesOutACifsShareAndListsTheSameSourceWithAnotherType) {
    EXPECT_EQ("/proc ", mount_points(table_of("//server/share /sys cifs rw 0 0\n"
                                              "//server/share /proc fuse rw 0 0\n"
                                              "//server/share / smbfs rw 0 0\n"
                                              "server:/share / nfs rw 0 0\n")));
}

TEST(SendDfTable, LeavesOutWhatTheKernelHasNoFiguresFor) {
    EXPECT_EQ("/proc ", mount_points(table_of("a /does/not/exist ext4 rw 0 0\n"
                                              "b /proc proc rw 0 0\n")));
}

TEST(SendDfTable, TakesWrittenBlanksInMountPointsForBlanks) {
    TempDir dir;
    dir.file("a b/file", "");
    const std::string written = dir.path() + "/a\\040b";
    EXPECT_EQ(dir.path() + "/a b ",
              mount_points(table_of(("x " + written + " t rw 0 0\n").c_str())));
}

TEST(SendDfTable, IsTheHeadingAloneWhenNothingIsMounted) {
    EXPECT_EQ(HEADING, table_of(""));
    EXPECT_EQ(HEADING, table_of(nullptr));
}

TEST(SendDfTable, IsCutAt204800Bytes) {
    std::string mounts, expected = HEADING;
    for (int i = 0; i < 9000; ++i) {
        mounts += "x /proc t rw 0 0\n";
        expected += "x                   \t0\t0\t/proc\n";
    }
    const std::string table = table_of(mounts.c_str());
    EXPECT_EQ(204800U, table.size());
    EXPECT_TRUE(expected.substr(0, 204800) == table);
}

TEST(SendDfTable, FailsWhenTheReaderHasGone) {
    signal(SIGPIPE, SIG_IGN);
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    close(ends[0]);
    RecordStream stream = {.fd = ends[1]};
    EXPECT_FALSE(send_df_table(&stream, 9, "/proc/mounts"));
    close(ends[1]);
}

}  // namespace
