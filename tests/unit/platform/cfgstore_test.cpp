#include <cfgstore.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/temp_dir.h"

namespace {

using Entry = std::vector<std::string>;

std::vector<Entry> entries_of(const std::string &text) {
    TempDir dir;
    void *cfg = cfgstore_opencfg(dir.file("config", text).c_str());
    if (cfg == nullptr) {
        ADD_FAILURE() << "cannot open the configuration file";
        return {};
    }
    std::vector<Entry> entries;
    const char *section;
    const char *key;
    const char *value;
    while (cfgstore_getcfg(cfg, &section, &key, &value) == 1)
        entries.push_back({section, key, value});
    EXPECT_EQ(cfgstore_getcfg(cfg, &section, &key, &value), 0) << "the end must stay the end";
    cfgstore_closecfg(cfg);
    return entries;
}

TEST(ConfigStore, GivesTheEntriesInTheOrderOfTheFile) {
    const std::vector<Entry> expected = {
        {"Core", "CoreHandler", "ftp"}, {"Core", "Timeout", "30"}, {"Other", "Timeout", "5"}};
    EXPECT_EQ(entries_of("[Core]\nCoreHandler=ftp\nTimeout=30\n[Other]\nTimeout=5\n"), expected);
}

TEST(ConfigStore, EntriesBeforeAnySectionHaveTheEmptySectionName) {
    EXPECT_EQ(entries_of("a=1\n"), std::vector<Entry>({{"", "a", "1"}}));
}

TEST(ConfigStore, BlanksAroundKeyAndValueAreLeftOut) {
    EXPECT_EQ(entries_of("[ S ]\r\n \t key \t=\t a b \t\r\n"),
              std::vector<Entry>({{"S", "key", "a b"}}));
}

TEST(ConfigStore, OnePairOfDoubleQuotesIsRemoved) {
    const std::vector<Entry> expected = {{"", "a", " x "}, {"", "b", "\"y\""}, {"", "c", "\"z"},
                                         {"", "d", "\""},  {"", "e", ""},      {"", "f", "'q'"}};
    EXPECT_EQ(entries_of("a=\" x \"\nb=\"\"y\"\"\nc=\"z\nd=\"\ne=\"\"\nf='q'\n"), expected);
}

TEST(ConfigStore, CommentsAndBlankLinesAreSkipped) {
    EXPECT_EQ(entries_of("# a=1\n;b=2\n\n   \n  # c=3\nd=4 # not a comment\n"),
              std::vector<Entry>({{"", "d", "4 # not a comment"}}));
}

TEST(ConfigStore, OtherLinesAreSkipped) {
    EXPECT_EQ(entries_of("word\n=1\n[open\n[open=1\nfine=1\n"),
              std::vector<Entry>({{"", "fine", "1"}}));
}

TEST(ConfigStore, AValueMayBeEmptyOrHoldAnEqualsSign) {
    EXPECT_EQ(entries_of("a=\nb=c=d\n"), std::vector<Entry>({{"", "a", ""}, {"", "b", "c=d"}}));
}

TEST(ConfigStore, TheLastLineNeedsNoNewline) {
    EXPECT_EQ(entries_of("a=1\nb=2"), std::vector<Entry>({{"", "a", "1"}, {"", "b", "2"}}));
    EXPECT_EQ(entries_of("a=1\n[S]"), std::vector<Entry>({{"", "a", "1"}}));
}

TEST(ConfigStore, AnEmptyFileHasNoEntries) {
    EXPECT_EQ(entries_of(""), std::vector<Entry>());
}

TEST(ConfigStore, AZeroByteEndsTheFile) {
    EXPECT_EQ(entries_of(std::string("a=1\nb=2\0c\nd=4\n", 15)),
              std::vector<Entry>({{"", "a", "1"}, {"", "b", "2"}}));
}

// The sanitizer builds see a byte too far.
TEST(ConfigStore, AFileCutAtEveryLengthIsReadToItsEnd) {
    const std::string whole = "[S]\n k = \"v\" \n#c\n[T]\nx=\"\ny=1\n";
    for (size_t length = 0; length <= whole.size(); ++length)
        EXPECT_LE(entries_of(whole.substr(0, length)).size(), 3U) << length;
}

TEST(ConfigStore, AnAbsentFileCannotBeOpened) {
    TempDir dir;
    EXPECT_EQ(cfgstore_opencfg((dir / "none").c_str()), nullptr);
}

TEST(ConfigStore, OnlyAPlainFileIsRead) {
    TempDir dir;
    ASSERT_EQ(mkfifo((dir / "pipe").c_str(), 0600), 0);
    EXPECT_EQ(cfgstore_opencfg((dir / "pipe").c_str()), nullptr);
    EXPECT_EQ(cfgstore_opencfg(dir.path().c_str()), nullptr);
    EXPECT_EQ(cfgstore_opencfg("/dev/zero"), nullptr);
}

TEST(ConfigStore, AFileOfMoreThanAMebibyteIsRefused) {
    TempDir dir;
    const std::string line = "a=1\n";
    void *cfg = cfgstore_opencfg(dir.file("fits", line + std::string(1048572, '\n')).c_str());
    EXPECT_NE(cfg, nullptr);
    cfgstore_closecfg(cfg);
    EXPECT_EQ(cfgstore_opencfg(dir.file("over", line + std::string(1048573, '\n')).c_str()),
              nullptr);
}

TEST(ConfigStore, AFileOfMoreThanASizeOf32BitsIsRefused) {
    TempDir dir;
    const std::string path = dir.file("huge", "a=1\n");
    if (truncate(path.c_str(), (off_t{1} << 32) + 4) != 0)
        GTEST_SKIP() << "truncate: " << strerror(errno);
    EXPECT_EQ(cfgstore_opencfg(path.c_str()), nullptr);
}

TEST(ConfigStore, ClosingNothingIsHarmless) {
    cfgstore_closecfg(nullptr);
}

}  // namespace
