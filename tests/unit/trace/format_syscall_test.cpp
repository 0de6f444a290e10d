#include "trace/format_syscall.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/guarded_buffer.h"
#include "unit/trace/made_up_mips_kernel.h"
#include "util/unique_fd.h"

namespace {

// No process has such a number, so its descriptors are bare numbers.
constexpr pid_t NOBODY = 99999999;

constexpr unsigned long ONES = 0xffffffff;

// Made-up memory of the process: "hi\n" at 0x10000, "/etc/missing" at 0x10010, 5 and -7 at 0x10040.
class FormatSyscall : public testing::Test {
  protected:
    FormatSyscall() {
        kernel.put(0x10000, "hi\n.......");
        kernel.put(0x10010, std::string("/etc/missing\0...", 16));
        kernel.put_word(0x10040, 5);
        kernel.put_word(0x10044, 0xfffffff9);
        request.backend = &MIPS_BACKEND;
    }

    std::string format(bool at_entry, const char *name, SyscallRecord record, pid_t pid = NOBODY) {
        char buf[1024];
        record.pc = 0x400a10;
        record.ra = 0x2aab1234;
        const int length =
            format_syscall(&request, at_entry, name, pid, "worker", buf, sizeof(buf), &record);
        EXPECT_EQ(strlen(buf), static_cast<size_t>(length));
        EXPECT_EQ(record.writeback, 0U);
        return buf;
    }

