#include "archive/system_snapshot.h"

#include <fcntl.h>
#include <linux/filter.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include "archive/tar_members.h"
#include "pcap/capture.h"
#include "pcap/connection_filter.h"
#include "trace/trace_engine.h"
#include "util/await_reader.h"
#include "util/spawn.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr char CAPTURE_INTERFACE[] = "eth0";
constexpr int32_t CAPTURE_DURATION = 5;        // seconds, unless a request says otherwise
constexpr int32_t CAPTURE_SIZE = 5120000;      // bytes, unless a request says otherwise
constexpr uint32_t CAPTURE_CUT_LENGTH = 1536;  // bytes per record

constexpr off_t KCORE_LIMIT = 10485760;
constexpr int32_t STRACE_SIZE = 204800;
constexpr int32_t STRACE_DURATION = 5;  // seconds
constexpr int READER_PATIENCE = 5;      // seconds, in which all that is traced stands still

struct TraceLog {
    BoundedWriter writer;
    bool given_up;  // the reader takes nothing: the trace ends, the archive goes on
};

uint32_t write_trace(intptr_t cookie, const char *text, uint32_t len) {
    auto *log = reinterpret_cast<TraceLog *>(cookie);
    const bool writes = static_cast<int32_t>(len) > 0 && log->writer.remaining > 0;
    if (writes && !log->given_up)
        log->given_up = !await_reader(log->writer.fd, READER_PATIENCE, nullptr);
    return log->given_up ? 0 : bounded_write_cb(&log->writer, text, len);
}

}  // namespace

int add_kcore(TarWriter *tw, int fd) {
    UniqueFd source(open("/proc/kcore", O_RDONLY | O_CLOEXEC));
    struct stat status;
    if (fstat(source.get(), &status) != 0 || status.st_size == 0 || status.st_size > KCORE_LIMIT)
        return 0;
    return tar_add_open_file(tw, fd, "kcore", source.get(), status.st_size, true);
}

int add_netdump(TarWriter *tw, int fd, const char *interface, int32_t duration, int32_t size) {
    unsigned length = 0;
    UniqueBlock<sock_filter> instructions(make_connection_filter(fd, &length));
    sock_fprog filter = {static_cast<unsigned short>(length), instructions.get()};

    if (tw != nullptr)
        tar_header(tw, "netdump.cap", size);
    int64_t captured = capture_packets(interface, fd, static_cast<uint32_t>(size),
                                       CAPTURE_CUT_LENGTH, static_cast<uint32_t>(duration), true,
                                       instructions != nullptr ? &filter : nullptr);
    // Also where there could be no capture at all: archives without one have always ended here.
    if (captured < 0)
        return 1;
    // The capture fills its stream up by itself; that the size is met must not hang on it.
    if (write_zeros(fd, size - captured) != 0)
        return 1;
    if (tw != nullptr)
        tar_account(tw, static_cast<uint32_t>(size));
    return 0;
}

int pcap_request(int fd, int32_t duration, int32_t size) {
    return add_netdump(nullptr, fd, CAPTURE_INTERFACE, duration < 0 ? CAPTURE_DURATION : duration,
                       size < 0 ? CAPTURE_SIZE : size);
}

int add_strace_log(TarWriter *tw, pid_t *pids, int count) {
    TraceLog log = {.writer = {tw->fd, STRACE_SIZE, 0}, .given_up = false};
    tar_header(tw, "strace.log", STRACE_SIZE);

    TraceRequest request = {};
    request.output_cb = write_trace;
    request.cookie = reinterpret_cast<intptr_t>(&log);
    request.flags = static_cast<uint32_t>(-1);
    request.pids = pids;
    request.nr_pids = count;
    request.timeout_s = STRACE_DURATION;
    trace_run(&request);

    if (log.writer.failed)
        return 1;
    write_space_lines(tw->fd, log.writer.remaining);
    tar_account(tw, STRACE_SIZE);
    return 0;
}

void write_space_lines(int fd, int32_t n) {
    // Blanks and not zeros, so that the log stays a text.
    char line[80];
    memset(line, ' ', sizeof line);
    line[sizeof line - 1] = '\n';
    while (n > 0) {
        uint32_t piece = std::min(static_cast<uint32_t>(n), static_cast<uint32_t>(sizeof line));
        if (write_all(fd, line, piece) < 0)
            return;
        n -= static_cast<int32_t>(piece);
    }
}

void run_ps(int fd) {
    char path[] = "/bin/ps";
    char *argv[] = {path, nullptr};
    (void)run_process_wait(path, argv, STDIN_FILENO, fd, fd, false);
}
