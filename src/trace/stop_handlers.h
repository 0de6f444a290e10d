// What is done at a tracee's system-call stops: read, format, and write back.
#pragma once

#include <stddef.h>
#include <sys/types.h>

#include "trace/trace_request.h"

// Handles the entry stop of `pid`: reads its registers into `regs` (kept for the exit stop), fills
// `record` and writes a line into `buf` of `size` bytes, with its newline if that fits as well.
// Returns the length of the whole line, which may be more than fitted, or -1 when the registers
// cannot be read or the call's number is out of range.
int syscall_entry_stop(TraceRequest *request, pid_t pid, SyscallRecord *record, char *buf,
                       size_t size, TraceRegisters *regs);

// Handles the exit stop that follows: the result goes into `exit_record` and the line ends in it.
// Returns as above, -1 for a number out of range.
int syscall_exit_stop(TraceRequest *request, pid_t pid, SyscallRecord *record, char *buf,
                      size_t size, TraceRegisters *regs, unsigned long *exit_record);

// Puts the arguments and the result of `record` back into `pid`, a tracee at an exit stop whose
// entry registers are `regs`, and clears its writeback flag; says so on standard output. For a
// formatter that cannot wait for its stop handler to do it; there is none yet.
void arch_writeback_sc(const TraceRequest *request, pid_t pid, const TraceRegisters &regs,
                       SyscallRecord *record);
