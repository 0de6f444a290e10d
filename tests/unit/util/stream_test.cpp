#include "util/stream.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

struct Pipe {
    Pipe() {
        int ends[2];
        EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
        in.reset(ends[0]);
        out.reset(ends[1]);
    }
    UniqueFd in;
    UniqueFd out;
};

// As the dispatcher does for every applet.
class Stream : public testing::Test {
  protected:
    void SetUp() override { signal(SIGPIPE, SIG_IGN); }
};

void ignore_signal(int) {}

// Interrupts blocking calls of this process every millisecond for as long as it lives.
class Interruptions {
  public:
    Interruptions() {
        struct sigaction action = {};
        action.sa_handler = ignore_signal;
        sigaction(SIGALRM, &action, nullptr);
        set_timer(1000);
    }
    ~Interruptions() {
        set_timer(0);
        signal(SIGALRM, SIG_DFL);
    }

  private:
    static void set_timer(suseconds_t us) {
        itimerval timer = {{0, us}, {0, us}};
        setitimer(ITIMER_REAL, &timer, nullptr);
    }
};

std::string pattern(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i)
        text[i] = static_cast<char>('a' + i * 7 % 26);
    return text;
}

// What `producer` writes to the pipe that it is given, read slowly enough to make it block.
template <typename Producer>
std::string read_slowly(Pipe &pipe, Producer producer) {
    pid_t pid = fork();
    if (pid == 0) {
        pipe.in.reset();
        producer();
        _exit(testing::Test::HasFailure());
    }
    pipe.out.reset();
    std::string text;
    char block[8192];
    ssize_t n;
    usleep(20000);
    while ((n = read(pipe.in.get(), block, sizeof block)) > 0) {
        text.append(block, static_cast<size_t>(n));
        usleep(1000);
    }
    int status;
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
    return text;
}

TEST_F(Stream, WriteAllResumesAfterSignalsAndReturnsTheFullLength) {
    std::string text = pattern(300000);
    Pipe pipe;
    EXPECT_EQ(text, read_slowly(pipe, [&] {
                  Interruptions interruptions;
                  EXPECT_EQ(300000, write_all(pipe.out.get(), text.data(), 300000));
              }));
}

TEST_F(Stream, WriteAllWaitsOutAFullNonBlockingDescriptor) {
    std::string text = pattern(300000);
    Pipe pipe;
    EXPECT_EQ(text, read_slowly(pipe, [&] {
                  fcntl(pipe.out.get(), F_SETFL, O_NONBLOCK);
                  EXPECT_EQ(300000, write_all(pipe.out.get(), text.data(), 300000));
              }));
}

TEST_F(Stream, WriteAllOfNothingStillMakesACall) {
    Pipe pipe;
    EXPECT_EQ(0, write_all(pipe.out.get(), "", 0));
    EXPECT_EQ(-1, write_all(-1, "", 0));
    EXPECT_EQ(EBADF, errno);
}

TEST_F(Stream, WriteAllFailsWhenTheReaderHasGone) {
    Pipe pipe;
    pipe.in.reset();
    EXPECT_EQ(-1, write_all(pipe.out.get(), "x", 1));
    EXPECT_EQ(EPIPE, errno);
}

TEST_F(Stream, ReadAllStopsAtTheEndOfAShortFile) {
    TempDir dir;
    UniqueFd file(open(dir.file("ten", "0123456789").c_str(), O_RDONLY));
    char buf[100];
    EXPECT_EQ(10, read_all(file.get(), buf, sizeof buf));
    EXPECT_EQ("0123456789", std::string(buf, 10));
    EXPECT_EQ(0, read_all(file.get(), buf, sizeof buf));
}

TEST_F(Stream, ReadAllOfADirectoryFailsWithEisdir) {
    UniqueFd dir(open("/", O_RDONLY));
    char buf[10];
    EXPECT_EQ(-1, read_all(dir.get(), buf, sizeof buf));
    EXPECT_EQ(EISDIR, errno);
}

TEST_F(Stream, ReadAllOfAnUnopenedDescriptorFailsWithEbadf) {
    char buf[10];
    EXPECT_EQ(-1, read_all(-1, buf, sizeof buf));
    EXPECT_EQ(EBADF, errno);
}

TEST_F(Stream, ReadAllGathersPiecesAndSurvivesSignals) {
    Pipe pipe;
    pid_t pid = fork();
    if (pid == 0) {
        for (int i = 0; i < 10; ++i) {
            usleep(3000);
            (void)!write(pipe.out.get(), "ab", 2);
        }
        _exit(0);
    }
    char buf[20];
    {
        Interruptions interruptions;
        EXPECT_EQ(20, read_all(pipe.in.get(), buf, sizeof buf));
    }
    EXPECT_EQ("abababababababababab", std::string(buf, 20));
    waitpid(pid, nullptr, 0);
}

