// What the tests of streams have in common.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>

#include "util/unique_fd.h"

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

// Interrupts blocking calls of this process every millisecond for as long as it lives.
class Interruptions {
  public:
    Interruptions() {
        struct sigaction action = {};
        action.sa_handler = [](int) {};
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

inline std::string pattern(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i)
        text[i] = static_cast<char>('a' + i * 7 % 26);
    return text;
}
