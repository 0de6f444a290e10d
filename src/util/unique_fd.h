// Small owners for the things that an early return would otherwise leak.
#pragma once

#include <dirent.h>
#include <stdlib.h>
#include <unistd.h>

#include <memory>
#include <utility>

// Owns one descriptor, or none (-1). Closing errors are ignored: what matters shows in the writes.
class UniqueFd {
  public:
    UniqueFd() = default;
    explicit UniqueFd(int fd) : fd_(fd) {}
    UniqueFd(UniqueFd &&other) noexcept : fd_(other.release()) {}
    UniqueFd &operator=(UniqueFd &&other) noexcept {
        reset(other.release());
        return *this;
    }
    ~UniqueFd() { reset(); }

    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }

    // Hands the descriptor over to the caller.
    int release() { return std::exchange(fd_, -1); }

    // Closes what is owned and takes `fd`.
    void reset(int fd = -1) {
        if (fd_ >= 0 && fd_ != fd)
            (void)close(fd_);
        fd_ = fd;
    }

  private:
    int fd_ = -1;
};

struct CloseDir {
    void operator()(DIR *dir) const { (void)closedir(dir); }
};
using UniqueDir = std::unique_ptr<DIR, CloseDir>;

struct FreeBlock {
    void operator()(void *block) const { free(block); }
};
// Memory that came from malloc, calloc, realloc or asprintf.
template <typename T>
using UniqueBlock = std::unique_ptr<T, FreeBlock>;
