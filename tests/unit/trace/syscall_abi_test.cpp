#include "trace/syscall_abi.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>

#include <string>

namespace {

bool mips_has(unsigned long number) {
    return syscall_in_range(MIPS_ABI, number);
}

std::string mips_name(unsigned long number) {
    EXPECT_TRUE(mips_has(number));
    return syscall_name(MIPS_ABI, number);
}

}  // namespace

TEST(MipsSyscallNames, NameTheCallsThatMatterMost) {
    EXPECT_EQ(mips_name(4001), "exit");
    EXPECT_EQ(mips_name(4246), "exit_group");
    EXPECT_EQ(mips_name(4102), "socketcall");
    EXPECT_EQ(mips_name(4210), "mmap2");
    EXPECT_EQ(mips_name(4332), "perf_counter_open");
    EXPECT_EQ(mips_name(4000), "syscall");
}

TEST(MipsSyscallNames, GoOnBehindTheO32ListWithMarkersAndTheOtherTwoLists) {
    EXPECT_EQ(mips_name(4333), "Linux_syscalls");
    EXPECT_EQ(mips_name(4334), "O32_Linux");
    EXPECT_EQ(mips_name(4335), "O32_Linux_syscalls");
    EXPECT_EQ(mips_name(4336), "Linux");
    EXPECT_EQ(mips_name(4337), "read");
    EXPECT_EQ(mips_name(4628), "perf_counter_open");
    EXPECT_EQ(mips_name(4629), "Linux_syscalls");
    EXPECT_EQ(mips_name(4630), "64_Linux");
    EXPECT_EQ(mips_name(4631), "64_Linux_syscalls");
    EXPECT_EQ(mips_name(4632), "Linux");
    EXPECT_EQ(mips_name(4633), "read");
    EXPECT_EQ(mips_name(4928), "perf_counter_open");
    EXPECT_EQ(mips_name(4929), "Linux_syscalls");
    EXPECT_EQ(mips_name(4930), "N32_Linux");
    EXPECT_EQ(mips_name(4931), "N32_Linux_syscalls");
}

TEST(MipsSyscallNames, KeepThePlaceholdersOfTheGaps) {
    EXPECT_EQ(mips_name(4018), "unused18");
    EXPECT_EQ(mips_name(4028), "unused28");
    EXPECT_EQ(mips_name(4059), "unused59");
    EXPECT_EQ(mips_name(4082), "reserved82");
    EXPECT_EQ(mips_name(4084), "unused84");
    EXPECT_EQ(mips_name(4109), "unused109");
    EXPECT_EQ(mips_name(4150), "unused150");
    EXPECT_EQ(mips_name(4221), "reserved221");
    EXPECT_EQ(mips_name(4337 + 177), "reserved177");
    EXPECT_EQ(mips_name(4337 + 193), "reserved193");
    EXPECT_EQ(mips_name(4633 + 177), "reserved177");
    EXPECT_EQ(mips_name(4633 + 193), "reserved193");
}

TEST(MipsSyscallNames, EndAt3999And4932) {
    EXPECT_FALSE(mips_has(3999));
    EXPECT_TRUE(mips_has(4000));
    EXPECT_TRUE(mips_has(4931));
    EXPECT_FALSE(mips_has(4932));
    EXPECT_FALSE(mips_has(0));
    EXPECT_FALSE(mips_has(931));
    EXPECT_FALSE(mips_has(0xffffffff));
}

// The 32-bit FNV-1a sum of the device's 932 names in order, a newline behind each, as it was worked
// out from the list outside this program.
TEST(MipsSyscallNames, AreTheDevicesOwnToTheLetter) {
    uint32_t sum = 2166136261;
    size_t bytes = 0;
    for (unsigned long number = 4000; number <= 4931; number++) {
        for (char c : mips_name(number) + "\n") {
            sum = (sum ^ static_cast<unsigned char>(c)) * 16777619;
            bytes++;
        }
    }
    EXPECT_EQ(bytes, 8922U);
    EXPECT_EQ(sum, 0x1f8e8dc2U);
}

TEST(SocketcallNames, AreThoseOfTheKernel) {
    const char *const names[] = {
        "socket",      "bind",       "connect",    "listen",  "accept",  "getsockname",
        "getpeername", "socketpair", "send",       "recv",    "sendto",  "recvfrom",
        "shutdown",    "setsockopt", "getsockopt", "sendmsg", "recvmsg", "accept4"};
    for (unsigned long i = 0; i < 18; i++)
        EXPECT_STREQ(socketcall_name(i + 1), names[i]);
}

