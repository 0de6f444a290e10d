#include "rtrace/probes.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <string>
#include <vector>

#include "probe_stand_ins.h"
#include "util/children.h"

namespace {

// The next line of a probe that has written one.
std::string line_of(const Probe &probe) {
    std::string line;
    char c;
    while (read(probe.read_end.get(), &c, 1) == 1 && c != '\n')
        line += c;
    return line;
}

std::string link_of(int fd) {
    char target[256];
    const ssize_t n =
        readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), target, sizeof target);
    return std::string(target, n > 0 ? static_cast<size_t>(n) : 0);
}

// What every probe shows of its descriptors: the streams of ours, and none that we have besides.
std::string expected_descriptors() {
    for (int fd = 3; fd < 1024; ++fd)
        (void)fcntl(fd, F_SETFD, FD_CLOEXEC);
    return " stdin=" + link_of(0) + " stderr=" + link_of(2) + " others=0";
}

bool is_gone(pid_t pid) {
    return kill(pid, 0) == -1 && errno == ESRCH;
}

// Waits until the child `pid` has ended, and leaves it to be reaped.
void wait_for_end(pid_t pid) {
    siginfo_t info;
    EXPECT_EQ(0, waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOWAIT));
}

bool has_children() {
    return waitpid(-1, nullptr, WNOHANG) != -1;
}

TEST(StartProbes, StartsAllFourInOrderWithTheirWordsAndVariables) {
    run_in_sandbox([] {
        stand_in_for_probes();
        const std::string descriptors = expected_descriptors();
        setenv("OF_THE_SERVICE", "not for probes", 1);
        Probes probes;
        start_probes(0x740, 10, &probes);
        ASSERT_EQ(4, probes.count);
        const struct {
            uint32_t record_type;
            const char *words;
        } expected[] = {
            {1, "argv=[/usr/bin/iostat][-xcdk][10] env="},
            {11,
             "argv=[/usr/bin/mediahub][-n] "
             "env=[PPRB_LOG_NAME=-][PPRB_SHOW=gap][LD_PRELOAD=/tmp/libpipeprobe.so]"},
            {12, "argv=[/usr/bin/evsink][-s][-r] env="},
            {13, "argv=[/usr/bin/pidstat][10] env="},
        };
        for (int i = 0; i < 4; ++i) {
            const std::string line = line_of(probes.started[i]);
            EXPECT_EQ(probes.started[i].pid, pid_of_line(line));
            EXPECT_EQ(expected[i].words + descriptors, rest_of_line(line));
            EXPECT_EQ(expected[i].record_type, probes.started[i].record_type);
        }
        stop_probes(&probes);
    });
}

TEST(StartProbes, StartsOnlyWhatIsWanted) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Probes probes;
        start_probes(0x600, 1, &probes);
        ASSERT_EQ(2, probes.count);
        EXPECT_EQ(12U, probes.started[0].record_type);
        EXPECT_EQ(13U, probes.started[1].record_type);
        stop_probes(&probes);

        Probes none;
        start_probes(0x8bf, 1, &none);
        EXPECT_EQ(0, none.count);
        EXPECT_FALSE(has_children());
    });
}

TEST(StartProbes, WritesTheIntervalInAtMostNineCharacters) {
    run_in_sandbox([] {
        stand_in_for_probes();
        const struct {
            int32_t interval;
            const char *word;
        } cases[] = {{0, "[0]"},
                     {-1, "[-1]"},
                     {999999999, "[999999999]"},
                     {2147483647, "[214748364]"},
                     {-2147483647 - 1, "[-21474836]"}};
        for (const auto &c : cases) {
            Probes probes;
            start_probes(0x400, c.interval, &probes);
            const std::string line = rest_of_line(line_of(probes.started[0]));
            EXPECT_EQ(0U, line.find("argv=[/usr/bin/pidstat]" + std::string(c.word) + " env= "))
                << line;
            stop_probes(&probes);
        }
    });
}

