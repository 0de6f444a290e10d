// Reading the kernel's socket tables line by line.
#pragma once

#include <stdio.h>

#include <memory>

#include "proc/socket_tables.h"

struct CloseFile {
    void operator()(FILE *file) const { (void)fclose(file); }
};
using UniqueFile = std::unique_ptr<FILE, CloseFile>;

constexpr const char *SOCKET_TABLE_NAMES[] = {"tcp", "tcp6", "unix"};  // by SocketTable

// Calls look(line) for each line, or piece of a longer one, of `table` in the directory `net_dir`
// until it returns true. Returns whether it did.
template <typename Look>
bool find_line(const char *net_dir, SocketTable table, Look look) {
    char path[128];
    (void)snprintf(path, sizeof path, "%s/%s", net_dir,
                   SOCKET_TABLE_NAMES[static_cast<size_t>(table)]);
    char block[4096];  // what one read of such a table gives at most
    UniqueFile file(fopen(path, "re"));
    if (file == nullptr)
        return false;
    (void)setvbuf(file.get(), block, _IOFBF, sizeof block);
    char line[SOCKET_LINE_SIZE];
    while (fgets(line, sizeof line, file.get()) != nullptr) {
        if (look(line))
            return true;
    }
    return false;
}
