// The socket tables as they were at one moment, for a caller that asks about many sockets at once.
#pragma once

#include <stddef.h>

#include "proc/socket_tables.h"
#include "util/unique_fd.h"

class SocketSnapshot {
  public:
    // Of the tables in `net_dir`, which is borrowed. They are read when the first socket is asked
    // for.
    explicit SocketSnapshot(const char *net_dir = "/proc/net") : net_dir_(net_dir) {}

    // What a search of the tables would do for the socket `inode`: writes its text into `buf` and
    // returns the length of it, or 0 when it is in none of them. NO_MATCH when the tables are too
    // large to be held: they have to be searched, then.
    int describe(unsigned long inode, char *buf, size_t size);

  private:
    struct Entry {
        unsigned long inode;
        size_t line;  // where its text begins in text_; also tells which of two came first
        SocketTable table;
    };
    bool load();
    bool add(SocketTable table, unsigned long inode, const char *line);

    const char *net_dir_;
    bool loaded_ = false;
    bool complete_ = false;
    UniqueBlock<Entry> entries_;  // sorted by inode, then in the order of the tables
    size_t nr_entries_ = 0;
    size_t max_entries_ = 0;
    UniqueBlock<char> text_;
    size_t text_length_ = 0;
    size_t text_size_ = 0;
};
