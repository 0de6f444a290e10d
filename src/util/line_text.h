// A text that is put together piece by piece in a buffer that may be too small for it.
#pragma once

#include <stdarg.h>
#include <stddef.h>
#include <stdio.h>

#include <algorithm>

// What does not fit is counted and not written. As long as there is any room, the text is
// terminated.
class LineText {
  public:
    // `buf` is borrowed, and may be null if `size` is 0.
    LineText(char *buf, size_t size) : buf_(buf), size_(size) {}

    // Of the whole text, what did not fit included.
    int length() const { return static_cast<int>(length_); }

    // Where the next piece goes, and what fits there, terminator included.
    char *end() const { return buf_ + std::min(length_, size_); }
    size_t room() const { return size_ - std::min(length_, size_); }

    // Counts a piece of `length` that was written at end(). A negative one, a formatting error, is
    // no piece.
    void count(int length) { length_ += static_cast<size_t>(std::max(length, 0)); }

    __attribute__((format(printf, 2, 3))) void add(const char *format, ...) {
        va_list args;
        va_start(args, format);
        count(vsnprintf(end(), room(), format, args));
        va_end(args);
    }

    void add_char(char c) {
        if (room() > 0) {
            *end() = c;
            buf_[std::min(length_ + 1, size_ - 1)] = '\0';
        }
        length_++;
    }

  private:
    char *buf_;
    size_t size_;
    size_t length_ = 0;
};
