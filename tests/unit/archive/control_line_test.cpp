#include "archive/control_line.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

std::vector<pid_t> pids(const std::string &line, int max = 10) {
    pid_t found[100];
    int count = control_line_pids(line.c_str(), found, max);
    return std::vector<pid_t>(found, found + count);
}

using Pids = std::vector<pid_t>;

//                    12345678        123456789012345678901
const std::string ONE =
    "CORELEN 12345"
    " bytes, of processes:"
    "77\n";
const std::string THREE =
    "12345678"
    "900"
    "abcdefghijklmnopqrstu"
    "5 66 777\n";

TEST(ControlLine, TellsTheLengthFromCharacterEight) {
    EXPECT_EQ(12345, control_line_core_length(ONE.c_str()));
    EXPECT_EQ(900, control_line_core_length(THREE.c_str()));
    EXPECT_EQ(0, control_line_core_length("CORELEN 0 bytes\n"));
    EXPECT_EQ(0, control_line_core_length("CORELEN none\n"));
    EXPECT_EQ(-5, control_line_core_length("CORELEN -5\n"));
}

TEST(ControlLine, ListsTheProcessesBehindTheGap) {
    EXPECT_EQ(Pids({77}), pids(ONE));
    EXPECT_EQ(Pids({5, 66, 777}), pids(THREE));
}

TEST(ControlLine, SkipsWhatIsNoDigitBetweenIds) {
    EXPECT_EQ(Pids({5, 66}), pids("12345678"
                                  "900"
                                  "abcdefghijklmnopqrstu"
                                  "x5, y66\n"));
}

TEST(ControlLine, ListsNoMoreIdsThanBlanksAndOne) {
    EXPECT_EQ(Pids({5}), pids("12345678"
                              "900"
                              "abcdefghijklmnopqrstu"
                              "5,66,777\n"));
    EXPECT_EQ(Pids({5, 66}), pids("12345678"
                                  "900"
                                  "abcdefghijklmnopqrstu"
                                  "5,66,777 \n"));
}

TEST(ControlLine, ListsNoMoreIdsThanThereIsRoomFor) {
    EXPECT_EQ(Pids({5, 66}), pids(THREE, 2));
    EXPECT_EQ(Pids(), pids(THREE, 0));
}

TEST(ControlLine, CutAtEveryLengthIsReadNoFurther) {
    for (size_t length = 0; length <= THREE.size(); ++length) {
        std::string cut = THREE.substr(0, length);
        EXPECT_EQ(length < 9    ? 0
                  : length < 10 ? 9
                  : length < 11 ? 90
                                : 900,
                  control_line_core_length(cut.c_str()));
        EXPECT_EQ(length > 32, !pids(cut).empty()) << length;
    }
}

}  // namespace
