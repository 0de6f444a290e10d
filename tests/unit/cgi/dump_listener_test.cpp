#include "cgi/dump_listener.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "client_pair.h"
#include "support/service.h"
#include "support/temp_dir.h"

namespace {

int open_file(const std::string &path) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    EXPECT_GE(fd, 0) << path;
    return fd;
}

bool is_open(int fd) {
    return fcntl(fd, F_GETFD) != -1;
}

TEST(DumpListener, WithoutAListenerADumpIsDroppedAndItsSourceClosed) {
    TempDir dir;
    int source = open_file(dir.file("dump", "material"));
    EXPECT_EQ(1, send_dump(source, "dump"));
    EXPECT_FALSE(is_open(source));
    EXPECT_EQ(1, send_dump(-1, "dump"));
}

TEST(DumpListener, GetsOneDumpAndIsDisconnected) {
    TempDir dir;
    ClientPair pair;
    int client = pair.release_server();
    set_dump_listener(client);
    EXPECT_TRUE(pair.is_waiting());
    int source = open_file(dir.file("dump", "material"));
    EXPECT_EQ(0, send_dump(source, "the name"));
    EXPECT_FALSE(is_open(source));
    EXPECT_FALSE(is_open(client));
    EXPECT_EQ(ok_header("application/octet-stream", "the name") + "material", pair.reply());
    // Nobody waits any more.
    EXPECT_EQ(1, send_dump(open_file(dir / "dump"), "the name"));
}

TEST(DumpListener, GetsDumpsOfAnySizeToTheByte) {
    TempDir dir;
    for (size_t size : {0, 1, 2047, 2048, 2049, 65535, 65536, 65537, 300000}) {
        std::string material;
        while (material.size() < size)
            material += std::to_string(material.size()) + ' ';
        material.resize(size);
        ClientPair pair;
        set_dump_listener(pair.release_server());
        std::string reply;
        std::thread reader([&] { reply = pair.reply(); });
        EXPECT_EQ(0, send_dump(open_file(dir.file("dump", material)), "dump"));
        reader.join();
        EXPECT_TRUE(ok_header("application/octet-stream", "dump") + material == reply) << size;
    }
}

TEST(DumpListener, GetsWhatHasComeBeforeTheSourceEnds) {
    ClientPair source;
    ClientPair pair;
    set_dump_listener(pair.release_server());
    ASSERT_EQ(4, write(source.client(), "half", 4));
    std::thread sender([&] { EXPECT_EQ(0, send_dump(source.release_server(), "core")); });
    const std::string expected = ok_header("application/octet-stream", "core") + "half";
    std::string received(expected.size(), '?');
    size_t done = 0;
    while (done < received.size()) {
        ssize_t n = read(pair.client(), received.data() + done, received.size() - done);
        ASSERT_GT(n, 0);
        done += static_cast<size_t>(n);
    }
    EXPECT_EQ(expected, received);
    ASSERT_EQ(5, write(source.client(), " more", 5));
    source.close_client();
    sender.join();
    EXPECT_EQ(" more", pair.reply());
}

TEST(DumpListener, GetsItsDumpWholeThoughSignalsInterruptIt) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    static int source_end;
    static volatile sig_atomic_t signals;
    source_end = ends[1];
    signals = 0;
    struct sigaction action = {};
    // The tenth one brings the dump.
    action.sa_handler = [](int) {
        signals = signals + 1;
        if (signals == 10) {
            (void)!write(source_end, "material", 8);
            (void)close(source_end);
        }
    };
    struct sigaction before;
    ASSERT_EQ(0, sigaction(SIGALRM, &action, &before));
    const itimerval often = {{0, 5000}, {0, 5000}};
    setitimer(ITIMER_REAL, &often, nullptr);
    ClientPair pair;
    set_dump_listener(pair.release_server());
    EXPECT_EQ(0, send_dump(ends[0], "dump"));
    const itimerval never = {};
    setitimer(ITIMER_REAL, &never, nullptr);
    sigaction(SIGALRM, &before, nullptr);
    EXPECT_EQ(ok_header("application/octet-stream", "dump") + "material", pair.reply());
}

TEST(DumpListener, IsReplacedByTheNextWithoutAReply) {
    ClientPair first, second;
    set_dump_listener(first.release_server());
    set_dump_listener(second.release_server());
    EXPECT_EQ("", first.reply());
    EXPECT_TRUE(second.is_waiting());
    EXPECT_EQ(1, send_dump(-1, "core"));
    EXPECT_EQ(ok_header("application/octet-stream", "core"), second.reply());
}

TEST(DumpListener, GetsTheHeaderAloneWhenTheSourceCannotBeRead) {
    TempDir dir;
    // There was nothing to accept, or the source is a directory.
    for (int source : {-1, open(dir.path().c_str(), O_RDONLY | O_CLOEXEC)}) {
        ClientPair pair;
        set_dump_listener(pair.release_server());
        EXPECT_EQ(1, send_dump(source, "core"));
        EXPECT_EQ(ok_header("application/octet-stream", "core"), pair.reply());
        EXPECT_EQ(1, send_dump(-1, "core"));
    }
}

TEST(DumpListener, ThatHasLeftIsAFailureAndIsForgotten) {
    signal(SIGPIPE, SIG_IGN);
    TempDir dir;
    const std::string path = dir.file("dump", "material");
    ClientPair pair;
    int client = pair.release_server();
    set_dump_listener(client);
    pair.close_client();
    int source = open_file(path);
    EXPECT_EQ(1, send_dump(source, "core"));
    EXPECT_FALSE(is_open(source));
    EXPECT_FALSE(is_open(client));
}

TEST(DumpListener, ThatLeavesDuringTheDumpIsAFailure) {
    signal(SIGPIPE, SIG_IGN);
    TempDir dir;
    const std::string path = dir.file("dump", std::string(4 << 20, 'x'));
    ClientPair pair;
    set_dump_listener(pair.release_server());
    std::thread reader([&] {
        char block[4096];
        EXPECT_GT(read(pair.client(), block, sizeof block), 0);
        pair.close_client();
    });
    EXPECT_EQ(1, send_dump(open_file(path), "core"));
    reader.join();
}

}  // namespace
