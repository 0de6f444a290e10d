// Whole traces, read as a client reads them.
#include "rtrace/rtrace.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <map>
#include <set>
#include <string>
#include <thread>

#include "probe_stand_ins.h"
#include "support/rtrace_stream.h"
#include "support/temp_dir.h"

namespace {

constexpr uint32_t SMAPS = 0x1, STATUS = 0x2, SMAPSTOT = 0x4, FILENR = 0x8, MEMINFO = 0x10;
constexpr uint32_t DISKINFO = 0x20, PAGETYPEINFO = 0x80, EVENT = 0x200, PIDSTAT = 0x400;

// A trace in a thread of its own, as in the service. Only inside a sandbox, whose end is also the
// end of a trace that does not end for itself.
class RunningTrace {
  public:
    RunningTrace(int32_t interval, uint32_t items) {
        signal(SIGPIPE, SIG_IGN);
        int ends[2];
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
        client_ = ends[0];
        Rtrace *trace = rtrace_create(ends[1], interval, items);
        EXPECT_NE(nullptr, trace);
        thread_ = std::thread([trace, fd = ends[1]] {
            rtrace_run(trace);
            rtrace_free(trace);
            close(fd);
        });
    }
    ~RunningTrace() {
        disconnect();
        if (thread_.joinable())
            thread_.detach();
    }
    RunningTrace(const RunningTrace &) = delete;
    RunningTrace &operator=(const RunningTrace &) = delete;

    RtraceTestRecord next() { return receive_rtrace_record(client_); }

    bool is_silent_for(int milliseconds) const {
        pollfd waited = {client_, POLLIN, 0};
        return poll(&waited, 1, milliseconds) == 0;
    }

    // Everything up to the end, which the trace must come to by itself.
    std::string rest() {
        std::string text;
        char block[65536];
        ssize_t n;
        while ((n = read(client_, block, sizeof block)) > 0)
            text.append(block, static_cast<size_t>(n));
        thread_.join();
        return text;
    }

    void disconnect() {
        if (client_ >= 0)
            close(client_);
        client_ = -1;
    }

    // Returns when the trace has.
    void wait_for_end() { thread_.join(); }

