// The two passes over the pages of an oops log.
#include "oops/log_scan.h"

#include "oops/log_page.h"

namespace {

// Pages that are there as a whole.
int64_t count_pages(uint64_t size) {
    return static_cast<int64_t>(size / LOG_PAGE_SIZE);
}

// Reads page `position`. Returns false if it lies in a bad block or is no entry.
bool read_entry(const LogSource &source, int64_t position, LogPage *page) {
    const uint64_t offset = static_cast<uint64_t>(position) * LOG_PAGE_SIZE;
    if (source.is_bad_block != nullptr && source.is_bad_block(source.context, offset))
        return false;
    erase_log_page(page);
    source.read_page(source.context, offset, page->bytes);
    return is_log_entry(*page);
}

void print_entry(const LogPage &page, int64_t position, FILE *out) {
    char text[LOG_TEXT_SIZE];
    const size_t length = write_log_text(page, text);
    // As signed numbers: the upper half of the counts prints as negative ones.
    fprintf(out, "Log Entry %d (at position %d)\n", static_cast<int>(log_entry_count(page)),
            static_cast<int>(position));
    fwrite(text, 1, length, out);
}

}  // namespace

bool find_newest_entry(const LogSource &source, NewestEntry *newest) {
    const int64_t pages = count_pages(source.size);
    bool found = false;
    LogPage page;
    for (int64_t i = 0; i < pages; ++i) {
        if (!read_entry(source, i, &page))
            continue;
        const uint32_t count = log_entry_count(page);
        if (!found || is_newer_count(count, newest->count)) {
            *newest = {.position = i, .count = count};
            found = true;
        }
    }
    return found;
}

int64_t next_log_position(int64_t position, LogDirection direction, uint64_t size) {
    if (direction == LogDirection::BACKWARD)
        return position > 0 ? position - 1 : count_pages(size) - 1;
    // Deliberately not compared with the number of pages: a last page that is there in part only is
    // a step of its own. The way round is then one step longer than the walk, which ends before the
    // newest entry; no flash partition has such a size.
    const uint64_t next = static_cast<uint64_t>(position) + 1;
    return next * LOG_PAGE_SIZE < size ? static_cast<int64_t>(next) : 0;
}

void print_log(const LogSource &source, int64_t newest, LogDirection direction, FILE *out) {
    int64_t position = newest;
    LogPage page;
    for (int64_t steps = count_pages(source.size); steps > 0; --steps) {
        position = next_log_position(position, direction, source.size);
        if (read_entry(source, position, &page))
            print_entry(page, position, out);
    }
}
