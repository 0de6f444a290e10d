// Where a capture has its frames from: a packet socket. The frames come through a ring of slots
// that the kernel fills and this process reads, without a system call for each; where that cannot
// be had, by reads from the socket.
#pragma once

#include <linux/filter.h>
#include <stddef.h>
#include <stdint.h>

#include "util/unique_fd.h"

// The longest part of a frame that is kept.
constexpr uint32_t FRAME_SIZE = 1536;

enum class Taken {
    FRAME,
    NOTHING,  // for now: the next frame makes the socket readable
    FAILURE,  // the socket gives no more frames, for instance as its interface went down
};

// The slots that are shared with the kernel, or none.
class FrameRing {
  public:
    FrameRing() = default;
    FrameRing(const FrameRing &) = delete;
    FrameRing &operator=(const FrameRing &) = delete;
    ~FrameRing();

    // Makes `socket_fd` put its frames into a ring, if the kernel can do that and has the memory,
    // and unless this process has several already. To be called before the socket is bound: what it
    // has queued by then is lost.
    void open(int socket_fd);
    bool valid() const { return blocks_ != nullptr; }
    // How many frames it holds.
    uint32_t slots() const;

    // As take_frame() below.
    Taken take(uint8_t *to, uint32_t size, uint32_t *length);

  private:
    bool map(int socket_fd);

    uint8_t *blocks_ = nullptr;
    uint32_t block_count_ = 0;
    uint32_t block_ = 0;  // where the next frame will be
    uint32_t slot_ = 0;   // within that block
};

struct FrameSource {
    UniqueFd socket_fd;
    FrameRing ring;  // goes before the socket does
};

// Binds a new socket to `interface` (an unknown name: to all) and attaches `filter`, which may be
// null. Returns 0 or a negated system error number; failures after the socket was made are printed.
int open_frame_source(const char *interface, const sock_fprog *filter, FrameSource *source);

// Takes the next frame without waiting for it. What a read of at most FRAME_SIZE bytes would have
// brought is `length`; only the first `size` bytes of that are stored at `to`.
Taken take_frame(FrameSource *source, uint8_t *to, uint32_t size, uint32_t *length);

// To be asked when a wait says that there is an error: whether the socket has failed. It tells of a
// failure once.
bool frame_source_failed(const FrameSource &source);
