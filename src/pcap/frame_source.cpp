// Where a capture has its frames from: a packet socket and the ring of slots that belongs to it.
#include "pcap/frame_source.h"

#include <arpa/inet.h>
#include <errno.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <stdio.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/sysinfo.h>

#include <algorithm>
#include <atomic>

namespace {

// ETH_P_ALL as a plain number, deliberately not in network byte order: until bind() names the
// interface and the protocol, the socket then queues nothing on the little-endian device, while
// htons(ETH_P_ALL) would queue frames of every interface.
constexpr int UNBOUND_PROTOCOL = 3;

// The second version of rings: each frame is handed over when it comes. The third hands over whole
// blocks of frames, by a timer when the line is quiet, so that a frame would wait for others.
constexpr int RING_VERSION = TPACKET_V2;

// What the kernel puts before a frame: its own header, an address, and, as far as it has to be
// aligned, the link header.
constexpr uint32_t SLOT_HEADERS = TPACKET_ALIGN(TPACKET2_HDRLEN + 16);
constexpr uint32_t SLOT_SIZE = SLOT_HEADERS + FRAME_SIZE;
static_assert(SLOT_SIZE % TPACKET_ALIGNMENT == 0);

// Slots do not reach across blocks. A whole number of pages, however large these are.
constexpr uint32_t BLOCK_SIZE = 65536;
constexpr uint32_t SLOTS_PER_BLOCK = BLOCK_SIZE / SLOT_SIZE;

// A ring cannot be swapped out, so a small device gets a small one, and no more than some at a
// time: how many captures there are is up to the service's clients.
constexpr int MOST_RINGS = 4;
constexpr uint32_t MOST_BLOCKS = 4194304 / BLOCK_SIZE;
constexpr uint32_t FEWEST_BLOCKS = 262144 / BLOCK_SIZE;
constexpr uint32_t RING_SHARE_OF_MEMORY = 64;

// Without a ring. The kernel doubles it, and takes from it what it needs itself.
constexpr int SOCKET_BUFFER_SIZE = 2097152;

// While a frame is taken, the beginning of the one that comes as many slots later is fetched.
constexpr uint32_t PREFETCH_AHEAD = 4;
constexpr uint32_t PREFETCHED_BYTES = 192;
constexpr uint32_t CACHE_LINE = 64;

std::atomic<int> open_rings;

int report_failure(const char *what) {
    const int error = errno;
    perror(what);
    return -error;
}

uint32_t wanted_blocks() {
    struct sysinfo info = {};
    (void)sysinfo(&info);
    const uint64_t blocks =
        uint64_t{info.totalram} * info.mem_unit / RING_SHARE_OF_MEMORY / BLOCK_SIZE;
    return static_cast<uint32_t>(std::clamp<uint64_t>(blocks, FEWEST_BLOCKS, MOST_BLOCKS));
}

// With 0 blocks: gives up the ring that the socket has.
bool set_ring(int socket_fd, uint32_t blocks) {
    const tpacket_req request = {.tp_block_size = blocks != 0 ? BLOCK_SIZE : 0,
                                 .tp_block_nr = blocks,
                                 .tp_frame_size = blocks != 0 ? SLOT_SIZE : 0,
                                 .tp_frame_nr = blocks * SLOTS_PER_BLOCK};
    return setsockopt(socket_fd, SOL_PACKET, PACKET_RX_RING, &request, sizeof request) == 0;
}

}  // namespace

FrameRing::~FrameRing() {
    if (blocks_ == nullptr)
        return;
    (void)munmap(blocks_, size_t{block_count_} * BLOCK_SIZE);
    --open_rings;
}

void FrameRing::open(int socket_fd) {
    if (++open_rings > MOST_RINGS || !map(socket_fd))
        --open_rings;
}

bool FrameRing::map(int socket_fd) {
    int version = RING_VERSION;
    if (setsockopt(socket_fd, SOL_PACKET, PACKET_VERSION, &version, sizeof version) < 0)
        return false;
    uint32_t blocks = wanted_blocks();
    while (!set_ring(socket_fd, blocks)) {
        blocks /= 2;
        if (blocks < FEWEST_BLOCKS)
            return false;
    }
    const size_t size = size_t{blocks} * BLOCK_SIZE;
    void *mapped = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, socket_fd, 0);
    if (mapped == MAP_FAILED) {
        // With a ring that nobody can look at, no frame would ever be seen.
        (void)set_ring(socket_fd, 0);
        return false;
    }
    // A child would keep the socket, and with it the capture, alive.
    (void)madvise(mapped, size, MADV_DONTFORK);
    blocks_ = static_cast<uint8_t *>(mapped);
    block_count_ = blocks;
    return true;
}

