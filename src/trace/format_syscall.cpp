// Turns a system-call stop into a line of text.

#include "trace/format_syscall.h"

#include <algorithm>
#include <array>
#include <iterator>

#include "trace/argument_styles.h"
#include "util/line_text.h"

namespace {

// How the calls of a style are shown. The patterns are format_arguments' own; the values are the
// six arguments and, as the seventh, the result.
struct StyleRow {
    ArgStyle style;
    const char *arguments;
    bool hex_result = false;
};

// The two kinds of socket calls are not here: what they show hangs on their sub-call.
constexpr StyleRow STYLE_ROWS[] = {
    {ArgStyle::GENERIC, SIX_NUMBERS},
    {ArgStyle::EXIT, "%d0)"},
    {ArgStyle::READ, "%f0, 0x%x1, %d2)"},
    {ArgStyle::WRITE, "%f0, %b12, %d2)"},
    {ArgStyle::OPEN, "%s0, %d1, %d2)"},
    {ArgStyle::CLOSE, "%f0)"},
    // The first is a decimal number behind "0x": odd, but the text of the line is what readers of
    // traces know, so it stays.
    {ArgStyle::WAITPID, "0x%d0, 0x%x1, %d2)"},
    {ArgStyle::TIME, "0x%x0)"},
    {ArgStyle::LSEEK, "%f0, %d1, %d2)"},
    {ArgStyle::PTRACE, "%r0, %u1, 0x%x2, 0x%x3)"},
    {ArgStyle::ACCESS, "%s0, 0x%h1)"},
    {ArgStyle::BRK, "0x%x0)", true},
    {ArgStyle::IOCTL, "%f0, %d1, %x2, %x3, %x4, %x5)"},
    {ArgStyle::TIMEOFDAY, "0x%x0, 0x%x1)"},
    {ArgStyle::MMAP, "0x%x0, %u1, 0x%x2, 0x%x3, %f4, %u5)", true},
    {ArgStyle::MUNMAP, "0x%x0, %u1)"},
    {ArgStyle::STAT, "%s0, 0x%x1)"},
    {ArgStyle::FSTAT, "%f0, 0x%x1)"},
    {ArgStyle::NANOSLEEP, "%P0%p1"},
    {ArgStyle::POLL, "0x%x0, %d1, %d2)"},
};

// A read that has brought something: the buffer, as long as the result.
constexpr const char *READ_DATA = "%f0, %b16, %d2)";

const StyleRow &style_row(ArgStyle style) {
    const auto *row = std::find_if(std::begin(STYLE_ROWS), std::end(STYLE_ROWS),
                                   [style](const StyleRow &r) { return r.style == style; });
    return row != std::end(STYLE_ROWS) ? *row : STYLE_ROWS[0];
}

// The arguments of `record`, a call of the style of `row` that is no socket call.
int format_plain_args(const Tracee &tracee, char *buf, size_t size, const StyleRow &row,
                      bool at_entry, const SyscallRecord &record) {
    std::array<unsigned long, 7> values;
    std::copy(std::begin(record.arg), std::end(record.arg), values.begin());
    values[6] = record.result;

    const bool data = row.style == ArgStyle::READ && !at_entry &&
                      signed_word(*tracee.backend->abi, record.result) > 0;
    return format_arguments(tracee, buf, size, data ? READ_DATA : row.arguments, values);
}

}  // namespace

int format_syscall(TraceRequest *request, bool at_entry, const char *name, pid_t pid,
                   const char *procname, char *buf, size_t size, SyscallRecord *record) {
    const TraceBackend &backend = trace_backend(request);
    const SyscallAbi &abi = *backend.abi;
    const Tracee tracee = {pid, &backend};
    const ArgStyle style = syscall_style(abi, record->number);
    const StyleRow &row = style_row(style);
    if (style == ArgStyle::SOCKETCALL)
        name = socketcall_name(record->arg[0]);

    LineText line(buf, size);
    line.add_char('[');
    line.add_decimal(pid);
    line.add_char(' ');
    line.add_text(procname);
    line.add_text("] [");
    line.add_hex(unsigned_word(abi, record->pc));
    line.add_char(' ');
    line.add_hex(unsigned_word(abi, record->ra));
    line.add_text("] ");
    line.add_text(name != nullptr ? name : "(null)");
    line.add_char('(');

    if (style == ArgStyle::SOCKETCALL) {
        // The sub-call's own arguments lie in a block at arg[1], but the line has always shown the
        // registers and stack words of the call itself, sub-call number first, in their places.
        // Readers of traces rely on that, so the block is not fetched.
        line.count(
            format_socketcall_args(tracee, line.end(), line.room(), record->arg[0], record->arg));
    } else if (style == ArgStyle::SOCKET) {
        line.count(format_socketcall_args(tracee, line.end(), line.room(),
                                          socket_subcall(abi, record->number), record->arg));
    } else {
        line.count(format_plain_args(tracee, line.end(), line.room(), row, at_entry, *record));
    }

    // The caller is told before it gets the line. When it has asked for a list of descriptors, that
    // goes through the same buffer, and what it leaves there is handed out as the line. The order
    // is known to readers of traces: an exit shows up ahead of its own line.
    if (style == ArgStyle::EXIT)
        trace_event(request, pid, TRACE_EVENT_CALL, record->arg[0], record);

    if (at_entry)
        return line.length();
    line.add_text(" = ");
    if (row.hex_result) {
        line.add_text("0x");
        line.add_hex(unsigned_word(abi, record->result));
    } else {
        line.add_decimal(signed_word(abi, record->result));
    }
    line.add_char('\n');
    return line.length();
}
