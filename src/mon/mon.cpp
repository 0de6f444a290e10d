#include "mon/mon.h"

#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>

#include <atomic>

#include "mon/monitor.h"

namespace {

constexpr char REPORT_PATH[] = "/tmp/dbg-report.txt";
constexpr unsigned long DEFAULT_INTERVAL_US = 1000;
constexpr unsigned long US_PER_S = 1000000;

std::atomic<bool> stop_flag;

void on_interrupt(int) {
    stop_flag = true;
}

void catch_interrupt() {
    struct sigaction action = {};
    action.sa_handler = on_interrupt;
    (void)sigaction(SIGINT, &action, nullptr);
}

// From now on an interrupt comes through only where the mask that is returned holds, that is in the
// pause: none can fall between a look at the flag and the pause behind it, and be slept over.
sigset_t hold_interrupt() {
    sigset_t interrupt;
    sigset_t pausing;
    (void)sigemptyset(&interrupt);
    (void)sigaddset(&interrupt, SIGINT);
    (void)sigprocmask(SIG_BLOCK, &interrupt, &pausing);
    (void)sigdelset(&pausing, SIGINT);
    return pausing;
}

}  // namespace

unsigned long mon_interval_us(int argc, char **argv) {
    return argc > 1 ? strtoul(argv[1], nullptr, 0) : DEFAULT_INTERVAL_US;
}

int run_mon(int argc, char **argv) {
    const unsigned long interval_us = mon_interval_us(argc, argv);
    timespec interval = {};
    interval.tv_sec = static_cast<time_t>(interval_us / US_PER_S);
    interval.tv_nsec = static_cast<long>(interval_us % US_PER_S * 1000);

    catch_interrupt();
    MonitorContext *context = monitor_create(REPORT_PATH);
    if (context == nullptr) {
        perror("monitor_create");
        return 1;
    }
    const sigset_t pausing = hold_interrupt();
    while (!stop_flag) {
        monitor_round(context);
        (void)ppoll(nullptr, 0, &interval, &pausing);
    }
    fputs("\nCleanup and exit.\n", stderr);
    monitor_destroy(context);
    return 0;
}
