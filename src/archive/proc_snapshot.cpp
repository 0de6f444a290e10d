#include "archive/proc_snapshot.h"

#include <stdio.h>
#include <string.h>

#include "archive/local_stamp.h"
#include "archive/tar_members.h"
#include "util/unique_fd.h"

namespace {

// Files of /proc that hold the machine's memory, or that block their reader.
constexpr const char *PROC_SKIP_LIST[] = {"kcore", "vmcore", "kmem", "kmsg", nullptr};

// Copied one level deep, in this order.
constexpr const char *PROC_DIR_LIST[] = {
    "/proc/sys/",
    "/proc/sys/fs/",
    "/proc/sys/kernel/",
    "/proc/sys/kernel/random/",
    "/proc/sys/net/bridge/",
    "/proc/sys/net/core/",
    "/proc/sys/net/ipv4/",
    "/proc/sys/net/ipv4/conf/",
    "/proc/sys/net/ipv4/neigh/",
    "/proc/sys/net/ipv4/route/",
    "/proc/sys/net/ipv6/",
    "/proc/sys/net/ipv6/conf/",
    "/proc/sys/net/ipv6/icmp/",
    "/proc/sys/net/ipv6/neigh/",
    "/proc/sys/net/ipv6/route/",
    "/proc/sys/net/unix/",
    "/proc/sys/vm/",
    "/proc/driver/",
    "/proc/net/",
    "/proc/net/dev_snmp6/",
    "/proc/net/ip6t_hashlimit/",
    "/proc/net/ipt_hashlimit/",
    "/proc/net/netfilter/",
    "/proc/net/rpc/",
    "/proc/net/stat/",
    "/proc/net/vlan/",
};

bool is_in(const char *name, const char *const *list) {
    for (; list != nullptr && *list != nullptr; ++list) {
        if (strcmp(name, *list) == 0)
            return true;
    }
    return false;
}

// `dir` and `name` in one piece; null when memory is short.
UniqueBlock<char> join(const char *dir, const char *name) {
    char *path;
    return UniqueBlock<char>(asprintf(&path, "%s%s", dir, name) >= 0 ? path : nullptr);
}

}  // namespace

int snapshot_proc(TarWriter *tw, int fd) {
    LocalStamp stamp = local_stamp();
    char name[80];
    (void)snprintf(name, sizeof name, "proc.%s/", stamp.text);
    int result = copy_dir_files(tw, fd, name, "/proc/", PROC_SKIP_LIST);
    for (const char *dir : PROC_DIR_LIST)
        (void)copy_dir_files(tw, fd, dir + 1, dir, nullptr);  // many kernels lack some of them
    return result;
}

int copy_dir_files(TarWriter *tw, int fd, const char *archive_dir, const char *fs_dir,
                   const char *const *skip) {
    UniqueDir dir(opendir(fs_dir));
    if (dir == nullptr)
        return 1;
    // Whatever is no file drops out when it is read.
    while (const dirent *entry = readdir(dir.get())) {
        if (is_in(entry->d_name, skip))
            continue;
        UniqueBlock<char> name = join(archive_dir, entry->d_name);
        UniqueBlock<char> path = join(fs_dir, entry->d_name);
        if (name != nullptr && path != nullptr)
            (void)tar_add_small_file(tw, fd, name.get(), path.get(), 0);
    }
    return 0;
}
