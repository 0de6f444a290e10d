#include "cgi/request_values.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <numeric>
#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

// What parse_number makes of `text`: the number, or "none".
std::string parsed(const std::string &text) {
    int32_t number = 77;
    bool found = parse_number(text.c_str(), &number);
    EXPECT_TRUE(found || number == 77) << text;
    return found ? std::to_string(number) : "none";
}

// The list after another one has been appended to it.
std::vector<pid_t> with_list(std::vector<pid_t> pids, const std::string &list) {
    int count = static_cast<int>(pids.size());
    pids.resize(MAX_TRACED + 1, -7);
    add_pid_list(list.c_str(), pids.data(), &count);
    EXPECT_EQ(-7, pids[MAX_TRACED]) << "written behind the end";
    EXPECT_LE(count, MAX_TRACED);
    pids.resize(static_cast<size_t>(count));
    return pids;
}

std::vector<pid_t> listed(const std::string &list) {
    return with_list({}, list);
}

// Processes of the given name.
class Namesakes {
  public:
    Namesakes(const std::string &name, int count) {
        for (int i = 0; i < count; ++i) {
            processes_.push_back(std::make_unique<Background>(
                std::vector<std::string>{fixture_path("behave"), "sleep"},
                RunOptions{.argv0 = "/of/" + name}));
            EXPECT_EQ("ready", processes_.back()->read_line());
            pids_.push_back(processes_.back()->pid());
        }
    }
    const std::vector<pid_t> &pids() const { return pids_; }

  private:
    std::vector<std::unique_ptr<Background>> processes_;
    std::vector<pid_t> pids_;
};

// An id that no process has.
pid_t absent_pid() {
    pid_t pid = fork();
    if (pid == 0)
        _exit(0);
    EXPECT_EQ(pid, waitpid(pid, nullptr, 0));
    return pid;
}

TEST(ParseNumber, TakesDigitsBehindBlanksAndASign) {
    EXPECT_EQ("123", parsed("123"));
    EXPECT_EQ("123", parsed(" \t\n\v\f\r123"));
    EXPECT_EQ("5", parsed("+5"));
    EXPECT_EQ("-5", parsed("-5"));
    EXPECT_EQ("-1", parsed("-1"));
    EXPECT_EQ("0", parsed("0"));
    EXPECT_EQ("0", parsed("-0"));
}

TEST(ParseNumber, IsAlwaysDecimal) {
    EXPECT_EQ("10", parsed("010"));
    EXPECT_EQ("0", parsed("0x1f"));
}

TEST(ParseNumber, DoesNotMindWhatFollowsTheDigits) {
    EXPECT_EQ("123", parsed("123abc"));
    EXPECT_EQ("1", parsed("1,2"));
    EXPECT_EQ("12", parsed("12 34"));
    EXPECT_EQ("12", parsed("12.9"));
}

TEST(ParseNumber, FindsNoneWithoutDigits) {
    for (const char *text : {"", " ", "-", "+", "abc", "- 1", "--1", "+-1", ".5", "x1"})
        EXPECT_EQ("none", parsed(text)) << text;
}

TEST(ParseNumber, EndsAtTheLimitsOf32Bits) {
    EXPECT_EQ("2147483646", parsed("2147483646"));
    EXPECT_EQ("2147483647", parsed("2147483647"));
    EXPECT_EQ("2147483647", parsed("000000000000000000000000002147483647"));
    EXPECT_EQ("none", parsed("2147483648"));
    EXPECT_EQ("none", parsed("4294967295"));
    EXPECT_EQ("none", parsed("4294967296"));
    EXPECT_EQ("none", parsed("4294967297"));
    EXPECT_EQ("-2147483647", parsed("-2147483647"));
    EXPECT_EQ("-2147483648", parsed("-2147483648"));
    EXPECT_EQ("none", parsed("-2147483649"));
    EXPECT_EQ("none", parsed("-4294967297"));
}

TEST(ParseNumber, EndsAtTheLimitsOf64Bits) {
    for (const char *text : {"9223372036854775807", "9223372036854775808", "18446744073709551615",
                             "18446744073709551617", "-9223372036854775808", "-9223372036854775809",
                             "99999999999999999999999999999999999999"})
        EXPECT_EQ("none", parsed(text)) << text;
}

TEST(ParseNumber, DoesNotMindAnEarlierError) {
    errno = ERANGE;
    EXPECT_EQ("5", parsed("5"));
}

