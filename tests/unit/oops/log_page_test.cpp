#include "oops/log_page.h"

#include <gtest/gtest.h>
#include <string.h>

#include <random>
#include <string>

#include "support/oops_image.h"
#include "support/slow_machine.h"

namespace {

LogPage page_of(const std::string &bytes) {
    LogPage page;
    erase_log_page(&page);
    memcpy(page.bytes, bytes.data(), bytes.size());
    return page;
}

std::string text_of(const LogPage &page) {
    std::string text(LOG_TEXT_SIZE, '#');
    const size_t length = write_log_text(page, text.data());
    EXPECT_EQ(std::string(text.size() - length, '#'), text.substr(length));
    return text.substr(0, length);
}

TEST(LogPage, HasAGuardOfErasedBytesBehindIt) {
    LogPage page;
    memset(page.bytes, 0, sizeof(page.bytes));
    erase_log_page(&page);
    ASSERT_EQ(4100u, sizeof(page.bytes));
    for (uint8_t byte : page.bytes)
        ASSERT_EQ(0xff, byte);
}

TEST(LogPage, TellsTheCountByItsFourLittleEndianBytes) {
    EXPECT_EQ(0x12345678u, log_entry_count(page_of("\x78\x56\x34\x12")));
    EXPECT_EQ(0xfffffffeu, log_entry_count(page_of("\xfe\xff\xff\xff")));
    EXPECT_EQ(0x80u, log_entry_count(page_of(std::string("\x80\0\0\0", 4))));
}

TEST(LogPage, IsAnEntryWithACountAndTheMagic) {
    EXPECT_TRUE(is_log_entry(page_of(std::string("\x05\0\0\0\x00\x5d\x00\x5d", 8))));
    EXPECT_TRUE(is_log_entry(page_of(std::string("\0\0\0\0\x00\x5d\x00\x5d", 8))));
    EXPECT_TRUE(is_log_entry(page_of(std::string("\xfe\xff\xff\xff\x00\x5d\x00\x5d", 8))));
}

TEST(LogPage, IsNoEntryWhenErased) {
    EXPECT_FALSE(is_log_entry(page_of("")));
    EXPECT_FALSE(is_log_entry(page_of(std::string("\xff\xff\xff\xff\x00\x5d\x00\x5d", 8))));
}

TEST(LogPage, IsNoEntryWithAnotherMagic) {
    EXPECT_FALSE(is_log_entry(page_of(std::string("\x05\0\0\0\x5d\x00\x5d\x00", 8))));
    EXPECT_FALSE(is_log_entry(page_of(std::string("\x05\0\0\0\x01\x5d\x00\x5d", 8))));
    EXPECT_FALSE(is_log_entry(page_of(std::string("\x05\0\0\0\x00\x5d\x00\x5c", 8))));
    EXPECT_FALSE(is_log_entry(page_of(std::string(8, '\0'))));
}

TEST(LogPage, CutAtEveryLengthIsAnEntryOnceItsHeaderIsThere) {
    const std::string whole = oops_page(7, "text");
    for (size_t length = 0; length <= whole.size(); ++length) {
        const LogPage page = page_of(whole.substr(0, length));
        ASSERT_EQ(length >= 8, is_log_entry(page)) << length;
        if (length >= 8) {
            ASSERT_EQ(std::string("text").substr(0, length - 8), text_of(page)) << length;
        }
    }
}

TEST(LogText, EndsAtTheFirstErasedByte) {
    EXPECT_EQ("one", text_of(page_of(oops_page(1, "one\xfftwo"))));
}

TEST(LogText, IsEmptyWhenFlashIsErasedRightBehindTheHeader) {
    EXPECT_EQ("", text_of(page_of(oops_page(1, ""))));
}

TEST(LogText, FillsAWholePageWithoutAnErasedByteAndNoMore) {
    EXPECT_EQ(std::string(4088, 'x'), text_of(page_of(oops_page(1, std::string(4088, 'x')))));
    EXPECT_EQ(std::string(4087, 'x'), text_of(page_of(oops_page(1, std::string(4087, 'x')))));
}

TEST(LogText, IsBoundedEvenWithoutAGuard) {
    LogPage page;
    memset(page.bytes, 'x', sizeof(page.bytes));
    EXPECT_EQ(std::string(4092, 'x'), text_of(page));
}

TEST(LogText, ShowsEachByteByItselfOrAsADot) {
    std::string all;
    for (int byte = 0; byte < 0xff; ++byte)
        all += static_cast<char>(byte);
    EXPECT_EQ(std::string(9, '.') + "\t\n\v\f\r" + std::string(18, '.') +
                  " !\"#$%&'()*+,-./0123456789:;<=>?@ABCDEFGHIJKLMNOPQRSTUVWXYZ[\\]^_`"
                  "abcdefghijklmnopqrstuvwxyz{|}~" +
                  std::string(128, '.'),
              text_of(page_of(oops_page(1, all))));
}

// A byte at a time, up to the first one of erased flash.
std::string plain_text_of(const std::string &page) {
    std::string text;
    for (size_t i = 8; i < page.size() && page[i] != '\xff'; ++i) {
        const bool shown =
            (page[i] >= ' ' && page[i] <= '~') || (page[i] >= '\t' && page[i] <= '\r');
        text += shown ? page[i] : '.';
    }
    return text;
}

TEST(LogText, OfAnyPageIsWhatIsFoundAByteAtATime) {
    std::minstd_rand random(1);
    for (int round = 0; round < rounds(600); ++round) {
        // Down to pages without an erased byte, which are rare where each byte may be one.
        const unsigned highest = round % 2 == 0 ? 0xff : 0xfe;
        std::string page = oops_page(1, "");
        const size_t length = round % 3 == 0 ? random() % page.size() : page.size();
        for (size_t i = 8; i < length; ++i)
            page[i] = static_cast<char>(random() % (highest + 1));
        ASSERT_EQ(plain_text_of(page), text_of(page_of(page))) << round;
    }
}

TEST(NewerCount, IsTheGreaterOneAsUnsignedNumbers) {
    EXPECT_TRUE(is_newer_count(6, 5));
    EXPECT_FALSE(is_newer_count(5, 6));
    EXPECT_TRUE(is_newer_count(0x80000000, 0x7fffffff));
    EXPECT_FALSE(is_newer_count(0x7fffffff, 0x80000000));
    EXPECT_TRUE(is_newer_count(1, 0));
}

TEST(NewerCount, IsNotAnEqualOne) {
    for (uint32_t count : {0u, 1u, 0x80000000u, 0xfffffffeu})
        EXPECT_FALSE(is_newer_count(count, count));
}

TEST(NewerCount, IsZeroOnlyRightBehindTheLastCount) {
    EXPECT_TRUE(is_newer_count(0, 0xfffffffe));
    EXPECT_FALSE(is_newer_count(0, 0xfffffffd));
    EXPECT_FALSE(is_newer_count(0, 5));
}

TEST(NewerCount, DoesNotLookFurtherAcrossTheWrap) {
    EXPECT_FALSE(is_newer_count(1, 0xfffffffe));
    EXPECT_TRUE(is_newer_count(0xfffffffe, 0));
}

}  // namespace
