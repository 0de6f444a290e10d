#include "archive/write_archive.h"

#include <stdio.h>

#include <algorithm>

#include "archive/local_stamp.h"
#include "archive/proc_snapshot.h"
#include "archive/process_snapshot.h"
#include "archive/system_snapshot.h"
#include "archive/tar_members.h"
#include "proc/process_table.h"

namespace {

constexpr int MAX_PIDS = 1024;

constexpr char NETDUMP_INTERFACE[] = "eth0";
constexpr int32_t NETDUMP_DURATION = 5;  // seconds
constexpr int32_t NETDUMP_SIZE = 512000;

// Archives made by this process. One is made at a time, so there is no lock.
int archive_counter = 0;

struct Assembly {
    TarWriter *tw;
    int fd;
    pid_t pids[MAX_PIDS];
    int nr_pids;
};

int add_monitor_status(Assembly *a) {
    return tar_add_small_file(a->tw, a->fd, "dbg-monitor.txt", "/var/run/dbg-cgi/dbg-monitor.txt",
                              SMALL_FILE_LIMIT);
}

int add_media_configuration(Assembly *a) {
    return tar_add_small_file(a->tw, a->fd, "media.conf", "/etc/ws/onvif/media/media.conf",
                              SMALL_FILE_LIMIT);
}

int add_proc(Assembly *a) {
    return snapshot_proc(a->tw, a->fd);
}

int add_trace(Assembly *a) {
    // On a copy: what cannot be traced (kernel threads, say) or ends meanwhile is still
    // snapshotted, or said to have gone.
    pid_t pids[MAX_PIDS];
    std::copy_n(a->pids, a->nr_pids, pids);
    return add_strace_log(a->tw, pids, a->nr_pids);
}

int add_capture(Assembly *a) {
    return add_netdump(a->tw, a->fd, NETDUMP_INTERFACE, NETDUMP_DURATION, NETDUMP_SIZE);
}

int add_status_report(Assembly *a) {
    char path[] = "/usr/sbin/gen_healthsheet.sh";
    char name_template[] = "/tmp/.hsheetXXXXXX";
    char *argv[] = {path, nullptr};
    return add_command_output(a->tw, a->fd, "healthsheet.txt", argv, name_template);
}

int add_oops_log(Assembly *a) {
    char path[] = "/usr/sbin/oopslog";
    char option[] = "-r";
    char device[] = "/dev/part/oops";
    char name_template[] = "/tmp/.oopslogXXXXXX";
    char *argv[] = {path, option, device, nullptr};
    return add_command_output(a->tw, a->fd, "oopslog", argv, name_template);
}

int add_kernel_memory(Assembly *a) {
    return add_kcore(a->tw, a->fd);
}

int add_processes(Assembly *a) {
    snapshot_processes(a->tw, a->fd, a->pids, a->nr_pids);
    return 0;
}

// Each adds members and returns 0, or anything else to end the archive there.
using Collector = int (*)(Assembly *);

constexpr Collector COLLECTORS[] = {
    add_monitor_status,
    add_media_configuration,
    add_proc,
    add_trace,
    add_capture,
    add_status_report,
    add_oops_log,
    add_kernel_memory,
    // Once more, so that a comparison shows what changed while the archive was being made. The
    // members below its own time stamp are new; the others repeat names, and readers keep the
    // later.
    add_proc,
    add_processes,
};

bool collect(Assembly *a) {
    for (Collector collector : COLLECTORS) {
        if (collector(a) != 0)
            return false;
    }
    return true;
}

}  // namespace

void write_archive(int fd, pid_t exclude_pid) {
    Assembly a;
    a.fd = fd;
    a.nr_pids = list_pids(a.pids, MAX_PIDS, exclude_pid);
    char name[128];
    (void)snprintf(name, sizeof name, "debug-%s-c%d/", local_stamp().text, archive_counter++);
    a.tw = tar_open(fd, name);
    if (a.tw == nullptr)
        return;
    if (collect(&a))
        tar_close(a.tw);
    else
        tar_abandon(a.tw);
}

void write_archive_tar(int fd) {
    write_archive(fd, -1);
}
