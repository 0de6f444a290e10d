// The pieces of a hand-over; whole ones are in tests/system.
#include "coredump-handler/service_handover.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>

#include "util/unique_fd.h"

namespace {

struct Pair {
    Pair() {
        int ends[2];
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
        ours.reset(ends[0]);
        theirs.reset(ends[1]);
    }
    UniqueFd ours, theirs;
};

std::string error_output_of(void (*body)()) {
    testing::internal::CaptureStderr();
    body();
    return testing::internal::GetCapturedStderr();
}

}  // namespace

TEST(WaitForAnswer, DropsUpToEightBytes) {
    Pair pair;
    ASSERT_EQ(10, write(pair.theirs.get(), "0123456789", 10));
    wait_for_answer(pair.ours.get(), 20000);
    char rest[16] = {};
    EXPECT_EQ(2, read(pair.ours.get(), rest, sizeof rest));
    EXPECT_STREQ("89", rest);
}

TEST(WaitForAnswer, EndsSilentlyWhenTheOtherSideHangsUp) {
    EXPECT_EQ("", error_output_of([] {
                  Pair pair;
                  pair.theirs.reset();
                  wait_for_answer(pair.ours.get(), 20000);
              }));
}

TEST(WaitForAnswer, EndsSilentlyWhenTheTimeIsOver) {
    EXPECT_EQ("", error_output_of([] {
                  Pair pair;
                  wait_for_answer(pair.ours.get(), 10);
              }));
}

TEST(WaitForAnswer, NamesTheErrorOfAWaitThatFails) {
    EXPECT_EQ("select(): Interrupted system call\n", error_output_of([] {
                  struct sigaction action = {};
                  action.sa_handler = [](int) {};
                  struct sigaction before;
                  sigaction(SIGALRM, &action, &before);
                  // Again and again, in case that the first one comes too early.
                  const itimerval often = {{0, 20000}, {0, 20000}};
                  setitimer(ITIMER_REAL, &often, nullptr);
                  Pair pair;
                  wait_for_answer(pair.ours.get(), 20000);
                  const itimerval never = {};
                  setitimer(ITIMER_REAL, &never, nullptr);
                  sigaction(SIGALRM, &before, nullptr);
              }));
}

TEST(HandCoreOver, NamesASocketThatCannotBeConnectedTo) {
    EXPECT_EQ("connect to /nosuch/socket failed\n",
              error_output_of([] { EXPECT_FALSE(hand_core_over("/nosuch/socket")); }));
}

TEST(HandCoreOver, CannotConnectToAPathThatIsTooLong) {
    EXPECT_EQ("connect to /" + std::string(107, 'a') + " failed\n", error_output_of([] {
                  EXPECT_FALSE(hand_core_over(("/" + std::string(107, 'a')).c_str()));
              }));
}
