// One round of the monitor on its own.
//
//   mon_round REPORT
#include "mon/monitor.h"

int main(int argc, char **argv) {
    MonitorContext *context = argc == 2 ? monitor_create(argv[1]) : nullptr;
    if (context == nullptr)
        return 1;
    monitor_round(context);
    monitor_destroy(context);
    return 0;
}