uint32_t FrameRing::slots() const {
    return block_count_ * SLOTS_PER_BLOCK;
}

Taken FrameRing::take(uint8_t *to, uint32_t size, uint32_t *length) {
    uint8_t *slot = blocks_ + size_t{block_} * BLOCK_SIZE + size_t{slot_} * SLOT_SIZE;
    auto *header = reinterpret_cast<tpacket2_hdr *>(slot);
    // Whose the slot is; everything else in it may be looked at, or left, only in this order.
    const std::atomic_ref<uint32_t> status(header->tp_status);
    if ((status.load(std::memory_order_acquire) & TP_STATUS_USER) == 0)
        return Taken::NOTHING;
    // Another processor has filled the slots; to wait for each cache line of each would be what
    // takes most of the time. Beyond the last slot of a block this is of no use, and of no harm.
    for (uint32_t line = 0; line < PREFETCHED_BYTES; line += CACHE_LINE)
        __builtin_prefetch(slot + PREFETCH_AHEAD * SLOT_SIZE + line);
    // Not tp_len: that is the frame's length before the filter cut it.
    const uint32_t there = std::min(header->tp_snaplen, FRAME_SIZE);
    memcpy(to, slot + header->tp_mac, std::min(there, size));
    status.store(TP_STATUS_KERNEL, std::memory_order_release);

    if (++slot_ == SLOTS_PER_BLOCK) {
        slot_ = 0;
        block_ = (block_ + 1) % block_count_;
    }
    *length = there;
    return there > 0 ? Taken::FRAME : Taken::FAILURE;
}

int open_frame_source(const char *interface, const sock_fprog *filter, FrameSource *source) {
    // An unknown name gives 0, which stands for all interfaces. Looking it up takes a descriptor
    // for a moment, so it comes first: the last free one would otherwise be the socket's, and the
    // capture that of all interfaces.
    const unsigned index = if_nametoindex(interface);
    source->socket_fd.reset(socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, UNBOUND_PROTOCOL));
    if (!source->socket_fd.valid())
        return -errno;
    const int fd = source->socket_fd.get();

    source->ring.open(fd);
    if (!source->ring.valid())
        (void)setsockopt(fd, SOL_SOCKET, SO_RCVBUFFORCE, &SOCKET_BUFFER_SIZE,
                         sizeof SOCKET_BUFFER_SIZE);

    sockaddr_ll address = {};
    address.sll_family = AF_PACKET;
    address.sll_protocol = htons(ETH_P_ALL);
    address.sll_ifindex = static_cast<int>(index);
    if (bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) < 0)
        return report_failure("bind");
    if (filter != nullptr &&
        setsockopt(fd, SOL_SOCKET, SO_ATTACH_FILTER, filter, sizeof *filter) < 0)
        return report_failure("setsockopt attach filter");
    return 0;
}

Taken take_frame(FrameSource *source, uint8_t *to, uint32_t size, uint32_t *length) {
    if (source->ring.valid())
        return source->ring.take(to, size, length);
    // With MSG_TRUNC the result is the frame's whole length, whatever is stored of it.
    const ssize_t there = recv(source->socket_fd.get(), to, size, MSG_DONTWAIT | MSG_TRUNC);
    if (there < 1)
        return there < 0 && (errno == EAGAIN || errno == EWOULDBLOCK) ? Taken::NOTHING
                                                                      : Taken::FAILURE;
    *length = static_cast<uint32_t>(std::min<ssize_t>(there, FRAME_SIZE));
    return Taken::FRAME;
}

bool frame_source_failed(const FrameSource &source) {
    int error = 0;
    socklen_t size = sizeof error;
    return getsockopt(source.socket_fd.get(), SOL_SOCKET, SO_ERROR, &error, &size) < 0 ||
           error != 0;
}
