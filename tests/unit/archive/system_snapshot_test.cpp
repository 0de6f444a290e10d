#include "archive/system_snapshot.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>

#include <string>
#include <thread>

#include "archive_file.h"
#include "support/failed_writes.h"
#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

// The member "kcore" of an archive made where /proc/kcore is a file of `size` bytes; its size, or
// -1 for no member.
long kcore_member(off_t size) {
    ArchiveFile archive;
    std::string core = archive.dir.file("kcore", "core");
    EXPECT_EQ(0, truncate(core.c_str(), size));
    // Not every kernel has the file, so the whole of /proc is replaced.
    sandbox_bind(archive.dir.path(), "/proc");
    EXPECT_EQ(0, add_kcore(archive.tw, archive.fd.get()));
    EXPECT_EQ(0, umount2("/proc", MNT_DETACH));
    std::vector<TarMember> members = archive.close();
    if (members.empty())
        return -1;
    EXPECT_EQ("top/kcore", members[0].name);
    return static_cast<long>(members[0].data.size());
}

TEST(AddKcore, AddsTheKernelsMemoryOfUpToTenMebibytes) {
    run_in_sandbox([] {
        EXPECT_EQ(4, kcore_member(4));
        EXPECT_EQ(10485760, kcore_member(10485760));
    });
}

TEST(AddKcore, AddsNothingAndSaysNothingWhenItIsLargerOrEmpty) {
    run_in_sandbox([] {
        testing::internal::CaptureStderr();
        EXPECT_EQ(-1, kcore_member(10485761));
        EXPECT_EQ(-1, kcore_member(0));
        EXPECT_EQ("", testing::internal::GetCapturedStderr());
    });
}

TEST(AddKcore, AddsNothingWhenItCannotBeOpened) {
    run_in_sandbox([] {
        ArchiveFile archive;
        TempDir empty;
        sandbox_bind(empty.path(), "/proc");
        EXPECT_EQ(0, add_kcore(archive.tw, archive.fd.get()));
        EXPECT_EQ(0u, archive.close().size());
    });
}

uint32_t little_endian(const std::string &bytes, size_t at) {
    uint32_t value = 0;
    for (size_t i = 4; i-- > 0;)
        value = value << 8 | static_cast<unsigned char>(bytes.at(at + i));
    return value;
}

// Captured lengths of the records of a pcap stream, each with a minus sign when it is filler.
std::vector<long> records(const std::string &stream) {
    std::vector<long> lengths;
    size_t at = 24;
    while (at + 16 <= stream.size()) {
        long length = little_endian(stream, at + 8);
        bool filler = little_endian(stream, at) == 0;
        lengths.push_back(filler ? -length : length);
        at += 16 + static_cast<size_t>(length);
    }
    EXPECT_EQ(stream.size(), at);
    return lengths;
}

[[noreturn]] void send_datagrams(const char *to) {
    int fd = socket(AF_INET, SOCK_DGRAM, 0);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = inet_addr(to);
    address.sin_port = htons(9);
    for (;;) {
        (void)sendto(fd, "hello", 5, 0, reinterpret_cast<sockaddr *>(&address), sizeof address);
        usleep(10000);
    }
}

sockaddr_in loopback(uint16_t port) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    return address;
}

// Writes what comes from `in` into the file `path`.
[[noreturn]] void copy_into(const std::string &path, int in) {
    int out = open(path.c_str(), O_WRONLY | O_CREAT, 0600);
    char block[4096];
    for (ssize_t n; (n = read(in, block, sizeof block)) > 0;)
        (void)!write(out, block, static_cast<size_t>(n));
    _exit(0);
}

