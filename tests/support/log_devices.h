// Devices with a log on them, for tests of what reads it. Kernel modules that they need are loaded
// only where FIELDKIT_LOAD_MODULES stands in the environment; there they must exist.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

class LogDevice {
  public:
    virtual ~LogDevice() = default;
    std::string path;    // empty where the machine has no such device,
    std::string reason;  // for this reason
};

// A loop device over `file`. It goes with the object, or with the test's process.
std::unique_ptr<LogDevice> make_loop_device(const std::string &file);

// A device over `file` whose bytes from `begin` up to `end` (multiples of 512) cannot be read, made
// with the kernel's device mapper.
std::unique_ptr<LogDevice> make_failing_device(const std::string &file, off_t begin, off_t end);

// Whether reading at `offset` is an input/output error, as such a device has them.
bool fails_to_read(const std::string &device, off_t offset);

enum class FlashNode { RAW, BLOCK };

// A partition with these contents on emulated flash (the kernel's mtdram), as raw flash or as the
// block device that stands for it. Only on emulated flash: a machine's own is never written to.
std::unique_ptr<LogDevice> make_flash_device(const std::string &image, FlashNode node);

// Simulated NAND flash (the kernel's nandsim) with `image` at its beginning and `bad_image` in its
// second block, which is bad. The block lies at NAND_BLOCK_SIZE; what `image` has there is left
// out.
std::unique_ptr<LogDevice> make_bad_nand_device(const std::string &image,
                                                const std::string &bad_image);
constexpr off_t NAND_BLOCK_SIZE = 16384;
