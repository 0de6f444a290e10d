// The backend of the machine that the test runs on, against its real kernel.
#include <errno.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/user.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>

#include "trace/backend.h"

extern "C" char __executable_start, etext;

namespace {

// Read in the child's memory.
volatile unsigned char child_bytes[] = {0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff,
                                        0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x08};

// A child that runs `body` and exits with its result, stopped at the entry of its first system call
// `number` there.
class Child {
  public:
    Child(long number, const std::function<long()> &body) {
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            ptrace(PTRACE_TRACEME, 0, 0, 0);
            kill(getpid(), SIGSTOP);
            syscall(SYS_exit_group, body());
        }
        EXPECT_EQ(waitpid(pid_, &status_, 0), pid_);
        EXPECT_EQ(ptrace(PTRACE_SETOPTIONS, pid_, 0, PTRACE_O_TRACESYSGOOD | PTRACE_O_EXITKILL), 0);
        // A sanitizer makes calls of its own ahead of it.
        for (int calls = 0; calls < 100; calls++) {
            next_stop();
            TraceRegisters regs = {};
            SyscallRecord record;
            EXPECT_EQ(native_backend().read_entry(pid_, &regs), 0);
            native_backend().entry_record(pid_, regs, &record);
            if (record.number == static_cast<unsigned long>(number))
                return;
            next_stop();
        }
        ADD_FAILURE() << "call " << number << " has not been seen";
    }
    ~Child() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    Child(const Child &) = delete;
    Child &operator=(const Child &) = delete;

    pid_t pid() const { return pid_; }

    // Goes on to the next system-call stop.
    void next_stop() {
        EXPECT_EQ(ptrace(PTRACE_SYSCALL, pid_, 0, 0), 0);
        EXPECT_EQ(waitpid(pid_, &status_, 0), pid_);
        EXPECT_TRUE(WIFSTOPPED(status_) && WSTOPSIG(status_) == (SIGTRAP | 0x80));
    }

    int exit_status() {
        EXPECT_EQ(ptrace(PTRACE_CONT, pid_, 0, 0), 0);
        EXPECT_EQ(waitpid(pid_, &status_, 0), pid_);
        EXPECT_TRUE(WIFEXITED(status_));
        return WEXITSTATUS(status_);
    }

  private:
    pid_t pid_;
    int status_ = 0;
};

long ask_for_parent() {
    return syscall(SYS_getppid, 11, 12, 13, 14, 15, 16);
}

bool in_program(unsigned long address) {
    return address >= reinterpret_cast<unsigned long>(&__executable_start) &&
           address < reinterpret_cast<unsigned long>(&etext);
}

const TraceBackend &backend = native_backend();

}  // namespace

TEST(NativeBackend, ShowsARealCallAtItsEntryAndExit) {
    Child child(SYS_getppid, ask_for_parent);
    TraceRegisters regs = {};
    SyscallRecord entry = {};
    entry.writeback = 1;
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    backend.entry_record(child.pid(), regs, &entry);
    EXPECT_EQ(entry.number, static_cast<unsigned long>(SYS_getppid));
    EXPECT_EQ(entry.result, static_cast<unsigned long>(SYS_getppid));
    EXPECT_EQ(entry.writeback, 0U);
    for (unsigned long i = 0; i < 6; i++)
        EXPECT_EQ(entry.arg[i], 11 + i);
    EXPECT_NE(entry.pc, 0U);
    EXPECT_FALSE(in_program(entry.pc));
#if defined(__mips__)
    // There syscall() does not make the call itself but in a routine that returns into it.
    EXPECT_NE(entry.ra, 0U);
#else
    EXPECT_TRUE(in_program(entry.ra)) << std::hex << entry.ra;
#endif
    EXPECT_STREQ(syscall_name(*backend.abi, entry.number), "getppid");

    child.next_stop();
    SyscallRecord exit = {};
    backend.exit_record(child.pid(), regs, &exit);
    EXPECT_EQ(exit.result, static_cast<unsigned long>(getpid()));
    EXPECT_EQ(exit.number, entry.number);
    EXPECT_EQ(exit.pc, entry.pc);
    EXPECT_EQ(exit.ra, entry.ra);
    for (unsigned long i = 0; i < 6; i++)
        EXPECT_EQ(exit.arg[i], 11 + i);
}

TEST(NativeBackend, ShowsAFailureAsTheKernelLeavesIt) {
    Child child(SYS_close, [] { return syscall(SYS_close, -1); });
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    child.next_stop();
    backend.exit_record(child.pid(), regs, &record);
#if defined(__mips__)
    EXPECT_EQ(signed_word(*backend.abi, record.result), EBADF);
#else
    EXPECT_EQ(signed_word(*backend.abi, record.result), -EBADF);
#endif
}

