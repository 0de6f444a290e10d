#include "proc/socket_tables.h"

#include <gtest/gtest.h>

#include <string>

namespace {

// As the kernel prints them.
const std::string TCP_LINE =
    "   1: 0200000A:0050 0900000A:C886 01 00000000:00000000 00:00000000 00000000  1000        0 "
    "4711 1 0000000000000000 20 4 30 10 -1                     \n";
const std::string TCP_LISTEN_LINE =
    "   0: 00000000:0016 00000000:0000 0A 00000000:00000000 00:00000000 00000000     0        0 "
    "4712 1 0000000000000000 100 0 0 10 0                      \n";
const std::string TCP6_LINE =
    "   0: 00000000000000000000000001000000:1F90 00000000000000000000000001000000:9D78 01 "
    "00000000:00000000 00:00000000 00000000     0        0 4713 1 0000000000000000 20 4 0 10 -1\n";
const std::string TCP6_MAPPED_LINE =
    "   0: 0000000000000000FFFF00000200000A:1F90 B80D0120000000000000000001000000:9D78 08 "
    "00000000:00000000 00:00000000 00000000     0        0 4714 1 0000000000000000 20 4 0 10 -1\n";
const std::string UNIX_LINE =
    "0000000000000000: 00000002 00000000 00010000 0001 01  4715 /run/app.sock\n";

using Match = int (*)(const char *, unsigned long, char *, size_t);

// The text for `inode` in `line`; "(no match)" for none.
std::string match(Match function, const std::string &line, unsigned long inode) {
    char buf[256] = "";
    int length = function(line.c_str(), inode, buf, sizeof buf);
    if (length == NO_MATCH)
        return "(no match)";
    EXPECT_EQ(length, static_cast<int>(std::string(buf).size()));
    return buf;
}

TEST(TcpLine, ShowsBothEndsAndTheState) {
    EXPECT_EQ("[10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]",
              match(match_tcp_line, TCP_LINE, 4711));
}

TEST(TcpLine, OfAListeningSocketShowsNoRemoteEnd) {
    EXPECT_EQ("[0.0.0.0:22 -> 0.0.0.0:0][TCP_LISTEN]",
              match(match_tcp_line, TCP_LISTEN_LINE, 4712));
}

TEST(TcpLine, DoesNotMatchAnotherInodeOrTheHeader) {
    EXPECT_EQ("(no match)", match(match_tcp_line, TCP_LINE, 471));
    EXPECT_EQ("(no match)", match(match_tcp_line, TCP_LINE, 47110));
    std::string header =
        "  sl  local_address rem_address   st tx_queue rx_queue tr tm->when retrnsmt   uid  "
        "timeout "
        "inode                                                     \n";
    EXPECT_EQ("(no match)", match(match_tcp_line, header, 0));
}

TEST(TcpLine, WithAUserIdWiderThanFiveDigitsDoesNotMatch) {
    std::string line = TCP_LINE;
    line.replace(line.find(" 1000 "), 5, "100000");
    EXPECT_EQ("(no match)", match(match_tcp_line, line, 4711));
    line.replace(line.find("100000"), 6, "1000000");
    EXPECT_EQ("(no match)", match(match_tcp_line, line, 4711));
    line.replace(line.find("       0 4711"), 8, "      12");
    EXPECT_EQ("(no match)", match(match_tcp_line, line, 2));
    line = TCP_LINE;
    line.replace(line.find("  1000 "), 6, " 65534");
    EXPECT_EQ("[10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]",
              match(match_tcp_line, line, 4711));
}

TEST(TcpLine, NamesEveryStateOfTheTableAndShowsTheNumberOfOthers) {
    const char *const names[] = {"DESTROYED",
                                 "TCP_ESTABLISHED",
                                 "TCP_SYN_SENT",
                                 "TCP_SYN_RECV",
                                 "TCP_FIN_WAIT1",
                                 "TCP_FIN_WAIT2",
                                 "TCP_TIME_WAIT",
                                 "TCP_CLOSE",
                                 "TCP_CLOSE_WAIT",
                                 "TCP_LAST_ACK",
                                 "TCP_LISTEN",
                                 "TCP_CLOSING",
                                 "12",
                                 "13"};
    for (unsigned state = 0; state < 14; ++state) {
        std::string line = TCP_LINE;
        char digits[3];
        snprintf(digits, sizeof digits, "%02X", state);
        line.replace(34, 2, digits);
        EXPECT_EQ("[10.0.0.2:80 -> 10.0.0.9:51334][" + std::string(names[state]) + "]",
                  match(match_tcp_line, line, 4711));
    }
    std::string line = TCP_LINE;
    line.replace(34, 2, "FF");
    EXPECT_EQ("[10.0.0.2:80 -> 10.0.0.9:51334][255]", match(match_tcp_line, line, 4711));
}

TEST(Tcp6Line, WritesAllEightGroupsWithoutCompression) {
    EXPECT_EQ("[0:0:0:0:0:0:0:1:8080 -> 0:0:0:0:0:0:0:1:40312][TCP_ESTABLISHED]",
              match(match_tcp6_line, TCP6_LINE, 4713));
}

TEST(Tcp6Line, ShowsAMappedAddressInHexadecimalGroups) {
    EXPECT_EQ("[0:0:0:0:0:ffff:a00:2:8080 -> 2001:db8:0:0:0:0:0:1:40312][TCP_CLOSE_WAIT]",
              match(match_tcp6_line, TCP6_MAPPED_LINE, 4714));
}

TEST(UnixLine, ShowsThePath) {
    EXPECT_EQ("[/run/app.sock]", match(match_unix_line, UNIX_LINE, 4715));
}

TEST(UnixLine, OfAnAbstractSocketShowsTheKernelsAtSign) {
    EXPECT_EQ("[@/tmp/x y]",
              match(match_unix_line,
                    "00000000: 00000002 00000000 00010000 0001 01    12 @/tmp/x y\n", 12));
}

TEST(UnixLine, WithoutAPathMatchesWithNoText) {
    std::string line = "00000000: 00000002 00000000 00010000 0001 01 4715\n";
    char buf[8] = "#";
    EXPECT_EQ(0, match_unix_line(line.c_str(), 4715, buf, sizeof buf));
    EXPECT_STREQ("#", buf);
}

TEST(UnixLine, DoesNotMatchAnotherFieldOrTheHeader) {
    EXPECT_EQ("(no match)", match(match_unix_line, UNIX_LINE, 2));
    EXPECT_EQ("(no match)", match(match_unix_line,
                                  "Num       RefCount Protocol Flags    Type St Inode Path\n", 0));
}

TEST(SocketLines, CutAtEveryLengthNeitherCrashNorMatchWrongly) {
    struct Case {
        Match function;
        const std::string &line;
        unsigned long inode;
    };
    for (const Case &c :
         {Case{match_tcp_line, TCP_LINE, 4711}, Case{match_tcp6_line, TCP6_LINE, 4713},
          Case{match_unix_line, UNIX_LINE, 4715}}) {
        size_t inode_end = c.line.find(std::to_string(c.inode)) + 4;
        for (size_t length = 0; length <= c.line.size(); ++length) {
            std::string cut = c.line.substr(0, length);
            EXPECT_EQ(length < inode_end, match(c.function, cut, c.inode) == "(no match)")
                << length;
        }
    }
}

TEST(SocketLines, ReportTheWholeLengthOfTextThatDoesNotFit) {
    std::string whole = "[10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]";
    for (size_t size = 1; size < whole.size() + 2; ++size) {
        std::string buf(size, '#');
        EXPECT_EQ(static_cast<int>(whole.size()),
                  match_tcp_line(TCP_LINE.c_str(), 4711, buf.data(), size));
        EXPECT_EQ(whole.substr(0, size - 1), buf.c_str());
    }
    char buf[20];
    EXPECT_EQ(64, match_tcp6_line(TCP6_LINE.c_str(), 4713, buf, sizeof buf));
    EXPECT_STREQ("[0:0:0:0:0:0:0:1:80", buf);
}

}  // namespace
