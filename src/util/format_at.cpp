#include "util/format_at.h"

#include <stdarg.h>
#include <stdio.h>

int format_at(char *buf, size_t size, int length, const char *format, ...) {
    size_t offset = static_cast<size_t>(length);
    bool room = offset < size;
    va_list arguments;
    va_start(arguments, format);
    int added =
        vsnprintf(room ? buf + offset : nullptr, room ? size - offset : 0, format, arguments);
    va_end(arguments);
    return length + added;
}
