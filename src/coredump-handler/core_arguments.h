// The command line that the kernel starts the core-dump handler with.
#pragma once

#include <stdint.h>

// Checks the command line, and whether the size limit of the process allows for a core of at least
// one page.
//
// Returns true when the core is to be delivered. Otherwise false, with the reason in the system log
// and the handler's exit status in `*status`: 0 when cores are disabled, 1 for arguments that are
// wrong. With less than two arguments after the applet's name nothing is checked.
bool check_core_arguments(int argc, char **argv, int *status);

// Takes the whole of `text` for a decimal number. Returns false, with nothing of use in `*limit`,
// when it is none or too large. A sign is part of a number: -1 is the largest one, no limit.
bool parse_size_limit(const char *text, uint64_t *limit);

// The name to store the core under: the first argument, or "core.core" without any.
const char *core_name(int argc, char **argv);