    MadeUpMipsKernel kernel;
    TraceRequest request = {};
};

std::string own_prefix() {
    char prefix[64];
    snprintf(prefix, sizeof(prefix), "[%d worker] [400a10 2aab1234] ", getpid());
    return prefix;
}

struct Example {
    const char *name;
    unsigned long number;
    std::vector<unsigned long> arg;
    unsigned long result;
    const char *entry;  // behind the prefix
    const char *exit;   // null: as at the entry
    const char *result_text;
};

SyscallRecord record_of(const Example &example) {
    SyscallRecord record = {};
    record.number = example.number;
    std::copy(example.arg.begin(), example.arg.end(), record.arg);
    record.result = example.result;
    return record;
}

class FormatSyscallExample : public FormatSyscall, public testing::WithParamInterface<Example> {};

const Example EXAMPLES[] = {
    {"exit", 4001, {0xfffffffe}, 0, "exit(-2)", nullptr, " = 0\n"},
    {"exit_group", 4246, {7}, 0, "exit_group(7)", nullptr, " = 0\n"},
    {"read",
     4003,
     {3, 0x10000, 100},
     3,
     "read(3, 0x10000, 100)",
     "read(3, \"hi\\n\", 100)",
     " = 3\n"},
    {"read", 4003, {3, 0x10000, ONES}, 1, "read(3, 0x10000, -1)", "read(3, \"h\", -1)", " = 1\n"},
    {"write", 4004, {1, 0x10000, 3}, 3, "write(1, \"hi\\n\", 3)", nullptr, " = 3\n"},
    {"write", 4004, {1, 0x10000, 0}, 0, "write(1, \"\", 0)", nullptr, " = 0\n"},
    {"write", 4004, {1, 0x10010, ONES}, 14, "write(1, \"/etc/missing\", -1)", nullptr, " = 14\n"},
    {"open", 4005, {0x10010, 577, 438}, 3, "open(\"/etc/missing\", 577, 438)", nullptr, " = 3\n"},
    {"open",
     4005,
     {0x10010, ONES, 0x80000000},
     3,
     "open(\"/etc/missing\", -1, -2147483648)",
     nullptr,
     " = 3\n"},
    {"close", 4006, {ONES}, 9, "close(-1)", nullptr, " = 9\n"},
    {"waitpid",
     4007,
     {1234, 0x7fff0000, 2},
     1234,
     "waitpid(0x1234, 0x7fff0000, 2)",
     nullptr,
     " = 1234\n"},
    {"waitpid", 4007, {ONES, 0, ONES}, 10, "waitpid(0x-1, 0x0, -1)", nullptr, " = 10\n"},
    {"time", 4013, {0xfffffff0}, 0x80000001, "time(0xfffffff0)", nullptr, " = -2147483647\n"},
    {"lseek", 4019, {3, 0xfffffff6, 1}, 90, "lseek(3, -10, 1)", nullptr, " = 90\n"},
    {"ptrace",
     4026,
     {3, 1234, 0x40, 0xdeadbeef},
     0,
     "ptrace(PTRACE_PEEKUSER, 1234, 0x40, 0xdeadbeef)",
     nullptr,
     " = 0\n"},
    {"ptrace", 4026, {7, 1234, 1, 0}, 0, "ptrace(7, 1234, 0x1, 0x0)", nullptr, " = 0\n"},
    {"ptrace", 4026, {ONES, ONES, 1, 0}, 0, "ptrace(-1, 4294967295, 0x1, 0x0)", nullptr, " = 0\n"},
    {"access",
     4033,
     {0x10010, 0x80000004},
     2,
     "access(\"/etc/missing\", 0x80000004)",
     nullptr,
     " = 2\n"},
    {"brk", 4045, {0x80000000}, 0x80001000, "brk(0x80000000)", nullptr, " = 0x80001000\n"},
    {"ioctl",
     4054,
     {1, 21505, 0xfffffff0, 2, 3, 0xab},
     0,
     "ioctl(1, 21505, fffffff0, 2, 3, ab)",
     nullptr,
     " = 0\n"},
    {"ioctl",
     4054,
     {1, 0x80047476, 1, 2, 3, 4},
     25,
     "ioctl(1, -2147191690, 1, 2, 3, 4)",
     nullptr,
     " = 25\n"},
    {"gettimeofday", 4078, {0xfffff000, 0}, 0, "gettimeofday(0xfffff000, 0x0)", nullptr, " = 0\n"},
    {"settimeofday",
     4079,
     {0x7fff0000, 0x10},
     1,
     "settimeofday(0x7fff0000, 0x10)",
     nullptr,
     " = 1\n"},
    {"mmap",
     4090,
     {0, 4096, 3, 0x802, ONES, 0xfffff000},
     0xaaaab000,
     "mmap(0x0, 4096, 0x3, 0x802, -1, 4294963200)",
     nullptr,
     " = 0xaaaab000\n"},
    {"mmap2",
     4210,
     {0x80000000, ONES, 1, 2, 5, 7},
     12,
     "mmap2(0x80000000, 4294967295, 0x1, 0x2, 5, 7)",
     nullptr,
     " = 0xc\n"},
    {"munmap", 4091, {0xaaaab000, ONES}, 0, "munmap(0xaaaab000, 4294967295)", nullptr, " = 0\n"},
    {"stat",
     4106,
     {0x10010, 0xfffffff0},
     2,
     "stat(\"/etc/missing\", 0xfffffff0)",
     nullptr,
     " = 2\n"},
    {"lstat",
     4107,
     {0x10010, 0x7fff0000},
     2,
     "lstat(\"/etc/missing\", 0x7fff0000)",
     nullptr,
     " = 2\n"},
    {"fstat", 4108, {3, 0xfffffff0}, 0, "fstat(3, 0xfffffff0)", nullptr, " = 0\n"},
    {"nanosleep", 4166, {0x10040, 0}, 4, "nanosleep({ 5, -7 }, { -1, -1 })", nullptr, " = 4\n"},
    {"bind", 4169, {4, 0xfffffff0, 16}, 0, "bind(4, 0xfffffff0, 16)", nullptr, " = 0\n"},
    {"connect", 4170, {4, 0x7fff0000, 16}, 146, "connect(4, 0x7fff0000, 16)", nullptr, " = 146\n"},
    {"recvfrom",
     4176,
     {4, 0x10000, 3, 0x40, 0x7fff0000, 0x7fff0010},
     3,
     "recvfrom(4, \"hi\\n\", 0x40, 0x7fff0000, 0x7fff0010)",
     nullptr,
     " = 3\n"},
    {"recvmsg", 4177, {4, 0x7fff0000, ONES}, 3, "recvmsg(4, 0x7fff0000, -1)", nullptr, " = 3\n"},
    {"sendmsg",
     4179,
     {4, 0x7fff0000, 0x4040},
     3,
     "sendmsg(4, 0x7fff0000, 4040)",
     nullptr,
     " = 3\n"},
    {"sendto",
     4180,
     {4, 0x10000, 3, 0x40, 0x7fff0000, 16},
     3,
     "sendto(4, \"hi\\n\", 3, 0x40, 0x7fff0000, 16)",
     nullptr,
     " = 3\n"},
    {"setsockopt",
     4181,
     {4, 65535, 4, 0x7fff0000, 4},
     0,
     "setsockopt(4, 65535, 4, 0x7fff0000, 0x4)",
     nullptr,
     " = 0\n"},
    {"shutdown", 4182, {4, 2}, 134, "shutdown(4, 2)", nullptr, " = 134\n"},
    {"socket", 4183, {2, 2, ONES}, 4, "socket(2, 2, 4294967295)", nullptr, " = 4\n"},
    {"poll", 4188, {0xfffffff0, 1, ONES}, 1, "poll(0xfffffff0, 1, -1)", nullptr, " = 1\n"},
    // Everything else is six numbers, the other direct socket calls too.
    {"getpid",
     4020,
     {1, 2, 3, 4, 5, ONES},
     ONES,
     "getpid(1, 2, 3, 4, 5, 4294967295)",
     nullptr,
     " = -1\n"},
    {"accept", 4168, {4, 0, 0, 1, 2, 3}, 5, "accept(4, 0, 0, 1, 2, 3)", nullptr, " = 5\n"},
    {"getpeername", 4171, {4, 16}, 0, "getpeername(4, 16, 0, 0, 0, 0)", nullptr, " = 0\n"},
    {"send", 4178, {4, 65536, 3}, 3, "send(4, 65536, 3, 0, 0, 0)", nullptr, " = 3\n"},
    {"read", 4337, {3, 65536, 3}, 3, "read(3, 65536, 3, 0, 0, 0)", nullptr, " = 3\n"},
    {"open64", 4931, {3}, 3, "open64(3, 0, 0, 0, 0, 0)", nullptr, " = 3\n"},
};

}  // namespace

