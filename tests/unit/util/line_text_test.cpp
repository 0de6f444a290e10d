#include "util/line_text.h"

#include <gtest/gtest.h>

#include "support/guarded_buffer.h"

TEST(LineText, AddsPieceAfterPiece) {
    char buf[32];
    LineText line(buf, sizeof(buf));
    line.add("%d apples", 12);
    line.add_char(',');
    line.add(" %s", "pears");
    EXPECT_STREQ(buf, "12 apples, pears");
    EXPECT_EQ(line.length(), 16);
    EXPECT_EQ(line.room(), 16U);
    EXPECT_EQ(line.end(), buf + 16);
}

TEST(LineText, CountsWhatDoesNotFitAndWritesNothingBehindTheEnd) {
    expect_prefix_at_every_size("ab12cd345e", [](char *buf, size_t size) {
        LineText line(buf, size);
        line.add("ab%d", 12);
        line.add_char('c');
        line.add_char('d');
        line.add("%d", 345);
        line.add_char('e');
        return line.length();
    });
}

TEST(LineText, NeedsNoBufferToCount) {
    LineText line(nullptr, 0);
    line.add("%s", "twelve bytes");
    line.add_char('!');
    EXPECT_EQ(line.length(), 13);
    EXPECT_EQ(line.room(), 0U);
}

TEST(LineText, TakesANegativePieceForNone) {
    char buf[8];
    LineText line(buf, sizeof(buf));
    line.add("abc");
    line.count(-1);
    line.add("d");
    EXPECT_STREQ(buf, "abcd");
    EXPECT_EQ(line.length(), 4);
}

TEST(LineText, AddsNumbersAsPrintfDoes) {
    const unsigned long values[] = {0,    1,        9,        10,           11,
                                    99,   100,      101,      999,          1000,
                                    9999, 10000,    123456,   4294967295UL, 0x80000000UL,
                                    ~0UL, ~0UL - 1, ~0UL / 2, ~0UL / 2 + 1};
    for (unsigned long value : values) {
        for (size_t size : {64, 8, 2, 1}) {
            char expected[64] = "#", actual[64] = "#";
            int length = snprintf(expected, size, "%lu %ld %ld %lx.", value,
                                  static_cast<long>(value), -static_cast<long>(value / 2), value);
            LineText text(actual, size);
            text.add_unsigned(value);
            text.add_char(' ');
            text.add_decimal(static_cast<long>(value));
            text.add_char(' ');
            text.add_decimal(-static_cast<long>(value / 2));
            text.add_text(" ");
            text.add_hex(value);
            text.add_bytes(".and more", 1);
            EXPECT_EQ(length, text.length());
            EXPECT_STREQ(expected, actual);
        }
    }
}

TEST(LineText, AddsNumbersOfEveryLengthWhateverRoomThereIs) {
    for (unsigned long base : {10UL, 16UL}) {
        for (unsigned long power = 1;; power *= base) {
            for (unsigned long value : {power - 1, power, power + 1}) {
                char expected[100];
                int length = snprintf(expected, sizeof expected, "%lu %lx %ld %ld", value, value,
                                      static_cast<long>(value), -static_cast<long>(value));
                for (size_t size = 0; size <= sizeof expected; size++) {
                    char prefix[100] = "#", actual[101] = "#";
                    actual[size] = '|';
                    (void)snprintf(prefix, size, "%s", expected);
                    LineText text(actual, size);
                    text.add_unsigned(value);
                    text.add_char(' ');
                    text.add_hex(value);
                    text.add_char(' ');
                    text.add_decimal(static_cast<long>(value));
                    text.add_char(' ');
                    text.add_decimal(-static_cast<long>(value));
                    ASSERT_EQ(text.length(), length);
                    ASSERT_EQ(actual[size], '|');
                    actual[size] = '\0';
                    ASSERT_STREQ(actual, size == 0 ? "" : prefix) << size;
                }
            }
            if (power > ~0UL / base)
                break;
        }
    }
}
