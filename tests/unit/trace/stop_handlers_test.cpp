#include "trace/stop_handlers.h"

#include <gtest/gtest.h>

#include <string>

#include "support/guarded_buffer.h"
#include "unit/trace/made_up_mips_kernel.h"

namespace {

constexpr pid_t NOBODY = 99999999;  // no process has such a number

class StopHandlers : public testing::Test {
  protected:
    StopHandlers() {
        kernel.user = {{2, 4006}, {4, 5},           {5, 0},           {6, 0},
                       {7, 0},    {29, 0x7fff1000}, {31, 0x2aab1234}, {64, 0x400a10}};
        kernel.put_word(0x7fff1010, 0);
        kernel.put_word(0x7fff1014, 0);
        strcpy(process.name, "worker");
        request.backend = &MIPS_BACKEND;
        request.pids = &pid;
        request.nr_pids = 1;
        request.records = &process;
    }

    int entry(char *buf, size_t size) {
        return syscall_entry_stop(&request, NOBODY, &record, buf, size, &process.regs);
    }
    int exit(char *buf, size_t size) {
        return syscall_exit_stop(&request, NOBODY, &record, buf, size, &process.regs,
                                 &process.exit_record);
    }

    // A machine whose every formatter changes something.
    TraceBackend changing_backend() {
        TraceBackend backend = MIPS_BACKEND;
        backend.entry_record = [](pid_t p, const TraceRegisters &regs, SyscallRecord *r) {
            MIPS_BACKEND.entry_record(p, regs, r);
            r->writeback = 1;
        };
        backend.exit_record = [](pid_t p, const TraceRegisters &regs, SyscallRecord *r) {
            MIPS_BACKEND.exit_record(p, regs, r);
            r->writeback = 1;
        };
        return backend;
    }

    MadeUpMipsKernel kernel;
    pid_t pid = NOBODY;
    TracedProcess process = {};
    TraceRequest request = {};
    SyscallRecord record = {};
    char text[256] = {};
};

}  // namespace

TEST_F(StopHandlers, WriteALineAtTheEntryAndTheWholeCallWithItsResultAtTheExit) {
    EXPECT_EQ(entry(text, sizeof(text)), 45);
    EXPECT_STREQ(text, "[99999999 worker] [400a10 2aab1234] close(5)\n");
    kernel.user[2] = 9;
    EXPECT_EQ(exit(text, sizeof(text)), 49);
    EXPECT_STREQ(text, "[99999999 worker] [400a10 2aab1234] close(5) = 9\n");
    EXPECT_EQ(process.exit_record, 9U);
    EXPECT_TRUE(kernel.pokes.empty());
}

TEST_F(StopHandlers, ShowStackArgumentsAsTheyAreAtEachStop) {
    kernel.user[2] = 4020;
    kernel.put_word(0x7fff1010, 50);
    kernel.put_word(0x7fff1014, 60);
    entry(text, sizeof(text));
    EXPECT_STREQ(text, "[99999999 worker] [400a10 2aab1234] getpid(5, 0, 0, 0, 50, 60)\n");
    kernel.put_word(0x7fff1010, 51);
    kernel.memory.erase(0x7fff1016);
    kernel.user[2] = 99;
    exit(text, sizeof(text));
    EXPECT_STREQ(text,
                 "[99999999 worker] [400a10 2aab1234] getpid(5, 0, 0, 0, 51, 4294967295) = 99\n");
}

TEST_F(StopHandlers, FailWhenTheRegistersCannotBeRead) {
    kernel.getregs_fails = true;
    EXPECT_EQ(entry(text, sizeof(text)), -1);
    EXPECT_STREQ(text, "");
}

TEST_F(StopHandlers, FailForNumbersOutsideTheTable) {
    for (uint32_t number : {0U, 3999U, 4932U, 0xffffffffU}) {
        kernel.user[2] = number;
        EXPECT_EQ(entry(text, sizeof(text)), -1) << number;
        EXPECT_EQ(exit(text, sizeof(text)), -1) << number;
        EXPECT_EQ(process.exit_record, number);
    }
    EXPECT_STREQ(text, "");
}