TEST(NumberOrMinusOne, IsMinusOneUnlessThereIsANumber) {
    EXPECT_EQ(-1, number_or_minus_one(nullptr));
    EXPECT_EQ(-1, number_or_minus_one(""));
    EXPECT_EQ(-1, number_or_minus_one("abc"));
    EXPECT_EQ(-1, number_or_minus_one("2147483648"));
    EXPECT_EQ(-1, number_or_minus_one("-2147483649"));
    EXPECT_EQ(-1, number_or_minus_one("-1"));
    EXPECT_EQ(0, number_or_minus_one("0"));
    EXPECT_EQ(-30, number_or_minus_one("-30"));
    EXPECT_EQ(2147483647, number_or_minus_one("2147483647s"));
}

TEST(FindProcess, TakesANumberAsAnIdWhetherThereIsSuchAProcessOrNot) {
    EXPECT_EQ(123, find_process("123abc"));
    EXPECT_EQ(123, find_process("  123"));
    EXPECT_EQ(2147483647, find_process("2147483647"));
    EXPECT_EQ(-2, find_process("-2"));
    EXPECT_EQ(0, find_process("0"));
}

TEST(FindProcess, FindsTheFirstOfAName) {
    run_in_sandbox([] {
        Namesakes sakes("namesake", 3);
        EXPECT_EQ(sakes.pids()[0], find_process("namesake"));
        EXPECT_EQ(sakes.pids()[0], find_process(" \tnamesake \r\n"));
        for (const char *name : {"namesak", "namesakes", "Namesake", "/of/namesake", "name sake"})
            EXPECT_EQ(-1, find_process(name)) << name;
    });
}

TEST(FindProcess, TakesMinusOneAndWhatDoesNotFitForNames) {
    run_in_sandbox([] {
        for (const char *name : {"-1", "2147483648", "-2147483649", "99999999999999999999", ""})
            EXPECT_EQ(-1, find_process(name)) << name;
        Namesakes odd("-1", 1);
        Namesakes big("4294967297", 1);
        EXPECT_EQ(odd.pids()[0], find_process("-1"));
        EXPECT_EQ(big.pids()[0], find_process(" 4294967297 "));
    });
}

TEST(FindProcess, ReadsNamesOfAnyLength) {
    EXPECT_EQ(-1, find_process(std::string(4000, 'x').c_str()));
    EXPECT_EQ(-1, find_process(std::string(4000, ' ').c_str()));
}

TEST(AddPidList, AnEmptyOneAddsNothing) {
    for (const char *list : {"", ",", ",,,", " ", " , \t, ", "\n"})
        EXPECT_EQ(std::vector<pid_t>{}, listed(list)) << list;
    EXPECT_EQ(std::vector<pid_t>{}, listed(std::string(4000, ',')));
}

TEST(AddPidList, AddsTheIdsOfRunningProcessesInTheirOrder) {
    pid_t self = getpid(), parent = getppid();
    std::string two = std::to_string(self) + "," + std::to_string(parent);
    EXPECT_EQ((std::vector<pid_t>{self, parent}), listed(two));
    EXPECT_EQ((std::vector<pid_t>{self, parent}), listed(two + ","));
    EXPECT_EQ((std::vector<pid_t>{self, parent}), listed(",," + two + ",,"));
    EXPECT_EQ((std::vector<pid_t>{self, self}),
              listed(" " + std::to_string(self) + "x\t, \n+" + std::to_string(self) + " "));
    EXPECT_EQ((std::vector<pid_t>{parent, self}), with_list({parent}, std::to_string(self)));
}

TEST(AddPidList, DropsIdsWithoutAProcess) {
    pid_t self = getpid();
    EXPECT_EQ(std::vector<pid_t>{self}, listed(std::to_string(absent_pid()) + ",2147483647," +
                                               std::to_string(self) + ",-2147483648"));
}

TEST(AddPidList, FindsProcessesBehindThousandsOfCommas) {
    pid_t self = getpid();
    EXPECT_EQ(std::vector<pid_t>{self},
              listed(std::string(4000, ',') + std::to_string(self) + std::string(4000, ',')));
}

TEST(AddPidList, OneThenInitAddsOneAndThenEveryProcessOfThatName) {
    run_in_sandbox([] {
        Namesakes inits("init", 3);
        std::vector<pid_t> expected = inits.pids();
        expected.insert(expected.begin(), 1);
        EXPECT_EQ(expected, listed("1,init"));
        EXPECT_EQ(expected, listed(" 1 , init "));
        expected.push_back(1);
        EXPECT_EQ(expected, listed("1,nobody,init,,inits,1"));
    });
}

TEST(AddPidList, TakesTheNamesakesInTheOrderOfTheirIds) {
    run_in_sandbox([] {
        Namesakes sakes("namesake", 32);
        EXPECT_EQ(sakes.pids(), listed("namesake"));
    });
}

