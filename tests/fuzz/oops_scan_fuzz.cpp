// An oops log of any bytes, on a device that may be shorter than it says and have bad blocks.
//
// The input: a byte of which bit 0 is the direction and bit 1 tells raw flash; one that tells by
// how many pages the device has shrunk; two with the bad blocks, of four pages each; then the
// device.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>

#include "oops/log_page.h"
#include "oops/log_scan.h"

namespace {

constexpr size_t HEADER_SIZE = 4;

struct Device {
    const uint8_t *bytes;
    size_t size;
    unsigned bad_blocks;
};

bool is_bad_block(void *context, uint64_t offset) {
    const Device *device = static_cast<Device *>(context);
    return (device->bad_blocks >> (offset / 16384 % 16) & 1) != 0;
}

void read_page(void *context, uint64_t offset, uint8_t *buf) {
    const Device *device = static_cast<Device *>(context);
    if (offset < device->size)
        memcpy(buf, device->bytes + offset, std::min<size_t>(4096, device->size - offset));
}

void require(bool holds) {
    if (!holds)
        abort();
}

// What must hold of all that is printed.
void check_text(const char *text, size_t length, int64_t pages) {
    require(length <= static_cast<size_t>(pages) * (4088 + sizeof("Log Entry -2147483648 "
                                                                  "(at position 2147483647)\n")));
    for (size_t i = 0; i < length; ++i)
        require((text[i] >= ' ' && text[i] <= '~') || (text[i] >= '\t' && text[i] <= '\r'));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < HEADER_SIZE)
        return 0;
    Device device = {.bytes = data + HEADER_SIZE,
                     .size = size - HEADER_SIZE,
                     .bad_blocks = data[2] | static_cast<unsigned>(data[3]) << 8};
    const LogSource source = {.size = device.size + data[1] * uint64_t{4096},
                              .is_bad_block = (data[0] & 2) != 0 ? is_bad_block : nullptr,
                              .read_page = read_page,
                              .context = &device};
    const LogDirection direction =
        (data[0] & 1) != 0 ? LogDirection::BACKWARD : LogDirection::FORWARD;

    NewestEntry newest;
    if (!find_newest_entry(source, &newest))
        return 0;
    const int64_t pages = static_cast<int64_t>(source.size / 4096);
    require(newest.position >= 0 && newest.position < pages && newest.count != 0xffffffff);

    char *text = nullptr;
    size_t length = 0;
    FILE *out = open_memstream(&text, &length);
    require(out != nullptr);
    print_log(source, newest.position, direction, out);
    fclose(out);
    // Where all pages are there as a whole, the newest is printed too.
    require(length > 0 || source.size % 4096 != 0);
    check_text(text, length, pages);
    free(text);
    return 0;
}
