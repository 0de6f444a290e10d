// What is done at a tracee's system-call stops.

#include "trace/stop_handlers.h"

#include <stdio.h>

#include "trace/format_syscall.h"

namespace {

int format_stop(TraceRequest *request, bool at_entry, pid_t pid, char *buf, size_t size,
                SyscallRecord *record) {
    return format_syscall(request, at_entry,
                          syscall_name(*trace_backend(request).abi, record->number), pid,
                          trace_process_name(request, pid), buf, size, record);
}

}  // namespace

int syscall_entry_stop(TraceRequest *request, pid_t pid, SyscallRecord *record, char *buf,
                       size_t size, TraceRegisters *regs) {
    const TraceBackend &backend = trace_backend(request);
    if (backend.read_entry(pid, regs) < 0)
        return -1;
    backend.entry_record(pid, *regs, record);
    if (!syscall_in_range(*backend.abi, record->number))
        return -1;

    int length = format_stop(request, true, pid, buf, size, record);
    const auto end = static_cast<size_t>(length);
    if (size > end + 2) {
        buf[end] = '\n';
        buf[end + 1] = '\0';
        length++;
    }
    if (record->writeback != 0)
        backend.write_back(pid, *regs, *record, true);
    return length;
}

int syscall_exit_stop(TraceRequest *request, pid_t pid, SyscallRecord *record, char *buf,
                      size_t size, TraceRegisters *regs, unsigned long *exit_record) {
    const TraceBackend &backend = trace_backend(request);
    backend.exit_record(pid, *regs, record);
    *exit_record = record->result;
    if (!syscall_in_range(*backend.abi, record->number))
        return -1;

    const int length = format_stop(request, false, pid, buf, size, record);
    if (record->writeback != 0)
        backend.write_back(pid, *regs, *record, false);
    return length;
}

void arch_writeback_sc(const TraceRequest *request, pid_t pid, const TraceRegisters &regs,
                       SyscallRecord *record) {
    (void)puts("arch_writeback_sc");
    trace_backend(request).write_back(pid, regs, *record, false);
    record->writeback = 0;
}
