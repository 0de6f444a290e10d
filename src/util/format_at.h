// Builds a text piece by piece in a buffer of fixed size.
#pragma once

#include <stddef.h>

// Formats at offset `length` of `buf`, into what is left of its `size` bytes, terminator included;
// nothing is written once `length` has passed the end. Returns the length that the whole text now
// has, also as far as it did not fit, so that pieces can be summed up and the caller can tell.
int format_at(char *buf, size_t size, int length, const char *format, ...)
    __attribute__((format(printf, 4, 5)));
