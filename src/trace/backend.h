// The narrow seam behind which everything lies that depends on the processor.
//
// To port the tracer, write one TraceBackend and one SyscallAbi, and name them in native_backend().
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "trace/syscall_abi.h"

// The registers of a tracee at a system-call entry, kept from there to the exit. What a slot holds
// is the backend's business; on MIPS this is the kernel's PTRACE_GETREGS layout (the 32 general
// registers, lo, hi, epc, badvaddr, status, cause).
struct TraceRegisters {
    uint64_t slot[38];
};

// One system-call stop, as the formatter sees it. Words are the tracee's, zero-extended when they
// are shorter than an unsigned long.
struct SyscallRecord {
    unsigned long pc = 0;       // program counter
    unsigned long ra = 0;       // return address
    unsigned long number = 0;   // of the call, as at its entry
    unsigned long arg[6] = {};  // the fifth and sixth are read afresh at the exit
    unsigned long result = 0;   // at entry: the number again
    uint32_t writeback = 0;     // set by a formatter that changed arguments: put them back
};

// What the tracer asks of the machine. `pid` is a tracee of the calling thread, and stopped. The
// functions print nothing; those that return int give 0, or -1 with errno set.
struct TraceBackend {
    const SyscallAbi *abi;

    // Reads the registers at an entry stop into `regs`. -1 when they cannot be read.
    int (*read_entry)(pid_t pid, TraceRegisters *regs);

    // Fills `record` from `regs` and the stack words, for an entry stop. The number is not checked.
    void (*entry_record)(pid_t pid, const TraceRegisters &regs, SyscallRecord *record);

    // The same for the exit stop that follows: what the entry had, except for the result and the
    // stack words, which are read now.
    void (*exit_record)(pid_t pid, const TraceRegisters &regs, SyscallRecord *record);

    // Puts the arguments and the result of `record` back into the tracee. At an entry the result
    // stands for the call's number.
    void (*write_back)(pid_t pid, const TraceRegisters &regs, const SyscallRecord &record,
                       bool at_entry);

    // Reads the word at `address`, which need not be aligned, of the tracee's memory. -1 with errno
    // set when any of its bytes cannot be read.
    int (*peek)(pid_t pid, unsigned long address, unsigned long *word);

    // Reads at most `len` bytes at `address` into `buf` with one system call and returns how many
    // came, or -1. Bytes that can be peeked may be missing from the first one on that is hard to
    // read. Null where there is no such call.
    ssize_t (*read_block)(pid_t pid, unsigned long address, void *buf, size_t len);
};

// read_block for every machine; -1 on kernels before 3.2.
ssize_t read_tracee_block(pid_t pid, unsigned long address, void *buf, size_t len);

extern const TraceBackend MIPS_BACKEND;
#if defined(__x86_64__)
extern const TraceBackend X86_64_BACKEND;
#endif

// The backend of the machine that this was built for.
const TraceBackend &native_backend();
