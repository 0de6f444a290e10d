#include "rtrace/samples.h"

#include "rtrace/df_table.h"
#include "rtrace/trace_items.h"

namespace {

bool send_whole_file(RecordStream *stream, uint32_t type, const char *path) {
    return send_file_records(stream, type, path, -1);
}

struct SystemSample {
    uint32_t item;
    uint32_t record_type;
    bool (*send)(RecordStream *stream, uint32_t type, const char *path);
    const char *path;
};

// In the order in which they are sent.
constexpr SystemSample SYSTEM_SAMPLES[] = {
    {ITEM_SMAPSTOT, RECORD_SMAPSTOT, send_whole_file, "/proc/smapstot"},
    {ITEM_FILENR, RECORD_FILENR, send_whole_file, "/proc/sys/fs/file-nr"},
    {ITEM_MEMINFO, RECORD_MEMINFO, send_whole_file, "/proc/meminfo"},
    {ITEM_DISKINFO, RECORD_DISKINFO, send_df_table, "/proc/mounts"},
    {ITEM_PAGETYPEINFO, RECORD_PAGETYPEINFO, send_whole_file, "/proc/pagetypeinfo"},
};

bool send_process_samples(RecordStream *stream, uint32_t items) {
    if ((items & (ITEM_SMAPS | ITEM_STATUS)) == 0)
        return true;
    if (!send_record_header(stream, RECORD_PROCESSES, 0, FLAG_MORE))
        return false;
    if ((items & ITEM_SMAPS) != 0 && !send_pid_files(stream, RECORD_SMAPS, "/proc", "/smaps"))
        return false;
    if ((items & ITEM_STATUS) != 0 && !send_pid_files(stream, RECORD_STATUS, "/proc", "/status"))
        return false;
    return send_record_header(stream, RECORD_PROCESSES, 0, FLAG_LAST);
}

}  // namespace

bool send_samples(RecordStream *stream, uint32_t items) {
    if (!send_process_samples(stream, items))
        return false;
    for (const SystemSample &sample : SYSTEM_SAMPLES) {
        if ((items & sample.item) != 0 && !sample.send(stream, sample.record_type, sample.path))
            return false;
    }
    return true;
}
