// x86-64, 64-bit tracees. What a failed call leaves in its result register is a negated error
// number here, and it is shown as it stands.
#if defined(__x86_64__)

#include <errno.h>
#include <string.h>
#include <sys/ptrace.h>
#include <sys/user.h>

#include "trace/backend.h"

namespace {

// TraceRegisters holds the kernel's user_regs_struct, and behind it the word on top of the stack:
// the return address, as long as the call is made by a function that has pushed nothing.
constexpr size_t SLOT_RETURN_ADDRESS = sizeof(user_regs_struct) / sizeof(uint64_t);
static_assert(SLOT_RETURN_ADDRESS < sizeof(TraceRegisters::slot) / sizeof(uint64_t));

user_regs_struct unpack(const TraceRegisters &regs) {
    user_regs_struct user;
    memcpy(&user, regs.slot, sizeof(user));
    return user;
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
    user_regs_struct user;
    if (ptrace(PTRACE_GETREGS, pid, 0, &user) < 0)
        return -1;
    memcpy(regs->slot, &user, sizeof(user));
    unsigned long return_address = 0;
    (void)peek(pid, user.rsp, &return_address);  // stays 0 when it cannot be read
    regs->slot[SLOT_RETURN_ADDRESS] = return_address;
    return 0;
}

void entry_record(pid_t, const TraceRegisters &regs, SyscallRecord *record) {
    const user_regs_struct user = unpack(regs);
    *record = {
        .pc = user.rip,
        .ra = regs.slot[SLOT_RETURN_ADDRESS],
        .number = user.orig_rax,
        .arg = {user.rdi, user.rsi, user.rdx, user.r10, user.r8, user.r9},
        .result = user.orig_rax,
        .writeback = 0,
    };
}

void exit_record(pid_t pid, const TraceRegisters &regs, SyscallRecord *record) {
    entry_record(pid, regs, record);
    user_regs_struct now;
    if (ptrace(PTRACE_GETREGS, pid, 0, &now) < 0) {
        record->result = ~0UL;
        return;
    }
    record->arg[4] = now.r8;
    record->arg[5] = now.r9;
    record->result = now.rax;
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
};

const TraceBackend &native_backend() {
    return X86_64_BACKEND;
}

#endif
