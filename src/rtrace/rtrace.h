// The resource trace: what processes and system use, pass after pass, as a stream of records.
#pragma once

#include <stdint.h>

struct Rtrace;

// A trace of `items` (see trace_items.h) every `interval` seconds onto `fd`, which stays the
// caller's. Null when memory is short.
Rtrace *rtrace_create(int fd, int32_t interval, uint32_t items);

// Runs the trace until a write to its descriptor fails, the other end of that was closed where
// nothing is written, there is no memory to read a file into, or the wait for the probe programs
// fails. Nothing is printed. All probe programs have ended when it returns.
void rtrace_run(Rtrace *trace);

// Releases `trace`, which may be null.
void rtrace_free(Rtrace *trace);
