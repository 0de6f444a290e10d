// Copies the frames seen on a network interface into a stream in the classic pcap format.
#include "pcap/capture.h"

#include <errno.h>
#include <net/if.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysinfo.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <utility>

#include "pcap/frame_source.h"
#include "pcap/pcap_format.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

// After a frame that just fits, this leaves room for that frame's record header and for a filler of
// at least 33 bytes.
constexpr uint32_t FILLER_RESERVE = 48;

// The uptime is asked for so often at most: that takes as long as taking a frame.
constexpr int64_t UPTIME_INTERVAL_MS = 100;

// What one wait for frames may last at most: larger values overflow a 32-bit time.
constexpr int64_t LONGEST_WAIT_S = INT32_MAX;

// Records that are there at the same time are written together.
constexpr uint32_t BLOCK_SIZE = 65536;
constexpr uint32_t LARGEST_RECORD = PCAP_RECORD_HEADER_SIZE + FRAME_SIZE;

// On a busy line, where frames follow each other this closely for a while, to be woken for each of
// them costs more than all else; there a short pause lets some gather in the ring.
constexpr int64_t BUSY_INTERVAL_US = 100;
constexpr uint32_t BUSY_FRAMES = 16;
// The pause: as long as it takes to fill a part of the ring, and not so long that the times of the
// frames, which are those at which they are taken, would be of no use.
constexpr uint32_t GATHERED_SHARE = 8;
constexpr int64_t LONGEST_PAUSE_US = 500;
// A clock that is coarser than this would make the pause longer than the ring can bear.
constexpr long COARSEST_CLOCK_NS = 100000;

constexpr std::array<uint8_t, FRAME_SIZE> ZEROS = {};

struct Capture {
    FrameSource source;
    int out_fd;
    int awaited_out_fd;  // the same, or -1 when a read from it will tell nothing any more
    uint32_t size_limit;
    uint32_t cut_length;
    uint32_t time_limit;
    bool out_is_file;
    bool may_pause;
    long start;                  // uptime, in seconds
    int64_t uptime_asked_ms;     // when seconds_left was found out, by the clock of coarse_ms()
    int64_t seconds_left;        // only with a time limit
    int64_t length;              // bytes of the stream so far, those in the block included
    UniqueBlock<uint8_t> block;  // BLOCK_SIZE bytes
    uint32_t block_used;         // of it: records to be written
    int64_t last_frame_us;       // time of day of the last frame
    int64_t busy_since_us;       // and of the one that `busy_frames` follow
    uint32_t busy_frames;
    std::array<uint8_t, FRAME_SIZE> frame;  // with a cut length: what short frames are followed by
};

// Why a capture ended, or has not.
enum class End {
    NOT_YET,
    STOPPED,        // in order: a limit, the interface or the client
    WAIT_FAILED,    // reported
    OUTPUT_BROKEN,  // a write failed
};

struct Readable {
    bool packet;
    bool packet_error;
    bool output;
};

// A signal that ends the process would stop the write to a file in the midst of a record, so it has
// to wait. A client may be slow, and a signal is not to wait for that.
int32_t write_records(const Capture &capture, const void *bytes, uint32_t size) {
    if (!capture.out_is_file || size <= LARGEST_RECORD)
        return write_all(capture.out_fd, bytes, size);
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    (void)pthread_sigmask(SIG_SETMASK, &all, &before);
    const int32_t ret = write_all(capture.out_fd, bytes, size);
    (void)pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return ret;
}

bool write_block(Capture *capture) {
    const uint32_t size = std::exchange(capture->block_used, 0);
    return size == 0 || write_records(*capture, capture->block.get(), size) >= 0;
}

bool write_counted(Capture *capture, const void *bytes, uint32_t length) {
    if (write_all(capture->out_fd, bytes, length) < 0)
        return false;
    capture->length += length;
    return true;
}

// A clock in milliseconds that, on most machines, takes no system call.
int64_t coarse_ms() {
    timespec now = {};
    if (clock_gettime(CLOCK_MONOTONIC_COARSE, &now) != 0)  // before Linux 2.6.32
        (void)clock_gettime(CLOCK_MONOTONIC, &now);
    return int64_t{now.tv_sec} * 1000 + now.tv_nsec / 1000000;
}

// How long the next wait may last; 0 when the time is up. Only with a time limit.
int64_t seconds_left(Capture *capture) {
    const int64_t now = coarse_ms();
    if (now - capture->uptime_asked_ms >= UPTIME_INTERVAL_MS) {
        const int64_t elapsed = uptime_seconds() - capture->start;
        capture->uptime_asked_ms = now;
        capture->seconds_left =
            std::clamp<int64_t>(capture->time_limit - elapsed, 0, LONGEST_WAIT_S);
    }
    return capture->seconds_left;
}

