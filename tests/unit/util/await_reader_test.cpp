#include "util/await_reader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

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

TEST(AwaitReader, EndsAtASignalOnceNothingIsWantedAnyMore) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    ASSERT_EQ(0, sigaction(SIGUSR1, &action, nullptr));
    Pipe pipe;
    fill(pipe);
    std::atomic<uint32_t> wanted = 1;
    std::atomic<bool> ended = false;
    const pthread_t waiter = pthread_self();
    std::thread signaller([&] {
        for (int i = 0; !ended; ++i) {
            wanted = i < 10;
            pthread_kill(waiter, SIGUSR1);
            usleep(20000);
        }
    });
    EXPECT_FALSE(await_reader(pipe.out.get(), LONG, &wanted));
    EXPECT_EQ(0u, wanted);
    ended = true;
    signaller.join();
}

}  // namespace
