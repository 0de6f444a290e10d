#include "support/oops_image.h"

namespace {

std::string little_endian(uint32_t number) {
    std::string bytes;
    for (int shift = 0; shift < 32; shift += 8)
        bytes += static_cast<char>(number >> shift & 0xff);
    return bytes;
}

}  // namespace

std::string oops_page(uint32_t count, std::string_view text, uint32_t magic) {
    std::string page = little_endian(count) + little_endian(magic) + std::string(text);
    page.resize(4096, '\xff');
    return page;
}

std::string erased_page() {
    return std::string(4096, '\xff');
}
