#include "archive/gzip_stream.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

#include <string>

#include "archive_file.h"
#include "support/gunzip.h"
#include "support/temp_dir.h"

namespace {

// What gzip_filter makes of `input`, run in a child as always.
std::string filter(const std::string &input) {
    TempDir dir;
    dir.file("in", input);
    pid_t pid = fork();
    if (pid == 0) {
        dup2(open((dir / "in").c_str(), O_RDONLY), 0);
        dup2(open((dir / "out").c_str(), O_WRONLY | O_CREAT, 0600), 1);
        gzip_filter();
        _exit(0);
    }
    int status;
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
    return read_whole_file(dir / "out");
}

struct PipedFilter {
    int in;   // takes the text
    int out;  // gives the compressed file
    pid_t pid;
};

// gzip_filter in a child, which succeeds if that has closed its input in the end.
PipedFilter start_filter() {
    int in[2], out[2];
    EXPECT_EQ(0, pipe(in));
    EXPECT_EQ(0, pipe(out));
    pid_t pid = fork();
    if (pid == 0) {
        dup2(in[0], 0);
        dup2(out[1], 1);
        for (int fd : {in[0], in[1], out[0], out[1]})
            close(fd);
        gzip_filter();
        _exit(fcntl(0, F_GETFD) == -1 ? 0 : 1);
    }
    close(in[0]);
    close(out[1]);
    return {.in = in[1], .out = out[0], .pid = pid};
}

std::string varied(size_t size) {
    std::string text(size, '\0');
    unsigned seed = 1;
    for (size_t i = 0; i < size; ++i)
        text[i] = static_cast<char>(i % 3 == 0 ? rand_r(&seed) : 'a');
    return text;
}

TEST(GzipFilter, OfNothingIsAValidEmptyFile) {
    const unsigned char expected[] = {0x1f, 0x8b, 8, 0, 0, 0, 0, 0, 0, 3,  // header
                                      3,    0,                             // an empty last block
                                      0,    0,    0, 0, 0, 0, 0, 0};       // CRC and size
    EXPECT_EQ(std::string(reinterpret_cast<const char *>(expected), sizeof expected), filter(""));
}

TEST(GzipFilter, IsReadBackByAnyReaderWithItsCrcAndSize) {
    for (size_t size : {1, 100, 16383, 16384, 16385, 1000000}) {
        std::string text = varied(size);
        std::string file = filter(text);
        EXPECT_EQ(text, gunzip(file)) << size;
        auto trailer = [&](size_t at) {
            unsigned long value = 0;
            for (size_t i = 4; i-- > 0;)
                value = value << 8 | static_cast<unsigned char>(file.at(file.size() - 8 + at + i));
            return value;
        };
        EXPECT_EQ(crc32(0, reinterpret_cast<const Bytef *>(text.data()), static_cast<uInt>(size)),
                  trailer(0));
        EXPECT_EQ(size, trailer(4));
    }
}

TEST(GzipFilter, StreamsWhileItsInputIsStillOpen) {
    const PipedFilter piped = start_filter();
    std::string text = varied(200000);
    // More than the compressor can hold back, so that reading finds more than the header.
    EXPECT_EQ(65536, write(piped.in, text.data(), 65536));
    char byte;
    for (int i = 0; i < 100; ++i)
        ASSERT_EQ(1, read(piped.out, &byte, 1));
    close(piped.in);
    close(piped.out);
    waitpid(piped.pid, nullptr, 0);
}

TEST(GzipFilter, EndsAndClosesItsInputWhenTheReaderHasGone) {
    signal(SIGPIPE, SIG_IGN);
    const PipedFilter piped = start_filter();
    close(piped.out);
    std::string text = varied(1000000);
    size_t done = 0;
    ssize_t n;
    while (done < text.size() && (n = write(piped.in, text.data() + done, text.size() - done)) > 0)
        done += static_cast<size_t>(n);
    EXPECT_LT(done, text.size()) << "the compressor should have gone away";
    int status;
    waitpid(piped.pid, &status, 0);
    EXPECT_EQ(0, status);
    close(piped.in);
}

TEST(GzipChild, KeepsNoDescriptorOfAnotherRequest) {
    for (bool old_kernel : {false, true}) {
        int in[2], out[2], other[2];
        ASSERT_EQ(0, pipe2(in, O_CLOEXEC));
        ASSERT_EQ(0, pipe2(out, O_CLOEXEC));
        ASSERT_EQ(0, pipe2(other, O_CLOEXEC));
        pid_t pid = fork();
        if (pid == 0) {
            alarm(20);
            // As with a service that has many of them.
            int copies[200];
            for (int &copy : copies)
                copy = dup(other[1]);
            if (old_kernel)
                be_an_old_kernel();
            run_gzip_child(in[0], out[1]);
        }
        close(in[0]);
        close(out[1]);
        close(other[1]);
        // The other request's connection ends while the compressor goes on.
        char byte;
        EXPECT_EQ(0, read(other[0], &byte, 1));
        ASSERT_EQ(4, write(in[1], "text", 4));
        close(in[1]);
        std::string file(1000, '\0');
        size_t length = 0;
        for (ssize_t n; (n = read(out[0], &file[length], file.size() - length)) > 0;)
            length += static_cast<size_t>(n);
        file.resize(length);
        EXPECT_EQ("text", gunzip(file));
        close(out[0]);
        close(other[0]);
        int status;
        EXPECT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_EQ(0, status);
    }
}

TEST(GzipChild, LeavesTextThatItsParentHasNotFlushedToItsParent) {
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP() << "the thread sanitizer flushes all streams at any kind of exit";
#endif
    int in[2], out[2];
    ASSERT_EQ(0, pipe2(in, O_CLOEXEC));
    ASSERT_EQ(0, pipe2(out, O_CLOEXEC));
    pid_t pid = fork();
    if (pid == 0) {
        alarm(20);
        setvbuf(stdout, nullptr, _IOFBF, BUFSIZ);
        fputs("a tracer's complaint", stdout);
        run_gzip_child(in[0], out[1]);
    }
    close(in[0]);
    close(out[1]);
    ASSERT_EQ(4, write(in[1], "text", 4));
    close(in[1]);
    char file[1000];
    size_t length = 0;
    for (ssize_t n; (n = read(out[0], file + length, sizeof file - length)) > 0;)
        length += static_cast<size_t>(n);
    close(out[0]);
    EXPECT_EQ(filter("text"), std::string(file, length));
    int status;
    EXPECT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_EQ(0, status);
}

}  // namespace
