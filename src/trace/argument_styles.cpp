// The ways in which a single argument of a system call is shown.

#include "trace/argument_styles.h"

#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>

#include "proc/descriptors.h"
#include "util/line_text.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

// A counted string is shown whole up to the first length, and longer ones up to the second.
constexpr long WHOLE_STRING_MAX = 64;
constexpr long CUT_STRING_LENGTH = 32;

constexpr long ZERO_TERMINATED = -1;

struct SubcallRow {
    unsigned long subcall;
    const char *pattern;
};

constexpr SubcallRow SUBCALL_ROWS[] = {
    {1, "%u0, %u1, %u2)"},                       // socket
    {2, "%f0, 0x%x1, %d2)"},                     // bind
    {3, "%f0, 0x%x1, %d2)"},                     // connect
    {11, "%f0, %b12, %d2, 0x%x3, 0x%x4, %d5)"},  // sendto
    {12, "%f0, %b12, 0x%x3, 0x%x4, 0x%x5)"},     // recvfrom
    {13, "%f0, %d1)"},                           // shutdown
    {14, "%f0, %d1, %d2, 0x%x3, 0x%x4)"},        // setsockopt
    {16, "%f0, 0x%x1, %h2)"},                    // sendmsg
    {17, "%f0, 0x%x1, %d2)"},                    // recvmsg
};

struct RequestRow {
    unsigned long request;
    const char *name;
};

// Those that were there from the beginning; all others are shown as numbers, on purpose.
constexpr RequestRow PTRACE_REQUESTS[] = {
    {1, "PTRACE_PEEKTEXT"}, {2, "PTRACE_PEEKDATA"}, {3, "PTRACE_PEEKUSER"}, {4, "PTRACE_POKETEXT"},
    {5, "PTRACE_POKEDATA"}, {6, "PTRACE_POKEUSER"}, {16, "PTRACE_ATTACH"},  {24, "PTRACE_SYSCALL"},
};

int peek_byte(const Tracee &tracee, unsigned long address, unsigned char *byte) {
    unsigned long word = 0;
    if (tracee.backend->peek(tracee.pid, unsigned_word(*tracee.backend->abi, address), &word) < 0)
        return -1;
    *byte = static_cast<unsigned char>(word);  // the machines are little-endian
    return 0;
}

// The bytes of a string, of which most are read at once. What comes out is what peeks alone would
// give: one word for each byte, so that a string that ends less than a word before unreadable
// memory loses its last bytes.
class StringBytes {
  public:
    StringBytes(const Tracee &tracee, unsigned long address, long limit)
        : tracee_(tracee), address_(address) {
        const auto word_size = static_cast<long>(tracee.backend->abi->word_bits / 8);
        if (tracee.backend->read_block == nullptr)
            return;
        const ssize_t got =
            tracee.backend->read_block(tracee.pid, unsigned_word(*tracee.backend->abi, address),
                                       block_, static_cast<size_t>(limit + word_size - 1));
        known_ = got - word_size + 1;
    }

    // The bytes before this position, at most `limit`, are in block(), the others are to be peeked.
    long known() const { return known_; }
    const unsigned char *block() const { return block_; }

    // The byte at position `i`. -1 when it cannot be read.
    int peek(long i, unsigned char *byte) const {
        return peek_byte(tracee_, address_ + static_cast<unsigned long>(i), byte);
    }

  private:
    const Tracee &tracee_;
    unsigned long address_;
    long known_ = 0;  // the bytes of the block whose words are in it
    unsigned char block_[WHOLE_STRING_MAX + sizeof(unsigned long) - 1];
};

// The 32-bit number at `address`; -1, like any other -1, when it cannot be read.
int32_t peek_int(const Tracee &tracee, unsigned long address) {
    unsigned long word = 0;
    if (tracee.backend->peek(tracee.pid, unsigned_word(*tracee.backend->abi, address), &word) < 0)
        return -1;
    return static_cast<int32_t>(word);
}

constexpr size_t LONGEST_CHAR = 4;  // "\xff"

bool is_printable(unsigned char c) {
    return c >= ' ' && c <= '~';
}

// Writes the text for a character that is not printable at `out`; returns the end of it.
char *put_escaped(char *out, unsigned char c) {
    *out++ = '\\';
    if (c == '\n' || c == '\r' || c == '\t') {
        *out++ = c == '\n' ? 'n' : c == '\r' ? 'r' : 't';
        return out;
    }
    *out++ = 'x';
    return std::to_chars(out, out + 2, c, 16).ptr;
}

void add_ptrace_request(LineText *line, const SyscallAbi &abi, unsigned long request) {
    for (const RequestRow &row : PTRACE_REQUESTS) {
        if (row.request == request) {
            line->add_text(row.name);
            return;
        }
    }
    line->add_decimal(signed_word(abi, request));
}

