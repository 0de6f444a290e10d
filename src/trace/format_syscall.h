// Turns a system-call stop into a line of text.
#pragma once

#include <stddef.h>
#include <sys/types.h>

#include "trace/trace_request.h"

// Writes "[PID PROCNAME] [PC RA] NAME(ARGUMENTS)" for the call in `record` into `buf` of `size`
// bytes and, unless `at_entry`, " = RESULT" and a newline behind it. `name` stands for the call's
// own name; the multiplexed socket call shows its sub-call's. A call of exit or exit_group tells
// `request`'s caller of the exit first (trace_event), which may use the same buffer.
//
// Returns the length of the whole text, which may be more than fitted.
int format_syscall(TraceRequest *request, bool at_entry, const char *name, pid_t pid,
                   const char *procname, char *buf, size_t size, SyscallRecord *record);
