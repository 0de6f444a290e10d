#include "archive/gzip_stream.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

#include <string>

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
    int in[2], out[2];
    ASSERT_EQ(0, pipe(in));
    ASSERT_EQ(0, pipe(out));
    pid_t pid = fork();
    if (pid == 0) {
        dup2(in[0], 0);
        dup2(out[1], 1);
        for (int fd : {in[0], in[1], out[0], out[1]})
            close(fd);
        gzip_filter();
        _exit(0);
    }
    close(in[0]);
    close(out[1]);
    std::string text = varied(200000);
    // More than the compressor can hold back, so that reading finds something.
    EXPECT_EQ(65536, write(in[1], text.data(), 65536));
    char byte;
    EXPECT_EQ(1, read(out[0], &byte, 1));
    close(in[1]);
    close(out[0]);
    waitpid(pid, nullptr, 0);
}

TEST(GzipFilter, EndsAndClosesItsInputWhenTheReaderHasGone) {
    int in[2], out[2];
    ASSERT_EQ(0, pipe(in));
    ASSERT_EQ(0, pipe(out));
    signal(SIGPIPE, SIG_IGN);
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
    close(out[0]);
    close(out[1]);
    std::string text = varied(1000000);
    size_t done = 0;
    ssize_t n;
    while (done < text.size() && (n = write(in[1], text.data() + done, text.size() - done)) > 0)
        done += static_cast<size_t>(n);
    EXPECT_LT(done, text.size()) << "the compressor should have gone away";
    int status;
    waitpid(pid, &status, 0);
    EXPECT_EQ(0, status);
    close(in[1]);
}

}  // namespace
