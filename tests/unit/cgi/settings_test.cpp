#include "cgi/settings.h"

#include <getopt.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

struct Parsed {
    int result;
    Settings settings;
    pid_t ignore_pid = -1;
    std::string out;
};

Parsed parse(std::vector<std::string> words) {
    words.insert(words.begin(), "debugar.cgi");
    static std::vector<std::string> kept;  // strings are kept by the settings, not copied
    kept = words;
    std::vector<char *> argv;
    for (std::string &word : kept)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    Parsed parsed;
    optind = 0;
    testing::internal::CaptureStderr();
    testing::internal::CaptureStdout();
    parsed.result = parse_settings(static_cast<int>(words.size()), argv.data(), &parsed.settings,
                                   &parsed.ignore_pid);
    fflush(stdout);
    parsed.out = testing::internal::GetCapturedStdout();
    (void)testing::internal::GetCapturedStderr();
    return parsed;
}

const char USAGE[] =
    "dbg-cgi 0.1\ndbg-cgi [options] [pids...]\n\n-d\tdump tar archive with core-files for pids to "
    "stdout.\n-t\tonly tar the archive.\n-i\tignore pid\n-p\tprogram to create coredumps "
    "[/usr/bin/snapcore]\n-c\tcgi control socket name "
    "[/var/run/dbg-cgi/ctrl-cgi-socket]\n-s\tsegfault control socket name "
    "[/var/run/dbg-cgi/ctrl-segf-socket]\n-h\thelp\n";

TEST(Settings, HaveTheirInitialValues) {
    Parsed parsed = parse({});
    EXPECT_EQ(0, parsed.result);
    EXPECT_EQ(-1, parsed.ignore_pid);
    EXPECT_EQ(0u, parsed.settings.dump_mode);
    EXPECT_EQ(1u, parsed.settings.compress);
    EXPECT_EQ(0u, parsed.settings.no_daemon);
    EXPECT_STREQ("/var/run/dbg-cgi/ctrl-cgi-socket", parsed.settings.cgi_socket_path);
    EXPECT_STREQ("/var/run/dbg-cgi/ctrl-segf-socket", parsed.settings.segf_socket_path);
    EXPECT_STREQ("/usr/bin/snapcore", parsed.settings.core_program);
    EXPECT_STREQ("/var/spool/storage/SD_DISK/dumps", parsed.settings.dump_dir);
    EXPECT_EQ("", parsed.out);
}

TEST(Settings, AreOverwrittenByTheOptions) {
    Parsed parsed =
        parse({"-d", "-t", "-i", "500", "-n", "-p", "/p", "-c", "/c", "-s", "/s", "-k", "/k"});
    EXPECT_EQ(0, parsed.result);
    EXPECT_EQ(500, parsed.ignore_pid);
    EXPECT_EQ(1u, parsed.settings.dump_mode);
    EXPECT_EQ(0u, parsed.settings.compress);
    EXPECT_EQ(1u, parsed.settings.no_daemon);
    EXPECT_STREQ("/c", parsed.settings.cgi_socket_path);
    EXPECT_STREQ("/s", parsed.settings.segf_socket_path);
    EXPECT_STREQ("/p", parsed.settings.core_program);
    EXPECT_STREQ("/k", parsed.settings.dump_dir);
}

TEST(Settings, IgnoreTheSameProcessInHexadecimalDecimalAndOctal) {
    EXPECT_EQ(500, parse({"-i", "0x1f4"}).ignore_pid);
    EXPECT_EQ(500, parse({"-i", "500"}).ignore_pid);
    EXPECT_EQ(500, parse({"-i0764"}).ignore_pid);
    EXPECT_EQ(0, parse({"-i", "none"}).ignore_pid);
}

TEST(Settings, HelpIsAnsweredLikeAnUnknownOption) {
    for (const char *option : {"-h", "-x", "-?", "-p"}) {
        Parsed parsed = parse({option});
        EXPECT_EQ(-1, parsed.result) << option;
        EXPECT_EQ(USAGE, parsed.out) << option;
    }
}

TEST(Settings, ExtraArgumentsAreAcceptedAndIgnored) {
    Parsed parsed = parse({"-d", "12", "34"});
    EXPECT_EQ(0, parsed.result);
    EXPECT_EQ(1u, parsed.settings.dump_mode);
    EXPECT_EQ("", parsed.out);
}

}  // namespace
