#include "oops/oops_device.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <string.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <string>

#include "oops/oopslog.h"
#include "support/oops_image.h"
#include "support/refused_calls.h"
#include "support/temp_dir.h"

namespace {

TEST(BlockDeviceSize, IsNotCutToAWord) {
    EXPECT_EQ(0u, block_device_size(0));
    EXPECT_EQ(4096u, block_device_size(8));
    EXPECT_EQ(0x100000000u, block_device_size(0x800000));
    EXPECT_EQ(0x1fffffffe00u, block_device_size(0xffffffff));
}

// Runs the applet in a child that ends with its status.
void run_and_exit(const char *path) {
    char name[] = "oopslog";
    std::string device = path;
    char *argv[] = {name, device.data(), nullptr};
    int status = run_oopslog(2, argv);
    fflush(stdout);
    _exit(status);
}

TEST(OopsDeviceDeathTest, ThatCannotBeOpenedIsAnError) {
    EXPECT_EXIT(run_and_exit("/nonexistent"), testing::ExitedWithCode(1),
                "^open: No such file or directory\n$");
}

TEST(OopsDeviceDeathTest, ThatIsNoDeviceIsTakenForFlashAndTellsNoSize) {
    TempDir dir;
    EXPECT_EXIT(run_and_exit(dir.file("image", oops_page(1, "one")).c_str()),
                testing::ExitedWithCode(1), "^MEMGETINFO: Inappropriate ioctl for device\n$");
    EXPECT_EXIT(run_and_exit(dir.path().c_str()), testing::ExitedWithCode(1),
                "^MEMGETINFO: Inappropriate ioctl for device\n$");
    EXPECT_EXIT(run_and_exit("/dev/null"), testing::ExitedWithCode(1),
                "^MEMGETINFO: Inappropriate ioctl for device\n$");
}

// From here on every call that fstat may be made of fails with EIO.
void refuse_fstat() {
#ifdef SYS_fstat64
    constexpr long NUMBERS[] = {SYS_fstat64, SYS_fstatat64, SYS_statx};
#else
    constexpr long NUMBERS[] = {SYS_fstat, SYS_newfstatat, SYS_statx};
#endif
    for (long number : NUMBERS)
        EXPECT_TRUE(refuse_call(number, EIO));
}

TEST(OopsDeviceDeathTest, WhoseStatusIsRefusedIsAnError) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    EXPECT_EXIT(
        {
            refuse_fstat();
            run_and_exit("/dev/null");
        },
        testing::ExitedWithCode(1), "^stat: Input/output error\n$");
}

}  // namespace
