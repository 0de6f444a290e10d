// The programs whose output a resource trace forwards while it runs.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "rtrace/record_stream.h"
#include "util/unique_fd.h"

constexpr int MAX_PROBES = 4;

struct Probe {
    pid_t pid = -1;  // -1 also for one that could not be started
    uint32_t record_type = 0;
    UniqueFd read_end;   // of the pipe that is its standard output; none if there is no pipe
    UniqueFd write_end;  // kept open, so that a probe that has ended is silent and not always ready
};

struct Probes {
    int count = 0;  // of those that are wanted
    Probe started[MAX_PROBES];
};

// Starts the probes of `items` (trace_items.h), those that want to know it with `interval` as an
// argument. Standard input and standard error are the caller's. One that cannot be started is
// counted all the same.
void start_probes(uint32_t items, int32_t interval, Probes *probes);

// Sends what the probes write within the next `interval` seconds: of each probe what one read
// gives, the rest waits for the next call. Returns false when the stream is broken or the wait
// fails, as it does at once for a negative interval, and when the client goes during a wait of more
// than a minute.
bool pump_probes(const Probes *probes, int32_t interval, RecordStream *stream);

// Closes the pipes, ends the probes with SIGTERM and waits until each has ended.
void stop_probes(Probes *probes);
