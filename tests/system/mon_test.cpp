// The applet mon, among processes that a sandbox holds for it.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <sys/resource.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

constexpr char REPORT[] = "/tmp/dbg-report.txt";
constexpr char FAREWELL[] = "\nCleanup and exit.\n";
// Of the pause between rounds: only the first round is made.
constexpr char FOR_EVER[] = "1000000000";

double seconds_now() {
    timespec now = {};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// What is to be run must be seen also where it was built below /tmp.
void move_programs_out_of_tmp() {
    const std::string program = fieldkit_path();
    const std::string fixtures = fixture_path("");
    if (program.rfind("/tmp/", 0) != 0 && fixtures.rfind("/tmp/", 0) != 0)
        return;
    sandbox_shell("mount -t tmpfs none /mnt && cp '" + program + "' /mnt/fieldkit && cp -r '" +
                  fixtures + "' /mnt/fixtures");
    setenv("FIELDKIT", "/mnt/fieldkit", 1);
    setenv("FIXTURES", "/mnt/fixtures", 1);
}

// In a sandbox whose /tmp is its own.
void with_private_tmp(const std::function<void()> &body) {
    run_in_sandbox([&] {
        move_programs_out_of_tmp();
        sandbox_shell("mount -t tmpfs none /tmp");
        body();
    });
}

// What can be read of the report at one go; empty when there is none.
std::string report() {
    std::ifstream file(REPORT, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

// The round that the report tells of, 0 when there is no report.
unsigned long round_of(const std::string &text) {
    unsigned long round = 0;
    return sscanf(text.c_str(), "Debug monitor status round=%lx\n", &round) == 1 ? round : 0;
}

unsigned long reported_round() {
    return round_of(report());
}

bool reaches_round(unsigned long round) {
    return wait_until([&] { return reported_round() >= round; });
}

// A round that began after this call has been reported when this is over.
bool lets_a_round_pass() {
    return reaches_round(reported_round() + 2);
}

std::string header(unsigned long round) {
    char text[64];
    snprintf(text, sizeof text, "Debug monitor status round=%lx\n\n", round);
    return text;
}

class Mon : public Background {
  public:
    explicit Mon(const std::vector<std::string> &arguments, const std::string &name = "mon")
        : Background(words(name, arguments)) {}
    // Interrupts it and waits for its end; returns what it wrote to standard error.
    std::string interrupt() {
        send_signal(SIGINT);
        RunResult result = wait();
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("", result.out);
        return result.err;
    }

  private:
    static std::vector<std::string> words(const std::string &name,
                                          const std::vector<std::string> &arguments) {
        std::vector<std::string> result = {fieldkit_path(), name};
        result.insert(result.end(), arguments.begin(), arguments.end());
        return result;
    }
};

// 40 files with the three streams, and 300 sockets: 1 and 37 points.
class Holder : public Background {
  public:
    Holder() : Background({fixture_path("holder"), "37", "300"}) {
        EXPECT_EQ("ready", read_line());
    }
};

// How often it gave the processor away, as a pause of some length does, unless the processor itself
// is taken away for that long.
unsigned long pauses_of(pid_t pid) {
    return std::stoul(status_field(pid, "voluntary_ctxt_switches:\t"));
}

TEST(Mon, ReportsOfAQuietSystemTheHeaderAndABlankLine) {
    with_private_tmp([] {
        Background quiet({fixture_path("holder"), "30", "8"});
        ASSERT_EQ("ready", quiet.read_line());
        Mon mon({FOR_EVER});
        ASSERT_TRUE(reaches_round(1));
        EXPECT_EQ("Debug monitor status round=1\n\n", report());
        EXPECT_EQ(FAREWELL, mon.interrupt());
    });
}

TEST(Mon, SamplesWithoutPauseWithTheArgument0) {
    with_private_tmp([] {
        Mon mon({"0"});
        ASSERT_TRUE(reaches_round(400));
        const unsigned long pauses = pauses_of(mon.pid());
        EXPECT_LT(pauses, reported_round() / 8);
        mon.interrupt();
    });
}

// Runs `mon` until it has made some rounds, with a pause of at least `interval_s` between each two.
void expect_pauses(Mon &mon, double start, double interval_s) {
    ASSERT_TRUE(reaches_round(20));
    const unsigned long round = reported_round();
    EXPECT_GE(seconds_now() - start, interval_s * static_cast<double>(round - 1));
    EXPECT_GE(pauses_of(mon.pid()), round / 4);
    EXPECT_EQ(FAREWELL, mon.interrupt());
}

TEST(Mon, SamplesEvery1000MicrosecondsWithTheArgument0x3e8) {
    with_private_tmp([] {
        const double start = seconds_now();
        Mon mon({"0x3e8"});
        expect_pauses(mon, start, 0.001);
    });
}

TEST(Mon, SamplesEveryMillisecondWithoutAnArgument) {
    with_private_tmp([] {
        const double start = seconds_now();
        Mon mon({});
        expect_pauses(mon, start, 0.001);
    });
}

TEST(Mon, TakesALeading0ForOctal) {
    with_private_tmp([] {
        const double start = seconds_now();
        Mon mon({"011610"});
        expect_pauses(mon, start, 0.005);
    });
}

TEST(Mon, IsFoundBehindAPathAndTakesItsIntervalFromTheArgumentAfterIt) {
    with_private_tmp([] {
        // Had it another argument 0, the path would be the interval: no number, so no pause.
        const double start = seconds_now();
        Mon mon({"5000"}, "/some/dir/mon");
        expect_pauses(mon, start, 0.005);
    });
}

TEST(Mon, LeavesTheLastCompleteReportAndNothingBesideItWhenInterrupted) {
    with_private_tmp([] {
        Mon mon({"0"});
        ASSERT_TRUE(reaches_round(100));
        EXPECT_EQ(FAREWELL, mon.interrupt());
        const std::string last = report();
        EXPECT_GE(round_of(last), 100u);
        EXPECT_EQ(header(round_of(last)), last);
        for (const auto &entry : std::filesystem::directory_iterator("/tmp")) {
            const std::string name = entry.path().filename();
            EXPECT_TRUE(name == "dbg-report.txt" || name.substr(0, 10) != "dbg-report") << name;
        }
    });
}

// Whether a report is being written, that is, a round is being made.
bool in_a_round() {
    const std::filesystem::directory_iterator tmp("/tmp"), end;
    return std::any_of(tmp, end, [](const auto &entry) {
        return entry.path().filename().string().find(".tmp-") != std::string::npos;
    });
}

TEST(Mon, NeverSleepsOverAnInterruptOfItsRound) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "the thread sanitizer may put a signal handler off until a sleep has ended";
#endif
    with_private_tmp([] {
        // These make a round long enough to be met.
        std::vector<std::unique_ptr<Holder>> holders;
        for (int i = 0; i < 10; ++i)
            holders.push_back(std::make_unique<Holder>());
        for (int i = 0; i < 10; ++i) {
            Mon mon({FOR_EVER});
            // Without a pause of our own.
            const double deadline = seconds_now() + 20;
            while (!in_a_round() && access(REPORT, F_OK) != 0)
                ASSERT_LT(seconds_now(), deadline);
            mon.send_signal(SIGINT);
            RunResult result = mon.wait(20);
            ASSERT_EQ(0, result.exit_status) << "in attempt " << i;
            EXPECT_NE(std::string::npos, result.err.find(FAREWELL));
            EXPECT_EQ(1ul, reported_round()) << "the round is made to its end";
            ASSERT_TRUE(std::filesystem::remove(REPORT));
        }
    });
}

TEST(Mon, TellsOfAHolderOfManySocketsOnceAndShowsItsHistory) {
    with_private_tmp([] {
        Holder holder;
        const std::string pid = std::to_string(holder.pid());
        Mon mon({FOR_EVER});
        ASSERT_TRUE(reaches_round(1));
        EXPECT_EQ(
            "Debug monitor status round=1\n\n"
            "fdstats for pid=" +
                pid +
                " score=38:\n"
                "0h nr_fd=340 nr_sock=300 nr_pipe=0\n"
                "1h nr_fd=0 nr_sock=0 nr_pipe=0\n"
                "2h nr_fd=0 nr_sock=0 nr_pipe=0\n"
                "3h nr_fd=0 nr_sock=0 nr_pipe=0\n"
                "4h nr_fd=85 nr_sock=75 nr_pipe=0\n"
                "37h nr_fd=0 nr_sock=0 nr_pipe=0\n"
                "70h nr_fd=0 nr_sock=0 nr_pipe=0\n"
                "103h nr_fd=0 nr_sock=0 nr_pipe=0\n",
            report());
        EXPECT_EQ("pid " + pid + " name holder fd_score 38 [+38] sk=300\n" + FAREWELL,
                  mon.interrupt());

        // In many rounds, too, it is told of once.
        Mon again({"1000"});
        ASSERT_TRUE(reaches_round(20));
        EXPECT_EQ("pid " + pid + " name holder fd_score 38 [+38] sk=300\n" + FAREWELL,
                  again.interrupt());
    });
}

TEST(Mon, ShowsAReaderAlwaysAWholeReport) {
    with_private_tmp([] {
        Holder holder;
        Mon mon({"0"});
        ASSERT_TRUE(reaches_round(1));
        unsigned long last = 0;
        unsigned long changes = 0;
        for (int i = 0; i < 100000 && changes < 200; ++i) {
            const std::string text = report();
            const unsigned long round = round_of(text);
            ASSERT_GE(round, last) << text;
            ASSERT_EQ(header(round), text.substr(0, header(round).size()));
            ASSERT_EQ(10, std::count(text.begin(), text.end(), '\n') - 1) << text;
            ASSERT_EQ('\n', text.back()) << text;
            ASSERT_NE(std::string::npos, text.find("\n103h nr_fd=")) << text;
            changes += round != last;
            last = round;
        }
        EXPECT_EQ(200u, changes);
        mon.interrupt();
    });
}

TEST(Mon, GoesOnWithoutAReportWhereNoneCanBeWritten) {
    with_private_tmp([] {
        Holder holder;
        sandbox_shell("mount -o remount,ro /tmp");
        Mon mon({"1000"});
        ASSERT_TRUE(wait_until([&] { return pauses_of(mon.pid()) > 20; }));
        EXPECT_EQ("pid " + std::to_string(holder.pid()) +
                      " name holder fd_score 38 [+38] sk=300\n" + FAREWELL,
                  mon.interrupt());
        EXPECT_EQ("", report());
    });
}

struct OpenDescriptors {
    int all = 0;
    int sockets = 0;
};

OpenDescriptors descriptors_of(pid_t pid) {
    OpenDescriptors counts;
    const std::string dir = "/proc/" + std::to_string(pid) + "/fd";
    for (const auto &entry : std::filesystem::directory_iterator(dir)) {
        ++counts.all;
        counts.sockets += std::filesystem::read_symlink(entry).string()[0] == 's';
    }
    return counts;
}

// The history of a process that has had so many descriptors for a long time.
std::string steady_history(pid_t pid, const OpenDescriptors &counts) {
    const int score = (counts.all - counts.sockets) / 32 + counts.sockets / 8;
    std::string text =
        "fdstats for pid=" + std::to_string(pid) + " score=" + std::to_string(score) + ":\n";
    for (const char *hours : {"0", "1", "2", "3", "4", "37", "70", "103"})
        text += std::string(hours) + "h nr_fd=" + std::to_string(counts.all) +
                " nr_sock=" + std::to_string(counts.sockets) + " nr_pipe=0\n";
    return text;
}

TEST(Mon, FindsALeakAsItClimbsOver32) {
    with_private_tmp([] {
        Mon mon({"1000"});
        ASSERT_TRUE(reaches_round(1));
        Background leak({fieldkit_path(), "fdleak", "2000"}, {.before_exec = [] {
                            rlimit limit = {1000, 1000};
                            setrlimit(RLIMIT_NOFILE, &limit);
                        }});
        while (leak.read_line() != "leaked 480")
            ASSERT_FALSE(testing::Test::HasFailure());
        leak.send_signal(SIGSTOP);
        ASSERT_TRUE(wait_until([&] { return process_state(leak.pid()) == 'T'; }));
        const std::string history = steady_history(leak.pid(), descriptors_of(leak.pid()));
        EXPECT_TRUE(wait_until([&] { return report().find(history) != std::string::npos; }))
            << "expected: " << history << "last: " << report();

        const std::string err = mon.interrupt();
        int pid = 0, score = 0, change = 0, sockets = 0;
        ASSERT_EQ(4, sscanf(err.c_str(), "pid %d name fieldkit fd_score %d [+%d] sk=%d\n", &pid,
                            &score, &change, &sockets))
            << err;
        EXPECT_EQ(leak.pid(), pid);
        EXPECT_GE(score, 33);
        EXPECT_LE(score - change, 32) << "the score before was not worth telling";
        EXPECT_GE(sockets / 8, score * 3 / 4) << "every other descriptor is a socket";
    });
}

TEST(Mon, FindsAForkStormOf16ChildrenButNot15) {
    with_private_tmp([] {
        // One child for each line.
        Background storm({"/bin/sh", "-c", "while read line; do sleep 1000 & echo started; done"});
        const std::string pid = std::to_string(storm.pid());
        Mon mon({"1000"});
        for (int i = 0; i < 15; ++i) {
            storm.write_input("\n");
            ASSERT_EQ("started", storm.read_line());
        }
        ASSERT_TRUE(lets_a_round_pass());
        EXPECT_EQ(std::string::npos, report().find("forkstats"));

        storm.write_input("\n");
        ASSERT_EQ("started", storm.read_line());
        ASSERT_TRUE(lets_a_round_pass());
        const std::string text = report();
        EXPECT_EQ(header(round_of(text)) + "forkstats for pid=" + pid + ": score=16 nr_childs=16\n",
                  text);
        EXPECT_EQ("pid " + pid + " name sh fork_score 16 [+1]\n" + FAREWELL, mon.interrupt());
    });
}

}  // namespace
