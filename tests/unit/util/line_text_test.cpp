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
