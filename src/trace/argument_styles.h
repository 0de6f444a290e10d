// The ways in which a single argument of a system call is shown.
//
// Each function writes text at `buf`, which has room for `size` bytes including the terminator, and
// returns the length that the whole text has, which may be more than fitted. `size` may be 0; then
// nothing is written. Words of the tracee are taken as its own machine's, see unsigned_word.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <span>

#include "trace/backend.h"

// The process whose memory and descriptors the arguments refer to.
struct Tracee {
    pid_t pid;
    const TraceBackend *backend;
};

// The descriptor's number and, where that can be told, what it refers to: "3 /dev/null".
int format_fd_arg(const Tracee &tracee, char *buf, size_t size, unsigned long fd);

// The string at `address` between double quotes: up to a zero byte (`len` -1) or of `len` bytes. Of
// a string, and of more than 64 bytes, 32 are shown; unreadable memory ends it early. There is no
// mark for what was left out, and quotes and backslashes stand for themselves.
int format_string_arg(const Tracee &tracee, char *buf, size_t size, unsigned long address,
                      long len);

// The two 32-bit numbers at `address`: "{ 5, 0 }" and then ", " if there is `more`, else ")".
int format_pair_arg(const Tracee &tracee, char *buf, size_t size, unsigned long address, bool more);

// The arguments that `pattern` picks out of `values`. What follows a '%' in the pattern is a letter
// and the position of a value (one digit); all else stands for itself:
//
//     %d  signed decimal             %f  format_fd_arg
//     %u  unsigned decimal           %s  format_string_arg, up to a zero byte
//     %x  hexadecimal, no prefix     %b  format_string_arg, with a second digit: its length's place
//     %h  the same, low 32 bits      %p  format_pair_arg, as the last argument
//     %r  a ptrace request, by name  %P  format_pair_arg, with more to come
//         or else as %d
int format_arguments(const Tracee &tracee, char *buf, size_t size, const char *pattern,
                     std::span<const unsigned long> values);

// The pattern of a call about whose arguments nothing is known.
inline constexpr const char *SIX_NUMBERS = "%u0, %u1, %u2, %u3, %u4, %u5)";

// The arguments `x` of socketcall sub-call `subcall`, closing parenthesis included.
int format_socketcall_args(const Tracee &tracee, char *buf, size_t size, unsigned long subcall,
                           std::span<const unsigned long, 6> x);

// Reads `len` bytes at `offset` of the memory of `pid`. Returns the number read or -1, as read_all
// does, or -1 when the memory cannot be opened.
int read_process_memory(pid_t pid, void *buf, uint32_t len, off64_t offset);
