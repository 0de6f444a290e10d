#include "util/stream.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "stream_pieces.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

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
