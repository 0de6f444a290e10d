#include "util/standard_streams.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace {

bool is_null_device(int fd) {
    struct stat status;
    return fstat(fd, &status) == 0 && S_ISCHR(status.st_mode) && status.st_rdev == makedev(1, 3) &&
           (fcntl(fd, F_GETFL) & O_ACCMODE) == O_RDWR;
}

// Runs `body` in a child whose status tells what it returned.
template <typename Body>
void expect_in_child(Body body) {
    EXPECT_EXIT(_exit(body() ? 0 : 1), testing::ExitedWithCode(0), "");
}

TEST(FillStandardStreams, OpensTheNullDeviceOnThoseThatAreClosed) {
    expect_in_child([] {
        close(STDIN_FILENO);
        close(STDERR_FILENO);
        fill_standard_streams();
        return is_null_device(STDIN_FILENO) && is_null_device(STDERR_FILENO);
    });
}

TEST(FillStandardStreams, LeavesNothingElseOpen) {
    const int next = dup(STDOUT_FILENO);
    close(next);
    fill_standard_streams();
    const int same = dup(STDOUT_FILENO);
    close(same);
    EXPECT_EQ(next, same);
}

}  // namespace
