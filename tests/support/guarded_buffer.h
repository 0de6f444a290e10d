// Memory that ends at an unmapped page, so that one byte too far is a crash, and whose every byte
// in front is watched.
#pragma once

#include <gtest/gtest.h>
#include <stddef.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include <functional>
#include <string>

class GuardedBuffer {
  public:
    static constexpr size_t ROOM = 4096;

    GuardedBuffer() {
        void *pages = mmap(nullptr, ROOM + page_size(), PROT_READ | PROT_WRITE,
                           MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        EXPECT_NE(pages, MAP_FAILED);
        base_ = static_cast<char *>(pages);
        EXPECT_EQ(mprotect(base_ + ROOM, page_size(), PROT_NONE), 0);
    }
    ~GuardedBuffer() { munmap(base_, ROOM + page_size()); }
    GuardedBuffer(const GuardedBuffer &) = delete;
    GuardedBuffer &operator=(const GuardedBuffer &) = delete;

    // The last `size` bytes, everything filled with '#'.
    char *fresh(size_t size) {
        memset(base_, '#', ROOM);
        return base_ + ROOM - size;
    }

    // Whether nothing in front of the last `size` bytes has changed.
    bool front_is_untouched(size_t size) const {
        return std::string(base_, ROOM - size) == std::string(ROOM - size, '#');
    }

  private:
    static size_t page_size() { return static_cast<size_t>(sysconf(_SC_PAGESIZE)); }
    char *base_;
};

// Calls `format` with every size from 0 to beyond the length of `whole`, its full text: the length
// must be the same always, and the buffer hold as much of the text as fits.
inline void expect_prefix_at_every_size(const std::string &whole,
                                        const std::function<int(char *, size_t)> &format) {
    GuardedBuffer buffer;
    for (size_t size = 0; size <= whole.size() + 8; size++) {
        char *buf = buffer.fresh(size);
        ASSERT_EQ(format(buf, size), static_cast<int>(whole.size())) << "size " << size;
        ASSERT_TRUE(buffer.front_is_untouched(size)) << "size " << size;
        if (size > 0) {
            ASSERT_EQ(std::string(buf), whole.substr(0, size - 1)) << "size " << size;
        }
    }
}