TEST(SocketcallNames, AreMissingForZeroAndAboveEighteenAfterMasking) {
    EXPECT_EQ(socketcall_name(0), nullptr);
    for (unsigned long i = 19; i < 32; i++)
        EXPECT_EQ(socketcall_name(i), nullptr) << i;
    EXPECT_EQ(socketcall_name(32), nullptr);
    EXPECT_EQ(socketcall_name(32 + 31), nullptr);
}

TEST(SocketcallNames, LookAtTheLowestFiveBitsOnly) {
    EXPECT_STREQ(socketcall_name(32 + 1), "socket");
    EXPECT_STREQ(socketcall_name(64 + 18), "accept4");
    EXPECT_STREQ(socketcall_name(0xffffffe2), "bind");
}

TEST(SocketSubcall, MapsTheDirectCalls) {
    const unsigned map[][2] = {{4169, 2},  {4170, 3},  {4171, 7},  {4172, 6},  {4173, 15},
                               {4174, 4},  {4175, 10}, {4176, 12}, {4177, 17}, {4178, 9},
                               {4179, 16}, {4180, 11}, {4181, 14}, {4182, 13}, {4183, 1}};
    for (const auto &row : map)
        EXPECT_EQ(socket_subcall(MIPS_ABI, row[0]), row[1]) << row[0];
}

TEST(SocketSubcall, IsTwoForAnyOtherNumber) {
    for (unsigned long number : {0UL, 3999UL, 4000UL, 4102UL, 4168UL, 4184UL, 4931UL, 4932UL})
        EXPECT_EQ(socket_subcall(MIPS_ABI, number), 2U) << number;
}

TEST(MipsStyles, BelongToExactlyTheseCalls) {
    const std::pair<unsigned long, ArgStyle> styles[] = {
        {4001, ArgStyle::EXIT},      {4003, ArgStyle::READ},       {4004, ArgStyle::WRITE},
        {4005, ArgStyle::OPEN},      {4006, ArgStyle::CLOSE},      {4007, ArgStyle::WAITPID},
        {4013, ArgStyle::TIME},      {4019, ArgStyle::LSEEK},      {4026, ArgStyle::PTRACE},
        {4033, ArgStyle::ACCESS},    {4045, ArgStyle::BRK},        {4054, ArgStyle::IOCTL},
        {4078, ArgStyle::TIMEOFDAY}, {4079, ArgStyle::TIMEOFDAY},  {4090, ArgStyle::MMAP},
        {4091, ArgStyle::MUNMAP},    {4102, ArgStyle::SOCKETCALL}, {4106, ArgStyle::STAT},
        {4107, ArgStyle::STAT},      {4108, ArgStyle::FSTAT},      {4166, ArgStyle::NANOSLEEP},
        {4169, ArgStyle::SOCKET},    {4170, ArgStyle::SOCKET},     {4176, ArgStyle::SOCKET},
        {4177, ArgStyle::SOCKET},    {4179, ArgStyle::SOCKET},     {4180, ArgStyle::SOCKET},
        {4181, ArgStyle::SOCKET},    {4182, ArgStyle::SOCKET},     {4183, ArgStyle::SOCKET},
        {4188, ArgStyle::POLL},      {4210, ArgStyle::MMAP},       {4246, ArgStyle::EXIT},
    };
    const auto *next = std::begin(styles);
    for (unsigned long number = 3990; number < 4950; number++) {
        ArgStyle expected = ArgStyle::GENERIC;
        if (next != std::end(styles) && next->first == number)
            expected = next++->second;
        EXPECT_EQ(syscall_style(MIPS_ABI, number), expected) << number;
    }
    EXPECT_EQ(next, std::end(styles));
}

TEST(SignalName, UsesTheDevicesNumbers) {
    const char *const names[] = {
        "Invalid", "SIGHUP",  "SIGINT",  "SIGQUIT", "SIGILL",    "SIGTRAP", "SIGIOT",  "SIGEMT",
        "SIGFPE",  "SIGKILL", "SIGBUS",  "SIGSEGV", "SIGSYS",    "SIGPIPE", "SIGALRM", "SIGTERM",
        "SIGUSR1", "SIGUSR2", "SIGCHLD", "SIGPWR",  "SIGWINCH",  "SIGURG",  "SIGIO",   "SIGSTOP",
        "SIGTSTP", "SIGCONT", "SIGTTIN", "SIGTTOU", "SIGVTALRM", "SIGPROF", "SIGXCPU", "SIGXFSZ"};
    for (int i = 0; i < 32; i++)
        EXPECT_STREQ(signal_name(MIPS_ABI, i), names[i]) << i;
}

