#include "oops/log_scan.h"

#include <gtest/gtest.h>
#include <string.h>

#include <algorithm>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "support/oops_image.h"

namespace {

// A device in memory. What lies behind the end of `bytes` cannot be read.
struct Image {
    std::string bytes;
    std::set<uint64_t> bad = {};  // page numbers
    std::vector<uint64_t> asked = {};
    std::vector<uint64_t> read = {};

    LogSource source(uint64_t size) {
        return {.size = size, .is_bad_block = is_bad, .read_page = read_page, .context = this};
    }
    LogSource source() { return source(bytes.size()); }

    static bool is_bad(void *context, uint64_t offset) {
        Image *image = static_cast<Image *>(context);
        image->asked.push_back(offset);
        return image->bad.contains(offset / 4096);
    }

    static void read_page(void *context, uint64_t offset, uint8_t *buf) {
        Image *image = static_cast<Image *>(context);
        image->read.push_back(offset);
        if (offset < image->bytes.size())
            memcpy(buf, image->bytes.data() + offset,
                   std::min<size_t>(4096, image->bytes.size() - static_cast<size_t>(offset)));
    }
};

std::string print(const LogSource &source, int64_t newest, LogDirection direction) {
    char *text = nullptr;
    size_t length = 0;
    FILE *out = open_memstream(&text, &length);
    print_log(source, newest, direction, out);
    fclose(out);
    std::string printed(text, length);
    free(text);
    return printed;
}

// The position of the newest entry, or -1.
int64_t newest_position(const std::string &bytes) {
    Image image = {.bytes = bytes};
    NewestEntry newest = {.position = -1, .count = 77};
    bool found = find_newest_entry(image.source(), &newest);
    EXPECT_EQ(found, newest.position != -1);
    return newest.position;
}

std::string forward(const std::string &bytes) {
    Image image = {.bytes = bytes};
    return print(image.source(), newest_position(bytes), LogDirection::FORWARD);
}

std::string backward(const std::string &bytes) {
    Image image = {.bytes = bytes};
    return print(image.source(), newest_position(bytes), LogDirection::BACKWARD);
}

const std::string FIVE_TO_SEVEN = oops_page(5, "five\n") + oops_page(6, "six\n") +
                                  oops_page(7, "seven\n") + erased_page() + erased_page();

TEST(NewestEntry, IsTheOneWithTheGreatestCount) {
    Image image = {.bytes = FIVE_TO_SEVEN};
    NewestEntry newest;
    ASSERT_TRUE(find_newest_entry(image.source(), &newest));
    EXPECT_EQ(2, newest.position);
    EXPECT_EQ(7u, newest.count);
}

TEST(NewestEntry, IsFoundWhereverTheRingBegins) {
    EXPECT_EQ(0, newest_position(oops_page(9, "") + oops_page(7, "") + oops_page(8, "")));
    EXPECT_EQ(1, newest_position(oops_page(8, "") + oops_page(9, "") + oops_page(7, "")));
}

TEST(NewestEntry, OfEqualCountsIsTheEarlierPage) {
    EXPECT_EQ(1, newest_position(oops_page(4, "") + oops_page(5, "") + oops_page(5, "")));
    EXPECT_EQ(0, newest_position(oops_page(0, "") + oops_page(0, "")));
}

TEST(NewestEntry, IsZeroBehindTheLastCount) {
    const std::string older =
        oops_page(0xfffffffb, "") + oops_page(0xfffffffc, "") + oops_page(0xfffffffd, "");
    EXPECT_EQ(4, newest_position(older + oops_page(0xfffffffe, "") + oops_page(0, "")));
    EXPECT_EQ(5, newest_position(older + oops_page(0xfffffffe, "") + oops_page(0, "") +
                                 oops_page(1, "")));
}

TEST(NewestEntry, IsNotZeroBehindAnEarlierCount) {
    EXPECT_EQ(0, newest_position(oops_page(0xfffffffd, "") + oops_page(0, "")));
}

TEST(NewestEntry, IsZeroWhenThereIsNoOther) {
    EXPECT_EQ(1, newest_position(erased_page() + oops_page(0, "")));
}

TEST(NewestEntry, FromBeforeTheWrapWinsAgainWhenItComesLater) {
    EXPECT_EQ(1, newest_position(oops_page(0, "") + oops_page(0xfffffffe, "")));
    EXPECT_EQ(
        2, newest_position(oops_page(0xfffffffe, "") + oops_page(0, "") + oops_page(0xfff0, "")));
}

TEST(NewestEntry, IsNoPageWithAnotherMagic) {
    EXPECT_EQ(0, newest_position(oops_page(5, "") + oops_page(6, "", 0x005d005d)));
    EXPECT_EQ(-1, newest_position(oops_page(6, "", 0x005d005d)));
}

TEST(NewestEntry, IsNotThereOnErasedOrZeroedFlash) {
    EXPECT_EQ(-1, newest_position(erased_page() + erased_page()));
    EXPECT_EQ(-1, newest_position(std::string(8192, '\0')));
}

TEST(NewestEntry, IsNotThereOnLessThanAPage) {
    EXPECT_EQ(-1, newest_position(""));
    EXPECT_EQ(-1, newest_position(oops_page(5, "").substr(0, 4095)));
}

TEST(NewestEntry, IsOnAWholePage) {
    EXPECT_EQ(0, newest_position(oops_page(5, "")));
    EXPECT_EQ(0, newest_position((oops_page(5, "") + oops_page(6, "")).substr(0, 6000)));
}

TEST(NewestEntry, IsNotInABadBlock) {
    Image image = {.bytes = FIVE_TO_SEVEN, .bad = {2}};
    NewestEntry newest;
    ASSERT_TRUE(find_newest_entry(image.source(), &newest));
    EXPECT_EQ(1, newest.position);
    EXPECT_EQ((std::vector<uint64_t>{0, 4096, 8192, 12288, 16384}), image.asked);
    EXPECT_EQ((std::vector<uint64_t>{0, 4096, 12288, 16384}), image.read);
}

TEST(NewestEntry, IsNotThereWhenAllBlocksAreBad) {
    Image image = {.bytes = FIVE_TO_SEVEN, .bad = {0, 1, 2, 3, 4}};
    NewestEntry newest;
    EXPECT_FALSE(find_newest_entry(image.source(), &newest));
    EXPECT_EQ(std::vector<uint64_t>(), image.read);
}

TEST(NewestEntry, IsFoundOnBlockDevicesWithoutAskingForBadBlocks) {
    Image image = {.bytes = FIVE_TO_SEVEN};
    LogSource source = image.source();
    source.is_bad_block = nullptr;
    NewestEntry newest;
    ASSERT_TRUE(find_newest_entry(source, &newest));
    EXPECT_EQ(2, newest.position);
    EXPECT_EQ(
        "Log Entry 5 (at position 0)\nfive\n"
        "Log Entry 6 (at position 1)\nsix\n"
        "Log Entry 7 (at position 2)\nseven\n",
        print(source, 2, LogDirection::FORWARD));
}

// Nothing but bad blocks in front of one page: a log of this size need not be read for a test.
struct FarPage {
    uint64_t offset;

