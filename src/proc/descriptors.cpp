#include "proc/descriptors.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <memory>

#include "proc/socket_tables.h"
#include "util/unique_fd.h"

namespace {

struct CloseFile {
    void operator()(FILE *file) const { (void)fclose(file); }
};
using UniqueFile = std::unique_ptr<FILE, CloseFile>;

using MatchLine = int (*)(const char *line, unsigned long inode, char *buf, size_t size);

struct SocketTable {
    const char *name;
    MatchLine match;
};

// In the order in which they are searched.
constexpr SocketTable SOCKET_TABLES[] = {
    {"tcp", match_tcp_line},
    {"tcp6", match_tcp6_line},
    {"unix", match_unix_line},
};

// The result of the first line that matches, or NO_MATCH.
int search_table(const char *path, MatchLine match, unsigned long inode, char *buf, size_t size) {
    UniqueFile file(fopen(path, "re"));
    if (file == nullptr)
        return NO_MATCH;
    char line[SOCKET_LINE_SIZE];
    while (fgets(line, sizeof line, file.get()) != nullptr) {
        int length = match(line, inode, buf, size);
        if (length != NO_MATCH)
            return length;
    }
    return NO_MATCH;
}

}  // namespace

int list_fds(pid_t pid, int *fds, int max) {
    char path[64];
    (void)snprintf(path, sizeof path, "/proc/%ld/fd", static_cast<long>(pid));
    UniqueDir dir(opendir(path));
    if (dir == nullptr)
        return 0;
    int count = 0;
    while (count < max) {
        const dirent *entry = readdir(dir.get());
        if (entry == nullptr)
            break;
        if (entry->d_name[0] != '.')
            fds[count++] = static_cast<int>(strtol(entry->d_name, nullptr, 10));
    }
    return count;
}

int describe_fd(pid_t pid, int fd, char *buf, size_t size) {
    char path[128];
    (void)snprintf(path, sizeof path, "/proc/%ld/fd/%d", static_cast<long>(pid), fd);
    ssize_t n = readlink(path, buf, size - 1);
    if (n < 1)
        return static_cast<int>(n);
    buf[n] = '\0';
    int length = static_cast<int>(n);
    if (strncmp(buf, "socket:[", 8) == 0) {
        unsigned long inode = strtoul(buf + 8, nullptr, 10);
        length += describe_socket_inode(pid, inode, buf + n, size - static_cast<size_t>(n));
    }
    return length;
}

int describe_socket_inode(pid_t, unsigned long inode, char *buf, size_t size) {
    return describe_socket_inode_in("/proc/net", inode, buf, size);
}

int describe_socket_inode_in(const char *net_dir, unsigned long inode, char *buf, size_t size) {
    for (const SocketTable &table : SOCKET_TABLES) {
        char path[128];
        (void)snprintf(path, sizeof path, "%s/%s", net_dir, table.name);
        int length = search_table(path, table.match, inode, buf, size);
        if (length != NO_MATCH)
            return length;
    }
    return 0;
}