// Adds the value that the directive at `directive`, behind its '%', asks for. Returns the number of
// characters that the directive has.
int add_value(LineText *line, const Tracee &tracee, const char *directive,
              std::span<const unsigned long> values) {
    const SyscallAbi &abi = *tracee.backend->abi;
    const auto value_at = [&](int i) { return values[static_cast<size_t>(directive[i] - '0')]; };
    const unsigned long value = value_at(1);
    switch (directive[0]) {
        case 'd':
            line->add_decimal(signed_word(abi, value));
            break;
        case 'u':
            line->add_unsigned(unsigned_word(abi, value));
            break;
        case 'x':
            line->add_hex(unsigned_word(abi, value));
            break;
        case 'h':
            line->add_hex(static_cast<unsigned>(value));
            break;
        case 'r':
            add_ptrace_request(line, abi, value);
            break;
        case 'f':
            line->count(format_fd_arg(tracee, line->end(), line->room(), value));
            break;
        case 's':
            line->count(
                format_string_arg(tracee, line->end(), line->room(), value, ZERO_TERMINATED));
            break;
        case 'b':
            line->count(format_string_arg(tracee, line->end(), line->room(), value,
                                          signed_word(abi, value_at(2))));
            return 3;
        case 'p':
        case 'P':
            line->count(
                format_pair_arg(tracee, line->end(), line->room(), value, directive[0] == 'P'));
            break;
    }
    return 2;
}

}  // namespace

int format_fd_arg(const Tracee &tracee, char *buf, size_t size, unsigned long fd) {
    const int number = static_cast<int>(fd);
    char description[128];
    LineText line(buf, size);
    // The length that is returned may be more than fitted: the terminator counts.
    const bool known = describe_fd(tracee.pid, number, description, sizeof(description)) >= 1;
    line.add_decimal(number);
    if (known) {
        line.add_char(' ');
        line.add_text(description);
    }
    return line.length();
}

int format_string_arg(const Tracee &tracee, char *buf, size_t size, unsigned long address,
                      long len) {
    LineText line(buf, size);
    line.add_char('"');
    if (len == ZERO_TERMINATED || len >= 1) {
        const bool cut = len == ZERO_TERMINATED || len > WHOLE_STRING_MAX;
        const long limit = cut ? CUT_STRING_LENGTH : len;
        const StringBytes bytes(tracee, address, limit);
        const long known = bytes.known();
        char text[WHOLE_STRING_MAX * LONGEST_CHAR];
        char *end = text;
        // Room is kept for the opening quote, a character, the closing quote and the terminator.
        // The longest form of a character takes more: then the closing quote is what does not fit.
        const char *full = text + std::min(size > 4 ? size - 4 : 0, sizeof(text));
        const auto add = [&end, full, len](unsigned char c) {
            if (end >= full || (c == '\0' && len == ZERO_TERMINATED))
                return false;
            if (is_printable(c))
                *end++ = static_cast<char>(c);
            else
                end = put_escaped(end, c);
            return true;
        };
        long i = 0;
        while (i < known && add(bytes.block()[i]))
            i++;
        unsigned char c = 0;
        while (i >= known && i < limit && bytes.peek(i, &c) == 0 && add(c))
            i++;
        line.add_bytes(text, static_cast<size_t>(end - text));
    }
    line.add_char('"');
    return line.length();
}

int format_pair_arg(const Tracee &tracee, char *buf, size_t size, unsigned long address,
                    bool more) {
    const int32_t first = peek_int(tracee, address);
    const int32_t second = peek_int(tracee, address + 4);
    LineText line(buf, size);
    line.add("{ %d, %d }%s", first, second, more ? ", " : ")");
    return line.length();
}

int format_arguments(const Tracee &tracee, char *buf, size_t size, const char *pattern,
                     std::span<const unsigned long> values) {
    LineText line(buf, size);
    for (const char *p = pattern; *p != '\0';) {
        if (*p == '%') {
            p++;
            p += add_value(&line, tracee, p, values);
        } else {
            line.add_char(*p++);
        }
    }
    return line.length();
}

int format_socketcall_args(const Tracee &tracee, char *buf, size_t size, unsigned long subcall,
                           std::span<const unsigned long, 6> x) {
    const char *pattern = SIX_NUMBERS;
    for (const SubcallRow &row : SUBCALL_ROWS) {
        if (row.subcall == subcall)
            pattern = row.pattern;
    }
    return format_arguments(tracee, buf, size, pattern, x);
}

int read_process_memory(pid_t pid, void *buf, uint32_t len, off64_t offset) {
    char path[64];
    snprintf(path, sizeof(path), "/proc/%ld/mem", static_cast<long>(pid));
    const UniqueFd memory(open(path, O_RDONLY | O_CLOEXEC));
    if (!memory.valid() || lseek64(memory.get(), offset, SEEK_SET) < 0)
        return -1;
    return read_all(memory.get(), buf, len);
}
