// Counting the writes to pipes and sockets whose reader has gone.
#pragma once

#include <signal.h>

inline volatile sig_atomic_t broken_pipes_seen;

// How many such writes `body` makes. In the calling thread alone.
template <typename Body>
int failed_writes(Body body) {
    struct sigaction count = {};
    count.sa_handler = [](int) { broken_pipes_seen = broken_pipes_seen + 1; };
    struct sigaction before;
    (void)sigaction(SIGPIPE, &count, &before);
    broken_pipes_seen = 0;
    body();
    (void)sigaction(SIGPIPE, &before, nullptr);
    return broken_pipes_seen;
}
