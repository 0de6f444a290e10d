#include "cgi/request_values.h"

#include <ctype.h>
#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>

#include "proc/process_table.h"
#include "rtrace/trace_items.h"

namespace {

constexpr size_t PIECE_SIZE = 32;
constexpr int MAX_NAMESAKES = 32;

// Cuts white space off both ends of `text`, in place.
char *strip(char *text) {
    while (isspace(static_cast<unsigned char>(*text)))
        ++text;
    size_t length = strlen(text);
    while (length > 0 && isspace(static_cast<unsigned char>(text[length - 1])))
        --length;
    text[length] = '\0';
    return text;
}

// Calls take(piece) for each piece between the commas of `list`, stripped. Pieces that are too long
// are skipped.
template <typename Take>
void for_each_piece(const char *list, Take take) {
    for (;;) {
        size_t length = strcspn(list, ",");
        if (length < PIECE_SIZE) {
            char piece[PIECE_SIZE];
            memcpy(piece, list, length);
            piece[length] = '\0';
            take(strip(piece));
        }
        if (list[length] == '\0')
            return;
        list += length + 1;
    }
}

// Numbers that name a process: -1 never does, so that text is taken for a name.
bool parse_pid(const char *text, int32_t *pid) {
    return parse_number(text, pid) && *pid != -1;
}

}  // namespace

bool parse_number(const char *text, int32_t *number) {
    char *end;
    errno = 0;
    long value = strtol(text, &end, 10);
    // A `long` may be wider than the device's.
    if (end == text || errno == ERANGE || value < INT32_MIN || value > INT32_MAX)
        return false;
    *number = static_cast<int32_t>(value);
    return true;
}

int32_t number_or_minus_one(const char *text) {
    int32_t number;
    return text != nullptr && parse_number(text, &number) ? number : -1;
}

pid_t find_process(const char *text) {
    int32_t pid;
    if (parse_pid(text, &pid))
        return pid;
    char *copy = strdup(text);
    if (copy == nullptr)
        return -1;
    pid_t found = -1;
    int count = 0;
    find_pids_by_name("/proc", strip(copy), &found, &count, 1);
    free(copy);
    return count > 0 ? found : -1;
}

void add_pid_token(const char *token, pid_t *pids, int *count) {
    if (*token == '\0' || *count >= MAX_TRACED)
        return;
    int32_t pid;
    if (parse_pid(token, &pid)) {
        if (kill(pid, 0) == 0)
            pids[(*count)++] = pid;
        return;
    }
    pid_t namesakes[MAX_NAMESAKES];
    int found = 0;
    find_pids_by_name("/proc", token, namesakes, &found, MAX_NAMESAKES);
    found = std::min(found, MAX_TRACED - *count);
    memcpy(pids + *count, namesakes, static_cast<size_t>(found) * sizeof *pids);
    *count += found;
}

void add_pid_list(const char *list, pid_t *pids, int *count) {
    for_each_piece(list, [=](const char *piece) { add_pid_token(piece, pids, count); });
}

uint32_t parse_trace_items(const char *list) {
    uint32_t items = 0;
    for_each_piece(list, [&items](const char *piece) { items |= lookup_trace_item(piece); });
    return items != 0 ? items : ITEMS_FAST;
}
