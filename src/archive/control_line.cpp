#include "archive/control_line.h"

#include <ctype.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>

namespace {

constexpr size_t LENGTH_COLUMN = 8;
constexpr size_t GAP_TO_LIST = 21;

bool is_digit(char c) {
    return isdigit(static_cast<unsigned char>(c)) != 0;
}

// The text from character `column` on; its end when it is shorter.
const char *from_column(const char *text, size_t column) {
    return text + std::min(column, strlen(text));
}

}  // namespace

int64_t control_line_core_length(const char *line) {
    return strtoll(from_column(line, LENGTH_COLUMN), nullptr, 10);
}

int control_line_pids(const char *line, pid_t *pids, int max) {
    char *number_end;
    (void)strtoll(from_column(line, LENGTH_COLUMN), &number_end, 10);
    const char *p = from_column(number_end, GAP_TO_LIST);
    const char *end = p + strlen(p);
    // Blanks separate the ids, so there can be one more id than blanks.
    int64_t limit = std::min<int64_t>(std::count(p, end, ' ') + 1, max);
    int count = 0;
    while (count < limit) {
        while (p < end && !is_digit(*p))
            ++p;
        if (p == end)
            break;
        pids[count++] = static_cast<pid_t>(strtol(p, nullptr, 10));
        while (p < end && is_digit(*p))
            ++p;
    }
    return count;
}
