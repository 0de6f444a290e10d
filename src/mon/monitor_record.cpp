#include "mon/monitor_record.h"

#include <stddef.h>
#include <stdlib.h>

#include <algorithm>

namespace {

constexpr uint32_t AVERAGE_PERIOD = 32;  // rounds
constexpr int32_t OTHERS_PER_POINT = 32;
constexpr int32_t SOCKETS_PER_POINT = 8;

// Averages are those of unsigned numbers.
struct Sum {
    uint32_t total = 0;
    uint32_t sockets = 0;
    uint32_t pipes = 0;

    void add(const DescriptorCounts &counts) {
        total += static_cast<uint32_t>(counts.total);
        sockets += static_cast<uint32_t>(counts.sockets);
        pipes += static_cast<uint32_t>(counts.pipes);
    }

    DescriptorCounts divided_by(uint32_t n) const {
        return {static_cast<int32_t>(total / n), static_cast<int32_t>(sockets / n),
                static_cast<int32_t>(pipes / n)};
    }
};

}  // namespace

MonitorRecord *find_record(const HashTable *table, pid_t pid) {
    return static_cast<MonitorRecord *>(
        hash_find(table, &pid, sizeof pid, offsetof(MonitorRecord, link)));
}

MonitorRecord *next_record(const HashTable *table, HashCursor *cursor) {
    return static_cast<MonitorRecord *>(
        hash_next(table, cursor, nullptr, nullptr, offsetof(MonitorRecord, link)));
}

int insert_record(HashTable *table, MonitorRecord *record) {
    return hash_insert(table, &record->pid, sizeof record->pid, &record->link);
}

void drop_record(HashTable *table, MonitorRecord *record) {
    (void)hash_remove(table, &record->link);
    // Its children look at the record that they remember before they look for another one.
    HashCursor cursor = {};
    while (MonitorRecord *other = next_record(table, &cursor)) {
        if (other->parent == record)
            other->parent = nullptr;
    }
    free(record);
}

void add_to_history(MonitorRecord *record, uint32_t round, const DescriptorCounts &counts) {
    auto &history = record->history;
    if (round % AVERAGE_PERIOD == 0)
        std::move_backward(history.begin() + AVERAGE_COUNTS, history.end() - 1, history.end());

    // The sum is made of what the places held before the move, so the previous round is not in it:
    // the average covers this round and those two, three and four back. Do not mend it: everybody
    // who compares these averages with older ones relies on their being the same.
    Sum sum;
    for (size_t i = RECENT_COUNTS - 1; i > 0; --i) {
        sum.add(history[i]);
        history[i] = history[i - 1];
    }
    history[0] = counts;
    sum.add(counts);
    history[AVERAGE_COUNTS] = sum.divided_by(RECENT_COUNTS);
}

void count_as_child(const HashTable *table, MonitorRecord *record, pid_t ppid, uint32_t round) {
    // A mark of `round` was set in the previous round; one more, by a child listed before this.
    if (record->children_mark == round)
        record->children = 0;
    record->children_mark = round + 1;

    record->ppid = ppid;
    if (record->parent == nullptr || record->parent->pid != ppid)
        record->parent = find_record(table, ppid);
    MonitorRecord *parent = record->parent;
    if (parent == nullptr)
        return;
    parent->children = parent->children_mark == round ? 1 : parent->children + 1;
    parent->children_mark = round + 1;
}

int32_t fd_score(const DescriptorCounts &counts) {
    const int32_t others = counts.total - counts.sockets - counts.pipes;
    return others / OTHERS_PER_POINT + counts.pipes / OTHERS_PER_POINT +
           counts.sockets / SOCKETS_PER_POINT;
}