TEST_P(FormatSyscallExample, IsShownAsWrittenDown) {
    const Example &example = GetParam();
    const std::string prefix = "[99999999 worker] [400a10 2aab1234] ";
    EXPECT_EQ(format(true, example.name, record_of(example)), prefix + example.entry);
    EXPECT_EQ(
        format(false, example.name, record_of(example)),
        prefix + (example.exit != nullptr ? example.exit : example.entry) + example.result_text);
}

INSTANTIATE_TEST_SUITE_P(EveryStyle, FormatSyscallExample, testing::ValuesIn(EXAMPLES),
                         [](const testing::TestParamInfo<Example> &param) {
                             return std::string(param.param.name) + "_" +
                                    std::to_string(param.index);
                         });

TEST_F(FormatSyscall, ShowsAWriteOfThreeBytesWithItsDescriptorAndText) {
    const UniqueFd null(open("/dev/null", O_WRONLY | O_CLOEXEC));
    ASSERT_EQ(dup2(null.get(), 201), 201);
    const SyscallRecord record = {.number = 4004, .arg = {201, 0x10000, 3}, .result = 3};
    const std::string line = own_prefix() + "write(201 /dev/null, \"hi\\n\", 3)";
    EXPECT_EQ(format(true, "write", record, getpid()), line);
    EXPECT_EQ(format(false, "write", record, getpid()), line + " = 3\n");
    close(201);
}

TEST_F(FormatSyscall, ShowsThePositiveErrorNumberOfAFailedOpen) {
    const SyscallRecord record = {.number = 4005, .arg = {0x10010, 0, 0}, .result = 2};
    EXPECT_EQ(format(false, "open", record),
              "[99999999 worker] [400a10 2aab1234] open(\"/etc/missing\", 0, 0) = 2\n");
}

TEST_F(FormatSyscall, ShowsTheBufferAddressOfAReadThatBroughtNothing) {
    SyscallRecord record = {.number = 4003, .arg = {3, 0x10000, 3}, .result = 0};
    EXPECT_EQ(format(false, "read", record),
              "[99999999 worker] [400a10 2aab1234] read(3, 0x10000, 3) = 0\n");
    record.result = 0xffffffff;
    EXPECT_EQ(format(false, "read", record),
              "[99999999 worker] [400a10 2aab1234] read(3, 0x10000, 3) = -1\n");
    record.result = 0x80000000;
    EXPECT_EQ(format(false, "read", record),
              "[99999999 worker] [400a10 2aab1234] read(3, 0x10000, 3) = -2147483648\n");
}

TEST_F(FormatSyscall, ShowsTheBareNumberOfAnInvalidDescriptor) {
    const SyscallRecord record = {.number = 4006, .arg = {1023}, .result = 9};
    EXPECT_EQ(format(false, "close", record, getpid()), own_prefix() + "close(1023) = 9\n");
}

TEST_F(FormatSyscall, ShowsMmap2AndBrkResultsInHexadecimal) {
    const SyscallRecord map = {.number = 4210, .arg = {}, .result = 0x2aaab000};
    EXPECT_EQ(format(false, "mmap2", map),
              "[99999999 worker] [400a10 2aab1234] mmap2(0x0, 0, 0x0, 0x0, 0, 0) = 0x2aaab000\n");
    const SyscallRecord brk = {.number = 4045, .arg = {}, .result = 0xf0000000};
    EXPECT_EQ(format(false, "brk", brk),
              "[99999999 worker] [400a10 2aab1234] brk(0x0) = 0xf0000000\n");
}

