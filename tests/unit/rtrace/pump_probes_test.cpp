// What a trace takes from its probes in one pass, with pipes that the tests write to themselves.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>

#include "rtrace/probes.h"
#include "support/rtrace_stream.h"
#include "support/temp_dir.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

class PumpProbes : public testing::Test {
  protected:
    PumpProbes() {
        dir_.file("stream", "");
        stream_.fd = open((dir_ / "stream").c_str(), O_RDWR | O_CLOEXEC);
    }
    ~PumpProbes() override { close(stream_.fd); }

    // Adds a probe that has written `output`.
    Probe &add_probe(uint32_t record_type, const std::string &output = "") {
        Probe &probe = probes_.started[probes_.count++];
        int ends[2];
        EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
        probe.record_type = record_type;
        probe.read_end.reset(ends[0]);
        probe.write_end.reset(ends[1]);
        write_output(probe, output);
        return probe;
    }

    static void write_output(const Probe &probe, const std::string &output) {
        if (output.size() > 65536) {
            EXPECT_GE(fcntl(probe.write_end.get(), F_SETPIPE_SZ, 1 << 19), 1 << 19);
        }
        EXPECT_EQ(static_cast<ssize_t>(output.size()),
                  write(probe.write_end.get(), output.data(), output.size()));
    }

    static size_t left_in(const Probe &probe) {
        int size = -1;
        EXPECT_EQ(0, ioctl(probe.read_end.get(), FIONREAD, &size));
        return static_cast<size_t>(size);
    }

    bool pump(int32_t interval) {
        const auto start = steady_clock::now();
        const bool result = pump_probes(&probes_, interval, &stream_);
        lasted_ = std::chrono::duration_cast<milliseconds>(steady_clock::now() - start);
        return result;
    }

    std::vector<RtraceTestRecord> sent() {
        const RtraceTestStream parsed = parse_rtrace(read_whole_file(dir_ / "stream"));
        EXPECT_EQ("", parsed.rest);
        return parsed.records;
    }

    TempDir dir_;
    RecordStream stream_ = {.fd = -1};
    Probes probes_;
    milliseconds lasted_{0};
};

TEST_F(PumpProbes, ForwardsOutputInTheOrderOfTheStart) {
    const Probe &first = add_probe(1);
    add_probe(11);
    const Probe &third = add_probe(13);
    write_output(third, "of pidstat");
    write_output(first, "of iostat\n");
    EXPECT_TRUE(pump(0));
    const auto records = sent();
    ASSERT_EQ("1/0/10 13/0/10 ", brief(records));
    EXPECT_EQ("of iostat\n", records[0].payload);
    EXPECT_EQ("of pidstat", records[1].payload);
}

TEST_F(PumpProbes, ReadsAProbeOncePerPass) {
    std::string text(300000, 'x');
    text += std::string(100000, 'y');
    const Probe &probe = add_probe(12, text);
    EXPECT_TRUE(pump(1));
    EXPECT_EQ("12/0/204799 ", brief(sent()));
    EXPECT_EQ(400000U - 204799U, left_in(probe));
    EXPECT_GE(lasted_, milliseconds(1000)) << "what is left waits for the next pass";
    EXPECT_TRUE(pump(0));
    const auto records = sent();
    ASSERT_EQ("12/0/204799 12/0/195201 ", brief(records));
    EXPECT_TRUE(text == records[0].payload + records[1].payload);
}

TEST_F(PumpProbes, WaitsForTheWholeIntervalWhenNothingComes) {
    add_probe(1);
    EXPECT_TRUE(pump(1));
    EXPECT_GE(lasted_, milliseconds(1000));
    EXPECT_EQ("", brief(sent()));
}

TEST_F(PumpProbes, TakesWhatComesDuringTheWait) {
    const Probe &first = add_probe(1);
    const Probe &second = add_probe(12);
    std::thread writer([&] {
        write_output(second, "early");
        while (left_in(second) > 0)
            std::this_thread::sleep_for(milliseconds(1));
        write_output(first, "late");
    });
    EXPECT_TRUE(pump(2));
    writer.join();
    EXPECT_EQ("12/0/5 1/0/4 ", brief(sent()));
    EXPECT_GE(lasted_, milliseconds(2000));
}

TEST_F(PumpProbes, OutputDoesNotProlongThePass) {
    const Probe &first = add_probe(1);
    const Probe &second = add_probe(12);
    const Probe &third = add_probe(13);
    std::thread writer([&] {
        write_output(first, "a");
        while (left_in(first) > 0)
            std::this_thread::sleep_for(milliseconds(1));
        std::this_thread::sleep_for(milliseconds(1500));
        write_output(second, "b");
        std::this_thread::sleep_for(milliseconds(1500));
        write_output(third, "after the two seconds");
    });
    EXPECT_TRUE(pump(2));
    writer.join();
    EXPECT_EQ(21U, left_in(third));
}

