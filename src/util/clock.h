// The clock that limits and pauses are measured with.
#pragma once

#include <stdint.h>
#include <time.h>

// Milliseconds since some moment in the past, whatever the time of day is set to meanwhile.
inline int64_t monotonic_ms() {
    timespec now;
    (void)clock_gettime(CLOCK_MONOTONIC, &now);  // which cannot fail
    return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}
