#include "ini_text.h"

#include <string.h>

namespace {

bool is_blank(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\v' || c == '\f';
}

// Cuts the blanks off both ends of `begin` to `end`; the result ends with a zero byte.
char *trim(char *begin, char *end) {
    while (begin < end && is_blank(*begin))
        ++begin;
    while (end > begin && is_blank(end[-1]))
        --end;
    *end = '\0';
    return begin;
}

char *unquote(char *value) {
    const size_t length = strlen(value);
    if (length < 2 || value[0] != '"' || value[length - 1] != '"')
        return value;
    value[length - 1] = '\0';
    return value + 1;
}

// Cuts the next line off, and leaves `ini->next` null after the last.
char *next_line(IniText *ini) {
    char *line = ini->next;
    char *end = strchrnul(line, '\n');
    ini->next = *end == '\n' ? end + 1 : nullptr;
    return trim(line, end);
}

}  // namespace

IniText ini_begin(char *text) {
    return IniText{text, ""};
}

bool ini_next(IniText *ini, IniEntry *entry) {
    while (ini->next != nullptr) {
        char *line = next_line(ini);
        char *end = line + strlen(line);
        if (*line == '#' || *line == ';')
            continue;
        if (*line == '[') {
            if (end[-1] == ']')
                ini->section = trim(line + 1, end - 1);
            continue;
        }
        char *equals = strchr(line, '=');
        if (equals == nullptr)
            continue;
        char *value = unquote(trim(equals + 1, end));
        char *key = trim(line, equals);
        if (*key == '\0')
            continue;
        *entry = IniEntry{ini->section, key, value};
        return true;
    }
    return false;
}
