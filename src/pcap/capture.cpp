// Copies the frames seen on a network interface into a stream in the classic pcap format.
#include "pcap/capture.h"

#include <arpa/inet.h>
#include <errno.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/sysinfo.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <array>

#include "pcap/pcap_format.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

// The longest part of a frame that is kept.
constexpr uint32_t FRAME_SIZE = 1536;

// ETH_P_ALL as a plain number, deliberately not in network byte order: until bind() names the
// interface and the protocol, the socket then queues nothing on the little-endian device, while
// htons(ETH_P_ALL) would queue frames of every interface.
constexpr int UNBOUND_PROTOCOL = 3;

// After a frame that just fits, this leaves room for that frame's record header and for a filler of
// at least 33 bytes.
constexpr uint32_t FILLER_RESERVE = 48;

// What one wait for frames may last at most: larger values overflow a 32-bit time.
constexpr int64_t LONGEST_WAIT_S = INT32_MAX;

constexpr std::array<uint8_t, FRAME_SIZE> ZEROS = {};

// A record as it is written, in one piece.
struct Record {
    std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> header;
    std::array<uint8_t, FRAME_SIZE> frame;
};
static_assert(sizeof(Record) == PCAP_RECORD_HEADER_SIZE + FRAME_SIZE);

struct Capture {
    int socket_fd;
    int out_fd;
    uint32_t size_limit;
    uint32_t cut_length;
    uint32_t time_limit;
    long start;       // uptime, in seconds
    int64_t written;  // bytes of the stream so far
    Record record;
};

// Why a capture ended.
enum class End {
    STOPPED,        // in order: a limit, the interface or the client
    WAIT_FAILED,    // reported
    OUTPUT_BROKEN,  // a write failed
};

struct Readable {
    bool packet;
    bool output;
};

int report_failure(const char *what) {
    const int error = errno;
    perror(what);
    return -error;
}

// Returns the socket, or the negated error number with the failure printed.
int open_packet_socket(const char *interface, const sock_fprog *filter) {
    // An unknown name gives 0, which stands for all interfaces. Looking it up takes a descriptor
    // for a moment, so it comes first: the last free one would otherwise be the socket's, and the
    // capture that of all interfaces.
    const unsigned index = if_nametoindex(interface);
    UniqueFd ret(socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, UNBOUND_PROTOCOL));
    if (!ret.valid())
        return -errno;

    sockaddr_ll address = {};
    address.sll_family = AF_PACKET;
    address.sll_protocol = htons(ETH_P_ALL);
    address.sll_ifindex = static_cast<int>(index);
    if (bind(ret.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) < 0)
        return report_failure("bind");
    if (filter != nullptr &&
        setsockopt(ret.get(), SOL_SOCKET, SO_ATTACH_FILTER, filter, sizeof *filter) < 0)
        return report_failure("setsockopt attach filter");
    return ret.release();
}

bool write_counted(Capture *capture, const void *bytes, uint32_t length) {
    if (write_all(capture->out_fd, bytes, length) < 0)
        return false;
    capture->written += length;
    return true;
}

// How long the next wait may last; 0 when the time is up. Only with a time limit.
int64_t seconds_left(const Capture &capture) {
    const int64_t elapsed = uptime_seconds() - capture.start;
    return std::clamp<int64_t>(capture.time_limit - elapsed, 0, LONGEST_WAIT_S);
}

// Waits, at most until the time is up, until there is something to read. Returns 1, 0 when there
// is nothing (time-out or signal), or -1 with the failure printed.
//
// Messages and results are those of select(), which cannot be used: the service may have
// descriptors beyond FD_SETSIZE.
int wait_readable(const Capture &capture, int64_t timeout_s, Readable *readable) {
    const timespec timeout = {.tv_sec = static_cast<time_t>(timeout_s), .tv_nsec = 0};
    pollfd fds[] = {{.fd = capture.socket_fd, .events = POLLIN, .revents = 0},
                    {.fd = capture.out_fd, .events = POLLIN, .revents = 0}};
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
    *readable = {.packet = fds[0].revents != 0, .output = fds[1].revents != 0};
    return ready > 0 ? 1 : 0;
}

