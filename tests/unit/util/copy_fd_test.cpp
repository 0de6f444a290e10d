// copy_fd, of src/util/stream.h.
#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <thread>

#include "stream_pieces.h"
#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

class CopyFd : public Stream {};

TEST_F(CopyFd, OfAnEmptyFileWritesNothing) {
    TempDir dir;
    UniqueFd file(open(dir.file("empty", "").c_str(), O_RDONLY));
    Pipe pipe;
    EXPECT_EQ(0, copy_fd(file.get(), pipe.out.get()));
    pipe.out.reset();
    char byte;
    EXPECT_EQ(0, read(pipe.in.get(), &byte, 1));
}

TEST_F(CopyFd, CopiesEveryByteOfAnySize) {
    TempDir dir;
    for (int size : {1, 16383, 16384, 16385, 100000}) {
        std::string text = pattern(static_cast<size_t>(size));
        UniqueFd in(open(dir.file("in", text).c_str(), O_RDONLY));
        UniqueFd out(open((dir / "out").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600));
        EXPECT_EQ(size, copy_fd(in.get(), out.get()));
        EXPECT_EQ(text, read_whole_file(dir / "out"));
    }
}

TEST_F(CopyFd, IntoAPipeWithoutAReaderFails) {
    TempDir dir;
    UniqueFd in(open(dir.file("in", "text").c_str(), O_RDONLY));
    Pipe pipe;
    pipe.in.reset();
    EXPECT_EQ(-1, copy_fd(in.get(), pipe.out.get()));
    EXPECT_EQ(EPIPE, errno);
}

TEST_F(CopyFd, GoesOnAfterOtherOutputErrorsAndCountsWhatWentOut) {
    TempDir dir;
    UniqueFd in(open(dir.file("in", pattern(50000)).c_str(), O_RDONLY));
    UniqueFd full(open("/dev/full", O_WRONLY));
    EXPECT_EQ(0, copy_fd(in.get(), full.get()));
    EXPECT_EQ(50000, lseek(in.get(), 0, SEEK_CUR));
}

