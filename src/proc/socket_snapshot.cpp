#include "proc/socket_snapshot.h"

#include <stdlib.h>
#include <string.h>

#include <algorithm>

#include "proc/table_lines.h"

namespace {

// Some 20,000 sockets; with more, the tables are searched for each.
constexpr size_t MAX_TEXT = 3 * 1024 * 1024;

// Makes room for `needed` elements.
template <typename T>
bool grow(UniqueBlock<T> *block, size_t *size, size_t needed) {
    if (needed <= *size)
        return true;
    size_t new_size = std::max(needed, 2 * *size);
    T *larger = static_cast<T *>(realloc(block->get(), new_size * sizeof(T)));
    if (larger == nullptr)
        return false;
    (void)block->release();
    block->reset(larger);
    *size = new_size;
    return true;
}

}  // namespace

bool SocketSnapshot::add(SocketTable table, unsigned long inode, const char *line) {
    size_t length = strlen(line) + 1;
    if (text_length_ + length > MAX_TEXT || !grow(&text_, &text_size_, text_length_ + length) ||
        !grow(&entries_, &max_entries_, nr_entries_ + 1))
        return false;
    memcpy(text_.get() + text_length_, line, length);
    entries_.get()[nr_entries_++] = {.inode = inode, .line = text_length_, .table = table};
    text_length_ += length;
    return true;
}

bool SocketSnapshot::load() {
    for (SocketTable table : {SocketTable::TCP, SocketTable::TCP6, SocketTable::UNIX}) {
        bool full = find_line(net_dir_, table, [&](const char *line) {
            unsigned long inode;
            return line_inode(table, line, &inode) && !add(table, inode, line);
        });
        if (full)
            return false;
    }
    std::sort(entries_.get(), entries_.get() + nr_entries_, [](const Entry &a, const Entry &b) {
        return a.inode != b.inode ? a.inode < b.inode : a.line < b.line;
    });
    return true;
}

int SocketSnapshot::describe(unsigned long inode, char *buf, size_t size) {
    if (!loaded_) {
        loaded_ = true;
        complete_ = load();
    }
    if (!complete_)
        return NO_MATCH;
    const Entry *end = entries_.get() + nr_entries_;
    const Entry *entry =
        std::lower_bound(static_cast<const Entry *>(entries_.get()), end, inode,
                         [](const Entry &e, unsigned long wanted) { return e.inode < wanted; });
    if (entry == end || entry->inode != inode)
        return 0;
    return match_line(entry->table, text_.get() + entry->line, inode, buf, size);
}
