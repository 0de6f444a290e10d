// What the two tracer applets share: their command line, and tracing what it names.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "trace/trace_request.h"
#include "util/unique_fd.h"

// Set by SIGINT once catch_interrupt has been called.
bool stop_requested();

// An output callback: writes the text to the descriptor `fd`, failed or not. Returns 1 until
// stop_requested.
uint32_t trace_write_cb(intptr_t fd, const char *text, uint32_t len);

// The path of the executable that `command` names, searched as a shell would with PATH (or a few
// usual directories when that is unset), or null. Execute permission is not looked at.
UniqueBlock<char> find_in_path(const char *command);

// Parses "[-p PID]... [COMMAND [ARG...]]" and traces the processes or else the command, with the
// callbacks and flags of `request`; the rest of it is filled in here. `usage` is printed when there
// is nothing to trace or an option is unknown. Returns the applet's exit status: 0, or 1 when the
// command cannot be found.
int run_tracer(int argc, char **argv, const char *usage, TraceRequest *request);