// Waits, at most until the time is up, until there is something to read. Returns 1, 0 when there
// is nothing (time-out or signal), or -1 with the failure printed.
//
// Messages and results are those of select(), which cannot be used: the service may have
// descriptors beyond FD_SETSIZE.
int wait_readable(const Capture &capture, int64_t timeout_s, Readable *readable) {
    const timespec timeout = {.tv_sec = static_cast<time_t>(timeout_s), .tv_nsec = 0};
    pollfd fds[] = {{.fd = capture.source.socket_fd.get(), .events = POLLIN, .revents = 0},
                    {.fd = capture.awaited_out_fd, .events = POLLIN, .revents = 0}};
    int ready = ppoll(fds, 2, capture.time_limit != 0 ? &timeout : nullptr, nullptr);
    if (((fds[0].revents | fds[1].revents) & POLLNVAL) != 0) {
        errno = EBADF;
        ready = -1;
    }
    if (ready < 0 && errno == EINTR)
        return 0;
    if (ready < 0) {
        perror("select");
        return -1;
    }
    *readable = {.packet = fds[0].revents != 0,
                 .packet_error = (fds[0].revents & ~POLLIN) != 0,
                 .output = fds[1].revents != 0};
    return ready > 0 ? 1 : 0;
}

// Throws away what the client sends. Returns what the read did.
ssize_t drain_output(const Capture &capture) {
    std::array<uint8_t, FRAME_SIZE> unwanted;
    return read(capture.out_fd, unwanted.data(), unwanted.size());
}

// Looks at an output that is readable. Returns whether its end ends the capture.
bool client_ends_capture(Capture *capture) {
    const ssize_t n = drain_output(*capture);
    if (n > 0)
        return false;
    if (capture->time_limit == 0 && capture->size_limit == 0)
        return true;
    // With a limit the announced length or time holds even when the client has gone: the next
    // write tells. Until then it would be readable all the time, and no wait would be one.
    if (n == 0 || (errno != EAGAIN && errno != EINTR))
        capture->awaited_out_fd = -1;
    return false;
}

bool fits(const Capture &capture, uint32_t captured_length) {
    return capture.size_limit == 0 ||
           capture.length + FILLER_RESERVE + captured_length < capture.size_limit;
}

// Completes the record of a frame whose bytes are in the block already.
void add_record(Capture *capture, uint32_t captured_length, uint32_t original_length) {
    timeval now;
    (void)gettimeofday(&now, nullptr);
    const auto header = pcap_record_header({.seconds = static_cast<uint32_t>(now.tv_sec),
                                            .microseconds = static_cast<uint32_t>(now.tv_usec),
                                            .captured_length = captured_length,
                                            .original_length = original_length});
    std::copy(header.begin(), header.end(), capture->block.get() + capture->block_used);
    const uint32_t size = PCAP_RECORD_HEADER_SIZE + captured_length;
    capture->block_used += size;
    capture->length += size;
    capture->last_frame_us = int64_t{now.tv_sec} * 1000000 + now.tv_usec;
    ++capture->busy_frames;
}

// Takes one frame into the block.
Taken take_record(Capture *capture, End *end) {
    uint8_t *bytes = capture->block.get() + capture->block_used + PCAP_RECORD_HEADER_SIZE;
    const uint32_t cut_length = capture->cut_length;
    uint32_t original_length = 0;
    const Taken taken =
        cut_length != 0
            ? take_frame(&capture->source, capture->frame.data(), cut_length, &original_length)
            : take_frame(&capture->source, bytes, FRAME_SIZE, &original_length);
    if (taken == Taken::FAILURE)
        *end = End::STOPPED;
    if (taken != Taken::FRAME)
        return taken;
    // The cut holds for short frames, too (what follows them is left over from earlier ones):
    // with it every record has the same size, and readers count on that.
    const uint32_t captured_length = cut_length != 0 ? cut_length : original_length;
    if (!fits(*capture, captured_length)) {
        *end = End::STOPPED;
        return taken;
    }
    if (cut_length != 0)
        std::copy_n(capture->frame.data(), cut_length, bytes);
    add_record(capture, captured_length, original_length);
    return taken;
}

// Writes the frames that are there, as many as the block takes. No frame waits for later ones.
// `all` tells whether there are no more.
End copy_ready_frames(Capture *capture, bool *all) {
    End end = End::NOT_YET;
    *all = false;
    while (!*all && end == End::NOT_YET && BLOCK_SIZE - capture->block_used >= LARGEST_RECORD)
        *all = take_record(capture, &end) == Taken::NOTHING;
    return write_block(capture) ? end : End::OUTPUT_BROKEN;
}

// For how many microseconds it pays to let frames gather, as fast as they come now.
int64_t gathering_time(Capture *capture) {
    const uint32_t frames = capture->busy_frames;
    if (frames < BUSY_FRAMES || !capture->may_pause)
        return 0;
    const int64_t elapsed = capture->last_frame_us - capture->busy_since_us;
    capture->busy_frames = 0;
    capture->busy_since_us = capture->last_frame_us;
    if (elapsed < 0 || elapsed >= frames * BUSY_INTERVAL_US)
        return 0;
    const int64_t gathered = capture->source.ring.slots() / GATHERED_SHARE;
    return std::min(elapsed * gathered / frames, LONGEST_PAUSE_US);
}

