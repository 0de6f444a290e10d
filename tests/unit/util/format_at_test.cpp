#include "util/format_at.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

namespace {

TEST(FormatAt, AppendsAtTheGivenLength) {
    char buf[32];
    int length = format_at(buf, sizeof buf, 0, "%d-", 12);
    length = format_at(buf, sizeof buf, length, "%s", "ab");
    EXPECT_EQ(5, length);
    EXPECT_STREQ("12-ab", buf);
}

TEST(FormatAt, CutsAtEverySizeAndCountsOnWithoutWritingBeyondIt) {
    for (size_t size = 0; size <= 10; ++size) {
        char buf[16];
        memset(buf, '#', sizeof buf);
        int length = format_at(buf, size, 0, "abc");
        length = format_at(buf, size, length, "def");
        length = format_at(buf, size, length, "gh");
        EXPECT_EQ(8, length);
        for (size_t i = size; i < sizeof buf; ++i)
            EXPECT_EQ('#', buf[i]) << size;
        if (size > 0) {
            EXPECT_EQ(std::string("abcdefgh").substr(0, size - 1), buf);
        }
    }
}

}  // namespace
