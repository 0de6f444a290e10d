// A text that is put together piece by piece in a buffer that may be too small for it.
#pragma once

#include <stdarg.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>

#include <algorithm>
#include <array>
#include <bit>
#include <limits>

// What does not fit is counted and not written. As long as there is any room, the text is
// terminated.
class LineText {
  public:
    // `buf` is borrowed, and may be null if `size` is 0.
    LineText(char *buf, size_t size) : buf_(buf), end_(buf), limit_(buf + size) {}

    // Of the whole text, what did not fit included.
    int length() const { return static_cast<int>(static_cast<size_t>(end_ - buf_) + missing_); }

    // Where the next piece goes, and what fits there, terminator included.
    char *end() const { return end_; }
    size_t room() const { return static_cast<size_t>(limit_ - end_); }

    // Counts a piece of `length` that was written at end(). A negative one, a formatting error, is
    // no piece.
    void count(int length) {
        const auto whole = static_cast<size_t>(std::max(length, 0));
        if (whole < room())
            end_ += whole;
        else
            fill_up(whole);
    }

    __attribute__((format(printf, 2, 3))) void add(const char *format, ...) {
        va_list args;
        va_start(args, format);
        count(vsnprintf(end(), room(), format, args));
        va_end(args);
    }

    // The rest does what add() does with a matching format, in a fraction of its time.

    void add_bytes(const char *bytes, size_t count) {
        if (count < room()) {
            memcpy(end_, bytes, count);
            end_ += count;
            *end_ = '\0';
        } else {
            add_beginning(bytes, count);
        }
    }
    void add_text(const char *text) { add_bytes(text, strlen(text)); }
    void add_char(char c) {
        if (room() > 1) {
            *end_++ = c;
            *end_ = '\0';
        } else {
            add_beginning(&c, 1);
        }
    }
    void add_decimal(long value) {
        const auto bits = static_cast<unsigned long>(value);
        add_magnitude(value < 0 ? 0 - bits : bits, value < 0);
    }
    void add_unsigned(unsigned long value) { add_magnitude(value, false); }
    void add_hex(unsigned long value) {
        char piece[LONGEST_NUMBER];
        const auto length = static_cast<size_t>(std::bit_width(value | 1) + 3) / 4;
        char *const begin = place_for(length, piece);
        char *end = begin + length;
        do {
            *--end = "0123456789abcdef"[value & 15];
            value >>= 4;
        } while (value != 0);
        add_placed(begin, length);
    }

  private:
    static constexpr size_t LONGEST_NUMBER = 24;

    static constexpr char TWO_DIGITS[] =
        "00010203040506070809101112131415161718192021222324"
        "25262728293031323334353637383940414243444546474849"
        "50515253545556575859606162636465666768697071727374"
        "75767778798081828384858687888990919293949596979899";

    // Powers of ten, as far as an unsigned long goes.
    static constexpr auto POWERS = [] {
        std::array<unsigned long, std::numeric_limits<unsigned long>::digits10 + 1> powers{1};
        for (size_t i = 1; i < powers.size(); ++i)
            powers[i] = powers[i - 1] * 10;
        return powers;
    }();

    // The buffer ends before a piece of `count` does.
    void fill_up(size_t count) {
        missing_ += count - room();
        end_ = limit_;
    }
    void add_beginning(const char *bytes, size_t count) {
        if (room() > 0) {
            memcpy(end_, bytes, std::min(count, room() - 1));
            limit_[-1] = '\0';
        }
        fill_up(count);
    }

    static size_t count_digits(unsigned long value) {
        value |= 1;  // zero has a digit, too; otherwise this reaches no other power of ten
        // 1233 / 4096 is the logarithm of 2, as near as it takes for 64 bits.
        const auto digits = static_cast<size_t>(std::bit_width(value)) * 1233 / 4096;
        return digits + static_cast<size_t>(value >= POWERS[digits]);
    }

    static void put_two(char *out, unsigned value) {
        memcpy(out, TWO_DIGITS + size_t{2} * value, 2);
    }

    static void put_eight(char *out, unsigned value) {
        const unsigned high = value / 10000;
        const unsigned low = value % 10000;
        put_two(out, high / 100);
        put_two(out + 2, high % 100);
        put_two(out + 4, low / 100);
        put_two(out + 6, low % 100);
    }

    // A number is written from its end on: where it goes if it fits there, else in `piece`.
    char *place_for(size_t length, char *piece) const { return length < room() ? end_ : piece; }
    void add_placed(const char *begin, size_t length) {
        if (begin == end_) {
            end_ += length;
            *end_ = '\0';
        } else {
            add_beginning(begin, length);
        }
    }

    // Few digits at a time take longer than all the rest, since each time is a division.
    void add_magnitude(unsigned long value, bool negative) {
        constexpr unsigned long EIGHT_DIGITS = 100000000;
        char piece[LONGEST_NUMBER];
        const size_t length = count_digits(value) + static_cast<size_t>(negative);
        char *const begin = place_for(length, piece);
        char *end = begin + length;
        for (; value >= EIGHT_DIGITS; value /= EIGHT_DIGITS) {
            end -= 8;
            put_eight(end, static_cast<unsigned>(value % EIGHT_DIGITS));
        }
        auto rest = static_cast<unsigned>(value);
        for (; rest >= 100; rest /= 100) {
            end -= 2;
            put_two(end, rest % 100);
        }
        if (rest >= 10)
            put_two(end - 2, rest);
        else
            end[-1] = static_cast<char>('0' + rest);
        if (negative)
            *begin = '-';
        add_placed(begin, length);
    }

    char *buf_;
    char *end_;           // of what is in the buffer, or limit_ if that is not all
    char *limit_;         // of the buffer
    size_t missing_ = 0;  // of the text, beyond the size of the buffer
};
