// What the two tracer applets share: their command line, and tracing what it names.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "trace/trace_request.h"
#include "util/unique_fd.h"

// Set by SIGINT once run_tracer has begun to trace.
bool stop_requested();

// Sleeps until stop_requested. Only while run_tracer traces, which lets no SIGINT be missed.
void sleep_until_stop_requested();

// An output callback: writes the text to the descriptor `fd`, failed or not. Returns 1 until
// stop_requested.
uint32_t trace_write_cb(intptr_t fd, const char *text, uint32_t len);

// The path of the executable that `command` names, searched in the directories of PATH (or a few
// usual directories when that is unset), or null. Execute permission is not looked at.
UniqueBlock<char> find_in_path(const char *command);

// The words behind the applet's name: "[-p PID]... [COMMAND [ARG...]]".
struct TracerOptions {
    UniqueBlock<pid_t> pids;
    int nr_pids = 0;
    char **command = nullptr;  // null-terminated, within `argv`; null when there is none
};

// Parses the command line. Returns 0, -EINVAL when the usage is to be shown, or -ENOMEM.
int parse_tracer_options(int argc, char **argv, TracerOptions *options);

// Parses the command line and traces the processes or else the command, with the callbacks and
// flags of `request`; the rest of it is filled in here. `usage` is printed when there is nothing to
// trace or an option is unknown. Returns the applet's exit status: 0, or 1 when the command cannot
// be found or the set-up fails.
int run_tracer(int argc, char **argv, const char *usage, TraceRequest *request);
