// The constant tables that give names to what a tracer sees, one set for each kind of machine.
//
// The device's set (32-bit MIPS, O32) is compiled in everywhere, so that every machine can show and
// test the device's exact text.
#pragma once

#include <stddef.h>
#include <stdint.h>

// How the arguments of a call are shown. Several calls share a style where their text is the same.
enum class ArgStyle : uint8_t {
    GENERIC,  // six unsigned decimal numbers
    EXIT,
    READ,
    WRITE,
    OPEN,
    CLOSE,
    WAITPID,
    TIME,
    LSEEK,
    PTRACE,
    ACCESS,
    BRK,
    IOCTL,
    TIMEOFDAY,
    MMAP,
    MUNMAP,
    SOCKETCALL,  // the multiplexed call: argument 0 is the sub-call number
    STAT,
    FSTAT,
    NANOSLEEP,
    SOCKET,  // a direct socket call, shown as the sub-call that its number stands for
    POLL,
};

// One machine's calls and signals.
struct SyscallAbi {
    unsigned word_bits;            // 32 or 64: what a register and a pointer of a tracee hold
    unsigned long first_number;    // of the call that comes first in the tables
    unsigned long count;           // entries of each
    const char *name_text;         // all names, each terminated
    const uint16_t *name_offsets;  // where in it each begins
    const ArgStyle *styles;
    const uint8_t
        *subcalls;  // the socketcall sub-call that each direct socket call stands for, else 2
    const char *const *signal_names;  // 32 slots; an empty one is null
};

// 32-bit MIPS with the O32 calling convention: calls from 4000, signals in MIPS numbering.
extern const SyscallAbi MIPS_ABI;

#if defined(__x86_64__)
// The machine that fieldkit is developed on, with its own kernel's numbers.
extern const SyscallAbi X86_64_ABI;
#endif

// Whether `number` lies in the table. The bound is the length of the whole table and nothing else,
// so on MIPS the markers and the lists of the other two ABIs behind the O32 names count as well.
bool syscall_in_range(const SyscallAbi &abi, unsigned long number);

// The name of call `number`, which must be in range.
const char *syscall_name(const SyscallAbi &abi, unsigned long number);

// How to show the arguments of call `number`; GENERIC when out of range.
ArgStyle syscall_style(const SyscallAbi &abi, unsigned long number);

// The socketcall sub-call that the direct socket call `number` stands for; 2 for any other number.
unsigned socket_subcall(const SyscallAbi &abi, unsigned long number);

// The name of the socketcall sub-call `subcall` AND 31, or null.
const char *socketcall_name(unsigned long subcall);

// The name of signal `signo`, "Invalid" for a number without one.
const char *signal_name(const SyscallAbi &abi, int signo);

// A word of a tracee as an unsigned and as a signed number of this machine. Every word is shown
// through one of these, so that a 32-bit tracee's numbers look the same on a 64-bit machine.
inline unsigned long unsigned_word(const SyscallAbi &abi, unsigned long word) {
    return abi.word_bits == 32 ? static_cast<uint32_t>(word) : word;
}
inline long signed_word(const SyscallAbi &abi, unsigned long word) {
    return abi.word_bits == 32 ? static_cast<int32_t>(word) : static_cast<long>(word);
}
