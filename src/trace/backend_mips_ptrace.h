// The one way in which the MIPS backend reaches the kernel; internal to that backend and its tests.
//
// The backend is compiled on every machine but can only be run on its own, so a test on another
// machine puts a made-up kernel in here.
#pragma once

#include <sys/types.h>

// As ptrace(2) of the C library: peeks return the word, sign-extended where a long is wider, and
// set errno when they fail; other requests return 0 or -1.
using MipsPtrace = long (*)(int request, pid_t pid, unsigned long address, unsigned long data);

extern MipsPtrace mips_ptrace;
