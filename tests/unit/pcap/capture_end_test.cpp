// How captures end, and how they fail.
#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>

#include <atomic>
#include <functional>
#include <string>

#include "capture_run.h"
#include "pcap/capture.h"
#include "support/packets.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

// Collects what is printed on standard error.
struct StderrCapture {
    StderrCapture() { testing::internal::CaptureStderr(); }
    std::string text() { return testing::internal::GetCapturedStderr(); }
};

// A local socket pair: the output of a capture in the test's own thread, and its reader.
struct Output {
    int reader = -1;
    int fd = -1;
    Output() {
        int ends[2];
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends));
        reader = ends[0];
        fd = ends[1];
    }
    // What is in it now.
    std::string text() const {
        char block[65536];
        ssize_t n = recv(reader, block, sizeof block, MSG_DONTWAIT);
        return std::string(block, n > 0 ? static_cast<size_t>(n) : 0);
    }
};

// Runs a capture that `end_it` ends, from both states of the interface before, and looks at the
// promiscuous flag during and after it.
void expect_promiscuous_off_after(const CaptureOptions &options,
                                  const std::function<void(CaptureRun &)> &end_it) {
    run_in_sandbox(
        [&] {
            signal(SIGPIPE, SIG_IGN);
            for (bool before : {false, true}) {
                set_link_promiscuous("eth0", before);
                CaptureRun run(options);
                EXPECT_EQ(options.promiscuous, is_link_promiscuous("eth0"));
                end_it(run);
                run.result();
                EXPECT_FALSE(is_link_promiscuous("eth0")) << "before: " << before;
                set_link_up("eth0", true);
            }
        },
        WITH_ETH0);
}

// Lets a client go in the way `go` and expects that a capture with a time limit then waits for
// frames. It runs in the process's first thread, whose state is the one that the process shows.
void expect_sleep_without_client(const std::function<void(Output &)> &go) {
    run_in_sandbox(
        [&] {
            signal(SIGPIPE, SIG_IGN);
            Output out;
            std::thread client([&] {
                char header[24];
                EXPECT_EQ(24, recv(out.reader, header, sizeof header, MSG_WAITALL));
                go(out);
                // One that finds its output readable again and again is always about to run.
                EXPECT_TRUE(wait_until([] {
                    return read_whole_file("/proc/self/stat").find(") S ") != std::string::npos;
                }));
                set_link_up("eth0", false);
            });
            EXPECT_EQ(24, capture_into(out.fd, {.time_limit = 1000}));
            client.join();
        },
        WITH_ETH0);
}

std::atomic<int> signals_seen;
void count_signal(int) {
    ++signals_seen;
}

std::atomic<int> fd_to_close;
void close_on_signal(int) {
    close(fd_to_close);
}

void handle_signal(int signo, void (*handler)(int)) {
    struct sigaction action = {};
    action.sa_handler = handler;
    ASSERT_EQ(0, sigaction(signo, &action, nullptr));
}

}  // namespace

TEST(CaptureEnd, TheTimeLimitLeavesNoPromiscuousMode) {
    expect_promiscuous_off_after({.time_limit = 1},
                                 [](CaptureRun &run) { EXPECT_EQ(24u, run.read_all().size()); });
}

TEST(CaptureEnd, TheSizeLimitLeavesNoPromiscuousMode) {
    expect_promiscuous_off_after({.size_limit = 100}, [](CaptureRun &run) {
        send_frame("eth1", test_frame(60, 'x'));
        EXPECT_EQ(100u, run.read_all().size());
    });
}

TEST(CaptureEnd, ABrokenOutputLeavesNoPromiscuousMode) {
    expect_promiscuous_off_after({.time_limit = 1000}, [](CaptureRun &run) {
        run.close_client();
        send_frame("eth1", test_frame(60, 'x'));
    });
}

TEST(CaptureEnd, AnInterfaceThatGoesDownLeavesNoPromiscuousMode) {
    expect_promiscuous_off_after({}, [](CaptureRun &) { set_link_up("eth0", false); });
}

TEST(CaptureEnd, AClientThatGoesLeavesNoPromiscuousMode) {
    expect_promiscuous_off_after({}, [](CaptureRun &run) { run.close_client(); });
}