TEST(NativeBackend, PutsAChangedResultBack) {
    Child child(SYS_getppid, ask_for_parent);
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    child.next_stop();
    backend.exit_record(child.pid(), regs, &record);
    record.result = 77;
#if defined(__mips__)
    record.arg[3] = 0;  // a3, which by now tells the process whether the call has failed
#endif
    backend.write_back(child.pid(), regs, record, false);
    EXPECT_EQ(child.exit_status(), 77);
}

TEST(NativeBackend, PutsChangedArgumentsBack) {
    Child child(SYS_exit_group, [] { return syscall(SYS_exit_group, 1); });
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    backend.entry_record(child.pid(), regs, &record);
    record.arg[0] = 78;
    backend.write_back(child.pid(), regs, record, true);
    EXPECT_EQ(child.exit_status(), 78);
}

TEST(NativeBackend, PutsAllArgumentsBack) {
    Child child(SYS_getppid, ask_for_parent);
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    backend.entry_record(child.pid(), regs, &record);
    for (unsigned long i = 0; i < 6; i++)
        record.arg[i] = 21 + i;
    backend.write_back(child.pid(), regs, record, true);
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    backend.entry_record(child.pid(), regs, &record);
    EXPECT_EQ(record.number, static_cast<unsigned long>(SYS_getppid));
    for (unsigned long i = 0; i < 6; i++)
        EXPECT_EQ(record.arg[i], 21 + i);
}

TEST(NativeBackend, CannotReadTheRegistersOfAStranger) {
    TraceRegisters regs = {};
    EXPECT_EQ(backend.read_entry(99999999, &regs), -1);
}

TEST(NativeBackend, PeeksMemoryAtAnyAddress) {
    Child child(SYS_getppid, ask_for_parent);
    const auto address = reinterpret_cast<unsigned long>(&child_bytes);
    unsigned long word = 0;
    ASSERT_EQ(backend.peek(child.pid(), address + 7, &word), 0);
    EXPECT_EQ(word & 0xffffffff, 0x030201ffU);
    errno = EIO;
    ASSERT_EQ(backend.peek(child.pid(), address, &word), 0);
    EXPECT_EQ(word & 0xffffffff, 0xffffffffU);
}

TEST(NativeBackend, CannotPeekWhereNothingIsMapped) {
    const auto page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    void *pages =
        mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(pages, MAP_FAILED);
    ASSERT_EQ(munmap(static_cast<char *>(pages) + page, page), 0);
    Child child(SYS_getppid, ask_for_parent);
    const unsigned long end = reinterpret_cast<unsigned long>(pages) + page;
    unsigned long word = 55;
    EXPECT_EQ(backend.peek(child.pid(), end - sizeof(long), &word), 0);
    EXPECT_EQ(word, 0U);
    word = 55;
    EXPECT_EQ(backend.peek(child.pid(), end - 1, &word), -1);
    EXPECT_NE(errno, 0);
    EXPECT_EQ(backend.peek(child.pid(), 0, &word), -1);
    EXPECT_EQ(word, 55U);
    munmap(pages, page);
}

#if defined(__x86_64__)
TEST(NativeBackend, HasNoReturnAddressWhereTheStackCannotBeRead) {
    Child child(SYS_getppid, ask_for_parent);
    user_regs_struct user;
    ASSERT_EQ(ptrace(PTRACE_GETREGS, child.pid(), 0, &user), 0);
    user.rsp = 8;
    ASSERT_EQ(ptrace(PTRACE_SETREGS, child.pid(), 0, &user), 0);
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    backend.entry_record(child.pid(), regs, &record);
    EXPECT_EQ(record.ra, 0U);
    EXPECT_EQ(record.arg[0], 11U);
}

namespace {

// What read_entry makes of a stop, against all registers and a peek.
void expect_as_in_registers(pid_t pid) {
    user_regs_struct user;
    ASSERT_EQ(ptrace(PTRACE_GETREGS, pid, 0, &user), 0);
    errno = 0;
    long word = ptrace(PTRACE_PEEKDATA, pid, user.rsp, 0);
    if (errno != 0)
        word = 0;
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(pid, &regs), 0);
    backend.entry_record(pid, regs, &record);
    EXPECT_EQ(record.pc, user.rip);
    EXPECT_EQ(record.ra, static_cast<unsigned long>(word));
    EXPECT_EQ(record.number, user.orig_rax);
    EXPECT_EQ(record.result, user.orig_rax);
    const unsigned long arguments[] = {user.rdi, user.rsi, user.rdx, user.r10, user.r8, user.r9};
    for (size_t i = 0; i < 6; i++)
        EXPECT_EQ(record.arg[i], arguments[i]) << i;
}

// At the stop that the child is at, and those that follow.
void expect_as_in_registers_at(Child *child, int stops) {
    for (int stop = 0; stop < stops; stop++) {
        SCOPED_TRACE(stop);
        expect_as_in_registers(child->pid());
        child->next_stop();
    }
}

}  // namespace