TEST_F(CopyFd, CountsThePartOfABlockThatAFullDiskTook) {
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

// The plain way: a block is read and written, whatever the two are. The rest of a block that fails
// is dropped.
int64_t plain_copy(int in_fd, int out_fd) {
    char block[16384];
    int64_t total = 0;
    for (;;) {
        ssize_t n = read(in_fd, block, sizeof block);
        if (n == 0)
            return total;
        for (ssize_t done = 0; n > 0 && done < n;) {
            ssize_t written = write(out_fd, block + done, static_cast<size_t>(n - done));
            if (written < 0 && errno == EPIPE)
                return -1;
            if (written < 0 && errno != EINTR && errno != EAGAIN)
                break;
            done += std::max<ssize_t>(written, 0);
            total += std::max<ssize_t>(written, 0);
        }
    }
}

struct Copied {
    int64_t result;
    std::string received;
    bool took_all;  // of the input
    bool operator==(const Copied &) const = default;
};

// Copies `text`, which comes through a pipe in pieces of all sizes, to `out`.
Copied copy_from_pipe(int64_t (*copy)(int, int), const std::string &text, int out) {
    Pipe source;
    std::thread feeder([&] {
        size_t piece = 1;
        for (size_t done = 0; done < text.size(); done += piece) {
            piece = std::min(piece * 7 % 9973, text.size() - done);
            if (write_all(source.out.get(), text.data() + done, static_cast<uint32_t>(piece)) < 0)
                break;
        }
        source.out.reset();
    });
    Copied copied = {copy(source.in.get(), out), "", false};
    char byte;
    copied.took_all = copied.result >= 0 && read_all(source.in.get(), &byte, 1) == 0;
    source.in.reset();
    feeder.join();
    return copied;
}

// The same to a stream whose other end, `reader`, takes at most `wanted` bytes and hangs up then.
Copied copy_to_reader(int64_t (*copy)(int, int), const std::string &text, UniqueFd out,
                      UniqueFd reader, size_t wanted) {
    std::string received;
    std::thread drain([&] {
        char block[10000];
        ssize_t n = 1;
        while ((n > 0 || (n < 0 && errno == EINTR)) && received.size() < wanted) {
            n = read(reader.get(), block, std::min(sizeof block, wanted - received.size()));
            received.append(block, static_cast<size_t>(std::max<ssize_t>(n, 0)));
        }
        reader.reset();
    });
    Copied copied = copy_from_pipe(copy, text, out.get());
    out.reset();
    drain.join();
    copied.received = received;
    return copied;
}

Copied copy_to_file(int64_t (*copy)(int, int), const std::string &text, const std::string &path,
                    int flags) {
    UniqueFd out(open(path.c_str(), O_WRONLY | flags, 0600));
    EXPECT_TRUE(out.valid()) << path;
    Copied copied = copy_from_pipe(copy, text, out.get());
    if (flags & O_CREAT)
        copied.received = read_whole_file(path);
    return copied;
}

constexpr int SIZES[] = {0, 1, 4095, 16384, 65537, 400000};

TEST_F(CopyFd, FromAPipeDoesWhatThePlainCopyDoesToStreams) {
    for (int size : SIZES) {
        const std::string text = pattern(static_cast<size_t>(size));
        for (size_t wanted : {size_t{SIZE_MAX}, size_t{30000}}) {
            for (int kind : {0, 1, 2, 3}) {
                auto run = [&](int64_t (*copy)(int, int)) {
                    int ends[2];
                    EXPECT_EQ(0, kind < 2 ? pipe2(ends, kind == 1 ? O_NONBLOCK : 0)
                                          : socketpair(AF_UNIX, SOCK_STREAM, 0, ends));
                    // The reader blocks all the same; a queue as short as can be blocks the copy.
                    (void)fcntl(ends[0], F_SETFL, 0);
                    const int least = 1;
                    if (kind == 3)
                        (void)setsockopt(ends[1], SOL_SOCKET, SO_SNDBUF, &least, sizeof least);
                    return copy_to_reader(copy, text, UniqueFd(ends[1]), UniqueFd(ends[0]), wanted);
                };
                // Only one that hangs up long before the end is sure to be noticed.
                if (wanted < text.size() && size < 400000)
                    continue;
                const Copied copied = run(copy_fd);
                EXPECT_TRUE(run(plain_copy) == copied) << size << " " << wanted << " " << kind;
                EXPECT_EQ(wanted < text.size() ? -1 : size, copied.result);
                EXPECT_TRUE(text.substr(0, wanted) == copied.received);
            }
        }
    }
}

TEST_F(CopyFd, FromAPipeDoesWhatThePlainCopyDoesToFilesAndDevices) {
    TempDir dir;
    for (int size : SIZES) {
        const std::string text = pattern(static_cast<size_t>(size));
        for (int flags : {O_CREAT | O_TRUNC, O_CREAT | O_TRUNC | O_APPEND}) {
            const Copied copied = copy_to_file(copy_fd, text, dir / "out", flags);
            EXPECT_TRUE(copy_to_file(plain_copy, text, dir / "plain", flags) == copied) << size;
            EXPECT_TRUE((Copied{size, text, true} == copied)) << size;
        }
        for (const char *device : {"/dev/null", "/dev/full"})
            EXPECT_TRUE(copy_to_file(plain_copy, text, device, 0) ==
                        copy_to_file(copy_fd, text, device, 0))
                << size << device;
        // Nothing can be written to a descriptor that is not open for it.
        EXPECT_EQ(0, copy_from_pipe(copy_fd, text, STDIN_FILENO + 1000).result);
    }
}

TEST_F(CopyFd, FromAPipeDoesWhatThePlainCopyDoesToAFullDisk) {
    run_in_sandbox([] {
        TempDir disk;
        ASSERT_EQ(0, mount("none", disk.path().c_str(), "tmpfs", 0, "size=20480"));
        for (int size : SIZES) {
            const std::string text = pattern(static_cast<size_t>(size));
            const Copied plain = copy_to_file(plain_copy, text, disk / "out", O_CREAT | O_TRUNC);
            EXPECT_TRUE(plain == copy_to_file(copy_fd, text, disk / "out", O_CREAT | O_TRUNC));
            EXPECT_EQ(std::min(size, 20480), plain.result);
        }
        umount2(disk.path().c_str(), MNT_DETACH);
    });
}

// Files may get longer from the next error on, each time a little.
void raise_file_limit(int) {
    rlimit limit;
    getrlimit(RLIMIT_FSIZE, &limit);
    limit.rlim_cur += 30000;
    setrlimit(RLIMIT_FSIZE, &limit);
}

TEST_F(CopyFd, DropsAsMuchAsThePlainCopyDoesWhereAnErrorIsAPassingOne) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string text = pattern(400000);
        UniqueFd in(open(dir.file("in", text).c_str(), O_RDONLY));
        signal(SIGXFSZ, raise_file_limit);
        // The limits of which one lies at the end of a block, one behind it, and one before it.
        for (rlim_t first : {10u, 16384u, 16385u, 32767u, 65536u, 100000u}) {
            auto run = [&](int64_t (*copy)(int, int), const std::string &path) {
                const rlimit limit = {first, RLIM_INFINITY};
                EXPECT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
                UniqueFd out(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600));
                EXPECT_EQ(0, lseek(in.get(), 0, SEEK_SET));
                return copy(in.get(), out.get());
            };
            const int64_t result = run(copy_fd, dir / "out");
            EXPECT_EQ(run(plain_copy, dir / "plain"), result) << first;
            EXPECT_LT(result, 400000);
            EXPECT_TRUE(read_whole_file(dir / "plain") == read_whole_file(dir / "out")) << first;
        }
    });
}

