#include "mon/monitor.h"

#include <fcntl.h>
#include <limits.h>
#include <stdarg.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>

#include "proc/process_table.h"
#include "util/unique_fd.h"

namespace {

constexpr uint32_t TABLE_SIZE_HINT = 512;
constexpr int MAX_PROCESSES = 1024;
constexpr int32_t FD_SCORE_STEP = 32;   // a report tells of a rise by more than this,
constexpr int32_t FD_SCORE_SHOWN = 32;  // and a history is shown from this on
constexpr int32_t FORK_THRESHOLD = 16;
constexpr int32_t KERNEL_FORK_THRESHOLD = 32;

// The file that is written while a round is made, beside the report that it will replace.
struct TemporaryReport {
    char path[PATH_MAX] = "";
};

// Null when it cannot be had; then it does not exist either.
FILE *open_report(const char *report_path, TemporaryReport *temporary) {
    const int length =
        snprintf(temporary->path, sizeof temporary->path, "%s.tmp-XXXXXX", report_path);
    if (length < 0 || static_cast<size_t>(length) >= sizeof temporary->path)
        return nullptr;
    // It keeps the mode 0600: what goes on in all processes is for the owner of the monitor to
    // read, and to hand on. The service does that on request.
    UniqueFd fd(mkostemp(temporary->path, O_CLOEXEC));
    if (!fd.valid())
        return nullptr;
    FILE *report = fdopen(fd.get(), "w");
    if (report == nullptr) {
        (void)unlink(temporary->path);
        return nullptr;
    }
    (void)fd.release();
    return report;
}

// Puts the report in its place, or away if it is not whole.
void finish_report(FILE *report, const char *report_path, const TemporaryReport &temporary) {
    // Everything is in the file before it gets its name.
    if (fflush(report) != 0 || ferror(report) || rename(temporary.path, report_path) != 0)
        (void)unlink(temporary.path);
    (void)fclose(report);
}

// What stands before the digits of a change; a negative number has its sign.
const char *sign_of(int32_t change) {
    return change >= 1 ? "+" : "";
}

// The lines of a history are hours where rounds are made every hour.
int label_of(int place) {
    return place < 4 ? place : 33 * place - 128;
}

void write_history(FILE *report, const MonitorRecord &record, int32_t score) {
    fprintf(report, "fdstats for pid=%ld score=%d:\n", static_cast<long>(record.pid), score);
    int place = 0;
    for (const DescriptorCounts &counts : record.history) {
        fprintf(report, "%dh nr_fd=%d nr_sock=%d nr_pipe=%d\n", label_of(place), counts.total,
                counts.sockets, counts.pipes);
        ++place;
    }
}

void evaluate_descriptors(const MonitorContext *context, MonitorRecord *record) {
    const int32_t score = fd_score(record->history[0]);
    // A report needs a rise by more than the step, where one of children needs a rise by the
    // threshold alone; and what was reported stays so when the score falls, so that a process is
    // told of again only past its own peak. Both are meant.
    if (score > record->reported_fd_score + FD_SCORE_STEP) {
        const int32_t change = score - record->last_fd_score;
        monitor_print(context, "pid %d name %s fd_score %d [%s%d] sk=%d\n", record->pid,
                      record->name, score, sign_of(change), change, record->history[0].sockets);
        record->reported_fd_score = score;
    }
    record->last_fd_score = score;
    if (score >= FD_SCORE_SHOWN && context->report != nullptr)
        write_history(context->report, *record, score);
}

void evaluate_children(const MonitorContext *context, MonitorRecord *record) {
    const int32_t children = record->children;
    const int32_t change = children - record->last_children;
    record->last_children = children;
    // Most processes are below either threshold, and need not be asked which one is theirs.
    if (children < std::min(FORK_THRESHOLD, KERNEL_FORK_THRESHOLD))
        return;
    const int32_t threshold =
        is_kernel_thread(record->pid) ? KERNEL_FORK_THRESHOLD : FORK_THRESHOLD;
    if (children >= threshold + record->reported_children) {
        monitor_print(context, "pid %d name %s fork_score %d [%s%d]\n", record->pid, record->name,
                      children, sign_of(change), change);
        record->reported_children = children;
    }
    if (children >= threshold && context->report != nullptr) {
        fprintf(context->report, "forkstats for pid=%ld: score=%d nr_childs=%d\n",
                static_cast<long>(record->pid), children, children);
    }
}

// A record in the table for the process, which is called `name`; null when there is no memory.
MonitorRecord *enter_record(HashTable *table, MonitorRecord *record, pid_t pid,
                            const char (&name)[RECORD_NAME_SIZE]) {
    if (record != nullptr && strcmp(record->name, name) == 0)
        return record;
    if (record != nullptr) {
        // The pid has another process: nothing of the old one counts. The record stays where it
        // is, and who refers to it as a parent by this pid is right to.
        (void)hash_remove(table, &record->link);
        *record = {};
    } else {
        record = static_cast<MonitorRecord *>(calloc(1, sizeof *record));
        if (record == nullptr)
            return nullptr;
    }
    record->pid = pid;
    memcpy(record->name, name, sizeof name);
    if (insert_record(table, record) != 0) {
        drop_record(table, record);
        return nullptr;
    }
    return record;
}

// Evaluates the processes that are there and forgets the others.
void evaluate_all(MonitorContext *context) {
    HashCursor cursor = {};
    while (MonitorRecord *record = next_record(context->table, &cursor)) {
        if (record->seen_round != context->round) {
            drop_record(context->table, record);
            cursor = {};
        } else if (record->evaluated_round == record->seen_round) {
            monitor_evaluate(context, record);
        }
    }
}

}  // namespace