TEST(AddPidList, TakesNoMoreThan32Namesakes) {
    run_in_sandbox([] {
        Namesakes sakes("namesake", 33);
        std::vector<pid_t> expected = sakes.pids();
        expected.pop_back();
        EXPECT_EQ(expected, listed("namesake"));
        // Each time that it is named.
        expected.insert(expected.end(), sakes.pids().begin(), sakes.pids().end() - 1);
        EXPECT_EQ(expected, listed("namesake,namesake"));
    });
}

TEST(AddPidList, SkipsPiecesOf32BytesOrMore) {
    run_in_sandbox([] {
        const std::string name31(31, 'n'), name32(32, 'n'), name33(33, 'n');
        Namesakes of31(name31, 1), of32(name32, 1), of33(name33, 1);
        EXPECT_EQ(of31.pids(), listed(name31));
        EXPECT_EQ(of31.pids(), listed(name33 + "," + name31 + "," + name32));
        EXPECT_EQ(std::vector<pid_t>{}, listed(name32));
        EXPECT_EQ(std::vector<pid_t>{}, listed(name33));
        // The blanks around it belong to the piece.
        EXPECT_EQ(std::vector<pid_t>{}, listed(name31 + " "));
        EXPECT_EQ(std::vector<pid_t>{1}, listed(std::string(30, ' ') + "1"));
        EXPECT_EQ(std::vector<pid_t>{}, listed(std::string(31, ' ') + "1"));
        EXPECT_EQ(std::vector<pid_t>{1}, listed("1" + std::string(30, 'x')));
        EXPECT_EQ(std::vector<pid_t>{}, listed("1" + std::string(31, 'x')));
    });
}

TEST(AddPidList, HoldsNoMoreThan512Entries) {
    const std::string self = std::to_string(getpid());
    std::string list = self;
    for (int i = 1; i < 511; ++i)
        list += "," + self;
    EXPECT_EQ(511u, listed(list).size());
    list += "," + self;
    EXPECT_EQ(512u, listed(list).size());
    list += "," + self;
    EXPECT_EQ(512u, listed(list).size());
    EXPECT_EQ(512u, with_list(std::vector<pid_t>(512, 1), self).size());
}

TEST(AddPidList, TakesAsManyNamesakesAsFit) {
    run_in_sandbox([] {
        Namesakes sakes("namesake", 4);
        for (size_t room = 0; room <= 5; ++room) {
            std::vector<pid_t> expected(512 - room, 1);
            expected.insert(expected.end(), sakes.pids().begin(),
                            sakes.pids().begin() + static_cast<long>(std::min<size_t>(room, 4)));
            EXPECT_EQ(expected, with_list(std::vector<pid_t>(512 - room, 1), "namesake")) << room;
        }
    });
}

TEST(AddPidToken, TakesTheTokenAsItIs) {
    pid_t pids[MAX_TRACED];
    int count = 0;
    add_pid_token("", pids, &count);
    add_pid_token("no such process, surely", pids, &count);
    EXPECT_EQ(0, count);
    add_pid_token(std::to_string(getpid()).c_str(), pids, &count);
    EXPECT_EQ(1, count);
    EXPECT_EQ(getpid(), pids[0]);
}

TEST(ParseTraceItems, JoinsTheNamedItems) {
    const struct {
        const char *list;
        uint32_t items;
    } CASES[] = {
        {"smaps", 0x1},
        {"smaps,status", 0x3},
        {" smaps ,\tpidstat\n", 0x401},
        {"smaps,smaps", 0x1},
        {",smaps,,event,", 0x201},
        {"all", 0x67b},
        {"fast", 0x67c},
        {"all,fast", 0x67f},
        {"all,smapstot,pagetypeinfo,mediahub", 0x7ff},
        {"filenr,unknown", 0x8},
        {"Smaps,meminfo", 0x10},
        {"smap s,diskinfo", 0x20},
        {"iostat;event", 0x67c},
    };
    for (const auto &row : CASES)
        EXPECT_EQ(row.items, parse_trace_items(row.list)) << row.list;
}

TEST(ParseTraceItems, WithoutAKnownNameAreTheFastSet) {
    for (const char *list : {"", ",", "unknown", "ALL", "0x1", "1", " "})
        EXPECT_EQ(0x67cu, parse_trace_items(list)) << list;
    EXPECT_EQ(0x67cu, parse_trace_items(std::string(4000, ',').c_str()));
}

TEST(ParseTraceItems, SkipPiecesOf32BytesOrMore) {
    EXPECT_EQ(0x1u, parse_trace_items((std::string(26, ' ') + "smaps").c_str()));
    EXPECT_EQ(0x2u, parse_trace_items((std::string(27, ' ') + "smaps,status").c_str()));
    EXPECT_EQ(0x67cu, parse_trace_items((std::string(28, ' ') + "smaps").c_str()));
    EXPECT_EQ(0x10u, parse_trace_items((std::string(4000, 'x') + ",meminfo").c_str()));
}

}  // namespace