  private:
    int client_ = -1;
    std::thread thread_;
};

// A /proc in which nothing moves. In files, so that what is read is known; it must live as long as
// the trace.
void make_proc(const TempDir &proc) {
    proc.file("7/smaps", "smaps of 7");
    proc.file("7/status", "status of 7");
    proc.file("smapstot", "smapstot");
    proc.file("sys/fs/file-nr", "1 0 2\n");
    proc.file("meminfo", "MemTotal: 1 kB\n");
    proc.file("mounts", "");
    proc.file("pagetypeinfo", "pages");
    sandbox_bind(proc.path(), "/proc");
}

bool has_children() {
    return waitpid(-1, nullptr, WNOHANG) != -1;
}

bool is_gone(pid_t pid) {
    return kill(pid, 0) == -1 && errno == ESRCH;
}

TEST(Rtrace, SamplesEverythingInItsOrderPassAfterPass) {
    run_in_sandbox([] {
        TempDir proc;
        make_proc(proc);
        RunningTrace trace(0,
                           SMAPS | STATUS | SMAPSTOT | FILENR | MEMINFO | DISKINFO | PAGETYPEINFO);
        const struct {
            const char *brief;
            std::string payload;
        } expected[] = {
            {"4/1/0", ""},
            {"2/1/14", std::string("\7\0\0\0smaps of 7", 14)},
            {"2/0/0", ""},
            {"3/1/15", std::string("\7\0\0\0status of 7", 15)},
            {"3/0/0", ""},
            {"4/0/0", ""},
            {"6/1/8", "smapstot"},
            {"6/0/0", ""},
            {"7/1/6", "1 0 2\n"},
            {"7/0/0", ""},
            {"8/1/15", "MemTotal: 1 kB\n"},
            {"8/0/0", ""},
            {"9/0/43", "Filesystem          \tUsed\tAvail\tMounted on\n"},
            {"10/1/5", "pages"},
            {"10/0/0", ""},
        };
        for (int pass = 0; pass < 3; ++pass) {
            for (const auto &record : expected) {
                const RtraceTestRecord sent = trace.next();
                ASSERT_EQ(record.brief, brief(sent));
                EXPECT_EQ(record.payload, sent.payload);
            }
        }
        trace.disconnect();
        trace.wait_for_end();
    });
}

TEST(Rtrace, SamplesNothingThatIsNotWanted) {
    run_in_sandbox([] {
        TempDir proc;
        make_proc(proc);
        const struct {
            uint32_t items;
            const char *pass;
        } cases[] = {
            {SMAPS, "4/1/0 2/1/14 2/0/0 4/0/0 "}, {STATUS, "4/1/0 3/1/15 3/0/0 4/0/0 "},
            {SMAPSTOT, "6/1/8 6/0/0 "},           {FILENR, "7/1/6 7/0/0 "},
            {MEMINFO, "8/1/15 8/0/0 "},           {DISKINFO, "9/0/43 "},
            {PAGETYPEINFO, "10/1/5 10/0/0 "},
        };
        for (const auto &c : cases) {
            RunningTrace trace(0, c.items);
            std::string sent;
            while (sent.size() < 2 * std::string(c.pass).size() && !testing::Test::HasFailure())
                sent += brief(trace.next()) + " ";
            EXPECT_EQ(std::string(c.pass) + c.pass, sent);
            trace.disconnect();
            trace.wait_for_end();
        }
    });
}

TEST(Rtrace, AMissingSmapstotGivesNoRecord) {
    run_in_sandbox([] {
        TempDir proc;
        make_proc(proc);
        ASSERT_EQ(0, unlink((proc / "smapstot").c_str()));
        RunningTrace trace(0, SMAPSTOT | FILENR);
        for (int pass = 0; pass < 2; ++pass) {
            EXPECT_EQ("7/1/6", brief(trace.next()));
            EXPECT_EQ("7/0/0", brief(trace.next()));
        }
        trace.disconnect();
        trace.wait_for_end();
    });
}

TEST(Rtrace, LooksAtEveryProcess) {
    run_in_sandbox([] {
        Background other({"/bin/cat"});
        RunningTrace trace(-1, SMAPS | STATUS);
        std::map<uint32_t, std::map<int, std::string>> seen;  // by record type and process
        EXPECT_EQ("4/1/0", brief(trace.next()));
        for (;;) {
            const RtraceTestRecord record = trace.next();
            if (record.type == 4 || testing::Test::HasFailure())
                break;
            if (record.flag == 0)
                continue;
            ASSERT_GT(record.length, 4U);
            const auto *id = reinterpret_cast<const unsigned char *>(record.payload.data());
            seen[record.type][id[0] | id[1] << 8 | id[2] << 16 | id[3] << 24] +=
                record.payload.substr(4);
        }
        std::set<int> with_status;
        for (const auto &[pid, text] : seen[3]) {
            EXPECT_NE(std::string::npos, text.find("\nPid:\t" + std::to_string(pid) + "\n"));
            with_status.insert(pid);
        }
        EXPECT_EQ((std::set<int>{1, getpid(), other.pid()}), with_status);
        EXPECT_NE(std::string::npos, seen[2][other.pid()].find("[stack]"));
    });
}

TEST(Rtrace, AFileOnlyPassIsFollowedBySleepingForTheInterval) {
    run_in_sandbox([] {
        RunningTrace trace(2, MEMINFO);
        int64_t ends[2];
        for (int64_t &end : ends) {
            EXPECT_EQ(8U, trace.next().type);
            RtraceTestRecord record;
            do
                record = trace.next();
            while (record.flag == 1);
            end = record.time_ms;
        }
        EXPECT_GE(ends[1] - ends[0], 1950);  // wall-clock time may be adjusted meanwhile
    });
}

TEST(Rtrace, AnIntervalOf0SamplesWithoutPause) {
    run_in_sandbox(
        [] {
            RunningTrace trace(0, FILENR);
            for (int pass = 0; pass < 200; ++pass) {
                EXPECT_EQ(1U, trace.next().flag);
                EXPECT_EQ("7/0/0", brief(trace.next()));
            }
            trace.disconnect();
            trace.wait_for_end();
        },
        {.timeout_s = 60});
}

TEST(Rtrace, AFileOnlyTraceSleepsPracticallyForEverWithANegativeInterval) {
    run_in_sandbox([] {
        RunningTrace trace(-1, FILENR);
        EXPECT_EQ(1U, trace.next().flag);
        EXPECT_EQ("7/0/0", brief(trace.next()));
        EXPECT_TRUE(trace.is_silent_for(1500));
    });
}

TEST(Rtrace, ATraceWithProbesEndsAfterItsFirstPassWithANegativeInterval) {
    run_in_sandbox([] {
        stand_in_for_probes();
        RunningTrace trace(-1, FILENR | EVENT);
        const RtraceTestStream stream = parse_rtrace(trace.rest());
        EXPECT_EQ("", stream.rest);
        ASSERT_EQ(2U, stream.records.size());
        EXPECT_EQ("7/0/0", brief(stream.records[1]));
        EXPECT_FALSE(has_children());
    });
}

TEST(Rtrace, WithProbesAPassTakesTheirOutputInsteadOfSleeping) {
    run_in_sandbox([] {
        stand_in_for_probes();
        RunningTrace trace(2, FILENR | EVENT | PIDSTAT);
        EXPECT_EQ(7U, trace.next().type);
        EXPECT_EQ("7/0/0", brief(trace.next()));
        std::map<uint32_t, RtraceTestRecord> output;
        for (int i = 0; i < 2; ++i) {
            const RtraceTestRecord record = trace.next();
            EXPECT_EQ(0U, record.flag);
            output[record.type] = record;
        }
        EXPECT_EQ(0U, rest_of_line(output[12].payload).find("argv=[/usr/bin/evsink][-s][-r] "));
        EXPECT_EQ(0U, rest_of_line(output[13].payload).find("argv=[/usr/bin/pidstat][2] "));
        EXPECT_EQ(7U, trace.next().type) << "the next pass";
    });
}

TEST(Rtrace, WhatAProbeWritesAfterItWasReadWaitsForTheNextPass) {
    run_in_sandbox([] {
        TempDir dir;
        ASSERT_EQ(0, mkfifo((dir / "go").c_str(), 0600));
        // The first to be read is let go on by the second, which is read after that.
        const std::string first =
            dir.file("first",
                     "#!/bin/sh\necho one\nread -r line <" + dir / "go" + "\necho two\necho >" +
                         dir / "go2" + "\nexec sleep 1000\n",
                     0755);
        const std::string second = dir.file(
            "second", "#!/bin/sh\nread -r line <" + dir / "go2" + "\necho other\nexec sleep 1000\n",
            0755);
        ASSERT_EQ(0, mkfifo((dir / "go2").c_str(), 0600));
        sandbox_bind(first, "/usr/bin/evsink");
        sandbox_bind(second, "/usr/bin/pidstat");
        setenv("PATH", "/usr/bin:/bin", 1);
        RunningTrace trace(4, FILENR | EVENT | PIDSTAT);
        std::string order;
        for (int i = 0; i < 7; ++i) {
            const RtraceTestRecord record = trace.next();
            order += record.type == 7 ? brief(record).substr(0, 3) : record.payload;
            order += " ";
            if (record.payload == "one\n")
                sandbox_shell("echo >" + dir / "go");
        }
        EXPECT_EQ("7/1 7/0 one\n other\n 7/1 7/0 two\n ", order);
    });
}

TEST(Rtrace, EndsWithItsProbesAtTheNextWriteAfterTheClientHasGone) {
    run_in_sandbox([] {
        stand_in_for_probes();
        RunningTrace trace(1, FILENR | 0x740);
        std::set<pid_t> probes;
        while (probes.size() < 4 && !testing::Test::HasFailure()) {
            const RtraceTestRecord record = trace.next();
            if (record.type != 7)
                probes.insert(pid_of_line(record.payload));
        }
        for (pid_t probe : probes)
            EXPECT_FALSE(is_gone(probe)) << probe;
        trace.disconnect();
        trace.wait_for_end();
        for (pid_t probe : probes)
            EXPECT_TRUE(is_gone(probe)) << probe;
        EXPECT_FALSE(has_children());
    });
}

TEST(Rtrace, AVeryLongRestEndsWhenTheClientGoes) {
    run_in_sandbox([] {
        for (int32_t interval : {-1, 61}) {
            RunningTrace trace(interval, FILENR);
            EXPECT_EQ(1U, trace.next().flag);
            EXPECT_EQ("7/0/0", brief(trace.next()));
            trace.disconnect();
            trace.wait_for_end();
        }
    });
}

TEST(Rtrace, ATraceThatHasNothingToWriteEndsWhenTheClientHasGone) {
    run_in_sandbox([] {
        TempDir proc;
        make_proc(proc);
        ASSERT_EQ(0, unlink((proc / "smapstot").c_str()));
        RunningTrace trace(0, SMAPSTOT);
        EXPECT_TRUE(trace.is_silent_for(100));
        trace.disconnect();
        trace.wait_for_end();
    });
}

TEST(Rtrace, ALongPassOfSilentProbesEndsWithThemWhenTheClientGoes) {
    run_in_sandbox([] {
        stand_in_for_probes();
        RunningTrace trace(2147, EVENT);
        const pid_t probe = pid_of_line(trace.next().payload);
        EXPECT_FALSE(is_gone(probe));
        trace.disconnect();
        trace.wait_for_end();
        EXPECT_TRUE(is_gone(probe));
    });
}

TEST(Rtrace, TracesAtTheSameTimeHaveProbesOfTheirOwn) {
    run_in_sandbox([] {
        stand_in_for_probes();
        RunningTrace first(1, FILENR | EVENT);
        RunningTrace second(1, FILENR | EVENT);
        const auto probe_of = [](RunningTrace &trace) {
            RtraceTestRecord record;
            do
                record = trace.next();
            while (record.type == 7);
            return pid_of_line(record.payload);
        };
        const pid_t of_first = probe_of(first);
        const pid_t of_second = probe_of(second);
        EXPECT_NE(of_first, of_second);
        first.disconnect();
        first.wait_for_end();
        EXPECT_TRUE(is_gone(of_first));
        EXPECT_FALSE(is_gone(of_second));
        // Twice, since the first may have been under way.
        for (int records = 0; records < 4; ++records)
            EXPECT_EQ(7U, second.next().type);
        second.disconnect();
        second.wait_for_end();
        EXPECT_TRUE(is_gone(of_second));
    });
}

TEST(Rtrace, FreeingNoneIsHarmless) {
    rtrace_free(nullptr);
}

}  // namespace