// Connects to `port` and writes what comes into the file `path`.
[[noreturn]] void receive_into(const std::string &path, uint16_t port) {
    int in = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address = loopback(port);
    if (connect(in, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0)
        _exit(1);
    copy_into(path, in);
}

TEST(AddNetdump, OfAQuietNetworkHoldsTheHeaderAndFillerUpToTheSize) {
    run_in_sandbox(
        [] {
            ArchiveFile archive;
            EXPECT_EQ(0, add_netdump(archive.tw, archive.fd.get(), "eth0", 1, 512000));
            std::vector<TarMember> members = archive.close();
            ASSERT_EQ(1u, members.size());
            EXPECT_EQ("top/netdump.cap", members[0].name);
            ASSERT_EQ(512000u, members[0].data.size());
            EXPECT_EQ(0xa1b2c3d4u, little_endian(members[0].data, 0));
            for (long length : records(members[0].data))
                EXPECT_LE(length, 0);
        },
        {.eth0 = true});
}

TEST(AddNetdump, HoldsRecordsOf1536BytesForWhatIsOnTheWire) {
    run_in_sandbox(
        [] {
            ArchiveFile archive;
            sandbox_shell("ip neigh add 10.99.0.2 lladdr 02:00:00:00:00:02 dev eth0");
            pid_t sender = fork();
            if (sender == 0)
                send_datagrams("10.99.0.2");
            EXPECT_EQ(0, add_netdump(archive.tw, archive.fd.get(), "eth0", 2, 100000));
            std::vector<TarMember> members = archive.close();
            ASSERT_EQ(1u, members.size());
            EXPECT_EQ(100000u, members[0].data.size());
            EXPECT_EQ(1536, records(members[0].data).at(0));
            kill(sender, SIGKILL);
            waitpid(sender, nullptr, 0);
        },
        {.eth0 = true});
}

TEST(AddNetdump, WithoutAWriterIsExactlyTheSizeOfPlainOutput) {
    run_in_sandbox(
        [] {
            ArchiveFile archive;
            EXPECT_EQ(0, add_netdump(nullptr, archive.fd.get(), "eth0", 1, 1000));
            EXPECT_EQ(1000u, archive.bytes().size());
            EXPECT_EQ((std::vector<long>{-960}), records(archive.bytes()));
            tar_close(archive.tw);
        },
        {.eth0 = true});
}

TEST(AddNetdump, WithoutTheInterfaceListensToAll) {
    run_in_sandbox([] {
        ArchiveFile archive;
        EXPECT_EQ(0, add_netdump(archive.tw, archive.fd.get(), "eth0", 1, 5000));
        EXPECT_EQ(5000u, archive.close().at(0).data.size());
    });
}

TEST(AddNetdump, SaysWhenTheOutputIsBroken) {
    run_in_sandbox([] {
        BrokenArchive archive;
        EXPECT_EQ(1, add_netdump(archive.tw, archive.fd.get(), "lo", 1, 5000));
    });
}

TEST(AddNetdump, SaysWhenItMayNotCapture) {
    run_in_sandbox([] {
        ArchiveFile archive;
        rlimit tight = {static_cast<rlim_t>(archive.fd.get()) + 1, 1024};
        ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &tight));
        EXPECT_EQ(1, add_netdump(archive.tw, archive.fd.get(), "lo", 1, 5000));
        tar_abandon(archive.tw);
    });
}

TEST(AddNetdump, ToAConnectedSocketLeavesItsOwnConnectionOut) {
    run_in_sandbox([] {
        int listener = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in address = loopback(4000);
        ASSERT_EQ(0, bind(listener, reinterpret_cast<sockaddr *>(&address), sizeof address));
        ASSERT_EQ(0, listen(listener, 1));
        TempDir dir;
        std::string received = dir / "received";
        pid_t client = fork();
        if (client == 0)
            receive_into(received, 4000);
        UniqueFd connection(accept(listener, nullptr, nullptr));
        ASSERT_TRUE(connection.valid());
        // The stream itself makes for frames of the connection on "lo", all of them hidden.
        EXPECT_EQ(0, add_netdump(nullptr, connection.get(), "lo", 1, 300000));
        connection.reset();
        waitpid(client, nullptr, 0);
        std::string stream = read_whole_file(received);
        ASSERT_EQ(300000u, stream.size());
        for (long length : records(stream))
            EXPECT_LE(length, 0);
    });
}

TEST(AddNetdump, OntoAPipeHasNoFilterAndHoldsAllTraffic) {
    run_in_sandbox([] {
        int ends[2];
        ASSERT_EQ(0, pipe(ends));
        TempDir dir;
        std::string received = dir / "received";
        pid_t reader = fork();
        if (reader == 0) {
            close(ends[1]);
            copy_into(received, ends[0]);
        }
        close(ends[0]);
        pid_t sender = fork();
        if (sender == 0) {
            close(ends[1]);
            send_datagrams("127.0.0.1");
        }
        EXPECT_EQ(0, add_netdump(nullptr, ends[1], "lo", 1, 30000));
        close(ends[1]);
        waitpid(reader, nullptr, 0);
        kill(sender, SIGKILL);
        waitpid(sender, nullptr, 0);
        std::string stream = read_whole_file(received);
        ASSERT_EQ(30000u, stream.size());
        EXPECT_EQ(1536, records(stream).at(0));
    });
}

TEST(PcapRequest, TakesDefaultsForNegativeNumbers) {
    run_in_sandbox(
        [] {
            ArchiveFile archive;
            EXPECT_EQ(0, pcap_request(archive.fd.get(), 1, -1));
            EXPECT_EQ(5120000u, archive.bytes().size());
            tar_close(archive.tw);
        },
        {.eth0 = true});
}

TEST(PcapRequest, LastsFiveSecondsWhenNoDurationIsGiven) {
    run_in_sandbox(
        [] {
            ArchiveFile archive;
            timespec before, after;
            clock_gettime(CLOCK_MONOTONIC, &before);
            EXPECT_EQ(0, pcap_request(archive.fd.get(), -1, 2000));
            clock_gettime(CLOCK_MONOTONIC, &after);
            EXPECT_EQ(2000u, archive.bytes().size());
            EXPECT_GE(after.tv_sec - before.tv_sec, 4);
            tar_close(archive.tw);
        },
        {.eth0 = true});
}

