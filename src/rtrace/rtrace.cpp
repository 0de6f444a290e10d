#include "rtrace/rtrace.h"

#include <errno.h>
#include <poll.h>
#include <stdlib.h>
#include <unistd.h>

#include "rtrace/probes.h"
#include "rtrace/record_stream.h"
#include "rtrace/samples.h"

struct Rtrace {
    int32_t interval;  // seconds from pass to pass
    int32_t fd;        // the client's
    uint32_t items;
};

namespace {

constexpr unsigned LONG_REST_S = 60;

// Whether the client has gone, or goes within `timeout_ms`. One that has closed only its own
// direction, and reads on, cannot be told from it: this is for where no write is going to tell.
bool client_goes(int fd, int timeout_ms) {
    pollfd client = {.fd = fd, .events = POLLRDHUP, .revents = 0};
    int ready;
    do {
        ready = poll(&client, 1, timeout_ms);
    } while (ready == -1 && errno == EINTR);
    return ready > 0;
}

// A negative interval counts as unsigned: practically for ever. A signal does not cut it short. But
// no client that has gone is to hold its descriptor and its thread that long: false.
bool rest(const Rtrace &trace) {
    unsigned left = static_cast<unsigned>(trace.interval);
    while (left > LONG_REST_S) {
        if (client_goes(trace.fd, LONG_REST_S * 1000))
            return false;
        left -= LONG_REST_S;
    }
    while (left > 0)
        left = sleep(left);
    return true;
}

}  // namespace

Rtrace *rtrace_create(int fd, int32_t interval, uint32_t items) {
    Rtrace *trace = static_cast<Rtrace *>(calloc(1, sizeof(Rtrace)));
    if (trace != nullptr)
        *trace = {.interval = interval, .fd = fd, .items = items};
    return trace;
}

void rtrace_run(Rtrace *trace) {
    RecordStream stream = {.fd = trace->fd};
    Probes probes;
    start_probes(trace->items, trace->interval, &probes);
    bool goes_on = true;
    while (goes_on) {
        stream.sent = false;
        goes_on =
            send_samples(&stream, trace->items) &&
            (probes.count > 0 ? pump_probes(&probes, trace->interval, &stream) : rest(*trace)) &&
            (stream.sent || !client_goes(trace->fd, 0));
    }
    stop_probes(&probes);
}

void rtrace_free(Rtrace *trace) {
    free(trace);
}