// Throws away what the client sends. Returns whether it is still there.
bool drain_output(const Capture &capture) {
    std::array<uint8_t, FRAME_SIZE> unwanted;
    return read(capture.out_fd, unwanted.data(), unwanted.size()) > 0;
}

bool fits(const Capture &capture, uint32_t captured_length) {
    return capture.size_limit == 0 ||
           capture.written + FILLER_RESERVE + captured_length < capture.size_limit;
}

bool write_record(Capture *capture, uint32_t captured_length, uint32_t original_length) {
    timeval now;
    (void)gettimeofday(&now, nullptr);
    capture->record.header = pcap_record_header({.seconds = static_cast<uint32_t>(now.tv_sec),
                                                 .microseconds = static_cast<uint32_t>(now.tv_usec),
                                                 .captured_length = captured_length,
                                                 .original_length = original_length});
    return write_counted(capture, &capture->record, PCAP_RECORD_HEADER_SIZE + captured_length);
}

End copy_frames(Capture *capture) {
    const bool until_client_goes = capture->time_limit == 0 && capture->size_limit == 0;
    for (;;) {
        int64_t timeout_s = 0;
        if (capture->time_limit != 0) {
            timeout_s = seconds_left(*capture);
            if (timeout_s == 0)
                return End::STOPPED;
        }

        Readable readable = {};
        const int ready = wait_readable(*capture, timeout_s, &readable);
        if (ready < 0)
            return End::WAIT_FAILED;
        if (ready == 0)
            continue;

        // With a limit the announced length or time holds even when the client has gone: the next
        // write tells. A file, or a client that has gone, is always readable, so this then does not
        // block and keeps the processor busy while the network is quiet; that is accepted.
        if (readable.output && !drain_output(*capture) && until_client_goes)
            return End::STOPPED;
        if (!readable.packet)
            continue;

        Record &record = capture->record;
        const ssize_t length = read(capture->socket_fd, record.frame.data(), record.frame.size());
        if (length < 1)
            return End::STOPPED;
        const auto original_length = static_cast<uint32_t>(length);
        // The cut holds for short frames, too (what follows them is left over from earlier ones):
        // with it every record has the same size, and readers count on that.
        const uint32_t captured_length =
            capture->cut_length != 0 ? capture->cut_length : original_length;
        if (!fits(*capture, captured_length))
            return End::STOPPED;
        if (!write_record(capture, captured_length, original_length))
            return End::OUTPUT_BROKEN;
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
    while (capture->written < capture->size_limit) {
        const auto remainder = static_cast<uint32_t>(capture->size_limit - capture->written);
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
    const End end = copy_frames(capture);
    if (end == End::OUTPUT_BROKEN || (end == End::STOPPED && !write_fillers(capture)))
        return -1;
    return capture->written;
}

}  // namespace

int64_t capture_packets(const char *interface, int out_fd, uint32_t size_limit, uint32_t cut_length,
                        uint32_t time_limit, bool promiscuous, const sock_fprog *filter) {
    const int opened = open_packet_socket(interface, filter);
    if (opened < 0)
        return opened;
    const UniqueFd socket_fd(opened);

    set_promiscuous(socket_fd.get(), interface, promiscuous);
    Capture capture = {.socket_fd = socket_fd.get(),
                       .out_fd = out_fd,
                       .size_limit = size_limit,
                       .cut_length = std::min(cut_length, FRAME_SIZE),
                       .time_limit = time_limit,
                       .start = 0,
                       .written = 0,
                       .record = {}};
    const int64_t ret = write_stream(&capture);

    // Off even if it was on before: after an interrupted capture nobody else would switch it off.
    set_promiscuous(socket_fd.get(), interface, false);
    int unused = 0;
    (void)setsockopt(socket_fd.get(), SOL_SOCKET, SO_DETACH_FILTER, &unused, sizeof unused);
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
