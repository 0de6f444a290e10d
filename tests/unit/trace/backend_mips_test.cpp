#include <gtest/gtest.h>

#include <vector>

#include "trace/backend.h"
#include "unit/trace/made_up_mips_kernel.h"

namespace {

constexpr pid_t PID = 99999999;  // no process has such a number

class MipsBackend : public testing::Test {
  protected:
    MipsBackend() {
        kernel.user = {{2, 4004},       {4, 0x80000001},  {5, 0x10000},     {6, 3},
                       {7, 0xfffffff0}, {29, 0x7fff1000}, {31, 0x8000b000}, {64, 0x400a10}};
        kernel.put_word(0x7fff1010, 0x55555555);
        kernel.put_word(0x7fff1014, 0x80000066);
    }

    MadeUpMipsKernel kernel;
    TraceRegisters regs = {};
    SyscallRecord record = {};
};

}  // namespace

TEST_F(MipsBackend, ReadsAllRegistersAtOnce) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    EXPECT_EQ(kernel.last_pid, PID);
    EXPECT_EQ(kernel.requests, std::vector<int>{PTRACE_GETREGS});
    EXPECT_EQ(regs.slot[2], 4004U);
    EXPECT_EQ(regs.slot[5], 0x10000U);
    EXPECT_EQ(regs.slot[6], 3U);
    EXPECT_EQ(regs.slot[29], 0x7fff1000U);
    EXPECT_EQ(regs.slot[34], 0x400a10U);
    EXPECT_EQ(regs.slot[3], 0x1111000000000003U);
    EXPECT_EQ(regs.slot[37], 0x1111000000000025U);
}

TEST_F(MipsBackend, KeepsRegistersSignExtended) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    EXPECT_EQ(regs.slot[4], 0xffffffff80000001U);
    EXPECT_EQ(regs.slot[7], 0xfffffffffffffff0U);
    EXPECT_EQ(regs.slot[31], 0xffffffff8000b000U);
}

TEST_F(MipsBackend, FailsWhenTheRegistersCannotBeRead) {
    kernel.getregs_fails = true;
    EXPECT_EQ(MIPS_BACKEND.read_entry(PID, &regs), -1);
    EXPECT_EQ(kernel.requests, std::vector<int>{PTRACE_GETREGS});
}

TEST_F(MipsBackend, MakesTheEntryRecordOf32BitWords) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    record.writeback = 1;
    MIPS_BACKEND.entry_record(PID, regs, &record);
    EXPECT_EQ(record.pc, 0x400a10U);
    EXPECT_EQ(record.ra, 0x8000b000U);
    EXPECT_EQ(record.number, 4004U);
    EXPECT_EQ(record.arg[0], 0x80000001U);
    EXPECT_EQ(record.arg[1], 0x10000U);
    EXPECT_EQ(record.arg[2], 3U);
    EXPECT_EQ(record.arg[3], 0xfffffff0U);
    EXPECT_EQ(record.arg[4], 0x55555555U);
    EXPECT_EQ(record.arg[5], 0x80000066U);
    EXPECT_EQ(record.result, 4004U);
    EXPECT_EQ(record.writeback, 0U);
}

TEST_F(MipsBackend, ShowsStackWordsThatCannotBeReadAsAllOnes) {
    kernel.memory.clear();
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    MIPS_BACKEND.entry_record(PID, regs, &record);
    EXPECT_EQ(record.arg[4], 0xffffffffU);
    EXPECT_EQ(record.arg[5], 0xffffffffU);
}

TEST_F(MipsBackend, ReadsOnlyTheResultAndTheStackWordsAtTheExit) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    kernel.user = {{2, 0xfffffffe}, {4, 1}, {5, 1}, {6, 1}, {7, 1}, {29, 1}, {31, 1}, {64, 1}};
    kernel.put_word(0x7fff1010, 77);
    kernel.put_word(0x7fff1014, 78);
    kernel.requests.clear();
    MIPS_BACKEND.exit_record(PID, regs, &record);
    EXPECT_EQ(kernel.requests,
              (std::vector<int>{PTRACE_PEEKUSER, PTRACE_PEEKDATA, PTRACE_PEEKDATA}));
    EXPECT_EQ(record.pc, 0x400a10U);
    EXPECT_EQ(record.ra, 0x8000b000U);
    EXPECT_EQ(record.number, 4004U);
    EXPECT_EQ(record.arg[0], 0x80000001U);
    EXPECT_EQ(record.arg[3], 0xfffffff0U);
    EXPECT_EQ(record.arg[4], 77U);
    EXPECT_EQ(record.arg[5], 78U);
    EXPECT_EQ(record.result, 0xfffffffeU);
}

TEST_F(MipsBackend, WritesTheNumberFirstAtAnEntry) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    record = {.number = 4004, .arg = {11, 12, 13, 14, 15, 16}, .result = 4005};
    MIPS_BACKEND.write_back(PID, regs, record, true);
    const std::vector<MadeUpMipsKernel::Poke> expected = {
        {PTRACE_POKEUSER, 2, 4005},       {PTRACE_POKEUSER, 4, 11},
        {PTRACE_POKEUSER, 5, 12},         {PTRACE_POKEUSER, 6, 13},
        {PTRACE_POKEUSER, 7, 14},         {PTRACE_POKEDATA, 0x7fff1010, 15},
        {PTRACE_POKEDATA, 0x7fff1014, 16}};
    EXPECT_EQ(kernel.pokes, expected);
}

TEST_F(MipsBackend, WritesTheResultLastAtAnExit) {
    ASSERT_EQ(MIPS_BACKEND.read_entry(PID, &regs), 0);
    record = {.number = 4004, .arg = {11, 12, 13, 14, 15, 16}, .result = 0xffffffff};
    MIPS_BACKEND.write_back(PID, regs, record, false);
    const std::vector<MadeUpMipsKernel::Poke> expected = {
        {PTRACE_POKEUSER, 4, 11},          {PTRACE_POKEUSER, 5, 12},
        {PTRACE_POKEUSER, 6, 13},          {PTRACE_POKEUSER, 7, 14},
        {PTRACE_POKEDATA, 0x7fff1010, 15}, {PTRACE_POKEDATA, 0x7fff1014, 16},
        {PTRACE_POKEUSER, 2, 0xffffffff}};
    EXPECT_EQ(kernel.pokes, expected);
}

TEST_F(MipsBackend, PeeksWordsAtAnyAddress) {
    kernel.put(0x20000, "abcdefgh");
    unsigned long word = 0;
    ASSERT_EQ(MIPS_BACKEND.peek(PID, 0x20001, &word), 0);
    EXPECT_EQ(word, 0x65646362U);
    EXPECT_EQ(MIPS_BACKEND.peek(PID, 0x20005, &word), -1);
    EXPECT_EQ(word, 0x65646362U);
}

TEST_F(MipsBackend, TellsAWordOfMinusOneFromAFailureAlsoAfterAnEarlierError) {
    kernel.put_word(0x20000, 0xffffffff);
    unsigned long word = 0;
    errno = EIO;
    ASSERT_EQ(MIPS_BACKEND.peek(PID, 0x20000, &word), 0);
    EXPECT_EQ(word, 0xffffffffU);
}
