// How the handler reads the device's configuration.
#include "coredump-handler/core_config.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>

#include "support/temp_dir.h"

namespace {

CoreConfig read_text(const std::string &text) {
    TempDir dir;
    CoreConfig config;
    EXPECT_EQ(0, read_core_config(dir.file("config", text).c_str(), &config));
    return config;
}

std::string text_of(const UniqueBlock<char> &text) {
    return text != nullptr ? text.get() : "nothing";
}

// URL, path and limit in seconds.
using Target = std::tuple<std::string, std::string, long>;

Target target_of(const CoreConfig &config) {
    return {text_of(config.target_url), text_of(config.target_path), config.timeout_s};
}

// An upload's entries, as far as `entries` tells.
CoreConfig read_ftp(const std::string &entries) {
    CoreConfig config = read_text("CoreHandler = FTP\n[CoreHandlerFtp]\n" + entries);
    EXPECT_TRUE(config.use_ftp);
    return config;
}

}  // namespace

TEST(ReadCoreConfig, ChoosesTheServiceWithoutAFile) {
    CoreConfig config;
    EXPECT_EQ(0, read_core_config("/nosuch/file", &config));
    EXPECT_FALSE(config.use_ftp);
}

TEST(ReadCoreConfig, ChoosesTheServiceUnlessTheValueBeginsWithFtp) {
    for (const char *text : {
             "",
             "[General]\nOther = FTP\n",
             "CoreHandler = Socket\n",
             "CoreHandler = ftp\n",
             "CoreHandler = FT\n",
             "CoreHandler = \n",
             "CoreHandler = xFTP\n",
             // The key counts whole, and in its letters.
             "CoreHandler2 = FTP\n",
             "CoreHandle = FTP\n",
             "corehandler = FTP\n",
             // Without the choice its section does nothing.
             "[CoreHandlerFtp]\nTargetURL = ftp://host\n",
         }) {
        EXPECT_FALSE(read_text(text).use_ftp) << text;
    }
}

TEST(ReadCoreConfig, ChoosesFtpForEveryValueThatBeginsSo) {
    for (const char *text : {"CoreHandler = FTP\n", "[Any]\nCoreHandler = FTPS\n",
                             "[A]\nx = y\n[CoreHandlerFtp]\nCoreHandler = FTP upload\n"})
        EXPECT_TRUE(read_text(text).use_ftp) << text;
}

TEST(ReadCoreConfig, LetsTheFirstChoiceCount) {
    EXPECT_FALSE(read_text("CoreHandler = Socket\nCoreHandler = FTP\n").use_ftp);
    EXPECT_TRUE(read_text("CoreHandler = FTP\nCoreHandler = Socket\n").use_ftp);
}

TEST(ReadCoreConfig, KnowsNoTargetAndNoLimitWithoutThem) {
    EXPECT_EQ(Target("nothing", "nothing", 0), target_of(read_ftp("")));
}

TEST(ReadCoreConfig, TakesTheTargetAndTheLimit) {
    const CoreConfig config =
        read_ftp("TargetURL = ftp://host\nTargetPath = /cores\nTimeout = 30\n");
    EXPECT_EQ(Target("ftp://host", "/cores", 30), target_of(config));
}

TEST(ReadCoreConfig, TakesNamesThatOnlyBeginLikeTheKeysAndTheSection) {
    const CoreConfig config = read_text(
        "CoreHandler = FTP\n[CoreHandlerFtpBackup]\n"
        "TargetURL2 = ftp://host\nTargetPathname = /cores\nTimeouts = 30\n");
    EXPECT_EQ(Target("ftp://host", "/cores", 30), target_of(config));
}

TEST(ReadCoreConfig, TakesNothingFromOtherSectionsOrKeys) {
    const CoreConfig config = read_text(
        "CoreHandler = FTP\nTargetURL = a\n[CoreHandlerFt]\nTargetURL = b\n"
        "[corehandlerftp]\nTargetURL = c\n[XCoreHandlerFtp]\nTargetURL = d\n"
        "[CoreHandlerFtp]\nTargetUR = e\ntargeturl = f\nXTargetURL = g\nTargetPat = h\nTimeou = "
        "1\n");
    EXPECT_EQ(Target("nothing", "nothing", 0), target_of(config));
}

TEST(ReadCoreConfig, LetsTheLastOfAKeyCountAcrossSections) {
    const CoreConfig config = read_ftp(
        "TargetURL = a\nTargetPath = b\nTimeout = 1\nTargetURL = c\n[Other]\nTimeout = 5\n"
        "[CoreHandlerFtp2]\nTargetPath = d\nTimeout = 2\n");
    EXPECT_EQ(Target("c", "d", 2), target_of(config));
}

TEST(ReadCoreConfig, DoesNotSeeASectionBeforeTheChoice) {
    const CoreConfig config = read_text(
        "[CoreHandlerFtp]\nTargetURL = a\nTargetPath = b\nTimeout = 1\n[General]\nCoreHandler = "
        "FTP\n");
    EXPECT_TRUE(config.use_ftp);
    EXPECT_EQ(Target("nothing", "nothing", 0), target_of(config));
}

TEST(ReadCoreConfig, SeesWhatFollowsTheChoiceInTheSection) {
    const CoreConfig config =
        read_text("[CoreHandlerFtp]\nTargetPath = b\nCoreHandler = FTP\nTargetURL = a\n");
    EXPECT_EQ("a", text_of(config.target_url));
    EXPECT_EQ("nothing", text_of(config.target_path));
}

TEST(ReadCoreConfig, TakesACutFileForWhatItStillTells) {
    const std::string whole =
        "CoreHandler = FTP\n[CoreHandlerFtp]\nTargetURL = ftp://host\nTimeout = 30\n";
    for (size_t length = 0; length <= whole.size(); ++length) {
        const CoreConfig config = read_text(whole.substr(0, length));
        EXPECT_EQ(length >= whole.find("\n["), config.use_ftp) << length;
        const std::string url = config.target_url != nullptr ? config.target_url.get() : "";
        EXPECT_EQ(0u, std::string("ftp://host").find(url)) << length;
        EXPECT_TRUE(config.timeout_s == 0 || config.timeout_s == 3 || config.timeout_s == 30);
    }
}

TEST(ParseTimeout, TakesTheNumberAtTheBeginning) {
    EXPECT_EQ(30, parse_timeout("30"));
    EXPECT_EQ(30, parse_timeout("30s"));
    EXPECT_EQ(10, parse_timeout("010"));
    EXPECT_EQ(0, parse_timeout("0x10"));
    EXPECT_EQ(1, parse_timeout("1.9"));
}

TEST(ParseTimeout, KnowsNoLimitWithoutAUsableNumber) {
    for (const char *text : {"", "0", "never", "-1", "-99999999999999999999", "-"})
        EXPECT_EQ(0, parse_timeout(text)) << text;
}

TEST(ParseTimeout, CutsLongLimitsToWhatLibcurlTakes) {
    EXPECT_EQ(2147483, parse_timeout("2147483"));
    for (const char *text : {"2147484", "4294967296", "99999999999999999999999"})
        EXPECT_EQ(2147483, parse_timeout(text)) << text;
}
