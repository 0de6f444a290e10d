#include "rtrace/trace_items.h"

#include <string.h>

namespace {

struct TraceItem {
    const char *name;
    uint32_t bits;
};

constexpr TraceItem TRACE_ITEMS[] = {
    {"smaps", ITEM_SMAPS},       {"status", ITEM_STATUS},
    {"smapstot", ITEM_SMAPSTOT}, {"filenr", ITEM_FILENR},
    {"meminfo", ITEM_MEMINFO},   {"diskinfo", ITEM_DISKINFO},
    {"iostat", ITEM_IOSTAT},     {"pagetypeinfo", ITEM_PAGETYPEINFO},
    {"mediahub", ITEM_MEDIAHUB}, {"event", ITEM_EVENT},
    {"pidstat", ITEM_PIDSTAT},   {"all", ITEMS_ALL},
    {"fast", ITEMS_FAST},
};

}  // namespace

uint32_t lookup_trace_item(const char *name) {
    for (const TraceItem &item : TRACE_ITEMS) {
        if (strcmp(name, item.name) == 0)
            return item.bits;
    }
    return 0;
}
