// The ways in which a trace's text and events reach its caller.

#include "trace/trace_request.h"

#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <sys/ptrace.h>

#include <algorithm>

#include "proc/descriptors.h"

namespace {

constexpr int MAX_LISTED_FDS = 1024;

// Hands out the text that describe_fd has left in the buffer, with the length that it returned.
void output_description(TraceRequest *request, int length) {
    if (request->output_cb == nullptr)
        return;
    // The length may be more than fitted. Without a text, and for a descriptor that has gone in the
    // meantime (-1), it goes out as it stands: the callback knows both as no text.
    if (length > 0) {
        const size_t present = strnlen(request->buf, request->buf_size);
        length = static_cast<int>(std::min(static_cast<size_t>(length), present));
    }
    (void)request->output_cb(request->cookie, request->buf, static_cast<uint32_t>(length));
}

}  // namespace

int pid_index(pid_t pid, const pid_t *pids, int n) {
    for (int i = 0; i < n; i++) {
        if (pids[i] == pid)
            return i;
    }
    return -1;
}

const TraceBackend &trace_backend(const TraceRequest *request) {
    return request->backend != nullptr ? *request->backend : native_backend();
}

const char *trace_process_name(const TraceRequest *request, pid_t pid) {
    const int i = pid_index(pid, request->pids, request->nr_pids);
    return i >= 0 && request->records != nullptr ? request->records[i].name : "";
}

int trace_printf(TraceRequest *request, const char *format, ...) {
    va_list args;
    va_start(args, format);
    const int length = vsnprintf(request->buf, request->buf_size, format, args);
    va_end(args);
    // The callback's wish to end the trace is asked for again after the next wait.
    if (length >= 1 && static_cast<uint32_t>(length) < request->buf_size &&
        request->output_cb != nullptr)
        (void)request->output_cb(request->cookie, request->buf, static_cast<uint32_t>(length));
    return length;
}

void trace_list_fds(TraceRequest *request, pid_t pid) {
    int fds[MAX_LISTED_FDS];
    const int count = list_fds(pid, fds, MAX_LISTED_FDS);
    SocketSnapshot sockets;
    trace_printf(request, "\n[%d %s] %d open fds:\n", pid, trace_process_name(request, pid), count);
    for (int i = 0; i < count; i++) {
        trace_printf(request, "%d\t", fds[i]);
        output_description(request,
                           describe_fd(pid, fds[i], request->buf, request->buf_size, &sockets));
        trace_printf(request, "\n");
    }
}

void trace_event(TraceRequest *request, pid_t pid, int kind, unsigned long value,
                 const SyscallRecord *record) {
    if (kind == TRACE_EVENT_STOP) {
        value = 0;
        (void)ptrace(PTRACE_GETEVENTMSG, pid, 0, &value);  // stays 0 when there is none
    }
    if ((request->flags & TRACE_LIST_FDS) != 0)
        trace_list_fds(request, pid);
    if (request->event_cb != nullptr)
        (void)request->event_cb(request, request->cookie, pid, kind, value, record);
}