TEST_F(StopHandlers, TakeTheFirstAndTheLastNumberOfTheTable) {
    kernel.user[2] = 4000;
    EXPECT_GT(entry(text, sizeof(text)), 0);
    EXPECT_STREQ(text, "[99999999 worker] [400a10 2aab1234] syscall(5, 0, 0, 0, 0, 0)\n");
    kernel.user[2] = 4931;
    EXPECT_GT(entry(text, sizeof(text)), 0);
    EXPECT_STREQ(text,
                 "[99999999 worker] [400a10 2aab1234] N32_Linux_syscalls(5, 0, 0, 0, 0, 0)\n");
}

TEST_F(StopHandlers, AddTheEntryNewlineOnlyWhereMoreThanTwoBytesAreLeft) {
    // The line has 44 bytes without it.
    const std::string line = "[99999999 worker] [400a10 2aab1234] close(5)";
    GuardedBuffer buffer;
    for (size_t size = 0; size <= 60; size++) {
        char *buf = buffer.fresh(size);
        ASSERT_EQ(entry(buf, size), size > 46 ? 45 : 44) << "size " << size;
        ASSERT_TRUE(buffer.front_is_untouched(size));
        if (size > 46) {
            ASSERT_EQ(std::string(buf), line + "\n");
        } else if (size > 0) {
            ASSERT_EQ(std::string(buf), line.substr(0, size - 1));
        }
    }
}

TEST_F(StopHandlers, CutTheExitLineWithItsNewline) {
    const std::string line = "[99999999 worker] [400a10 2aab1234] close(5) = 4006\n";
    ASSERT_GT(entry(text, sizeof(text)), 0);
    expect_prefix_at_every_size(line, [this](char *buf, size_t size) { return exit(buf, size); });
}

TEST_F(StopHandlers, PutChangedArgumentsBack) {
    const TraceBackend backend = changing_backend();
    request.backend = &backend;
    kernel.put_word(0x7fff1010, 7);
    kernel.put_word(0x7fff1014, 8);
    ASSERT_GT(entry(text, sizeof(text)), 0);
    const std::vector<MadeUpMipsKernel::Poke> at_entry = {
        {PTRACE_POKEUSER, 2, 4006},      {PTRACE_POKEUSER, 4, 5}, {PTRACE_POKEUSER, 5, 0},
        {PTRACE_POKEUSER, 6, 0},         {PTRACE_POKEUSER, 7, 0}, {PTRACE_POKEDATA, 0x7fff1010, 7},
        {PTRACE_POKEDATA, 0x7fff1014, 8}};
    EXPECT_EQ(kernel.pokes, at_entry);

    kernel.pokes.clear();
    kernel.user[2] = 33;
    ASSERT_GT(exit(text, sizeof(text)), 0);
    const std::vector<MadeUpMipsKernel::Poke> at_exit = {
        {PTRACE_POKEUSER, 4, 5}, {PTRACE_POKEUSER, 5, 0},          {PTRACE_POKEUSER, 6, 0},
        {PTRACE_POKEUSER, 7, 0}, {PTRACE_POKEDATA, 0x7fff1010, 7}, {PTRACE_POKEDATA, 0x7fff1014, 8},
        {PTRACE_POKEUSER, 2, 33}};
    EXPECT_EQ(kernel.pokes, at_exit);
}

TEST_F(StopHandlers, PutNothingBackForANumberOutsideTheTable) {
    const TraceBackend backend = changing_backend();
    request.backend = &backend;
    kernel.user[2] = 3999;
    EXPECT_EQ(entry(text, sizeof(text)), -1);
    EXPECT_EQ(exit(text, sizeof(text)), -1);
    EXPECT_TRUE(kernel.pokes.empty());
}

TEST_F(StopHandlers, WriteARecordBackOnRequest) {
    ASSERT_GT(entry(text, sizeof(text)), 0);
    record = {.number = 4006, .arg = {11, 12, 13, 14, 15, 16}, .result = 17, .writeback = 1};
    testing::internal::CaptureStdout();
    arch_writeback_sc(&request, NOBODY, process.regs, &record);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "arch_writeback_sc\n");
    EXPECT_EQ(record.writeback, 0U);
    const std::vector<MadeUpMipsKernel::Poke> expected = {
        {PTRACE_POKEUSER, 4, 11},          {PTRACE_POKEUSER, 5, 12},
        {PTRACE_POKEUSER, 6, 13},          {PTRACE_POKEUSER, 7, 14},
        {PTRACE_POKEDATA, 0x7fff1010, 15}, {PTRACE_POKEDATA, 0x7fff1014, 16},
        {PTRACE_POKEUSER, 2, 17}};
    EXPECT_EQ(kernel.pokes, expected);
}
