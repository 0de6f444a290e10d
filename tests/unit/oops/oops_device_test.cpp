#include "oops/oops_device.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <string>

#include "oops/oopslog.h"
#include "support/oops_image.h"
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
void forbid_fstat() {
    sock_filter program[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
#ifdef SYS_fstat64
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_fstat64, 3, 0),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_fstatat64, 2, 0),
#else
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_fstat, 3, 0),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_newfstatat, 2, 0),
#endif
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_statx, 1, 0),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | EIO),
    };
    const sock_fprog filter = {.len = sizeof(program) / sizeof(program[0]), .filter = program};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 ||
        prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter, 0, 0) != 0)
        perror("seccomp");
}

TEST(OopsDeviceDeathTest, WhoseStatusIsRefusedIsAnError) {
    // Where the kernel knows filters it is the missing one that it complains about.
    if (prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, nullptr, 0, 0) != 0 && errno != EFAULT)
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    EXPECT_EXIT(
        {
            forbid_fstat();
            run_and_exit("/dev/null");
        },
        testing::ExitedWithCode(1), "^stat: Input/output error\n$");
}

}  // namespace
