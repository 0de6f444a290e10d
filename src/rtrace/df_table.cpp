#include "rtrace/df_table.h"

#include <mntent.h>
#include <stdio.h>
#include <string.h>
#include <sys/statfs.h>

#include <algorithm>
#include <memory>

#include "util/line_text.h"

namespace {

constexpr size_t MOUNT_LINE_SIZE = 4096;

struct CloseMounts {
    void operator()(FILE *mounts) const { (void)endmntent(mounts); }
};

// The product wraps at 4 GiB, and so do the figures of larger file systems. Readers of the table
// have always seen these numbers, and undo the wrap where they know the size: it stays.
long wrapped_kib(uint64_t blocks, uint64_t block_size) {
    return static_cast<long>(static_cast<uint32_t>(blocks * block_size) >> 10);
}

bool ask_figures(const char *mount_point, FilesystemFigures *figures) {
    struct statfs status;
    if (statfs(mount_point, &status) != 0)
        return false;
    *figures = {.block_size = static_cast<uint64_t>(status.f_bsize),
                .blocks = status.f_blocks,
                .free_blocks = status.f_bfree,
                .available_blocks = status.f_bavail};
    return true;
}

// Adds lines up to the first one that does not fit.
void add_lines(LineText *table, FILE *mounts) {
    char line[MOUNT_LINE_SIZE];
    mntent entry;
    while (table->room() > 1 && getmntent_r(mounts, &entry, line, sizeof line) != nullptr) {
        FilesystemFigures figures;
        if (df_lists(entry.mnt_fsname, entry.mnt_type) && ask_figures(entry.mnt_dir, &figures))
            table->count(format_df_line(table->end(), table->room(), entry.mnt_fsname, figures,
                                        entry.mnt_dir));
    }
}

}  // namespace

bool df_lists(const char *source, const char *type) {
    if (strchr(source, ':') != nullptr)
        return false;
    return strncmp(source, "//", 2) != 0 ||
           (strcmp(type, "smbfs") != 0 && strcmp(type, "cifs") != 0);
}

int format_df_heading(char *buf, size_t size) {
    return snprintf(buf, size, "%-20s\tUsed\tAvail\tMounted on\n", "Filesystem");
}

int format_df_line(char *buf, size_t size, const char *source, const FilesystemFigures &figures,
                   const char *mount_point) {
    const long used = wrapped_kib(figures.blocks - figures.free_blocks, figures.block_size);
    const long available = wrapped_kib(figures.available_blocks, figures.block_size);
    return snprintf(buf, size, "%-20s\t%ld\t%ld\t%s\n", source, used, available, mount_point);
}

bool send_df_table(RecordStream *stream, uint32_t type, const char *mounts_path) {
    char *buffer = record_buffer(stream);
    if (buffer == nullptr)
        return false;
    static_assert(RECORD_PID_SIZE > 0, "room for the terminator of a full table");
    LineText table(buffer, RECORD_DATA_SIZE + 1);
    table.count(format_df_heading(table.end(), table.room()));
    const std::unique_ptr<FILE, CloseMounts> mounts(setmntent(mounts_path, "re"));
    if (mounts != nullptr)
        add_lines(&table, mounts.get());
    const size_t length = std::min(static_cast<size_t>(table.length()), RECORD_DATA_SIZE);
    return send_record(stream, type, FLAG_LAST, buffer, length);
}
