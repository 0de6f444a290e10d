// x86-64, 64-bit tracees. What a failed call leaves in its result register is a negated error
// number here, and it is shown as it stands.
#if defined(__x86_64__)

#include <errno.h>
#include <linux/audit.h>
#include <stddef.h>
#include <sys/ptrace.h>
#include <sys/user.h>

#include <algorithm>
#include <iterator>

#include "trace/backend.h"

namespace {

// Places in TraceRegisters.
constexpr size_t SLOT_PC = 0;
constexpr size_t SLOT_RETURN_ADDRESS = 1;
constexpr size_t SLOT_NUMBER = 2;
constexpr size_t SLOT_ARGUMENTS = 3;  // six of them

// What an entry shows, and the stack pointer.
struct EntryState {
    uint64_t pc;
    uint64_t sp;
    uint64_t number;
    uint64_t arg[6];
};

// What the kernel tells of an entry alone, which takes it less time than all registers. False where
// it does not: before 5.3, and at any stop but the entry of a 64-bit call. Of the register with the
// number it takes the lower half, as it does for the call itself.
bool read_call(pid_t pid, EntryState *state) {
    __ptrace_syscall_info info;
    if (ptrace(PTRACE_GET_SYSCALL_INFO, pid, sizeof(info), &info) <= 0 ||
        info.op != PTRACE_SYSCALL_INFO_ENTRY || info.arch != AUDIT_ARCH_X86_64)
        return false;
    state->pc = info.instruction_pointer;
    state->sp = info.stack_pointer;
    state->number = info.entry.nr;
    std::copy(std::begin(info.entry.args), std::end(info.entry.args), state->arg);
    return true;
}

// The same from the registers, at whatever stop.
bool read_registers(pid_t pid, EntryState *state) {
    user_regs_struct user;
    if (ptrace(PTRACE_GETREGS, pid, 0, &user) < 0)
        return false;
    *state = {user.rip,
              user.rsp,
              user.orig_rax,
              {user.rdi, user.rsi, user.rdx, user.r10, user.r8, user.r9}};
    return true;
}

int peek(pid_t pid, unsigned long address, unsigned long *word) {
    errno = 0;
    const long value = ptrace(PTRACE_PEEKDATA, pid, address, 0);
    if (value == -1 && errno != 0)
        return -1;
    *word = static_cast<unsigned long>(value);
    return 0;
}

int read_entry(pid_t pid, TraceRegisters *regs) {
    EntryState state;
    if (!read_call(pid, &state) && !read_registers(pid, &state))
        return -1;
    // The word on top of the stack, as long as the call is made by a function that has pushed
    // nothing. It stays 0 when it cannot be read.
    unsigned long return_address = 0;
    (void)peek(pid, state.sp, &return_address);
    regs->slot[SLOT_PC] = state.pc;
    regs->slot[SLOT_RETURN_ADDRESS] = return_address;
    regs->slot[SLOT_NUMBER] = state.number;
    std::copy(std::begin(state.arg), std::end(state.arg), regs->slot + SLOT_ARGUMENTS);
    return 0;
}

void entry_record(pid_t, const TraceRegisters &regs, SyscallRecord *record) {
    record->pc = regs.slot[SLOT_PC];
    record->ra = regs.slot[SLOT_RETURN_ADDRESS];
    record->number = regs.slot[SLOT_NUMBER];
    std::copy_n(regs.slot + SLOT_ARGUMENTS, std::size(record->arg), record->arg);
    record->result = record->number;
    record->writeback = 0;
}

void exit_record(pid_t pid, const TraceRegisters &regs, SyscallRecord *record) {
    entry_record(pid, regs, record);
    // The fifth and sixth argument are in registers, which a call leaves alone. A result that
    // cannot be read is all ones.
    const long result = ptrace(PTRACE_PEEKUSER, pid, offsetof(user_regs_struct, rax), 0);
    record->result = static_cast<unsigned long>(result);
}

// Failures are not told: there is nobody who could do better than go on with the old values.
void write_back(pid_t pid, const TraceRegisters &, const SyscallRecord &record, bool at_entry) {
    user_regs_struct user;
    if (ptrace(PTRACE_GETREGS, pid, 0, &user) < 0)
        return;
    user.rdi = record.arg[0];
    user.rsi = record.arg[1];
    user.rdx = record.arg[2];
    user.r10 = record.arg[3];
    user.r8 = record.arg[4];
    user.r9 = record.arg[5];
    (at_entry ? user.orig_rax : user.rax) = record.result;
    (void)ptrace(PTRACE_SETREGS, pid, 0, &user);
}

}  // namespace

const TraceBackend X86_64_BACKEND = {
    .abi = &X86_64_ABI,
    .read_entry = read_entry,
    .entry_record = entry_record,
    .exit_record = exit_record,
    .write_back = write_back,
    .peek = peek,
    .read_block = read_tracee_block,
};

const TraceBackend &native_backend() {
    return X86_64_BACKEND;
}

#endif
