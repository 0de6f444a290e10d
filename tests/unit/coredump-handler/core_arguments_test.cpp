// What the handler makes of its command line. Faults are told in the system log, so they are left
// to tests/system, which has one of its own.
#include "coredump-handler/core_arguments.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

std::vector<char *> pointers(const std::vector<std::string> &words) {
    std::vector<char *> result;
    for (const std::string &word : words)
        result.push_back(const_cast<char *>(word.c_str()));
    result.push_back(nullptr);
    return result;
}

bool is_delivered(const std::vector<std::string> &words) {
    std::vector<char *> argv = pointers(words);
    int status = 77;
    const bool result = check_core_arguments(static_cast<int>(words.size()), argv.data(), &status);
    EXPECT_EQ(77, status);
    return result;
}

}  // namespace

TEST(ParseSizeLimit, TakesWholeDecimalNumbers) {
    const struct {
        const char *text;
        uint64_t limit;
    } cases[] = {
        {"0", 0},
        {"4096", 4096},
        {"010", 10},
        {"2147483647", 2147483647},
        {"4294967296", 4294967296},
        {"18446744073709551615", 18446744073709551615u},
        {"+5", 5},
        {"-1", 18446744073709551615u},
    };
    for (const auto &c : cases) {
        uint64_t limit = 77;
        EXPECT_TRUE(parse_size_limit(c.text, &limit)) << c.text;
        EXPECT_EQ(c.limit, limit) << c.text;
    }
}

TEST(ParseSizeLimit, RefusesWhatIsNotANumberToItsEnd) {
    for (const char *text : {"", " ", "+", "-", "4k", "4096 ", "0x1000", "unlimited", "4096.0",
                             "18446744073709551616", "99999999999999999999999"}) {
        uint64_t limit;
        EXPECT_FALSE(parse_size_limit(text, &limit)) << text;
    }
}

TEST(CheckCoreArguments, ChecksNothingWithLessThanTwoArguments) {
    EXPECT_TRUE(is_delivered({"coredump-handler"}));
    EXPECT_TRUE(is_delivered({"coredump-handler", "core.1"}));
    EXPECT_TRUE(is_delivered({"coredump-handler", ""}));
}

TEST(CheckCoreArguments, LetsLimitsOfAPageAndMorePass) {
    for (const char *limit : {"1048576", "2147483647", "18446744073709551615"})
        EXPECT_TRUE(is_delivered({"coredump-handler", "core.1", limit, "!bin", "app"})) << limit;
}

TEST(CheckCoreArguments, IgnoresFurtherArguments) {
    EXPECT_TRUE(is_delivered({"coredump-handler", "core.1", "1048576", "!bin", "app", "", "x"}));
}

TEST(CoreName, IsTheFirstArgumentOrCoreCore) {
    const std::vector<std::string> words = {"coredump-handler", "core.1234", "0"};
    std::vector<char *> argv = pointers(words);
    EXPECT_STREQ("core.1234", core_name(3, argv.data()));
    EXPECT_STREQ("core.1234", core_name(2, argv.data()));
    EXPECT_STREQ("core.core", core_name(1, argv.data()));
    const std::vector<std::string> empty = {"coredump-handler", ""};
    argv = pointers(empty);
    EXPECT_STREQ("", core_name(2, argv.data()));
}
