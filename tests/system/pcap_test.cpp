// The applet pcapdump, run as a user would.
#include <errno.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/packets.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true};

std::string global_header() {
    return from_hex("d4c3b2a1 0200 0400 00000000 00000000 ffff0000 01000000");
}

off_t size_of(const std::string &path) {
    struct stat status;
    return stat(path.c_str(), &status) == 0 ? status.st_size : -1;
}

mode_t permissions_of(const std::string &path) {
    struct stat status = {};
    EXPECT_EQ(0, stat(path.c_str(), &status));
    return status.st_mode & 07777;
}

void expect_size_reached(const std::string &path, off_t size) {
    EXPECT_TRUE(wait_until([&] { return size_of(path) >= size; }))
        << size_of(path) << " of " << size << " bytes";
}

void expect_silent_end(Background *dump) {
    RunResult result = dump->wait();
    EXPECT_EQ(0, result.exit_status) << result.signal;
    EXPECT_EQ("", result.out);
    EXPECT_EQ("", result.err);
}

std::vector<std::string> pcapdump(const std::string &interface, const std::string &path) {
    return {fieldkit_path(), "pcapdump", interface, path};
}

}  // namespace

TEST(Pcapdump, PrintsItsUsageWhenAnArgumentIsMissing) {
    for (const std::vector<std::string> &args :
         {std::vector<std::string>{"pcapdump"}, std::vector<std::string>{"pcapdump", "eth0"}}) {
        RunResult result = run_fieldkit(args);
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("USAGE: pcapdump netif dumpname\n", result.out);
        EXPECT_EQ("", result.err);
    }
}

TEST(Pcapdump, NamesAFileThatCannotBeMade) {
    TempDir dir;
    RunResult result = run_fieldkit({"pcapdump", "eth0", dir / "missing/dump"});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ(dir / "missing/dump: No such file or directory\n", result.err);
    result = run_fieldkit({"pcapdump", "eth0", dir.path()});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ(dir.path() + ": Is a directory\n", result.err);
}

TEST(Pcapdump, RecordsFramesOfTheInterfaceUntilItGoesDown) {
    run_in_sandbox(
        [] {
            TempDir dir;
            const std::string path = dir / "dump";
            RunOptions options;
            options.before_exec = [] { umask(0); };
            Background dump(pcapdump("eth0", path), options);
            expect_size_reached(path, 24);
            EXPECT_TRUE(is_link_promiscuous("eth0"));
            const std::vector<std::string> frames = {test_frame(14, 'a'), test_frame(60, 'b'),
                                                     test_frame(1514, 'c')};
            for (const std::string &frame : frames)
                send_frame("eth1", frame);
            expect_size_reached(path, 24 + 3 * 16 + 14 + 60 + 1514);
            // A reader always finds whole records.
            PcapTestStream parsed = parse_pcap(read_whole_file(path));
            EXPECT_EQ(global_header(), parsed.header);
            EXPECT_EQ("", parsed.rest);
            EXPECT_EQ(frames, frames_of(read_whole_file(path)));
            for (const PcapTestRecord &record : parsed.records) {
                EXPECT_EQ(record.data.size(), record.captured_length);
                EXPECT_EQ(record.data.size(), record.original_length);
            }

            set_link_up("eth0", false);
            expect_silent_end(&dump);
            EXPECT_EQ(24 + 3 * 16 + 14 + 60 + 1514, size_of(path));
            EXPECT_FALSE(is_link_promiscuous("eth0"));
            EXPECT_EQ(0600u, permissions_of(path));
        },
        WITH_ETH0);
}

TEST(Pcapdump, ReplacesWhatWasInTheFileAndKeepsItsMode) {
    run_in_sandbox(
        [] {
            TempDir dir;
            const std::string path = dir.file("dump", std::string(5000, 'o'), 0644);
            Background dump(pcapdump("eth0", path));
            ASSERT_TRUE(wait_until([&] { return size_of(path) == 24; }));
            EXPECT_EQ(global_header(), read_whole_file(path));
            set_link_up("eth0", false);
            expect_silent_end(&dump);
            EXPECT_EQ(0644u, permissions_of(path));
        },
        WITH_ETH0);
}

TEST(Pcapdump, CapturesOnAllInterfacesForAnUnknownName) {
    run_in_sandbox(
        [] {
            TempDir dir;
            const std::string path = dir / "dump";
            Background dump(pcapdump("nosuch", path));
            expect_size_reached(path, 24);
            send_frame("eth1", test_frame(60, 'x'));
            // As eth1 sent it and as eth0 received it.
            expect_size_reached(path, 24 + 2 * 76);
            EXPECT_EQ((std::vector<std::string>{test_frame(60, 'x'), test_frame(60, 'x')}),
                      frames_of(read_whole_file(path)));
            EXPECT_FALSE(is_link_promiscuous("eth0"));
            dump.send_signal(SIGTERM);
            RunResult result = dump.wait();
            EXPECT_EQ(SIGTERM, result.signal);
            EXPECT_EQ("", result.out + result.err);
        },
        WITH_ETH0);
}

TEST(Pcapdump, SucceedsEvenWhenNothingCanBeWritten) {
    run_in_sandbox(
        [] {
            Background dump(pcapdump("eth0", "/dev/full"));
            expect_silent_end(&dump);
            EXPECT_FALSE(is_link_promiscuous("eth0"));
        },
        WITH_ETH0);
}

TEST(Pcapdump, SucceedsEvenWithoutAPacketSocket) {
    run_in_sandbox(
        [] {
            TempDir dir;
            RunOptions options;
            options.leak_check = false;
            options.before_exec = [] {
                // Enough for the standard streams and the file.
                const rlimit four = {.rlim_cur = 4, .rlim_max = 4};
                setrlimit(RLIMIT_NOFILE, &four);
            };
            Background dump(pcapdump("eth0", dir / "dump"), options);
            expect_silent_end(&dump);
            EXPECT_EQ(0, size_of(dir / "dump"));
        },
        WITH_ETH0);
}

TEST(Pcapdump, WritesWhatAnOrdinaryReaderUnderstands) {
    run_in_sandbox(
        [] {
            if (run_program({"/bin/sh", "-c", "command -v tcpdump"}).exit_status != 0)
                GTEST_SKIP() << "no tcpdump here";
            TempDir dir;
            const std::string path = dir / "dump";
            Background dump(pcapdump("eth0", path));
            expect_size_reached(path, 24);
            send_frame("eth1", make_frame(0x0806, from_hex("0001 0800 06 04 0001"
                                                           "020000000002 0a630002"
                                                           "000000000000 0a630001")));
            expect_size_reached(path, 24 + 16 + 42);
            set_link_up("eth0", false);
            expect_silent_end(&dump);
            RunResult shown = run_program({"/bin/sh", "-c", "exec tcpdump -n -t -r \"$0\"", path});
            EXPECT_EQ(0, shown.exit_status) << shown.err;
            EXPECT_EQ("ARP, Request who-has 10.99.0.1 tell 10.99.0.2, length 28\n", shown.out);
        },
        WITH_ETH0);
}

TEST(Pcapdump, SleepsWhileTheNetworkIsQuiet) {
    run_in_sandbox(
        [] {
            TempDir dir;
            Background dump(pcapdump("eth0", dir / "dump"));
            expect_size_reached(dir / "dump", 24);
            // One that looks at its file again and again is always about to run.
            const std::string stat = "/proc/" + std::to_string(dump.pid()) + "/stat";
            EXPECT_TRUE(wait_until(
                [&] { return read_whole_file(stat).find(") S ") != std::string::npos; }));
        },
        WITH_ETH0);
}
