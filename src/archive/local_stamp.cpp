#include "archive/local_stamp.h"

#include <stdio.h>
#include <time.h>

LocalStamp local_stamp() {
    time_t now = time(nullptr);
    tm local = {};
    tzset();  // the zone may have changed since the last time; localtime_r would not look
    (void)localtime_r(&now, &local);
    LocalStamp stamp;
    (void)snprintf(stamp.text, sizeof stamp.text, "%4.4d%2.2d%2.2d-%2.2d%2.2d%2.2d",
                   local.tm_year + 1900, local.tm_mon + 1, local.tm_mday, local.tm_hour,
                   local.tm_min, local.tm_sec);
    return stamp;
}
