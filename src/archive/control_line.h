// The line in which a core-image writer announces the core that follows.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

constexpr size_t CONTROL_LINE_SIZE = 256;  // bytes at most, the newline included

// The length of the core that `line`, a terminated text, announces; 0 or less for none. The number
// starts behind eight characters that mean nothing here.
int64_t control_line_core_length(const char *line);

// Stores the process ids that `line` lists, the processes which the core covers, in `pids` and
// returns how many, at most `max`. The list starts 21 characters behind the number.
int control_line_pids(const char *line, pid_t *pids, int max);
