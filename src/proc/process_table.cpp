#include "proc/process_table.h"

#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>

#include "util/line_text.h"
#include "util/unique_fd.h"

namespace {

constexpr size_t PATH_SIZE = 128;
constexpr size_t NAME_SIZE = 1024;
constexpr size_t LISTING_SIZE = 8192;  // of some 300 descriptors

// To ask for a number that is free takes what is saved with about four that are in use.
constexpr int FREE_NUMBER_SHARE = 4;
constexpr int ALL_COUNTED = -1;

pid_t ignore_pid = -1;

void format_proc_path(char (&path)[PATH_SIZE], const char *root, pid_t pid, const char *file) {
    (void)snprintf(path, sizeof path, "%s/%ld/%s", root, static_cast<long>(pid), file);
}

// Reads a file of process `pid` into `buf`. Returns the number of bytes, 0 when there is nothing to
// read.
size_t read_proc_file(const char *root, pid_t pid, const char *file, char *buf, size_t len) {
    char path[PATH_SIZE];
    format_proc_path(path, root, pid, file);
    ssize_t n = read_file(path, buf, len);
    return n > 0 ? static_cast<size_t>(n) : 0;
}

// Likewise, as a terminated text that is cut to `len` - 1 bytes. False when there is nothing to
// read.
bool read_proc_text(const char *root, pid_t pid, const char *file, char *buf, size_t len) {
    size_t n = read_proc_file(root, pid, file, buf, len);
    if (n == 0)
        return false;
    buf[std::min(n, len - 1)] = '\0';
    return true;
}

// Moves what `name` points to inside `buf` to its start.
void move_to_start(char *buf, const char *name) {
    memmove(buf, name, strlen(name) + 1);
}

struct DescriptorCounts {
    int all = 0;
    int sockets = 0;
    int pipes = 0;
};

void count_target(const char *target, DescriptorCounts *counts) {
    if (strncmp(target, "socket:[", 8) == 0)
        ++counts->sockets;
    // A comparison of the whole target, which always has a number behind the bracket, so no pipe is
    // ever counted. It stays: whoever weighs these counts has always seen 0 there.
    else if (strcmp(target, "pipe:[") == 0)
        ++counts->pipes;
}

// Counts what kind of descriptor `name` of the directory `dir` is. Returns false when there is
// none.
bool count_kind(int dir, const char *name, DescriptorCounts *counts) {
    char target[128];
    ssize_t n = readlinkat(dir, name, target, sizeof target - 1);
    if (n < 0 && errno == ENOENT)
        return false;
    // Links that may not be read stay so: beginning again for them would never end.
    target[n > 0 ? n : 0] = '\0';
    count_target(target, counts);
    return true;
}

// Counts the descriptors in the directory `dir` by their numbers, from 0 on, which saves listing
// them: where the kernel tells how many there are (as the size of the directory, since Linux 6.2),
// and as long as few numbers are free. Returns the number from which on a listing has to tell, or
// ALL_COUNTED.
int count_numbers(int dir, DescriptorCounts *counts) {
    struct stat status;
    if (fstat(dir, &status) != 0 || status.st_size == 0)
        return 0;
    long used = 0;
    int fd = 0;
    while (used < status.st_size && fd - used <= status.st_size / FREE_NUMBER_SHARE) {
        char name[16];
        LineText(name, sizeof name).add_decimal(fd++);
        if (count_kind(dir, name, counts))
            ++used;
    }
    counts->all += static_cast<int>(used);
    return used < status.st_size ? fd : ALL_COUNTED;
}

// Counts the descriptors from number `first` on in the directory `dir`, from where it stands.
// Returns false when one of them was closed meanwhile, or the process has gone. (No directory
// stream, which would cost an allocation and a call more than one that is read in one piece.)
bool count_entries(int dir, int first, bool read_links, DescriptorCounts *counts) {
    alignas(dirent64) char listing[LISTING_SIZE];
    for (;;) {
        const long length = syscall(SYS_getdents64, dir, listing, sizeof listing);
        if (length <= 0)
            return length == 0 || errno != ENOENT;
        for (long at = 0; at < length;) {
            const dirent64 *entry = reinterpret_cast<const dirent64 *>(listing + at);
            at += entry->d_reclen;
            if (entry->d_name[0] == '.' || strtol(entry->d_name, nullptr, 10) < first)
                continue;
            ++counts->all;
            if (read_links && !count_kind(dir, entry->d_name, counts))
                return false;
        }
    }
}

}  // namespace

ssize_t read_file(const char *path, char *buf, size_t len) {
    UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC));
    return fd.valid() ? read(fd.get(), buf, len) : -1;
}

bool name_from_cmdline(char *text) {
    const char *slash = strrchr(text, '/');
    if (slash == nullptr || slash[1] == '\0')
        return false;
    move_to_start(text, slash + 1);
    return true;
}

bool name_from_stat(char *text) {
    char *close = strrchr(text, ')');
    if (close == nullptr || close[1] != ' ')
        return false;
    *close = '\0';
    const char *open = strrchr(text, '(');
    if (open == nullptr || open[1] == '\0')
        return false;
    move_to_start(text, open + 1);
    return true;
}

