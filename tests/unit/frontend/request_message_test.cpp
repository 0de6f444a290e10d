#include <gtest/gtest.h>
#include <request_message.h>

#include <cstring>
#include <string>

namespace {

using namespace std::string_literals;

// The message, or "refused". Bytes behind its end are left as they were.
std::string composed(const char *script_name, const char *path_info, const char *query) {
    char message[4095];
    memset(message, '#', sizeof(message));
    const int length = compose_message(script_name, path_info, query, message);
    if (length < 0)
        return "refused";
    EXPECT_LE(length, 4095);
    for (size_t i = static_cast<size_t>(length) + 4; i < sizeof(message); ++i)
        EXPECT_EQ('#', message[i]) << i;
    return std::string(message, static_cast<size_t>(length));
}

}  // namespace

TEST(ComposeMessage, JoinsThePathAndTheQueryEachWithItsZeroByte) {
    EXPECT_EQ("/debug/debug.tgz\0cmd=ps\0"s, composed("/debug/debug.tgz", "", "cmd=ps"));
    EXPECT_EQ("/debug.tgz\0\0"s, composed("/debug.tgz", "", ""));
}

TEST(ComposeMessage, PutsThePathBehindTheProgramsName) {
    EXPECT_EQ("/cgi-bin/debugar/debug.tar\0listen\0"s,
              composed("/cgi-bin/debugar", "/debug.tar", "listen"));
}

TEST(ComposeMessage, TakesWhatTheServerDoesNotGiveForEmpty) {
    EXPECT_EQ("/x\0\0"s, composed("/x", nullptr, nullptr));
    EXPECT_EQ("/debug.tgz\0cmd=ps\0"s, composed(nullptr, "/debug.tgz", "cmd=ps"));
    EXPECT_EQ("\0\0"s, composed(nullptr, nullptr, nullptr));
}

TEST(ComposeMessage, LeavesTheQueryAsTheClientWroteIt) {
    EXPECT_EQ("/x\0cmd=strace&pid=1%2Cinit+%00&/nph-&&=\0"s,
              composed("/x", "", "cmd=strace&pid=1%2Cinit+%00&/nph-&&="));
}

TEST(ComposeMessage, HidesTheNphOfTheLastComponentFromTheService) {
    EXPECT_EQ("/cgi-bin/debug.tgz\0a=b\0"s, composed("/cgi-bin/nph-debug.tgz", "", "a=b"));
    EXPECT_EQ("debug.tgz\0\0"s, composed("nph-debug.tgz", "", ""));
    EXPECT_EQ("/\0q\0"s, composed("/nph-", "", "q"));
    // Elsewhere it is part of a name like any other.
    EXPECT_EQ("/cgi-bin/nph-debugar/debug.tgz\0\0"s,
              composed("/cgi-bin/nph-debugar", "/debug.tgz", ""));
    EXPECT_EQ("/my-nph-debug.tgz\0\0"s, composed("/my-nph-debug.tgz", "", ""));
    EXPECT_EQ("/nph-debug.tgz\0\0"s, composed("/nph-nph-debug.tgz", "", ""));
}

TEST(ComposeMessage, FillsAMessageToItsLastByteAndRefusesOneMore) {
    const std::string path = "/debug.tgz";        // 10 bytes
    const std::string query(4095 - 10 - 2, 'q');  // with two zero bytes: 4095
    const std::string expected = path + '\0' + query + '\0';
    ASSERT_EQ(4095u, expected.size());
    EXPECT_EQ(expected, composed("/debug.tgz", nullptr, query.c_str()));
    EXPECT_EQ("refused", composed("/debug.tgz", nullptr, (query + "q").c_str()));
    EXPECT_EQ("refused", composed("/debug.tgz", "x", query.c_str()));
    EXPECT_EQ("refused", composed(std::string(100000, '/').c_str(), nullptr, nullptr));
    EXPECT_EQ("refused", composed(nullptr, std::string(4094, '/').c_str(), nullptr));
    EXPECT_EQ(std::string(4093, '/') + '\0' + '\0',
              composed(nullptr, std::string(4093, '/').c_str(), nullptr));
}
