// What a resource trace can sample.
#pragma once

#include <stdint.h>

constexpr uint32_t ITEM_SMAPS = 0x1;
constexpr uint32_t ITEM_STATUS = 0x2;
constexpr uint32_t ITEM_SMAPSTOT = 0x4;
constexpr uint32_t ITEM_FILENR = 0x8;
constexpr uint32_t ITEM_MEMINFO = 0x10;
constexpr uint32_t ITEM_DISKINFO = 0x20;
constexpr uint32_t ITEM_IOSTAT = 0x40;
constexpr uint32_t ITEM_PAGETYPEINFO = 0x80;
constexpr uint32_t ITEM_MEDIAHUB = 0x100;
constexpr uint32_t ITEM_EVENT = 0x200;
constexpr uint32_t ITEM_PIDSTAT = 0x400;

// Two sets that requests name. Neither contains the other, and clients rely on both as they are:
// "all" leaves out smapstot, pagetypeinfo and mediahub; "fast" takes smapstot for smaps and status.
constexpr uint32_t ITEMS_ALL = 0x67b;
constexpr uint32_t ITEMS_FAST = 0x67c;

// The bits that `name` stands for, compared exactly; 0 for an unknown name.
uint32_t lookup_trace_item(const char *name);