TEST_F(CopyFd, PassesOnWhatHasComeBeforeTheEnd) {
    Pipe source;
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    std::thread copier([&] { EXPECT_EQ(9, copy_fd(source.in.get(), ends[1])); });
    char text[10] = "";
    for (const char *piece : {"half", " more"}) {
        const uint32_t length = static_cast<uint32_t>(strlen(piece));
        write_all(source.out.get(), piece, length);
        EXPECT_EQ(static_cast<int32_t>(length), read_all(ends[0], text, length));
        EXPECT_EQ(piece, std::string(text, length));
    }
    source.out.reset();
    copier.join();
    close(ends[0]);
    close(ends[1]);
}

TEST_F(CopyFd, LeavesWhoeverFillsAPipeKillableWhileTheOutputIsStuck) {
    Pipe source;
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    const pid_t filler = fork();
    if (filler == 0) {
        source.in.reset();
        const std::string text = pattern(65536);
        while (write_all(source.out.get(), text.data(), 65536) > 0)
            continue;
        _exit(1);
    }
    source.out.reset();
    std::thread copier([&] { EXPECT_EQ(-1, copy_fd(source.in.get(), ends[1])); });
    pollfd output = {ends[1], POLLOUT, 0};
    EXPECT_TRUE(wait_until([&] {
        const char state = process_state(filler);
        return poll(&output, 1, 0) == 0 && (state == 'S' || state == 'D');
    }));
    kill(filler, SIGKILL);
    EXPECT_TRUE(wait_until([&] { return waitpid(filler, nullptr, WNOHANG) == filler; }, 5));
    close(ends[0]);
    copier.join();
    close(ends[1]);
}

TEST_F(CopyFd, FromAPipeSurvivesSignals) {
    const std::string text = pattern(400000);
    Interruptions interruptions;
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    const Copied copied =
        copy_to_reader(copy_fd, text, UniqueFd(ends[1]), UniqueFd(ends[0]), SIZE_MAX);
    EXPECT_TRUE((Copied{400000, text, true} == copied));
}

}  // namespace
