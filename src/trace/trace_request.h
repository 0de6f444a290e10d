// One trace: what a caller asks for, and the ways in which text and events reach the caller.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "trace/backend.h"

struct TraceRequest;

// Bits of TraceRequest::flags.
constexpr uint32_t TRACE_SYSCALLS = 1;    // a line at every system-call entry and exit
constexpr uint32_t TRACE_SIGNALS = 2;     // a line when a process stops with a signal
constexpr uint32_t TRACE_EXIT_EVENT = 4;  // stop, and notify, at a process's exit
constexpr uint32_t TRACE_LIST_FDS = 8;    // list descriptors at an exit, and of all at the end

// Kinds of exit notification.
constexpr int TRACE_EVENT_STOP = 1;  // value: the kernel's exit status word
constexpr int TRACE_EVENT_CALL = 2;  // value: the first argument of the exit call

// Receives a piece of text, or none (`len` 0) as a poll after every wait; a `len` that is negative
// as a signed number is no text either. Returns 0 to end the trace.
using TraceOutputCb = uint32_t (*)(intptr_t cookie, const char *text, uint32_t len);

// Told of an exit. `record` is null for TRACE_EVENT_STOP. The result is not looked at.
using TraceEventCb = uint32_t (*)(TraceRequest *request, intptr_t cookie, pid_t pid, int kind,
                                  unsigned long value, const SyscallRecord *record);

constexpr int TRACED_NAME_SIZE = 32;

// What the engine knows of one traced process.
struct TracedProcess {
    char name[TRACED_NAME_SIZE];  // last path component of its first command-line word, or empty
    uint32_t in_syscall;          // bit 0: the last system-call stop was an entry
    bool stop_told;               // it was let go on with a signal, which may stop it
    bool held;                    // left in the stop that such a signal made, until SIGCONT
    bool released;                // at the end: let go of
    TraceRegisters regs;          // as at that entry
    unsigned long exit_record;    // the result word of the last exit stop
};

// Filled in by the caller of trace_run; zero is a good start for all that it does not set.
struct TraceRequest {
    TraceOutputCb output_cb;  // null: text is dropped
    TraceEventCb event_cb;    // null: events are dropped
    intptr_t cookie;          // handed to both
    TracedProcess *records;   // the engine's, one per entry of `pids`, while it runs
    uint32_t flags;
    pid_t *pids;  // entries of -1 are skipped; the engine sets an ended one to -1
    int32_t nr_pids;
    int32_t timeout_s;            // the trace ends after so many seconds; 0 or less: no limit
    uint32_t attached;            // the caller is already the tracer of `pids`, which are stopped
    char *buf;                    // null, or text buffer from malloc, freed by the engine
    uint32_t buf_size;            // 0, or its size
    const TraceBackend *backend;  // null: this machine's own; tests put in another
};

// The position of the first of the `n` entries of `pids` that equals `pid`, or -1.
int pid_index(pid_t pid, const pid_t *pids, int n);

// The backend of `request`.
const TraceBackend &trace_backend(const TraceRequest *request);

// The name of the traced process `pid`; empty when it is not known.
const char *trace_process_name(const TraceRequest *request, pid_t pid);

// Formats a piece of text into the request's buffer and hands it to output_cb. Text that does not
// fit the buffer is dropped whole. Returns the formatted length.
int trace_printf(TraceRequest *request, const char *format, ...)
    __attribute__((format(printf, 2, 3)));

// Hands a list of the open descriptors of `pid` to output_cb, piece by piece.
void trace_list_fds(TraceRequest *request, pid_t pid);

// Tells the caller of an exit of `pid`: lists its descriptors if TRACE_LIST_FDS asks for it, then
// calls event_cb. For TRACE_EVENT_STOP the value is read from the kernel and `value` is not used.
void trace_event(TraceRequest *request, pid_t pid, int kind, unsigned long value,
                 const SyscallRecord *record);
