#include "proc/descriptors.h"

#include <fcntl.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "proc/known_sockets.h"
#include "proc/socket_diag.h"
#include "proc/socket_snapshot.h"
#include "proc/socket_tables.h"
#include "proc/table_lines.h"
#include "util/line_text.h"
#include "util/unique_fd.h"

namespace {

bool find_tcp_socket(const char *net_dir, unsigned long inode, TcpSocket *socket) {
    return find_line(net_dir, SocketTable::TCP,
                     [&](const char *line) { return parse_tcp_line(line, inode, socket); }) ||
           find_line(net_dir, SocketTable::TCP6,
                     [&](const char *line) { return parse_tcp6_line(line, inode, socket); });
}

// The result of the first line that matches, or NO_MATCH.
int search_unix_table(const char *net_dir, unsigned long inode, char *buf, size_t size) {
    int length = NO_MATCH;
    (void)find_line(net_dir, SocketTable::UNIX, [&](const char *line) {
        length = match_unix_line(line, inode, buf, size);
        return length != NO_MATCH;
    });
    return length;
}

// The directory of the process whose descriptors were asked for last: a link is read faster below
// it than by its whole path.
pthread_mutex_t last_lock = PTHREAD_MUTEX_INITIALIZER;
pid_t last_pid = -1;
int last_dir = -1;  // /proc/LAST_PID/fd, or -1: only a process that is asked for twice has it

void close_last_dir() {
    if (last_dir != -1)
        (void)close(last_dir);
    last_dir = -1;
}

// The target of a link in the kept directory; -1 also when that is another process's.
ssize_t read_kept_link(pid_t pid, const char *name, const char *dir, char *buf, size_t size) {
    (void)pthread_mutex_lock(&last_lock);
    if (pid != last_pid) {
        close_last_dir();
        last_pid = pid;
    } else if (last_dir == -1) {
        last_dir = open(dir, O_PATH | O_DIRECTORY | O_CLOEXEC);
    }
    ssize_t n = last_dir != -1 ? readlinkat(last_dir, name, buf, size) : -1;
    (void)pthread_mutex_unlock(&last_lock);
    return n;
}

ssize_t read_fd_link(pid_t pid, int fd, char *buf, size_t size) {
    char name[16];
    LineText name_text(name, sizeof name);
    name_text.add_decimal(fd);
    char path[64];
    LineText text(path, sizeof path);
    text.add_text("/proc/");
    text.add_decimal(pid);
    text.add_text("/fd");
    ssize_t n = read_kept_link(pid, name, path, buf, size);
    if (n >= 0)
        return n;
    // Also where the directory is that of a process that has gone and whose number is another's
    // now.
    text.add_char('/');
    text.add_text(name);
    return readlink(path, buf, size);
}

}  // namespace

void forget_last_process() {
    (void)pthread_mutex_lock(&last_lock);
    close_last_dir();
    last_pid = -1;
    (void)pthread_mutex_unlock(&last_lock);
    close_diag();
    forget_sockets();
}

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

int describe_fd(pid_t pid, int fd, char *buf, size_t size, SocketSnapshot *sockets) {
    ssize_t n = read_fd_link(pid, fd, buf, size - 1);
    if (n < 1)
        return static_cast<int>(n);
    buf[n] = '\0';
    int length = static_cast<int>(n);
    if (strncmp(buf, "socket:[", 8) == 0) {
        unsigned long inode = strtoul(buf + 8, nullptr, 10);
        char *text = buf + n;
        size_t room = size - static_cast<size_t>(n);
        int found = sockets != nullptr ? sockets->describe(inode, text, room) : NO_MATCH;
        length += found != NO_MATCH ? found : describe_socket_inode(pid, inode, text, room);
    }
    return length;
}

int describe_socket_inode(pid_t, unsigned long inode, char *buf, size_t size) {
    constexpr char NET_DIR[] = "/proc/net";
    int length = describe_known_socket(inode, buf, size);
    if (length != NO_MATCH)
        return length;

    TcpSocket socket;
    if (find_tcp_socket(NET_DIR, inode, &socket)) {
        remember_tcp_socket(inode, socket);
        return format_tcp_socket(socket, buf, size);
    }
    // The name is asked for first: if it changes before the table is read, what is remembered does
    // not hold any more, and the table is read again.
    char name[SOCKET_LINE_SIZE];
    char text[SOCKET_LINE_SIZE] = "";
    int name_length = sockets_can_be_known(SocketKind::UNIX)
                          ? diag_unix_name(inode, name, sizeof name)
                          : DIAG_UNKNOWN;
    length = search_unix_table(NET_DIR, inode, text, sizeof text);
    if (length == NO_MATCH)
        return 0;
    remember_unix_socket(inode, name, name_length, text);
    if (length > 0)
        (void)snprintf(buf, size, "%s", text);
    return length;
}

int describe_socket_inode_in(const char *net_dir, unsigned long inode, char *buf, size_t size) {
    TcpSocket socket;
    if (find_tcp_socket(net_dir, inode, &socket))
        return format_tcp_socket(socket, buf, size);
    int length = search_unix_table(net_dir, inode, buf, size);
    return length != NO_MATCH ? length : 0;
}