TEST(StartProbes, CountsAMissingProgramLikeAnyOther) {
    run_in_sandbox([] {
        sandbox_scratch("/usr/bin");
        (void)unlink("/usr/bin/evsink");
        Probes probes;
        start_probes(0x200, 1, &probes);
        EXPECT_EQ(1, probes.count);
        EXPECT_GT(probes.started[0].pid, 0);
        wait_for_end(probes.started[0].pid);
        stop_probes(&probes);
        EXPECT_FALSE(has_children());
    });
}

TEST(StartProbes, AProbeThatHasEndedShortensNoPass) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Probes probes;
        start_probes(0x200, 1, &probes);
        EXPECT_EQ(probes.started[0].pid, pid_of_line(line_of(probes.started[0])));
        kill(probes.started[0].pid, SIGKILL);
        wait_for_end(probes.started[0].pid);
        pollfd watched = {probes.started[0].read_end.get(), POLLIN, 0};
        EXPECT_EQ(0, poll(&watched, 1, 0)) << "a pass of many hours would end at once";
        RecordStream stream = {.fd = -1};
        const auto start = std::chrono::steady_clock::now();
        EXPECT_TRUE(pump_probes(&probes, 1, &stream)) << "the end is no output";
        EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
        stop_probes(&probes);
    });
}

TEST(StopProbes, EndsThemAllAndClosesTheirPipes) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Probes probes;
        start_probes(0x740, 1, &probes);
        std::vector<pid_t> pids;
        std::vector<int> ends;
        for (const Probe &probe : probes.started) {
            EXPECT_EQ(probe.pid, pid_of_line(line_of(probe)));
            pids.push_back(probe.pid);
            ends.push_back(probe.read_end.get());
            ends.push_back(probe.write_end.get());
        }
        stop_probes(&probes);
        for (pid_t pid : pids)
            EXPECT_TRUE(is_gone(pid)) << pid;
        for (int end : ends)
            EXPECT_EQ(-1, fcntl(end, F_GETFD)) << end;
        EXPECT_FALSE(has_children());
    });
}

TEST(StopProbes, ReapsAProbeThatEndedByItself) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Probes probes;
        start_probes(0x200, 1, &probes);
        const pid_t pid = probes.started[0].pid;
        kill(pid, SIGKILL);
        wait_for_end(pid);
        stop_probes(&probes);
        EXPECT_TRUE(is_gone(pid));
        EXPECT_FALSE(has_children());
    });
}

TEST(StopProbes, SignalsNobodyWhoHasGotTheNumberOfAProbeThatATracerReaped) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Probes probes;
        start_probes(0x200, 1, &probes);
        const pid_t pid = probes.started[0].pid;
        kill(pid, SIGKILL);
        int status;
        ASSERT_EQ(pid, wait_as_tracer(-1, &status, 0));
        std::ofstream("/proc/sys/kernel/ns_last_pid") << pid - 1;
        const pid_t stranger = fork();
        if (stranger == 0) {
            pause();
            _exit(0);
        }
        if (stranger != pid)
            GTEST_SKIP() << "this kernel does not give out a number that is asked for";
        stop_probes(&probes);
        kill(stranger, SIGKILL);
        ASSERT_EQ(stranger, waitpid(stranger, &status, 0));
        EXPECT_EQ(SIGKILL, WTERMSIG(status)) << "and not SIGTERM";
    });
}

TEST(StopProbes, SignalsNobodyForAProbeThatCouldNotBeStarted) {
    run_in_sandbox([] {
        stand_in_for_probes();
        Background bystander({"/bin/cat"});
        rlimit limit;
        ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &limit));
        const int next = dup(0);
        close(next);
        const rlimit tight = {static_cast<rlim_t>(next), limit.rlim_max};
        Probes probes;
        ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &tight));
        start_probes(0x240, 1, &probes);
        ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &limit));
        ASSERT_EQ(2, probes.count);
        EXPECT_EQ(-1, probes.started[0].pid);
        EXPECT_EQ(-1, probes.started[1].pid);
        stop_probes(&probes);
        // A signal to everybody would have been delivered before this is answered.
        bystander.write_input("still here\n");
        EXPECT_EQ("still here", bystander.read_line());
    });
}

}  // namespace
