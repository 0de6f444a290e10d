#include "util/unique_fd.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>

namespace {

int open_null() {
    return open("/dev/null", O_RDONLY | O_CLOEXEC);
}

bool is_open(int fd) {
    return fcntl(fd, F_GETFD) != -1;
}

TEST(UniqueFd, ClosesAtTheEndOfItsLife) {
    int fd = open_null();
    {
        UniqueFd owner(fd);
        EXPECT_TRUE(owner.valid());
        EXPECT_TRUE(is_open(fd));
    }
    EXPECT_FALSE(is_open(fd));
}

TEST(UniqueFd, HoldsNothingAtFirst) {
    UniqueFd owner;
    EXPECT_FALSE(owner.valid());
    EXPECT_EQ(-1, owner.get());
}

TEST(UniqueFd, MovesWithoutClosing) {
    int fd = open_null();
    UniqueFd first(fd);
    UniqueFd second(std::move(first));
    EXPECT_EQ(fd, second.get());
    EXPECT_EQ(-1, first.get());
    UniqueFd third;
    third = std::move(second);
    EXPECT_EQ(fd, third.get());
    EXPECT_TRUE(is_open(fd));
}

TEST(UniqueFd, ReleaseHandsTheDescriptorOver) {
    int fd = open_null();
    {
        UniqueFd owner(fd);
        EXPECT_EQ(fd, owner.release());
    }
    EXPECT_TRUE(is_open(fd));
    close(fd);
}

TEST(UniqueFd, ResetClosesTheOldOneOnly) {
    int first = open_null();
    int second = open_null();
    UniqueFd owner(first);
    owner.reset(second);
    EXPECT_FALSE(is_open(first));
    EXPECT_TRUE(is_open(second));
    owner.reset(second);
    EXPECT_TRUE(is_open(second));
}

}  // namespace
