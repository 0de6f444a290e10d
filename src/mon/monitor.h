// The debug monitor: watches all processes for leaking descriptors and for storms of children.
//
// One round looks at every process once, tells of those that have climbed past their earlier peaks
// on standard error, and rewrites the report file, which shows those that are high. Neither init
// nor the caller nor its parent is looked at.
#pragma once

#include <stdint.h>
#include <stdio.h>

#include "mon/hash_table.h"
#include "mon/monitor_record.h"

// Used by one thread at a time.
struct MonitorContext {
    const char *report_path;  // borrowed; null for none
    FILE *report;             // of the round that is being made; null for none
    HashTable *table;         // of MonitorRecords
    uint32_t round;           // the number of the next round
};

// A monitor that has seen nothing yet. `report_path`, which may be null for no report, must outlive
// it. Null when there is no memory.
MonitorContext *monitor_create(const char *report_path);

// Frees the monitor and all that it remembers. The report file stays.
void monitor_destroy(MonitorContext *context);

// Makes one round. The report file is replaced in one step, by a file that was written beside it
// and that only its owner may read; when it cannot be written it stays as it was, and nothing is
// left beside it. Returns nothing: whatever cannot be read counts as gone.
void monitor_round(MonitorContext *context);

// Prints to standard error. The context tells nothing that matters to it.
__attribute__((format(printf, 2, 3))) void monitor_print(const MonitorContext *context,
                                                         const char *format, ...);

// The parts of a round.

// Enters the process `pid`, which has just been listed, into the table, or brings its record up to
// date. A record whose process has another name than before is begun anew.
void monitor_update(MonitorContext *context, pid_t pid);

// Scores a record that was updated in this round: prints the lines on standard error and writes to
// the report, if there is one.
void monitor_evaluate(const MonitorContext *context, MonitorRecord *record);
