#include "rtrace/probes.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "rtrace/trace_items.h"
#include "util/spawn.h"

namespace {

constexpr size_t PROBE_READ_SIZE = RECORD_DATA_SIZE - 1;
constexpr int64_t NS_PER_S = 1000000000;
constexpr int32_t LONG_PASS_S = 60;

// An interval of ten digits, 30 years, reaches the probes without its last one.
constexpr size_t INTERVAL_DIGITS = 9;

struct ProbeProgram {
    uint32_t item;
    uint32_t record_type;
    const char *path;
    const char *options[2];
    bool wants_interval;  // as its last argument
    const char *environment[4];
};

// In the order in which they are started and read.
constexpr ProbeProgram PROBE_PROGRAMS[MAX_PROBES] = {
    {ITEM_IOSTAT, RECORD_IOSTAT, "/usr/bin/iostat", {"-xcdk"}, true, {}},
    // The library that is loaded into this one writes its log to standard output.
    {ITEM_MEDIAHUB,
     RECORD_MEDIAHUB,
     "/usr/bin/mediahub",
     {"-n"},
     false,
     {"PPRB_LOG_NAME=-", "PPRB_SHOW=gap", "LD_PRELOAD=/tmp/libpipeprobe.so"}},
    {ITEM_EVENT, RECORD_EVENT, "/usr/bin/evsink", {"-s", "-r"}, false, {}},
    {ITEM_PIDSTAT, RECORD_PIDSTAT, "/usr/bin/pidstat", {}, true, {}},
};

pid_t spawn_probe(const ProbeProgram &program, const char *interval, int out_fd) {
    const char *argv[5] = {program.path};
    int count = 1;
    for (const char *option : program.options) {
        if (option != nullptr)
            argv[count++] = option;
    }
    if (program.wants_interval)
        argv[count] = interval;
    return spawn_process(program.path, const_cast<char *const *>(argv),
                         const_cast<char *const *>(program.environment), STDIN_FILENO, out_fd,
                         STDERR_FILENO, false);
}

void start_probe(const ProbeProgram &program, const char *interval, Probe *probe) {
    probe->record_type = program.record_type;
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0)
        return;
    probe->read_end.reset(ends[0]);
    probe->write_end.reset(ends[1]);
    probe->pid = spawn_probe(program, interval, ends[1]);
}

int64_t now_ns() {
    timespec now = {};
    (void)clock_gettime(CLOCK_MONOTONIC, &now);  // which cannot fail
    return static_cast<int64_t>(now.tv_sec) * NS_PER_S + now.tv_nsec;
}

int64_t time_left_ns(int64_t deadline_ns) {
    return std::max<int64_t>(deadline_ns - now_ns(), 0);
}

// Waits for at most `left_ns` and returns what poll does. Unlike select() it takes descriptors of
// any number, of which a busy service has many.
int wait_for_output(pollfd *watched, nfds_t count, int64_t left_ns) {
    timespec left;
    left.tv_sec = static_cast<time_t>(left_ns / NS_PER_S);
    left.tv_nsec = static_cast<long>(left_ns % NS_PER_S);
    return ppoll(watched, count, &left, nullptr);
}

// Whether less than a microsecond is left. The microseconds are counted in 32 bits, so for an
// interval above 2147 seconds this may be true as soon as the first output has been sent. That is
// when clients have always got the next pass of such a trace: it stays.
bool is_over(int64_t left_ns) {
    return static_cast<int32_t>(static_cast<uint32_t>(left_ns / 1000)) < 1;
}

// Sends what is there to be read from each probe that is ready, and no longer watches it.
bool forward_output(const Probes *probes, pollfd *watched, RecordStream *stream) {
    char *buffer = record_buffer(stream);
    for (int i = 0; i < probes->count; ++i) {
        if (watched[i].revents == 0)
            continue;
        const Probe &probe = probes->started[i];
        const ssize_t n = read(probe.read_end.get(), buffer, PROBE_READ_SIZE);
        if (n > 0 &&
            !send_record(stream, probe.record_type, FLAG_LAST, buffer, static_cast<size_t>(n)))
            return false;
        watched[i].fd = -1;
    }
    return true;
}

}  // namespace

void start_probes(uint32_t items, int32_t interval, Probes *probes) {
    char text[INTERVAL_DIGITS + 1];
    (void)snprintf(text, sizeof text, "%d", interval);
    for (const ProbeProgram &program : PROBE_PROGRAMS) {
        if ((items & program.item) != 0)
            start_probe(program, text, &probes->started[probes->count++]);
    }
}

bool pump_probes(const Probes *probes, int32_t interval, RecordStream *stream) {
    if (interval < 0)
        return false;
    // While the probes are silent no write tells that the client has gone, and it must not hold
    // them for hours. Short passes do not look: one that has closed only its own direction reads
    // on.
    pollfd watched[1 + MAX_PROBES] = {{interval > LONG_PASS_S ? stream->fd : -1, POLLRDHUP, 0}};
    const pollfd &client = watched[0];
    pollfd *const outputs = watched + 1;
    for (int i = 0; i < probes->count; ++i)
        outputs[i] = {probes->started[i].read_end.get(), POLLIN, 0};
    // Without memory to read into, only the time passes; the next pass may find some.
    const int readable = record_buffer(stream) != nullptr ? probes->count : 0;
    const nfds_t count = 1 + static_cast<nfds_t>(readable);

    const int64_t deadline_ns = now_ns() + interval * NS_PER_S;
    int64_t left_ns = interval * NS_PER_S;
    do {
        const int ready = wait_for_output(watched, count, left_ns);
        if (ready < 0)
            return false;
        if (ready == 0)
            return true;
        if (client.revents != 0 || !forward_output(probes, outputs, stream))
            return false;
        left_ns = time_left_ns(deadline_ns);
    } while (!is_over(left_ns));
    return true;
}

void stop_probes(Probes *probes) {
    for (Probe &probe : probes->started) {
        probe.read_end.reset();
        probe.write_end.reset();
    }
    for (const Probe &probe : probes->started) {
        signal_child(probe.pid, SIGTERM);
        (void)wait_for_child(probe.pid, nullptr);
    }
}
