// Lines of the kernel's socket tables. The input: a byte that tells the table and the room for the
// text, then the line. Every number that stands in the line is looked for as a socket's.
#include "proc/socket_tables.h"

#include <ctype.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

namespace {

using Match = int (*)(const char *line, unsigned long inode, char *buf, size_t size);
constexpr Match MATCHES[] = {match_tcp_line, match_tcp6_line, match_unix_line};

void match(Match function, const std::string &line, unsigned long inode, size_t room) {
    // Of exactly the size that is told, so that the sanitizer sees a byte too many.
    std::vector<char> text(room);
    const int length = function(line.c_str(), inode, text.data(), text.size());
    if (length < NO_MATCH)
        abort();
    // What fitted is terminated, and as long as was said.
    if (length > 0 && room > 0) {
        const size_t fitted = strnlen(text.data(), room);
        if (fitted == room || fitted > static_cast<size_t>(length))
            abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 1)
        return 0;
    const Match function = MATCHES[data[0] % 3];
    const size_t room = data[0] / 3;
    // As the caller reads them: terminated, and in pieces of a limited length.
    std::string line(reinterpret_cast<const char *>(data + 1), size - 1);
    line = line.substr(0, SOCKET_LINE_SIZE - 1).c_str();

    match(function, line, 0, room);
    for (size_t i = 0; i < line.size(); ++i) {
        const bool begins_word = i == 0 || isspace(static_cast<unsigned char>(line[i - 1])) != 0;
        if (begins_word && isdigit(static_cast<unsigned char>(line[i])) != 0)
            match(function, line, strtoul(line.c_str() + i, nullptr, 10), room);
    }
    return 0;
}
