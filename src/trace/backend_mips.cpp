// 32-bit MIPS with the O32 calling convention.

#include <errno.h>
#include <sys/ptrace.h>

#include "trace/backend.h"
#include "trace/backend_mips_ptrace.h"

namespace {

// Places in TraceRegisters, which is what PTRACE_GETREGS fills. Those of the general registers are
// their numbers, by which PTRACE_PEEKUSER and PTRACE_POKEUSER know them as well.
constexpr unsigned REG_V0 = 2;
constexpr unsigned REG_A0 = 4;
constexpr unsigned REG_SP = 29;
constexpr unsigned REG_RA = 31;
constexpr unsigned SLOT_EPC = 34;

constexpr unsigned REGISTER_ARGUMENTS = 4;  // a0 to a3; the other two are on the stack

long call_ptrace(int request, pid_t pid, unsigned long address, unsigned long data) {
    // The C library declares the request as an enumeration.
    return ptrace(static_cast<decltype(PTRACE_PEEKUSER)>(request), pid, address, data);
}

// The address of stack argument `i` (0 or 1) of the call at which `regs` were read.
unsigned long stack_argument(const TraceRegisters &regs, unsigned i) {
    return static_cast<uint32_t>(regs.slot[REG_SP] + 16 + 4 * i);
}

// A register of the user area, sign-extended. One that cannot be read is -1, as the kernel's answer
// stands.
uint64_t peek_user(pid_t pid, unsigned long number) {
    const long word = mips_ptrace(PTRACE_PEEKUSER, pid, number, 0);
    return static_cast<uint64_t>(static_cast<int64_t>(static_cast<int32_t>(word)));
}

// A stack argument; all bits set when it cannot be read.
unsigned long peek_stack_argument(pid_t pid, const TraceRegisters &regs, unsigned i) {
    return static_cast<uint32_t>(mips_ptrace(PTRACE_PEEKDATA, pid, stack_argument(regs, i), 0));
}

// The two stack arguments, which lie side by side.
void read_stack_arguments(pid_t pid, const TraceRegisters &regs, unsigned long *first,
                          unsigned long *second) {
    uint32_t words[2];
    if (read_tracee_block(pid, stack_argument(regs, 0), words, sizeof words) == sizeof words) {
        *first = words[0];
        *second = words[1];
        return;
    }
    *first = peek_stack_argument(pid, regs, 0);
    *second = peek_stack_argument(pid, regs, 1);
}

// All registers at once; the kernel sign-extends them.
int read_entry(pid_t pid, TraceRegisters *regs) {
    const auto slots = reinterpret_cast<unsigned long>(regs->slot);
    return mips_ptrace(PTRACE_GETREGS, pid, 0, slots) < 0 ? -1 : 0;
}

// What both stops show: the registers as at the entry, and the stack words as they are now.
void entry_record(pid_t pid, const TraceRegisters &regs, SyscallRecord *record) {
    const auto word = [&regs](unsigned slot) { return static_cast<uint32_t>(regs.slot[slot]); };
    record->pc = word(SLOT_EPC);
    record->ra = word(REG_RA);
    record->number = word(REG_V0);
    for (unsigned i = 0; i < REGISTER_ARGUMENTS; i++)
        record->arg[i] = word(REG_A0 + i);
    read_stack_arguments(pid, regs, &record->arg[4], &record->arg[5]);
    record->result = record->number;
    record->writeback = 0;
}

void exit_record(pid_t pid, const TraceRegisters &regs, SyscallRecord *record) {
    // The error flag in a3 is not looked at, on purpose: a failed call shows the positive error
    // number that the kernel leaves in v0.
    const auto result = static_cast<uint32_t>(peek_user(pid, REG_V0));
    entry_record(pid, regs, record);
    record->result = result;
}

// Failed pokes are not told: there is nobody who could do better than go on with the old values.
void write_back(pid_t pid, const TraceRegisters &regs, const SyscallRecord &record, bool at_entry) {
    if (at_entry)
        (void)mips_ptrace(PTRACE_POKEUSER, pid, REG_V0, record.result);
    for (unsigned i = 0; i < REGISTER_ARGUMENTS; i++)
        (void)mips_ptrace(PTRACE_POKEUSER, pid, REG_A0 + i, record.arg[i]);
    (void)mips_ptrace(PTRACE_POKEDATA, pid, stack_argument(regs, 0), record.arg[4]);
    (void)mips_ptrace(PTRACE_POKEDATA, pid, stack_argument(regs, 1), record.arg[5]);
    if (!at_entry)
        (void)mips_ptrace(PTRACE_POKEUSER, pid, REG_V0, record.result);
}

int peek(pid_t pid, unsigned long address, unsigned long *word) {
    errno = 0;
    const long value = mips_ptrace(PTRACE_PEEKDATA, pid, address, 0);
    if (value == -1 && errno != 0)
        return -1;
    *word = static_cast<uint32_t>(value);
    return 0;
}

}  // namespace

MipsPtrace mips_ptrace = call_ptrace;

const TraceBackend MIPS_BACKEND = {
    .abi = &MIPS_ABI,
    .read_entry = read_entry,
    .entry_record = entry_record,
    .exit_record = exit_record,
    .write_back = write_back,
    .peek = peek,
    .read_block = read_tracee_block,
};

#if defined(__mips__)
const TraceBackend &native_backend() {
    return MIPS_BACKEND;
}
#endif