pid_t ppid_from_stat(const char *text) {
    // The fields are counted as they come, parentheses or not: what follows from a name with a
    // blank in it is part of what callers expect of this number.
    for (int field = 1; field < 4; ++field) {
        while (*text != '\0' && !isspace(static_cast<unsigned char>(*text)))
            ++text;
        while (isspace(static_cast<unsigned char>(*text)))
            ++text;
    }
    return *text != '\0' ? static_cast<pid_t>(strtol(text, nullptr, 10)) : -1;
}

int proc_name(const char *root, pid_t pid, char *buf, size_t len) {
    if (read_proc_text(root, pid, "cmdline", buf, len) && name_from_cmdline(buf))
        return 1;
    return read_proc_text(root, pid, "stat", buf, len) && name_from_stat(buf);
}

int pid_name(pid_t pid, char *buf, size_t len) {
    return proc_name("/proc", pid, buf, len);
}

int proc_name_and_parent(const char *root, pid_t pid, char *buf, size_t len, pid_t *parent) {
    *parent = -1;
    bool named = read_proc_text(root, pid, "cmdline", buf, len) && name_from_cmdline(buf);
    char text[STAT_SIZE + 1];
    size_t n = read_proc_file(root, pid, "stat", text, STAT_SIZE);
    if (n == 0)
        return named;
    text[n] = '\0';
    pid_t ppid = ppid_from_stat(text);
    if (!named) {
        n = std::min(n, len - 1);
        memcpy(buf, text, n);
        buf[n] = '\0';
        named = name_from_stat(buf);
    }
    if (named)
        *parent = ppid;
    return named;
}

void set_ignore_pid(pid_t pid) {
    ignore_pid = pid;
}

int list_pids(pid_t *pids, int capacity, pid_t exclude_pid) {
    UniqueDir dir(opendir("/proc/"));
    if (dir == nullptr)
        return 0;
    pid_t self = getpid();
    pid_t parent = getppid();
    int count = 0;
    while (const dirent *entry = readdir(dir.get())) {
        pid_t pid = static_cast<pid_t>(strtol(entry->d_name, nullptr, 10));
        if (pid == 0 && entry->d_name[0] != '0')
            continue;
        if (pid == 1 || pid == exclude_pid || pid == ignore_pid || pid == self || pid == parent)
            continue;
        if (count < capacity)
            pids[count++] = pid;
    }
    return count;
}

void drop_pid(pid_t *pids, int first, int end, pid_t pid) {
    for (int i = first; i < end; ++i) {
        if (pids[i] == pid) {
            pids[i] = -1;
            return;
        }
    }
}

ssize_t exe_link(pid_t pid, char *buf, size_t size) {
    char path[PATH_SIZE];
    format_proc_path(path, "/proc", pid, "exe");
    ssize_t n = readlink(path, buf, size - 1);
    if (n == static_cast<ssize_t>(size - 1))
        buf[n] = '\0';
    return n;
}

int is_kernel_thread(pid_t pid) {
    char link[2];
    return exe_link(pid, link, sizeof link) == -1;
}

pid_t proc_ppid(pid_t pid) {
    char text[STAT_SIZE + 1];
    size_t n = read_proc_file("/proc", pid, "stat", text, STAT_SIZE);
    if (n == 0)
        return -1;
    text[n] = '\0';
    return ppid_from_stat(text);
}

void find_pids_by_name(const char *root, const char *name, pid_t *pids, int *count, int capacity) {
    *count = 0;
    UniqueDir dir(opendir(root));
    if (dir == nullptr)
        return;
    while (*count < capacity) {
        const dirent *entry = readdir(dir.get());
        if (entry == nullptr)
            return;
        if (!isdigit(static_cast<unsigned char>(entry->d_name[0])))
            continue;
        pid_t pid = static_cast<pid_t>(strtol(entry->d_name, nullptr, 10));
        char found[NAME_SIZE];
        if (proc_name(root, pid, found, sizeof found) == 1 && strcmp(found, name) == 0)
            pids[(*count)++] = pid;
    }
}

int count_fds(pid_t pid, int *sockets, int *pipes) {
    char path[PATH_SIZE];
    format_proc_path(path, "/proc", pid, "fd");
    bool read_links = sockets != nullptr || pipes != nullptr;
    DescriptorCounts counts;
    bool by_number = read_links;
    bool complete;
    do {
        UniqueFd dir(open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!dir.valid()) {
            counts = {};
            break;
        }
        const int first = by_number ? count_numbers(dir.get(), &counts) : 0;
        // A listing that is begun again keeps what had been counted so far, and counts it once
        // more: callers know the count of a busy table as one on the high side.
        by_number = false;
        complete = first == ALL_COUNTED || count_entries(dir.get(), first, read_links, &counts);
    } while (!complete);
    if (sockets != nullptr)
        *sockets = counts.sockets;
    if (pipes != nullptr)
        *pipes = counts.pipes;
    return counts.all;
}
