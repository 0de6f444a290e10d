#include "util/await_reader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <thread>

#include "stream_pieces.h"

namespace {

constexpr int LONG = 100;  // seconds, more than a test takes

void fill(const Pipe &pipe) {
    EXPECT_EQ(0, fcntl(pipe.out.get(), F_SETFL, O_NONBLOCK));
    char block[4096] = {};
    while (write(pipe.out.get(), block, sizeof block) > 0) {
    }
    EXPECT_EQ(0, fcntl(pipe.out.get(), F_SETFL, 0));
}

void take(const Pipe &pipe, size_t n) {
    char block[4096];
    EXPECT_EQ(static_cast<ssize_t>(n), read(pipe.in.get(), block, n));
}

TEST(AwaitReader, ComesBackWhenThereIsRoom) {
    Pipe pipe;
    EXPECT_TRUE(await_reader(pipe.out.get(), 1, nullptr));
    fill(pipe);
    std::thread reader([&] {
        usleep(200000);
        take(pipe, 4096);
    });
    EXPECT_TRUE(await_reader(pipe.out.get(), LONG, nullptr));
    reader.join();
}

TEST(AwaitReader, GivesUpAReaderThatTakesNothing) {
    Pipe pipe;
    fill(pipe);
    EXPECT_FALSE(await_reader(pipe.out.get(), 2, nullptr));
}

TEST(AwaitReader, HasPatienceWithAReaderThatTakesALittleAtATime) {
    Pipe pipe;
    fill(pipe);
    std::thread reader([&] {
        for (int i = 0; i < 8; ++i) {
            usleep(500000);
            take(pipe, 512);
        }
    });
    EXPECT_TRUE(await_reader(pipe.out.get(), 3, nullptr));
    reader.join();
}

TEST(AwaitReader, LeavesItToTheWriteToTellThatTheReaderHasGone) {
    Pipe pipe;
    fill(pipe);
    pipe.in.reset();
    EXPECT_TRUE(await_reader(pipe.out.get(), 1, nullptr));
}

// Sends SIGUSR1, which does nothing but end waits, to the thread that made it, all the time.
class Signaller {
  public:
    explicit Signaller(const std::function<void(int)> &before_each) {
        struct sigaction action = {};
        action.sa_handler = [](int) {};
        EXPECT_EQ(0, sigaction(SIGUSR1, &action, nullptr));
        thread_ = std::thread([this, before_each, waiter = pthread_self()] {
            for (int i = 0; !ended_; ++i) {
                before_each(i);
                pthread_kill(waiter, SIGUSR1);
                usleep(20000);
            }
        });
    }
    ~Signaller() {
        ended_ = true;
        thread_.join();
    }
    Signaller(const Signaller &) = delete;
    Signaller &operator=(const Signaller &) = delete;

  private:
    std::atomic<bool> ended_ = false;
    std::thread thread_;
};

TEST(AwaitReader, EndsAtASignalOnceNothingIsWantedAnyMore) {
    Pipe pipe;
    fill(pipe);
    std::atomic<uint32_t> wanted = 1;
    const Signaller signaller([&](int i) { wanted = i < 10; });
    EXPECT_FALSE(await_reader(pipe.out.get(), LONG, &wanted));
    EXPECT_EQ(0u, wanted);
}

TEST(AwaitReader, LosesNoPatienceThroughSignals) {
    Pipe pipe;
    fill(pipe);
    const Signaller signaller([](int) {});
    const time_t begin = time(nullptr);
    EXPECT_FALSE(await_reader(pipe.out.get(), 2, nullptr));
    EXPECT_LE(begin + 2, time(nullptr));
}

}  // namespace