TEST(CaptureEnd, WithoutTheFlagTheInterfaceIsMadeNotPromiscuous) {
    expect_promiscuous_off_after({.promiscuous = false},
                                 [](CaptureRun &run) { run.close_client(); });
}

TEST(CaptureEnd, ALongerNameDoesNotTouchTheInterfaceThatItBeginsWith) {
    run_in_sandbox(
        [] {
            sandbox_shell(
                "ip link set eth0 down && ip link set eth0 name fifteen_letters && "
                "ip link set fifteen_letters up");
            set_link_promiscuous("fifteen_letters", true);
            CaptureRun run({.interface = "fifteen_lettersX"});
            run.close_client();
            EXPECT_EQ(24, run.result());
            EXPECT_TRUE(is_link_promiscuous("fifteen_letters"));
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WithNeitherLimitTheClientsClosingEndsIt) {
    run_in_sandbox(
        [] {
            CaptureRun run({});
            send_frame("eth1", test_frame(60, 'x'));
            run.read_until(24 + 76);
            run.close_client();
            EXPECT_EQ(100, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WithNeitherLimitTheEndOfTheClientsSendingIsEnough) {
    run_in_sandbox(
        [] {
            CaptureRun run({});
            ASSERT_EQ(0, shutdown(run.client(), SHUT_WR));
            EXPECT_EQ(24u, run.read_all().size());
            EXPECT_EQ(24, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WhatTheClientSendsDoesNotEndIt) {
    run_in_sandbox(
        [] {
            CaptureRun run({});
            for (int i = 0; i < 10; ++i)
                ASSERT_EQ(5, write(run.client(), "hello", 5));
            // All of it has been taken.
            ASSERT_TRUE(wait_until([&] {
                char byte;
                return recv(run.server(), &byte, 1, MSG_PEEK | MSG_DONTWAIT) < 0;
            }));
            send_frame("eth1", test_frame(60, 'x'));
            EXPECT_EQ(test_frame(60, 'x'), frames_of(run.read_until(24 + 76)).at(0));
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WithASizeLimitTheEndOfTheClientsSendingDoesNotEndIt) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 300});
            ASSERT_EQ(0, shutdown(run.client(), SHUT_WR));
            send_frame("eth1", test_frame(60, 'x'));
            run.read_until(24 + 76);
            send_frame("eth1", test_frame(200, 'y'));
            EXPECT_EQ(300u, run.read_all().size());
            EXPECT_EQ(300, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WithATimeLimitTheEndOfTheClientsSendingDoesNotEndIt) {
    run_in_sandbox(
        [] {
            CaptureRun run({.time_limit = 1000});
            ASSERT_EQ(0, shutdown(run.client(), SHUT_WR));
            send_frame("eth1", test_frame(60, 'x'));
            EXPECT_EQ(test_frame(60, 'x'), frames_of(run.read_until(24 + 76)).at(0));
            set_link_up("eth0", false);
            EXPECT_EQ(100, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, WithALimitItSleepsAfterTheEndOfTheClientsSending) {
    expect_sleep_without_client([](Output &out) { ASSERT_EQ(0, shutdown(out.reader, SHUT_WR)); });
}

TEST(CaptureEnd, WithALimitItSleepsAfterTheClientsClosing) {
    expect_sleep_without_client([](Output &out) { ASSERT_EQ(0, close(out.reader)); });
}

TEST(CaptureEnd, WithALimitItSleepsAfterTheClientsReset) {
    expect_sleep_without_client([](Output &out) {
        // Closed with something unread, a local socket resets the other end.
        ASSERT_EQ(1, write(out.fd, "x", 1));
        ASSERT_EQ(0, close(out.reader));
    });
}

TEST(CaptureEnd, TheTimeLimitEndsItThoughFramesKeepComing) {
    run_in_sandbox(
        [] {
            CaptureRun run({.time_limit = 1});
            std::atomic<bool> ended = false;
            std::thread sender([&] {
                while (!ended)
                    send_frame("eth1", test_frame(60, 'x'));
            });
            EXPECT_LT(24u, run.read_all().size());
            ended = true;
            sender.join();
        },
        WITH_ETH0);
}

TEST(CaptureEnd, TheLargestTimeLimitsDoNotOverflow) {
    run_in_sandbox(
        [] {
            for (uint32_t limit : {2147483647u, 2147483648u, 4294967295u}) {
                CaptureRun run({.time_limit = limit});
                send_frame("eth1", test_frame(60, 'x'));
                EXPECT_EQ(100u, run.read_until(24 + 76).size()) << limit;
                set_link_up("eth0", false);
                EXPECT_EQ(100, run.result());
                set_link_up("eth0", true);
            }
        },
        WITH_ETH0);
}

TEST(CaptureEnd, AnInterfaceThatGoesDownEndsItWithAFilledStream) {
    run_in_sandbox(
        [] {
            CaptureRun run({.size_limit = 1000});
            send_frame("eth1", test_frame(60, 'x'));
            run.read_until(24 + 76);
            set_link_up("eth0", false);
            const std::string stream = run.read_all();
            EXPECT_EQ(1000u, stream.size());
            EXPECT_EQ(from_hex("00000000 00000000 74030000 74030000") + std::string(884, '\0'),
                      stream.substr(100));
            EXPECT_EQ(1000, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, AFrameThatCannotBeWrittenEndsItWithMinusOne) {
    run_in_sandbox(
        [] {
            signal(SIGPIPE, SIG_IGN);
            for (uint32_t size_limit : {0u, 1000u}) {
                CaptureRun run({.size_limit = size_limit, .time_limit = 1000});
                run.close_client();
                send_frame("eth1", test_frame(60, 'x'));
                EXPECT_EQ(-1, run.result());
            }
        },
        WITH_ETH0);
}

TEST(CaptureEnd, AFillerThatCannotBeWrittenEndsItWithMinusOne) {
    run_in_sandbox(
        [] {
            signal(SIGPIPE, SIG_IGN);
            CaptureRun run({.size_limit = 1000});
            run.close_client();
            send_frame("eth1", test_frame(1000, 'x'));  // does not fit
            EXPECT_EQ(-1, run.result());
        },
        WITH_ETH0);
}

TEST(CaptureEnd, AGlobalHeaderThatCannotBeWrittenEndsItWithMinusOne) {
    run_in_sandbox(
        [] {
            set_link_promiscuous("eth0", true);
            int full = open("/dev/full", O_WRONLY | O_CLOEXEC);
            ASSERT_GE(full, 0);
            EXPECT_EQ(-1, capture_into(full, {}));
            EXPECT_EQ(-1, capture_into(-1, {.size_limit = 1000, .time_limit = 1000}));
            EXPECT_FALSE(is_link_promiscuous("eth0"));
        },
        WITH_ETH0);
}

TEST(CaptureEnd, ASignalDoesNotEndTheWait) {
    run_in_sandbox(
        [] {
            handle_signal(SIGUSR1, count_signal);
            CaptureRun run({});
            for (int i = 1; i <= 20; ++i) {
                ASSERT_EQ(0, pthread_kill(run.thread().native_handle(), SIGUSR1));
                ASSERT_TRUE(wait_until([&] { return signals_seen == i; }));
            }
            send_frame("eth1", test_frame(60, 'x'));
            EXPECT_EQ(test_frame(60, 'x'), frames_of(run.read_until(24 + 76)).at(0));
        },
        WITH_ETH0);
}

TEST(CaptureFailure, APacketSocketThatCannotBeMadeGivesItsErrorWithoutAMessage) {
    run_in_sandbox(
        [] {
            Output out;
            StderrCapture errors;
            const rlimit none = {.rlim_cur = 0, .rlim_max = 4096};
            ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &none));
            EXPECT_EQ(-EMFILE, capture_into(out.fd, {.time_limit = 1}));
            const rlimit many = {.rlim_cur = 4096, .rlim_max = 4096};
            ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &many));
            EXPECT_EQ("", errors.text());
            EXPECT_EQ("", out.text());
        },
        WITH_ETH0);
}

TEST(CaptureFailure, ThePacketSocketIsMadeWithThePlainProtocolNumber3) {
    run_in_sandbox(
        [] {
#ifdef __NR_socket
            if (!refuse_call(__NR_socket, EPROTO, CallArgument{2, 3}))
                GTEST_SKIP() << "seccomp: " << strerror(errno);
            Output out;
            EXPECT_EQ(-EPROTO, capture_into(out.fd, {.time_limit = 1}));
#else
            GTEST_SKIP() << "no call of its own for socket";
#endif
        },
        WITH_ETH0);
}

TEST(CaptureFailure, ABindThatFailsIsReported) {
    run_in_sandbox(
        [] {
#ifdef __NR_bind
            if (!refuse_call(__NR_bind, ENODEV))
                GTEST_SKIP() << "seccomp: " << strerror(errno);
            Output out;
            StderrCapture errors;
            EXPECT_EQ(-ENODEV, capture_into(out.fd, {.time_limit = 1}));
            EXPECT_EQ("bind: No such device\n", errors.text());
            EXPECT_EQ("", out.text());
#else
            GTEST_SKIP() << "no call of its own for bind";
#endif
        },
        WITH_ETH0);
}

TEST(CaptureFailure, AFilterThatTheKernelRefusesIsReported) {
    run_in_sandbox(
        [] {
            Output out;
            StderrCapture errors;
            sock_filter no_end = BPF_STMT(BPF_LD | BPF_H | BPF_ABS, 12);
            const sock_fprog filter = {.len = 1, .filter = &no_end};
            EXPECT_EQ(-EINVAL, capture_into(out.fd, {.time_limit = 1, .filter = &filter}));
            EXPECT_EQ("setsockopt attach filter: Invalid argument\n", errors.text());
            EXPECT_EQ("", out.text());
            EXPECT_FALSE(is_link_promiscuous("eth0"));
        },
        WITH_ETH0);
}

TEST(CaptureFailure, AWaitThatFailsIsReportedAndEndsItWithoutFillers) {
    run_in_sandbox(
        [] {
            bool refused = refuse_call(__NR_ppoll, ENOMEM);
#ifdef __NR_ppoll_time64
            refused = refused && refuse_call(__NR_ppoll_time64, ENOMEM);
#endif
            if (!refused)
                GTEST_SKIP() << "seccomp: " << strerror(errno);
            Output out;
            StderrCapture errors;
            EXPECT_EQ(24, capture_into(out.fd, {.size_limit = 1000, .time_limit = 1000}));
            EXPECT_EQ("select: Cannot allocate memory\n", errors.text());
            EXPECT_EQ(24u, out.text().size());
            EXPECT_FALSE(is_link_promiscuous("eth0"));
        },
        WITH_ETH0);
}

TEST(CaptureFailure, AnOutputThatIsClosedMeanwhileIsAFailedWait) {
    run_in_sandbox(
        [] {
            Output out;
            fd_to_close = out.fd;
            handle_signal(SIGUSR1, close_on_signal);
            StderrCapture errors;
            std::thread closer([&, capturing = pthread_self()] {
                char header[24];
                EXPECT_EQ(24, recv(out.reader, header, sizeof header, MSG_WAITALL));
                pthread_kill(capturing, SIGUSR1);
            });
            EXPECT_EQ(24, capture_into(out.fd, {.size_limit = 1000, .time_limit = 1000}));
            closer.join();
            EXPECT_EQ("select: Bad file descriptor\n", errors.text());
            EXPECT_EQ("", out.text());
            EXPECT_FALSE(is_link_promiscuous("eth0"));
        },
        WITH_ETH0);
}

TEST(UptimeSeconds, IsTheMachinesUptime) {
    const long uptime = uptime_seconds();
    const std::string text = read_whole_file("/proc/uptime");
    const long known = strtol(text.c_str(), nullptr, 10);
    EXPECT_GE(uptime, known - 5);
    EXPECT_LE(uptime, known + 5);
    EXPECT_GT(uptime, 0);
}

TEST(SetPromiscuous, IgnoresWhatItCannotDo) {
    StderrCapture errors;
    set_promiscuous(-1, "lo", true);
    set_promiscuous(0, "nosuch", false);
    set_promiscuous(0, "", true);
    EXPECT_EQ("", errors.text());
}