MonitorContext *monitor_create(const char *report_path) {
    UniqueBlock<MonitorContext> context(
        static_cast<MonitorContext *>(calloc(1, sizeof(MonitorContext))));
    if (context == nullptr)
        return nullptr;
    context->report_path = report_path;
    context->round = 1;
    context->table = hash_create(TABLE_SIZE_HINT);
    return context->table != nullptr ? context.release() : nullptr;
}

void monitor_destroy(MonitorContext *context) {
    for (;;) {
        HashCursor cursor = {};
        MonitorRecord *record = next_record(context->table, &cursor);
        if (record == nullptr)
            break;
        (void)hash_remove(context->table, &record->link);
        free(record);
    }
    hash_destroy(context->table);
    free(context);
}

void monitor_print(const MonitorContext *, const char *format, ...) {
    va_list args;
    va_start(args, format);
    (void)vfprintf(stderr, format, args);
    va_end(args);
}

void monitor_update(MonitorContext *context, pid_t pid) {
    MonitorRecord *record = find_record(context->table, pid);
    char name[RECORD_NAME_SIZE] = "";
    pid_t parent;
    if (proc_name_and_parent("/proc", pid, name, sizeof name, &parent) != 1) {
        if (record != nullptr)
            drop_record(context->table, record);
        return;
    }
    record = enter_record(context->table, record, pid, name);
    if (record == nullptr)
        return;
    record->seen_round = context->round;
    record->evaluated_round = context->round;

    DescriptorCounts counts = {};
    counts.total = count_fds(pid, &counts.sockets, &counts.pipes);
    add_to_history(record, context->round, counts);
    count_as_child(context->table, record, parent, context->round);
}

void monitor_evaluate(const MonitorContext *context, MonitorRecord *record) {
    evaluate_descriptors(context, record);
    evaluate_children(context, record);
    ++record->evaluated_round;
}

void monitor_round(MonitorContext *context) {
    TemporaryReport temporary;
    if (context->report_path != nullptr)
        context->report = open_report(context->report_path, &temporary);
    if (context->report != nullptr)
        fprintf(context->report, "Debug monitor status round=%lx\n\n",
                static_cast<unsigned long>(context->round));

    pid_t pids[MAX_PROCESSES];
    const int count = list_pids(pids, MAX_PROCESSES, -1);
    for (int i = 0; i < count; ++i)
        monitor_update(context, pids[i]);
    evaluate_all(context);

    ++context->round;
    if (context->report != nullptr) {
        finish_report(context->report, context->report_path, temporary);
        context->report = nullptr;
    }
}
