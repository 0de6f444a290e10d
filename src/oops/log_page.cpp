// The format of one page of the oops log.
#include "oops/log_page.h"

#include <string.h>

namespace {

constexpr size_t COUNT_OFFSET = 0;
constexpr size_t MAGIC_OFFSET = 4;
constexpr size_t TEXT_OFFSET = 8;

constexpr uint8_t ERASED_BYTE = 0xff;
constexpr uint32_t ERASED_COUNT = 0xffffffff;
constexpr uint32_t LAST_COUNT = 0xfffffffe;  // 0 comes after it
constexpr uint32_t MAGIC = 0x5d005d00;

static_assert(LOG_TEXT_SIZE == sizeof(LogPage) - TEXT_OFFSET);

uint32_t number_at(const LogPage &page, size_t offset) {
    const uint8_t *bytes = page.bytes + offset;
    return uint32_t{bytes[0]} | uint32_t{bytes[1]} << 8 | uint32_t{bytes[2]} << 16 |
           uint32_t{bytes[3]} << 24;
}

// As it is what isprint and isspace take in the C locale, anything else as a dot. No branches, so
// that compilers make it work on many bytes at once.
char shown(uint8_t byte) {
    const bool is_print = static_cast<uint8_t>(byte - ' ') <= '~' - ' ';
    const bool is_space = static_cast<uint8_t>(byte - '\t') <= '\r' - '\t';
    return static_cast<char>((is_print | is_space) ? byte : '.');
}

}  // namespace

void erase_log_page(LogPage *page) {
    memset(page->bytes, ERASED_BYTE, sizeof(page->bytes));
}

bool is_log_entry(const LogPage &page) {
    return log_entry_count(page) != ERASED_COUNT && number_at(page, MAGIC_OFFSET) == MAGIC;
}

uint32_t log_entry_count(const LogPage &page) {
    return number_at(page, COUNT_OFFSET);
}

bool is_newer_count(uint32_t count, uint32_t best) {
    // Deliberately no distance modulo 2^32: the step over the wrap counts only when 0 comes right
    // behind the last count. After it, a later page with a count from before the wrap wins again.
    if (count == 0)
        return best == LAST_COUNT;
    return count > best;
}

size_t write_log_text(const LogPage &page, char *text) {
    const uint8_t *bytes = page.bytes + TEXT_OFFSET;
    const void *end = memchr(bytes, ERASED_BYTE, LOG_TEXT_SIZE);
    const size_t length = end != nullptr
                              ? static_cast<size_t>(static_cast<const uint8_t *>(end) - bytes)
                              : LOG_TEXT_SIZE;
    for (size_t i = 0; i < length; ++i)
        text[i] = shown(bytes[i]);
    return length;
}
