#include "cgi/spool.h"

#include <assert.h>
#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include "cgi/dump_listener.h"
#include "util/unique_fd.h"

namespace {

constexpr char LABEL[] = "check_dumps";

// The first entry but "." and "..", of whatever type; null at the end.
const dirent *first_entry(DIR *dir) {
    const dirent *entry;
    do {
        entry = readdir(dir);
    } while (entry != nullptr &&
             (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0));
    return entry;
}

// Sends the entry `name` and removes it. False when that failed.
bool send_entry(int dir_fd, const char *name) {
    // Not to wait for the other end of a fifo.
    int source_fd = openat(dir_fd, name, O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (source_fd == -1) {
        perror(LABEL);
        return false;
    }
    if (send_dump(source_fd, name) != 0) {
        syslog(LOG_ERR, "Failed to send dump: %s", name);
        return false;
    }
    if (unlinkat(dir_fd, name, 0) != 0) {
        perror(LABEL);
        return false;
    }
    return true;
}

}  // namespace

void check_dumps(const char *dump_dir, bool *spool_drained) {
    assert(spool_drained != nullptr);
    if (dump_dir == nullptr) {
        syslog(LOG_ERR, "Invalid dump directory");
        return;
    }
    UniqueFd dir_fd(open(dump_dir, O_RDONLY | O_CLOEXEC));
    if (!dir_fd.valid())
        return;
    UniqueDir dir(fdopendir(dir_fd.get()));
    if (dir == nullptr) {
        perror(LABEL);
        return;
    }
    (void)dir_fd.release();  // the stream's now
    const dirent *entry = first_entry(dir.get());
    if (entry != nullptr && !send_entry(dirfd(dir.get()), entry->d_name))
        return;
    // Any entry counts here, "." and ".." included, so that it may take another round to find out.
    if (readdir(dir.get()) == nullptr)
        *spool_drained = true;
    if (closedir(dir.release()) != 0)
        perror(LABEL);
}