TEST_F(Stream, CopyFdOfAnEmptyFileWritesNothing) {
    TempDir dir;
    UniqueFd file(open(dir.file("empty", "").c_str(), O_RDONLY));
    Pipe pipe;
    EXPECT_EQ(0, copy_fd(file.get(), pipe.out.get()));
    pipe.out.reset();
    char byte;
    EXPECT_EQ(0, read(pipe.in.get(), &byte, 1));
}

TEST_F(Stream, CopyFdCopiesEveryByteOfAnySize) {
    TempDir dir;
    for (int size : {1, 16383, 16384, 16385, 100000}) {
        std::string text = pattern(static_cast<size_t>(size));
        UniqueFd in(open(dir.file("in", text).c_str(), O_RDONLY));
        UniqueFd out(open((dir / "out").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600));
        EXPECT_EQ(size, copy_fd(in.get(), out.get()));
        EXPECT_EQ(text, read_whole_file(dir / "out"));
    }
}

TEST_F(Stream, CopyFdIntoAPipeWithoutAReaderFails) {
    TempDir dir;
    UniqueFd in(open(dir.file("in", "text").c_str(), O_RDONLY));
    Pipe pipe;
    pipe.in.reset();
    EXPECT_EQ(-1, copy_fd(in.get(), pipe.out.get()));
    EXPECT_EQ(EPIPE, errno);
}

TEST_F(Stream, CopyFdGoesOnAfterOtherOutputErrorsAndCountsWhatWentOut) {
    TempDir dir;
    UniqueFd in(open(dir.file("in", pattern(50000)).c_str(), O_RDONLY));
    UniqueFd full(open("/dev/full", O_WRONLY));
    EXPECT_EQ(0, copy_fd(in.get(), full.get()));
    EXPECT_EQ(50000, lseek(in.get(), 0, SEEK_CUR));
}

TEST_F(Stream, CopyFdCountsThePartOfABlockThatAFullDiskTook) {
    run_in_sandbox([] {
        TempDir dir;
        UniqueFd in(open(dir.file("in", pattern(50000)).c_str(), O_RDONLY));
        TempDir disk;
        ASSERT_EQ(0, mount("none", disk.path().c_str(), "tmpfs", 0, "size=20480"));
        {
            UniqueFd out(open((disk / "out").c_str(), O_WRONLY | O_CREAT, 0600));
            EXPECT_EQ(20480, copy_fd(in.get(), out.get()));
        }
        EXPECT_EQ(pattern(20480), read_whole_file(disk / "out"));
        umount2(disk.path().c_str(), MNT_DETACH);
    });
}

TEST_F(Stream, BoundedWriterCutsAtItsBudgetAndThenWritesNothing) {
    TempDir dir;
    UniqueFd out(open((dir / "out").c_str(), O_WRONLY | O_CREAT, 0600));
    std::string text = pattern(150);
    BoundedWriter writer = {out.get(), 100, 0};
    EXPECT_EQ(0u, bounded_write_cb(&writer, text.data(), 150));
    EXPECT_EQ(0, writer.remaining);
    EXPECT_EQ(0u, bounded_write_cb(&writer, text.data(), 150));
    EXPECT_EQ(text.substr(0, 100), read_whole_file(dir / "out"));
    EXPECT_EQ(0u, writer.failed);
}

TEST_F(Stream, BoundedWriterWantsMoreWhileSomethingRemains) {
    TempDir dir;
    UniqueFd out(open((dir / "out").c_str(), O_WRONLY | O_CREAT, 0600));
    BoundedWriter writer = {out.get(), 3, 0};
    EXPECT_EQ(1u, bounded_write_cb(&writer, "", 0));
    EXPECT_EQ(1u, bounded_write_cb(&writer, "ab", 2));
    EXPECT_EQ(1, writer.remaining);
    EXPECT_EQ(0u, bounded_write_cb(&writer, "c", 1));
    EXPECT_EQ("abc", read_whole_file(dir / "out"));
}

TEST_F(Stream, BoundedWriterTakesANegativeLengthForNoText) {
    TempDir dir;
    UniqueFd out(open((dir / "out").c_str(), O_WRONLY | O_CREAT, 0600));
    BoundedWriter writer = {out.get(), 3, 0};
    EXPECT_EQ(1u, bounded_write_cb(&writer, "abc", static_cast<uint32_t>(-1)));
    EXPECT_EQ(3, writer.remaining);
    EXPECT_EQ("", read_whole_file(dir / "out"));
}

TEST_F(Stream, BoundedWriterRemembersAFailedWrite) {
    Pipe pipe;
    pipe.in.reset();
    BoundedWriter writer = {pipe.out.get(), 100, 0};
    EXPECT_EQ(0u, bounded_write_cb(&writer, "x", 1));
    EXPECT_EQ(1u, writer.failed);
    EXPECT_EQ(100, writer.remaining);
    EXPECT_EQ(0u, bounded_write_cb(&writer, "", 0)) << "the producer's polls must end it too";
}

}  // namespace