    LogSource source() {
        return {.size = offset + 4096,
                .is_bad_block =
                    [](void *context, uint64_t at) {
                        return at != static_cast<FarPage *>(context)->offset;
                    },
                .read_page =
                    [](void *context, uint64_t at, uint8_t *buf) {
                        EXPECT_EQ(static_cast<FarPage *>(context)->offset, at);
                        memcpy(buf, oops_page(3, "far\n").data(), 4096);
                    },
                .context = this};
    }
};

TEST(NewestEntry, IsFoundBeyondFourGigabytes) {
    FarPage page = {.offset = 0x100001000};
    NewestEntry newest;
    ASSERT_TRUE(find_newest_entry(page.source(), &newest));
    EXPECT_EQ(0x100001, newest.position);
    EXPECT_EQ("Log Entry 3 (at position 1048577)\nfar\n",
              print(page.source(), newest.position, LogDirection::FORWARD));
}

TEST(NextPosition, GoesRoundTheRingInBothDirections) {
    EXPECT_EQ(1, next_log_position(0, LogDirection::FORWARD, 3 * 4096));
    EXPECT_EQ(2, next_log_position(1, LogDirection::FORWARD, 3 * 4096));
    EXPECT_EQ(0, next_log_position(2, LogDirection::FORWARD, 3 * 4096));
    EXPECT_EQ(1, next_log_position(2, LogDirection::BACKWARD, 3 * 4096));
    EXPECT_EQ(0, next_log_position(1, LogDirection::BACKWARD, 3 * 4096));
    EXPECT_EQ(2, next_log_position(0, LogDirection::BACKWARD, 3 * 4096));
}

TEST(NextPosition, OnASinglePageIsThatPage) {
    EXPECT_EQ(0, next_log_position(0, LogDirection::FORWARD, 4096));
    EXPECT_EQ(0, next_log_position(0, LogDirection::BACKWARD, 4096));
}

TEST(NextPosition, GoesOverAPartOfAPageAtTheEndOnlyForwards) {
    EXPECT_EQ(1, next_log_position(0, LogDirection::FORWARD, 6000));
    EXPECT_EQ(0, next_log_position(1, LogDirection::FORWARD, 6000));
    EXPECT_EQ(0, next_log_position(0, LogDirection::BACKWARD, 6000));
    EXPECT_EQ(1, next_log_position(0, LogDirection::FORWARD, 4097));
}

TEST(NextPosition, DoesNotWrapBeforeTheEndOfALargeDevice) {
    EXPECT_EQ(0x100000, next_log_position(0xfffff, LogDirection::FORWARD, 0x100001000));
    EXPECT_EQ(0xfffff, next_log_position(0, LogDirection::BACKWARD, 0x100000000));
}

TEST(PrintLog, ForwardsPrintsTheOldestFirst) {
    EXPECT_EQ(
        "Log Entry 5 (at position 0)\nfive\n"
        "Log Entry 6 (at position 1)\nsix\n"
        "Log Entry 7 (at position 2)\nseven\n",
        forward(FIVE_TO_SEVEN));
}

TEST(PrintLog, ForwardsWalksThroughTheErasedPagesFirst) {
    Image image = {.bytes = FIVE_TO_SEVEN};
    print(image.source(), 2, LogDirection::FORWARD);
    EXPECT_EQ((std::vector<uint64_t>{12288, 16384, 0, 4096, 8192}), image.read);
}

TEST(PrintLog, BackwardsBeginsAtTheSecondNewestAndEndsWithTheNewest) {
    EXPECT_EQ(
        "Log Entry 6 (at position 1)\nsix\n"
        "Log Entry 5 (at position 0)\nfive\n"
        "Log Entry 7 (at position 2)\nseven\n",
        backward(FIVE_TO_SEVEN));
    Image image = {.bytes = FIVE_TO_SEVEN};
    print(image.source(), 2, LogDirection::BACKWARD);
    EXPECT_EQ((std::vector<uint64_t>{4096, 0, 16384, 12288, 8192}), image.read);
}

TEST(PrintLog, GoesRoundTheEndOfTheDevice) {
    const std::string ring =
        oops_page(12, "c") + oops_page(13, "d") + oops_page(10, "a") + oops_page(11, "b");
    EXPECT_EQ(
        "Log Entry 10 (at position 2)\na"
        "Log Entry 11 (at position 3)\nb"
        "Log Entry 12 (at position 0)\nc"
        "Log Entry 13 (at position 1)\nd",
        forward(ring));
    EXPECT_EQ(
        "Log Entry 12 (at position 0)\nc"
        "Log Entry 11 (at position 3)\nb"
        "Log Entry 10 (at position 2)\na"
        "Log Entry 13 (at position 1)\nd",
        backward(ring));
}

TEST(PrintLog, PrintsASinglePageInBothDirections) {
    EXPECT_EQ("Log Entry 1 (at position 0)\nonly", forward(oops_page(1, "only")));
    EXPECT_EQ("Log Entry 1 (at position 0)\nonly", backward(oops_page(1, "only")));
}

TEST(PrintLog, PrintsCountsAsSignedNumbers) {
    EXPECT_EQ(
        "Log Entry -2147483648 (at position 0)\n"
        "Log Entry -2 (at position 1)\n"
        "Log Entry 0 (at position 2)\n",
        forward(oops_page(0x80000000, "") + oops_page(0xfffffffe, "") + oops_page(0, "")));
}

TEST(PrintLog, LeavesOutPagesWithAnotherMagic) {
    EXPECT_EQ("Log Entry 5 (at position 0)\na",
              forward(oops_page(5, "a") + oops_page(6, "b", 0x5d005d01)));
}

TEST(PrintLog, LeavesOutBadBlocksInBothDirections) {
    Image image = {.bytes = FIVE_TO_SEVEN, .bad = {1, 4}};
    EXPECT_EQ(
        "Log Entry 5 (at position 0)\nfive\n"
        "Log Entry 7 (at position 2)\nseven\n",
        print(image.source(), 2, LogDirection::FORWARD));
    EXPECT_EQ((std::vector<uint64_t>{12288, 0, 8192}), image.read);
    EXPECT_EQ(
        "Log Entry 5 (at position 0)\nfive\n"
        "Log Entry 7 (at position 2)\nseven\n",
        print(image.source(), 2, LogDirection::BACKWARD));
}

TEST(PrintLog, ShowsControlCharactersAsDotsButNotNewlinesAndTabs) {
    EXPECT_EQ("Log Entry 1 (at position 0)\na.b.c\n\td..",
              forward(oops_page(1, std::string("a\0b\x1b"
                                               "c\n\td\x7f\xfe",
                                               10))));
}

TEST(PrintLog, PrintsAWholePageOfTextAndNoByteOfAnother) {
    const std::string text(4088, 'x');
    EXPECT_EQ("Log Entry 1 (at position 0)\n" + text + "Log Entry 2 (at position 1)\n" + text,
              forward(oops_page(1, text) + oops_page(2, text)));
}

TEST(PrintLog, PrintsNothingForATextOfErasedFlash) {
    EXPECT_EQ("Log Entry 1 (at position 0)\n", forward(oops_page(1, "")));
}

TEST(PrintLog, PrintsAnEntryNeverTwiceBecauseTheNextCouldNotBeRead) {
    // The device has shrunk behind its first page since it was asked for its size.
    Image image = {.bytes = oops_page(1, "one\n") + oops_page(2, "two\n").substr(0, 7)};
    EXPECT_EQ("Log Entry 1 (at position 0)\none\n",
              print(image.source(4 * 4096), 3, LogDirection::FORWARD));
    image.read.clear();
    EXPECT_EQ("Log Entry 1 (at position 0)\none\n",
              print(image.source(4 * 4096), 0, LogDirection::BACKWARD));
    EXPECT_EQ((std::vector<uint64_t>{12288, 8192, 4096, 0}), image.read);
}

TEST(PrintLog, EndsTheTextOfAPageWhereItsReadEnded) {
    Image image = {.bytes =
                       oops_page(1, std::string(4088, 'x')) + oops_page(2, "two").substr(0, 9)};
    EXPECT_EQ(
        "Log Entry 1 (at position 0)\n" + std::string(4088, 'x') + "Log Entry 2 (at position 1)\nt",
        print(image.source(8192), 1, LogDirection::FORWARD));
}

TEST(PrintLog, OnAPageAndAPartBeginsWithThePartAndEndsThere) {
    const std::string bytes = (oops_page(5, "five") + oops_page(6, "six")).substr(0, 6000);
    EXPECT_EQ("Log Entry 6 (at position 1)\nsix", forward(bytes));
    EXPECT_EQ("Log Entry 5 (at position 0)\nfive", backward(bytes));
    EXPECT_EQ("", forward((oops_page(5, "five") + erased_page()).substr(0, 6000)));
}

TEST(PrintLog, CutAtEveryLengthPrintsOnlyWhatIsThere) {
    const std::string whole = oops_page(1, "one") + oops_page(2, "two") + oops_page(3, "three");
    const std::string lines[] = {"Log Entry 1 (at position 0)\none",
                                 "Log Entry 2 (at position 1)\ntwo",
                                 "Log Entry 3 (at position 2)\nthree"};
    for (size_t length = 0; length <= whole.size(); ++length) {
        // The size that the device told still is the whole one.
        Image image = {.bytes = whole.substr(0, length)};
        const std::string printed = print(image.source(whole.size()), 2, LogDirection::FORWARD);
        std::string expected;
        for (size_t i = 0; i < 3; ++i) {
            const size_t there = length > i * 4096 ? length - i * 4096 : 0;
            if (there < 8)
                break;
            const size_t header = lines[i].find('\n') + 1;
            expected += lines[i].substr(0, std::min(lines[i].size(), header + there - 8));
        }
        ASSERT_EQ(expected, printed) << length;
    }
}

TEST(PrintLog, OfARandomMegabytePrintsOnlyWhatHasTheMagic) {
    std::mt19937 random(1);
    std::string bytes(1 << 20, '\0');
    for (char &byte : bytes)
        byte = static_cast<char>(random());
    EXPECT_EQ(-1, newest_position(bytes));
    // Page 200 gets the header of an entry, and keeps its text, which goes to a byte 0xff.
    const std::string header("\x2a\0\0\0\0\x5d\0\x5d", 8);
    bytes.replace(200 * 4096, header.size(), header);
    EXPECT_EQ(200, newest_position(bytes));
    const std::string printed = forward(bytes);
    EXPECT_EQ("Log Entry 42 (at position 200)\n", printed.substr(0, 31));
    const size_t end = bytes.find('\xff', 200 * 4096 + 8);
    EXPECT_EQ(31 + end - (200 * 4096 + 8), printed.size());
    for (char c : printed)
        ASSERT_TRUE((c >= ' ' && c <= '~') || (c >= '\t' && c <= '\r'));
    EXPECT_EQ(printed, backward(bytes));
}

}  // namespace
