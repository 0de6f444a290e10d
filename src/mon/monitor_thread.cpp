#include "mon/monitor_thread.h"

#include <errno.h>
#include <pthread.h>
#include <sched.h>
#include <stdio.h>
#include <time.h>

#include "mon/monitor.h"

namespace {

constexpr char REPORT_PATH[] = "/var/run/dbg-cgi/dbg-monitor.txt";
constexpr time_t INTERVAL_S = 3600;

// Signals that the thread happens to receive do not shorten it.
void wait_for_next_round() {
    timespec left = {};
    left.tv_sec = INTERVAL_S;
    while (nanosleep(&left, &left) != 0 && errno == EINTR) {
    }
}

}  // namespace

void *monitor_thread(void *) {
    const sched_param priority = {};
    errno = pthread_setschedparam(pthread_self(), SCHED_IDLE, &priority);
    if (errno != 0) {
        perror("setschedparam");
        return nullptr;
    }
    MonitorContext *context = monitor_create(REPORT_PATH);
    if (context == nullptr) {
        perror("monitor_create");
        return nullptr;
    }
    for (;;) {
        monitor_round(context);
        wait_for_next_round();
    }
}
