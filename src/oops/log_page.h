// One page of the kernel's oops log, as it lies on the device; all numbers are little-endian:
//
//   0     4  count  of the report, one more than that of the report before it
//   4     4  magic  0x5d005d00
//   8  4088  text   of the report, up to the first byte 0xff (erased flash) or the page's end
//
// Nothing here touches a device.
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr uint32_t LOG_PAGE_SIZE = 4096;
constexpr size_t LOG_PAGE_GUARD = 4;

// Room for one page, and behind it the guard, bytes 0xff that end the text of a page which has none
// of its own.
struct LogPage {
    uint8_t bytes[LOG_PAGE_SIZE + LOG_PAGE_GUARD];
};

// The longest text that write_log_text makes.
constexpr size_t LOG_TEXT_SIZE = sizeof(LogPage) - 8;

// Makes `page` one of erased flash, the guard included. To be done before each read into it: what a
// short or failed read leaves out is then no entry, rather than the rest of another page.
void erase_log_page(LogPage *page);

// Whether the page holds a report: neither erased nor of another format.
bool is_log_entry(const LogPage &page);

// The sequence count of an entry.
uint32_t log_entry_count(const LogPage &page);

// Whether an entry with `count` is newer than the newest one that was found before it, which has
// the count `best`.
bool is_newer_count(uint32_t count, uint32_t best);

// Writes the text of an entry to `text`, which has room for LOG_TEXT_SIZE bytes, in its printable
// form: "." for all but printable ASCII and white space. Returns its length. No terminator.
size_t write_log_text(const LogPage &page, char *text);