TEST(NativeBackend, ShowsWhatTheRegistersHoldAtEntriesAndExits) {
    Child child(SYS_getppid, [] {
        ask_for_parent();
        syscall(SYS_close, -1L, 1L << 63, ~0UL >> 1, 0x80000000L, -2L, 0xffffffffL);
        syscall(-1L, 1, 2, 3, 4, 5, 6);
        syscall(0x12345678L, 1, 2, 3, 4, 5, 6);
        return syscall(SYS_execve, nullptr, nullptr, nullptr);
    });
    expect_as_in_registers_at(&child, 9);
}

TEST(NativeBackend, ShowsWhatTheRegistersHoldInAProgramThatHasReplacedAnother) {
    Child child(SYS_execve, [] {
        sigset_t all;
        sigfillset(&all);
        sigprocmask(SIG_SETMASK, &all, nullptr);  // keeps back the SIGTRAP of the execve
        char path[] = "/proc/self/exe", option[] = "--gtest_list_tests";
        char *argv[] = {path, option, nullptr}, *env[] = {nullptr};
        return execve(path, argv, env);
    });
    expect_as_in_registers_at(&child, 12);
}

TEST(NativeBackend, ShowsWhatTheRegistersHoldOfA32BitCall) {
    Child child(SYS_getppid, [] {
        ask_for_parent();
        long result = 20;  // that call's number of getpid
        asm volatile("int $0x80"
                     : "+a"(result)
                     : "b"(1), "c"(2), "d"(3)
                     : "r8", "r9", "r10", "r11", "memory");
        return result;
    });
    child.next_stop();
    ASSERT_EQ(ptrace(PTRACE_SYSCALL, child.pid(), 0, 0), 0);
    int status = 0;
    ASSERT_EQ(waitpid(child.pid(), &status, 0), child.pid());
    if (WIFSTOPPED(status) && WSTOPSIG(status) == SIGSEGV)
        GTEST_SKIP() << "this kernel has no 32-bit calls";
    ASSERT_TRUE(WIFSTOPPED(status) && WSTOPSIG(status) == (SIGTRAP | 0x80));
    expect_as_in_registers(child.pid());
    child.next_stop();
    expect_as_in_registers(child.pid());
}

TEST(NativeBackend, ReadsTheReturnAddressUpToTheEndOfMemoryAndNotBeyond) {
    const auto page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    void *pages =
        mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(pages, MAP_FAILED);
    ASSERT_EQ(munmap(static_cast<char *>(pages) + page, page), 0);
    memset(pages, 0x5a, page);
    ASSERT_EQ(mprotect(pages, page, PROT_NONE), 0);  // a tracer may read it all the same
    Child child(SYS_getppid, ask_for_parent);
    for (unsigned long from_end : {8, 7, 1, 0}) {
        user_regs_struct user;
        ASSERT_EQ(ptrace(PTRACE_GETREGS, child.pid(), 0, &user), 0);
        user.rsp = reinterpret_cast<unsigned long>(pages) + page - from_end;
        ASSERT_EQ(ptrace(PTRACE_SETREGS, child.pid(), 0, &user), 0);
        TraceRegisters regs = {};
        SyscallRecord record = {};
        ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
        backend.entry_record(child.pid(), regs, &record);
        EXPECT_EQ(record.ra, from_end == 8 ? 0x5a5a5a5a5a5a5a5aU : 0U);
    }
    munmap(pages, page);
}

// The kernel looks at no more of it, but before 5.13 refused what has more.
TEST(NativeBackend, NamesACallByTheLowerHalfOfItsNumber) {
    Child child(SYS_getppid, [] {
        ask_for_parent();
        return syscall(SYS_getppid | 1L << 32);
    });
    child.next_stop();
    child.next_stop();
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    child.next_stop();
    backend.exit_record(child.pid(), regs, &record);
    if (static_cast<long>(record.result) == -ENOSYS)
        GTEST_SKIP() << "this kernel looks at the whole number";
    EXPECT_EQ(record.number, static_cast<unsigned long>(SYS_getppid));
}

TEST(NativeBackend, ShowsTheArgumentsOfTheEntryAtTheExit) {
    Child child(SYS_getppid, ask_for_parent);
    TraceRegisters regs = {};
    SyscallRecord record = {};
    ASSERT_EQ(backend.read_entry(child.pid(), &regs), 0);
    child.next_stop();
    user_regs_struct user;
    ASSERT_EQ(ptrace(PTRACE_GETREGS, child.pid(), 0, &user), 0);
    user.rdi = 91;
    user.r10 = 94;
    user.r8 = 95;
    user.r9 = 96;
    ASSERT_EQ(ptrace(PTRACE_SETREGS, child.pid(), 0, &user), 0);
    backend.exit_record(child.pid(), regs, &record);
    EXPECT_EQ(record.arg[0], 11U);
    EXPECT_EQ(record.arg[3], 14U);
    EXPECT_EQ(record.arg[4], 15U);
    EXPECT_EQ(record.arg[5], 16U);
}
#endif
