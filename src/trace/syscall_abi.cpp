// The call, sub-call and signal tables.

#include "trace/syscall_abi.h"

#include <signal.h>

#include <array>
#include <iterator>
#include <span>
#include <string_view>

namespace {

constexpr unsigned long MIPS_FIRST_NUMBER = 4000;
constexpr const char *MIPS_NAMES[] = {
#include "trace/mips_syscall_names.inc"
};
static_assert(std::size(MIPS_NAMES) == 932);

// The names one behind the other, and where each begins. A table of pointers would be adjusted by
// the dynamic linker at every start, also of an applet that never looks at it.
template <size_t COUNT, size_t LENGTH>
struct NameTable {
    std::array<char, LENGTH> text{};
    std::array<uint16_t, COUNT> offsets{};

    constexpr explicit NameTable(const char *const (&names)[COUNT]) {
        size_t end = 0;
        for (size_t i = 0; i < COUNT; i++) {
            offsets[i] = static_cast<uint16_t>(end);
            for (const char c : std::string_view(names[i]))
                text[end++] = c;
            end++;
        }
    }
};

constexpr size_t text_length(std::span<const char *const> names) {
    size_t length = 0;
    for (const char *name : names)
        length += std::string_view(name).size() + 1;
    return length;
}
static_assert(text_length(MIPS_NAMES) <= UINT16_MAX);

constexpr NameTable<std::size(MIPS_NAMES), text_length(MIPS_NAMES)> MIPS_NAME_TABLE(MIPS_NAMES);

// What socket_subcall gives for a call that is no socket call.
constexpr uint8_t DEFAULT_SUBCALL = 2;

// A call that is shown in a style of its own, or that is a direct socket call.
struct CallRow {
    unsigned mips_number;
    std::string_view name;
    ArgStyle style;
    uint8_t subcall = DEFAULT_SUBCALL;
};

// On MIPS a row is found by its number; the name is checked. On other machines the number differs,
// and a row stands for the call of the same name. A call that has no row here is shown as six
// numbers: that is deliberate for the other socket calls, too, some of which have a sub-call here.
constexpr CallRow CALL_ROWS[] = {
    {4001, "exit", ArgStyle::EXIT},
    {4003, "read", ArgStyle::READ},
    {4004, "write", ArgStyle::WRITE},
    {4005, "open", ArgStyle::OPEN},
    {4006, "close", ArgStyle::CLOSE},
    {4007, "waitpid", ArgStyle::WAITPID},
    {4013, "time", ArgStyle::TIME},
    {4019, "lseek", ArgStyle::LSEEK},
    {4026, "ptrace", ArgStyle::PTRACE},
    {4033, "access", ArgStyle::ACCESS},
    {4045, "brk", ArgStyle::BRK},
    {4054, "ioctl", ArgStyle::IOCTL},
    {4078, "gettimeofday", ArgStyle::TIMEOFDAY},
    {4079, "settimeofday", ArgStyle::TIMEOFDAY},
    {4090, "mmap", ArgStyle::MMAP},
    {4091, "munmap", ArgStyle::MUNMAP},
    {4102, "socketcall", ArgStyle::SOCKETCALL},
    {4106, "stat", ArgStyle::STAT},
    {4107, "lstat", ArgStyle::STAT},
    {4108, "fstat", ArgStyle::FSTAT},
    {4166, "nanosleep", ArgStyle::NANOSLEEP},
    {4169, "bind", ArgStyle::SOCKET, 2},
    {4170, "connect", ArgStyle::SOCKET, 3},
    {4171, "getpeername", ArgStyle::GENERIC, 7},
    {4172, "getsockname", ArgStyle::GENERIC, 6},
    {4173, "getsockopt", ArgStyle::GENERIC, 15},
    {4174, "listen", ArgStyle::GENERIC, 4},
    {4175, "recv", ArgStyle::GENERIC, 10},
    {4176, "recvfrom", ArgStyle::SOCKET, 12},
    {4177, "recvmsg", ArgStyle::SOCKET, 17},
    {4178, "send", ArgStyle::GENERIC, 9},
    {4179, "sendmsg", ArgStyle::SOCKET, 16},
    {4180, "sendto", ArgStyle::SOCKET, 11},
    {4181, "setsockopt", ArgStyle::SOCKET, 14},
    {4182, "shutdown", ArgStyle::SOCKET, 13},
    {4183, "socket", ArgStyle::SOCKET, 1},
    {4188, "poll", ArgStyle::POLL},
    {4210, "mmap2", ArgStyle::MMAP},
    {4246, "exit_group", ArgStyle::EXIT},
};

constexpr bool row_names_match() {
    for (const CallRow &row : CALL_ROWS) {
        if (row.name != MIPS_NAMES[row.mips_number - MIPS_FIRST_NUMBER])
            return false;
    }
    return true;
}
static_assert(row_names_match());

// The rows spread out over a machine's call numbers.
template <size_t COUNT>
struct CallTable {
    std::array<ArgStyle, COUNT> styles{};  // all GENERIC at first
    std::array<uint8_t, COUNT> subcalls{};

    constexpr CallTable() { subcalls.fill(DEFAULT_SUBCALL); }