TEST_F(FormatSyscall, ShowsAPtraceContinueAsTheNumberSeven) {
    const SyscallRecord record = {.number = 4026, .arg = {7, 4711, 0, 23}, .result = 0};
    EXPECT_EQ(format(true, "ptrace", record),
              "[99999999 worker] [400a10 2aab1234] ptrace(7, 4711, 0x0, 0x17)");
}

TEST_F(FormatSyscall, ShowsSocketcallBySubcallNameWithTheRawRegisters) {
    const std::pair<unsigned long, const char *> subcalls[] = {
        {0, "(null)(0, 65536, 3, 64, 2147483664, 16)"},
        {1, "socket(1, 65536, 3)"},
        {2, "bind(2, 0x10000, 3)"},
        {3, "connect(3, 0x10000, 3)"},
        {4, "listen(4, 65536, 3, 64, 2147483664, 16)"},
        {5, "accept(5, 65536, 3, 64, 2147483664, 16)"},
        {6, "getsockname(6, 65536, 3, 64, 2147483664, 16)"},
        {7, "getpeername(7, 65536, 3, 64, 2147483664, 16)"},
        {8, "socketpair(8, 65536, 3, 64, 2147483664, 16)"},
        {9, "send(9, 65536, 3, 64, 2147483664, 16)"},
        {10, "recv(10, 65536, 3, 64, 2147483664, 16)"},
        {11, "sendto(11, \"hi\\n\", 3, 0x40, 0x80000010, 16)"},
        {12, "recvfrom(12, \"hi\\n\", 0x40, 0x80000010, 0x10)"},
        {13, "shutdown(13, 65536)"},
        {14, "setsockopt(14, 65536, 3, 0x40, 0x80000010)"},
        {15, "getsockopt(15, 65536, 3, 64, 2147483664, 16)"},
        {16, "sendmsg(16, 0x10000, 3)"},
        {17, "recvmsg(17, 0x10000, 3)"},
        {18, "accept4(18, 65536, 3, 64, 2147483664, 16)"},
        {19, "(null)(19, 65536, 3, 64, 2147483664, 16)"},
        {31, "(null)(31, 65536, 3, 64, 2147483664, 16)"},
        {32, "(null)(32, 65536, 3, 64, 2147483664, 16)"},
        // The name looks at five bits only, the arguments at the whole number.
        {33, "socket(33, 65536, 3, 64, 2147483664, 16)"},
        {50, "accept4(50, 65536, 3, 64, 2147483664, 16)"},
        {51, "(null)(51, 65536, 3, 64, 2147483664, 16)"},
    };
    for (const auto &[subcall, text] : subcalls) {
        const SyscallRecord record = {
            .number = 4102, .arg = {subcall, 0x10000, 3, 0x40, 0x80000010, 16}, .result = 0};
        const std::string line = std::string("[99999999 worker] [400a10 2aab1234] ") + text;
        EXPECT_EQ(format(true, "socketcall", record), line);
        EXPECT_EQ(format(false, "socketcall", record), line + " = 0\n");
    }
}

TEST_F(FormatSyscall, ShowsAnEmptyProcessName) {
    SyscallRecord record = {.pc = 1, .ra = 0xffffffff, .number = 4013, .arg = {}, .result = 0};
    char buf[64];
    format_syscall(&request, true, "time", 42, "", buf, sizeof(buf), &record);
    EXPECT_STREQ(buf, "[42 ] [1 ffffffff] time(0x0)");
}

TEST_F(FormatSyscall, FitsALineIntoAnySpace) {
    const SyscallRecord record = {.number = 4054, .arg = {1, 2, 3, 4, 5, 6}, .result = 25};
    expect_prefix_at_every_size(
        "[99999999 worker] [0 0] ioctl(1, 2, 3, 4, 5, 6) = 25\n", [&](char *buf, size_t size) {
            SyscallRecord copy = record;
            return format_syscall(&request, false, "ioctl", NOBODY, "worker", buf, size, &copy);
        });
}