TEST(AddStraceLog, WithoutProcessesIsBlankLinesThroughout) {
    ArchiveFile archive;
    pid_t none[] = {-1};
    EXPECT_EQ(0, add_strace_log(archive.tw, none, 1));
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(1u, members.size());
    EXPECT_EQ("top/strace.log", members[0].name);
    std::string lines;
    while (lines.size() < 204800)
        lines += std::string(79, ' ') + "\n";
    EXPECT_EQ(lines.substr(0, 204800), members[0].data);
}

TEST(AddStraceLog, HoldsTheCallsOfABusyProcessCutAtTheSize) {
    run_in_sandbox([] {
        ArchiveFile archive;
        Background busy({"/bin/sh", "-c", "while :; do echo text; done >/dev/null"});
        pid_t pids[] = {busy.pid()};
        EXPECT_EQ(0, add_strace_log(archive.tw, pids, 1));
        std::string log = archive.close().at(0).data;
        ASSERT_EQ(204800u, log.size());
        std::string prefix = "[" + std::to_string(busy.pid()) + " sh] [";
        EXPECT_NE(std::string::npos, log.find(prefix)) << log.substr(0, 500);
        EXPECT_NE(std::string::npos, log.find("write(1 /dev/null, \"text\\n\", 5) = 5\n"));
    });
}

TEST(AddStraceLog, OfAQuietProcessIsFilledUpWithBlankLines) {
    run_in_sandbox([] {
        ArchiveFile archive;
        Background quiet({"/bin/sleep", "100"});
        pid_t pids[] = {quiet.pid()};
        EXPECT_EQ(0, add_strace_log(archive.tw, pids, 1));
        std::string log = archive.close().at(0).data;
        ASSERT_EQ(204800u, log.size());
        EXPECT_NE(std::string::npos, log.find(" open fds:\n"));
        size_t text = log.find_last_not_of(" \n");
        EXPECT_LT(text, 100000u);
        // The filler begins behind the text's own newline.
        EXPECT_EQ(std::string(79, ' ') + "\n", log.substr(text + 2, 80));
    });
}

TEST(AddStraceLog, SaysWhenTheOutputIsBroken) {
    run_in_sandbox([] {
        BrokenArchive archive;
        Background busy({"/bin/sh", "-c", "while :; do echo text; done >/dev/null"});
        pid_t pids[] = {busy.pid()};
        EXPECT_EQ(1, add_strace_log(archive.tw, pids, 1));
    });
}

// As a web server does that is traced as well: it cannot read before the trace lets go of it.
TEST(AddStraceLog, EndsEarlyWhenItsReaderStandsStillWithTheTraced) {
    run_in_sandbox([] {
        int ends[2];
        ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
        Background busy({"/bin/sh", "-c", "while :; do echo text; done >/dev/null"});
        std::string bytes;
        std::thread reader([&] {
            EXPECT_TRUE(
                wait_until([&] { return status_field(busy.pid(), "TracerPid:\t") != "0"; }));
            EXPECT_TRUE(wait_until([&] { return runs_free(busy.pid()); }));
            char block[4096];
            for (ssize_t n; (n = read(ends[0], block, sizeof block)) > 0;)
                bytes.append(block, static_cast<size_t>(n));
        });
        TarWriter *tw = tar_open(ends[1], "top/");
        pid_t pids[] = {busy.pid()};
        EXPECT_EQ(0, add_strace_log(tw, pids, 1));
        tar_close(tw);
        close(ends[1]);
        reader.join();
        close(ends[0]);

        const std::string log = read_tar(bytes).at(0).data;
        ASSERT_EQ(204800u, log.size());
        EXPECT_NE(std::string::npos, log.find("\"text\\n\", 5) = 5\n"));
        EXPECT_NE(std::string::npos, log.find("\n" + std::string(79, ' ') + "\n"));
    });
}

TEST(WriteSpaceLines, WritesWholeLinesAndTheBeginningOfALastOne) {
    for (int32_t n : {0, 1, 79, 80, 81, 1000}) {
        ArchiveFile archive;
        write_space_lines(archive.fd.get(), n);
        std::string expected;
        for (int32_t i = 0; i < n; ++i)
            expected += i % 80 == 79 ? '\n' : ' ';
        EXPECT_EQ(expected, archive.bytes());
        tar_close(archive.tw);
    }
}

TEST(WriteSpaceLines, StopsEarlyWhenAWriteFails) {
    BrokenArchive archive;
    EXPECT_EQ(1, failed_writes([&] { write_space_lines(archive.fd.get(), 1000); }));
}

TEST(RunPs, WritesAProcessListingToTheDescriptor) {
    run_in_sandbox([] {
        ArchiveFile archive;
        run_ps(archive.fd.get());
        EXPECT_NE(std::string::npos, archive.bytes().find("PID")) << archive.bytes();
        tar_close(archive.tw);
    });
}

}  // namespace