TEST(SignalName, IsInvalidForZeroThirtyTwoAndNegativeNumbers) {
    EXPECT_STREQ(signal_name(MIPS_ABI, 0), "Invalid");
    EXPECT_STREQ(signal_name(MIPS_ABI, 32), "Invalid");
    EXPECT_STREQ(signal_name(MIPS_ABI, 33), "Invalid");
    EXPECT_STREQ(signal_name(MIPS_ABI, -1), "Invalid");
    EXPECT_STREQ(signal_name(MIPS_ABI, INT32_MIN), "Invalid");
    EXPECT_STREQ(signal_name(MIPS_ABI, 0x80 | 5), "Invalid");
}

TEST(Words, OfA32BitTraceeLookTheSameOnEveryMachine) {
    EXPECT_EQ(signed_word(MIPS_ABI, 0xffffffff), -1);
    EXPECT_EQ(signed_word(MIPS_ABI, 0x80000000), -2147483647L - 1);
    EXPECT_EQ(signed_word(MIPS_ABI, 0x7fffffff), 2147483647);
    EXPECT_EQ(unsigned_word(MIPS_ABI, 0xffffffff), 0xffffffff);
    EXPECT_EQ(unsigned_word(MIPS_ABI, ~0UL), 0xffffffff);
}

#if defined(__x86_64__)
TEST(X86_64Syscalls, HaveTheKernelsNumbers) {
    EXPECT_STREQ(syscall_name(X86_64_ABI, SYS_read), "read");
    EXPECT_STREQ(syscall_name(X86_64_ABI, SYS_execve), "execve");
    EXPECT_STREQ(syscall_name(X86_64_ABI, SYS_exit_group), "exit_group");
    EXPECT_STREQ(syscall_name(X86_64_ABI, SYS_pidfd_open), "pidfd_open");
    EXPECT_STREQ(syscall_name(X86_64_ABI, 0), "read");
    EXPECT_STREQ(syscall_name(X86_64_ABI, 59), "execve");
    EXPECT_STREQ(syscall_name(X86_64_ABI, 231), "exit_group");
    EXPECT_STREQ(syscall_name(X86_64_ABI, 434), "pidfd_open");
}

TEST(X86_64Syscalls, NameTheHolesInTheirNumbers) {
    EXPECT_STREQ(syscall_name(X86_64_ABI, 400), "unused400");
}

TEST(X86_64Syscalls, EndWithTheTable) {
    EXPECT_TRUE(syscall_in_range(X86_64_ABI, 0));
    EXPECT_TRUE(syscall_in_range(X86_64_ABI, X86_64_ABI.count - 1));
    EXPECT_FALSE(syscall_in_range(X86_64_ABI, X86_64_ABI.count));
    EXPECT_FALSE(syscall_in_range(X86_64_ABI, ~0UL));
    EXPECT_GT(X86_64_ABI.count, 434U);
}

TEST(X86_64Syscalls, HaveTheStylesOfTheirNames) {
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_read), ArgStyle::READ);
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_mmap), ArgStyle::MMAP);
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_exit_group), ArgStyle::EXIT);
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_sendto), ArgStyle::SOCKET);
    EXPECT_EQ(socket_subcall(X86_64_ABI, SYS_sendto), 11U);
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_getpeername), ArgStyle::GENERIC);
    EXPECT_EQ(socket_subcall(X86_64_ABI, SYS_getpeername), 7U);
    EXPECT_EQ(syscall_style(X86_64_ABI, SYS_getpid), ArgStyle::GENERIC);
    EXPECT_EQ(socket_subcall(X86_64_ABI, SYS_getpid), 2U);
    EXPECT_EQ(syscall_style(X86_64_ABI, ~0UL), ArgStyle::GENERIC);
}

TEST(X86_64Signals, HaveTheKernelsNumbers) {
    EXPECT_STREQ(signal_name(X86_64_ABI, 7), "SIGBUS");
    EXPECT_STREQ(signal_name(X86_64_ABI, 19), "SIGSTOP");
    EXPECT_STREQ(signal_name(X86_64_ABI, 23), "SIGURG");
    EXPECT_STREQ(signal_name(X86_64_ABI, 31), "SIGSYS");
    EXPECT_STREQ(signal_name(X86_64_ABI, 0), "Invalid");
    EXPECT_STREQ(signal_name(X86_64_ABI, 32), "Invalid");
}

TEST(Words, OfA64BitTraceeKeepAllTheirBits) {
    EXPECT_EQ(signed_word(X86_64_ABI, 0xffffffff), 4294967295L);
    EXPECT_EQ(signed_word(X86_64_ABI, ~0UL), -1);
    EXPECT_EQ(unsigned_word(X86_64_ABI, ~0UL), ~0UL);
}
#endif