TEST_F(FormatSyscall, KeepsAStringWithinAnySpaceAndGoesOnBehindIt) {
    const std::string full = "[99999999 worker] [0 0] open(\"/etc/missing\", 1, 2) = 3\n";
    GuardedBuffer buffer;
    for (size_t size = 0; size <= full.size() + 8; size++) {
        SyscallRecord record = {.number = 4005, .arg = {0x10010, 1, 2}, .result = 3};
        char *buf = buffer.fresh(size);
        const int length =
            format_syscall(&request, false, "open", NOBODY, "worker", buf, size, &record);
        ASSERT_TRUE(buffer.front_is_untouched(size));
        // The opening quote is at 29; a character needs room for three more, so all twelve are
        // there from 29 + 12 + 3 + 1 on.
        const size_t shown = size < 33 ? 0 : std::min<size_t>(size - 33, 12);
        std::string expected = full;
        expected.erase(30 + shown, 12 - shown);
        ASSERT_EQ(length, static_cast<int>(expected.size())) << "size " << size;
        if (size > 0) {
            ASSERT_EQ(std::string(buf), expected.substr(0, size - 1)) << "size " << size;
        }
    }
}

TEST_F(FormatSyscall, TellsOfAnExitAtEntryAndExitAlike) {
    struct Event {
        const TraceRequest *request;
        intptr_t cookie;
        pid_t pid;
        int kind;
        unsigned long value;
        const SyscallRecord *record;
    };
    static std::vector<Event> events;
    events.clear();
    request.cookie = 33;
    request.event_cb = [](TraceRequest *r, intptr_t cookie, pid_t pid, int kind,
                          unsigned long value, const SyscallRecord *record) -> uint32_t {
        events.push_back({r, cookie, pid, kind, value, record});
        return 0;
    };
    char buf[128];
    SyscallRecord record = {.number = 4246, .arg = {0xfffffff7}, .result = 0};
    format_syscall(&request, true, "exit_group", NOBODY, "worker", buf, sizeof(buf), &record);
    ASSERT_EQ(events.size(), 1U);
    EXPECT_EQ(events[0].request, &request);
    EXPECT_EQ(events[0].cookie, 33);
    EXPECT_EQ(events[0].pid, NOBODY);
    EXPECT_EQ(events[0].kind, 2);
    EXPECT_EQ(events[0].value, 0xfffffff7U);
    EXPECT_EQ(events[0].record, &record);

    format_syscall(&request, false, "exit_group", NOBODY, "worker", buf, sizeof(buf), &record);
    record.number = 4001;
    format_syscall(&request, true, "exit", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_EQ(events.size(), 3U);

    record.number = 4006;
    format_syscall(&request, true, "close", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_EQ(events.size(), 3U);
}

TEST_F(FormatSyscall, HandsOutWhatTheListOfDescriptorsLeftInTheBufferForAnExitLine) {
    static std::string output;
    output.clear();
    request.output_cb = [](intptr_t, const char *text, uint32_t len) -> uint32_t {
        output.append(text, len);
        return 1;
    };
    char buf[256] = {};
    request.buf = buf;
    request.buf_size = sizeof(buf);
    request.flags = TRACE_LIST_FDS;
    // A process that is not there has no descriptors.
    SyscallRecord record = {.pc = 16, .ra = 17, .number = 4001, .arg = {5}, .result = 0};
    const int length =
        format_syscall(&request, false, "exit", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_EQ(output, "\n[99999999 ] 0 open fds:\n");
    // "[99999999 worker] [10 11] exit(5)" has been written first and is 33 bytes long; then the
    // list's heading of 25 bytes and its terminator over it; then the result at 33.
    EXPECT_EQ(length, 38);
    EXPECT_EQ(std::string(buf, 39), std::string("\n[99999999 ] 0 open fds:\n\0exit(5) = 0\n", 39));
}

#if defined(__x86_64__)
TEST_F(FormatSyscall, ShowsAllBitsOfA64BitTracee) {
    TraceBackend backend = MIPS_BACKEND;
    backend.abi = &X86_64_ABI;
    request.backend = &backend;
    SyscallRecord record = {.pc = 0x7f0000001000,
                            .ra = 0x55550000abcd,
                            .number = 8,
                            .arg = {3, 0x100000000, ~0UL},
                            .result = ~0UL - 8};
    char buf[256];
    format_syscall(&request, false, "lseek", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_STREQ(buf,
                 "[99999999 worker] [7f0000001000 55550000abcd] lseek(3, 4294967296, -1) = -9\n");
    record.number = 12;
    format_syscall(&request, false, "brk", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_STREQ(buf,
                 "[99999999 worker] [7f0000001000 55550000abcd] brk(0x3) = 0xfffffffffffffff7\n");
    record.number = 21;
    record.arg[0] = 0x10010;
    format_syscall(&request, true, "access", NOBODY, "worker", buf, sizeof(buf), &record);
    EXPECT_STREQ(buf,
                 "[99999999 worker] [7f0000001000 55550000abcd] access(\"/etc/missing\", 0x0)");
}
#endif