    constexpr void set(size_t index, const CallRow &row) {
        styles[index] = row.style;
        subcalls[index] = row.subcall;
    }
};

constexpr CallTable<std::size(MIPS_NAMES)> mips_call_table() {
    CallTable<std::size(MIPS_NAMES)> table;
    for (const CallRow &row : CALL_ROWS)
        table.set(row.mips_number - MIPS_FIRST_NUMBER, row);
    return table;
}

constexpr CallTable<std::size(MIPS_NAMES)> MIPS_CALLS = mips_call_table();

constexpr const char *SOCKETCALL_NAMES[32] = {
    nullptr,       "socket",     "bind",    "connect", "listen",  "accept",   "getsockname",
    "getpeername", "socketpair", "send",    "recv",    "sendto",  "recvfrom", "shutdown",
    "setsockopt",  "getsockopt", "sendmsg", "recvmsg", "accept4",
};

constexpr size_t SIGNAL_SLOTS = 32;

constexpr const char *MIPS_SIGNALS[SIGNAL_SLOTS] = {
    nullptr,   "SIGHUP",  "SIGINT",  "SIGQUIT", "SIGILL",    "SIGTRAP", "SIGIOT",  "SIGEMT",
    "SIGFPE",  "SIGKILL", "SIGBUS",  "SIGSEGV", "SIGSYS",    "SIGPIPE", "SIGALRM", "SIGTERM",
    "SIGUSR1", "SIGUSR2", "SIGCHLD", "SIGPWR",  "SIGWINCH",  "SIGURG",  "SIGIO",   "SIGSTOP",
    "SIGTSTP", "SIGCONT", "SIGTTIN", "SIGTTOU", "SIGVTALRM", "SIGPROF", "SIGXCPU", "SIGXFSZ",
};
#if defined(__mips__)
static_assert(SIGEMT == 7 && SIGBUS == 10 && SIGUSR1 == 16 && SIGCHLD == 18 && SIGSTOP == 23 &&
              SIGXFSZ == 31);
#endif

#if defined(__x86_64__)
constexpr const char *X86_64_NAMES[] = {
#include "native_syscall_names.inc"
};

static_assert(text_length(X86_64_NAMES) <= UINT16_MAX);
constexpr NameTable<std::size(X86_64_NAMES), text_length(X86_64_NAMES)> X86_64_NAME_TABLE(
    X86_64_NAMES);

constexpr CallTable<std::size(X86_64_NAMES)> x86_64_call_table() {
    CallTable<std::size(X86_64_NAMES)> table;
    for (size_t i = 0; i < std::size(X86_64_NAMES); i++) {
        for (const CallRow &row : CALL_ROWS) {
            if (row.name == X86_64_NAMES[i])
                table.set(i, row);
        }
    }
    return table;
}

constexpr CallTable<std::size(X86_64_NAMES)> X86_64_CALLS = x86_64_call_table();

constexpr const char *X86_64_SIGNALS[SIGNAL_SLOTS] = {
    nullptr,     "SIGHUP",  "SIGINT",    "SIGQUIT", "SIGILL",   "SIGTRAP", "SIGIOT",  "SIGBUS",
    "SIGFPE",    "SIGKILL", "SIGUSR1",   "SIGSEGV", "SIGUSR2",  "SIGPIPE", "SIGALRM", "SIGTERM",
    "SIGSTKFLT", "SIGCHLD", "SIGCONT",   "SIGSTOP", "SIGTSTP",  "SIGTTIN", "SIGTTOU", "SIGURG",
    "SIGXCPU",   "SIGXFSZ", "SIGVTALRM", "SIGPROF", "SIGWINCH", "SIGIO",   "SIGPWR",  "SIGSYS",
};
static_assert(SIGBUS == 7 && SIGUSR1 == 10 && SIGUSR2 == 12 && SIGCHLD == 17 && SIGSTOP == 19 &&
              SIGSYS == 31);
#endif

}  // namespace

const SyscallAbi MIPS_ABI = {
    .word_bits = 32,
    .first_number = MIPS_FIRST_NUMBER,
    .count = std::size(MIPS_NAMES),
    .name_text = MIPS_NAME_TABLE.text.data(),
    .name_offsets = MIPS_NAME_TABLE.offsets.data(),
    .styles = MIPS_CALLS.styles.data(),
    .subcalls = MIPS_CALLS.subcalls.data(),
    .signal_names = MIPS_SIGNALS,
};

#if defined(__x86_64__)
const SyscallAbi X86_64_ABI = {
    .word_bits = 64,
    .first_number = 0,
    .count = std::size(X86_64_NAMES),
    .name_text = X86_64_NAME_TABLE.text.data(),
    .name_offsets = X86_64_NAME_TABLE.offsets.data(),
    .styles = X86_64_CALLS.styles.data(),
    .subcalls = X86_64_CALLS.subcalls.data(),
    .signal_names = X86_64_SIGNALS,
};
#endif

bool syscall_in_range(const SyscallAbi &abi, unsigned long number) {
    return number - abi.first_number < abi.count;
}

const char *syscall_name(const SyscallAbi &abi, unsigned long number) {
    return abi.name_text + abi.name_offsets[number - abi.first_number];
}

ArgStyle syscall_style(const SyscallAbi &abi, unsigned long number) {
    if (!syscall_in_range(abi, number))
        return ArgStyle::GENERIC;
    return abi.styles[number - abi.first_number];
}

unsigned socket_subcall(const SyscallAbi &abi, unsigned long number) {
    if (!syscall_in_range(abi, number))
        return DEFAULT_SUBCALL;
    return abi.subcalls[number - abi.first_number];
}

const char *socketcall_name(unsigned long subcall) {
    return SOCKETCALL_NAMES[subcall & 31];
}

const char *signal_name(const SyscallAbi &abi, int signo) {
    const auto slot = static_cast<unsigned>(signo);
    if (slot >= SIGNAL_SLOTS || abi.signal_names[slot] == nullptr)
        return "Invalid";
    return abi.signal_names[slot];
}