End copy_frames(Capture *capture) {
    for (;;) {
        int64_t timeout_s = 0;
        if (capture->time_limit != 0) {
            timeout_s = seconds_left(capture);
            if (timeout_s == 0)
                return End::STOPPED;
        }

        Readable readable = {};
        const int ready = wait_readable(*capture, timeout_s, &readable);
        if (ready < 0)
            return End::WAIT_FAILED;
        if (ready == 0)
            continue;

        if (readable.output && client_ends_capture(capture))
            return End::STOPPED;
        // A failure counts before the frames that came before it.
        if (readable.packet_error && frame_source_failed(capture->source))
            return End::STOPPED;
        if (!readable.packet)
            continue;

        bool all = false;
        const End end = copy_ready_frames(capture, &all);
        if (end != End::NOT_YET)
            return end;
        const int64_t pause_us = all ? gathering_time(capture) : 0;
        if (pause_us > 0) {
            const timespec pause = {.tv_sec = 0, .tv_nsec = static_cast<long>(pause_us) * 1000};
            (void)nanosleep(&pause, nullptr);
        }
    }
}

bool write_zeros(Capture *capture, uint32_t count) {
    while (count > 0) {
        const uint32_t piece = std::min(count, FRAME_SIZE);
        if (!write_counted(capture, ZEROS.data(), piece))
            return false;
        count -= piece;
    }
    return true;
}

// Fills the stream up to its size limit, if it has one.
bool write_fillers(Capture *capture) {
    while (capture->length < capture->size_limit) {
        const auto remainder = static_cast<uint32_t>(capture->size_limit - capture->length);
        const uint32_t size = pcap_filler_size(remainder);
        if (size < PCAP_RECORD_HEADER_SIZE)  // a limit just above the size of the global header
            return write_zeros(capture, size);
        const uint32_t data_length = size - PCAP_RECORD_HEADER_SIZE;
        const auto header = pcap_filler_header(data_length);
        if (!write_counted(capture, header.data(), PCAP_RECORD_HEADER_SIZE) ||
            !write_zeros(capture, data_length))
            return false;
    }
    return true;
}

// The whole stream. Returns its length, or -1 when a write failed.
int64_t write_stream(Capture *capture) {
    const auto header = pcap_global_header();
    if (!write_counted(capture, header.data(), PCAP_GLOBAL_HEADER_SIZE))
        return -1;
    capture->start = uptime_seconds();
    capture->uptime_asked_ms = -UPTIME_INTERVAL_MS;  // never
    const End end = copy_frames(capture);
    if (end == End::OUTPUT_BROKEN || (end == End::STOPPED && !write_fillers(capture)))
        return -1;
    return capture->length;
}

bool is_file(int fd) {
    struct stat status;
    return fstat(fd, &status) == 0 && S_ISREG(status.st_mode);
}

bool clock_is_fine() {
    timespec resolution = {};
    return clock_getres(CLOCK_MONOTONIC, &resolution) == 0 && resolution.tv_sec == 0 &&
           resolution.tv_nsec <= COARSEST_CLOCK_NS;
}

}  // namespace

int64_t capture_packets(const char *interface, int out_fd, uint32_t size_limit, uint32_t cut_length,
                        uint32_t time_limit, bool promiscuous, const sock_fprog *filter) {
    Capture capture = {};
    capture.block.reset(static_cast<uint8_t *>(malloc(BLOCK_SIZE)));
    if (capture.block == nullptr)
        return -ENOMEM;
    const int opened = open_frame_source(interface, filter, &capture.source);
    if (opened < 0)
        return opened;
    capture.out_fd = out_fd;
    capture.awaited_out_fd = out_fd;
    capture.size_limit = size_limit;
    capture.cut_length = std::min(cut_length, FRAME_SIZE);
    capture.time_limit = time_limit;
    capture.out_is_file = is_file(out_fd);
    capture.may_pause = capture.source.ring.valid() && clock_is_fine();

    const int socket_fd = capture.source.socket_fd.get();
    set_promiscuous(socket_fd, interface, promiscuous);
    const int64_t ret = write_stream(&capture);

    // Off even if it was on before: after an interrupted capture nobody else would switch it off.
    set_promiscuous(socket_fd, interface, false);
    int unused = 0;
    (void)setsockopt(socket_fd, SOL_SOCKET, SO_DETACH_FILTER, &unused, sizeof unused);
    return ret;
}

void set_promiscuous(int socket_fd, const char *interface, bool on) {
    ifreq request = {};
    if (strlen(interface) >= sizeof request.ifr_name)  // cut, it might name another interface
        return;
    strcpy(request.ifr_name, interface);
    if (ioctl(socket_fd, SIOCGIFFLAGS, &request) < 0)
        return;
    const int flags = on ? request.ifr_flags | IFF_PROMISC : request.ifr_flags & ~IFF_PROMISC;
    request.ifr_flags = static_cast<short>(flags);
    (void)ioctl(socket_fd, SIOCSIFFLAGS, &request);
}

long uptime_seconds() {
    struct sysinfo info = {};
    (void)sysinfo(&info);
    return info.uptime;
}