TEST_F(PumpProbes, AnIntervalOf0TakesOnlyWhatIsThere) {
    add_probe(1);
    add_probe(13, "x");
    EXPECT_TRUE(pump(0));
    EXPECT_EQ("13/0/1 ", brief(sent()));
    EXPECT_TRUE(pump(0));
    EXPECT_EQ("13/0/1 ", brief(sent()));
}

TEST_F(PumpProbes, ANegativeIntervalFailsAtOnce) {
    const Probe &probe = add_probe(1, "never read");
    EXPECT_FALSE(pump(-1));
    EXPECT_FALSE(pump(-2147483647 - 1));
    EXPECT_EQ("", brief(sent()));
    EXPECT_EQ(10U, left_in(probe));
}

// 2148 seconds are more microseconds than 31 bits hold.
TEST_F(PumpProbes, AVeryLongPassEndsWithTheFirstOutput) {
    for (int32_t interval : {2148, 4294}) {
        add_probe(1, "x");
        EXPECT_TRUE(pump(interval));
        EXPECT_EQ("1/0/1 ", brief(sent()));
        EXPECT_LT(lasted_, milliseconds(2147000));
        ASSERT_EQ(0, ftruncate(stream_.fd, 0));
        ASSERT_EQ(0, lseek(stream_.fd, 0, SEEK_SET));
    }
}

// The output of a silent probe would never show that nobody wants it.
TEST_F(PumpProbes, AVeryLongPassEndsWhenTheClientGoes) {
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    RecordStream stream = {.fd = ends[0]};
    add_probe(12);
    std::thread client([fd = ends[1]] {
        std::this_thread::sleep_for(milliseconds(100));
        close(fd);
    });
    EXPECT_FALSE(pump_probes(&probes_, 2147483647, &stream));
    client.join();
    EXPECT_FALSE(pump_probes(&probes_, 61, &stream));
    close(ends[0]);
}

TEST_F(PumpProbes, AClientThatOnlyReadsGetsTheOutputOfShortPasses) {
    int ends[2];
    ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
    ASSERT_EQ(0, shutdown(ends[1], SHUT_WR));
    RecordStream stream = {.fd = ends[0]};
    add_probe(12, "x");
    EXPECT_TRUE(pump_probes(&probes_, 1, &stream));
    EXPECT_EQ("12/0/1", brief(receive_rtrace_record(ends[1])));
    close(ends[0]);
    close(ends[1]);
}

TEST_F(PumpProbes, FailsWhenTheWaitIsInterrupted) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    struct sigaction before;
    ASSERT_EQ(0, sigaction(SIGALRM, &action, &before));
    // Again and again, in case that the first one comes too early.
    const itimerval often = {{0, 20000}, {0, 20000}};
    setitimer(ITIMER_REAL, &often, nullptr);
    add_probe(1);
    EXPECT_FALSE(pump(60));
    const itimerval never = {};
    setitimer(ITIMER_REAL, &never, nullptr);
    sigaction(SIGALRM, &before, nullptr);
    EXPECT_LT(lasted_, milliseconds(60000));
}

TEST_F(PumpProbes, PassesOverAProbeWithoutAPipe) {
    probes_.started[probes_.count++].record_type = 1;
    add_probe(12, "x");
    EXPECT_TRUE(pump(0));
    EXPECT_EQ("12/0/1 ", brief(sent()));
}

TEST_F(PumpProbes, TakesDescriptorsOfAnyNumber) {
    rlimit limit;
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &limit));
    if (limit.rlim_max <= 4000)
        GTEST_SKIP() << "no more than " << limit.rlim_max << " descriptors are allowed";
    const rlimit wide = {limit.rlim_max, limit.rlim_max};
    ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &wide));
    Probe &probe = add_probe(1, "x");
    probe.read_end.reset(fcntl(probe.read_end.get(), F_DUPFD_CLOEXEC, 4000));
    ASSERT_GE(probe.read_end.get(), 4000);
    EXPECT_TRUE(pump(0));
    EXPECT_EQ("1/0/1 ", brief(sent()));
    probe.read_end.reset();
    EXPECT_EQ(0, setrlimit(RLIMIT_NOFILE, &limit));
}

TEST_F(PumpProbes, FailsWhenTheReaderHasGone) {
    signal(SIGPIPE, SIG_IGN);
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    close(ends[0]);
    RecordStream broken = {.fd = ends[1]};
    add_probe(1);
    EXPECT_TRUE(pump_probes(&probes_, 0, &broken)) << "nothing was to be written";
    write_output(probes_.started[0], "x");
    EXPECT_FALSE(pump_probes(&probes_, 0, &broken));
    close(ends[1]);
}

}  // namespace
