// What the monitor remembers of one process, and the arithmetic on it. Nothing here looks at the
// system.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <array>

#include "mon/hash_table.h"

struct DescriptorCounts {
    int32_t total;
    int32_t sockets;
    int32_t pipes;
};

// Rounds are numbered from 1. The places of the history: this round, the three rounds before it,
// the running average, and that average at the last three rounds that were multiples of 32.
constexpr size_t RECENT_COUNTS = 4;
constexpr size_t AVERAGE_COUNTS = 4;
constexpr size_t HISTORY_SIZE = 8;
constexpr size_t RECORD_NAME_SIZE = 128;

// All zero at first.
struct MonitorRecord {
    pid_t pid;
    pid_t ppid;             // as of the last round
    MonitorRecord *parent;  // null, or some record in the table: see count_as_child
    HashLink link;
    char name[RECORD_NAME_SIZE];
    std::array<DescriptorCounts, HISTORY_SIZE> history;
    int32_t last_fd_score;
    int32_t reported_fd_score;  // never falls
    int32_t children;           // of this round: the fork score
    int32_t last_children;
    int32_t reported_children;  // never falls
    uint32_t children_mark;     // the last round that changed `children`, plus one
    uint32_t seen_round;        // the last round in which the process was listed
    uint32_t evaluated_round;   // seen_round, and one more once evaluated in it
};

// The record of `pid`, or null, in a table in which records lie under the bytes of their pid.
MonitorRecord *find_record(const HashTable *table, pid_t pid);

// The next record of the table, or null; see hash_next.
MonitorRecord *next_record(const HashTable *table, HashCursor *cursor);

// Puts `record` into the table under its pid. Returns 0, or -ENOMEM.
int insert_record(HashTable *table, MonitorRecord *record);

// Takes `record` out of the table and frees it; no other record refers to it afterwards.
void drop_record(HashTable *table, MonitorRecord *record);

// Moves the history on by one round, which is `round`, and enters what was counted in it.
void add_to_history(MonitorRecord *record, uint32_t round, const DescriptorCounts &counts);

// Sets the parent of `record` to `ppid` and counts it as a child of that process, if the table has
// it. To be called once for each listed process in each round, in any order: children are counted
// from 0 by the first call that touches the parent in the round.
void count_as_child(const HashTable *table, MonitorRecord *record, pid_t ppid, uint32_t round);

// What a process is weighed by: 8 sockets are as heavy as 32 other descriptors.
int32_t fd_score(const DescriptorCounts &counts);
