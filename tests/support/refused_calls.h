// System calls that fail because a test wants it: the faults of a kernel that is out of memory, or
// the calls that an older one does not have.
#pragma once

#include <optional>

// One of the six arguments of a system call, from 0.
struct CallArgument {
    unsigned index;
    unsigned value;  // its lower 32 bits
};

// Whether this machine can do that; errno says why not.
bool can_refuse_calls();

// Makes a system call, or only those with this argument, fail with `error` from now on, in this
// process and in those that it starts. Says whether that is so.
bool refuse_call(long number, int error, std::optional<CallArgument> argument = std::nullopt);
