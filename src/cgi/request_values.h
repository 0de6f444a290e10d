// The values that requests carry.
#pragma once

#include <stdint.h>
#include <sys/types.h>

constexpr int MAX_TRACED = 512;  // processes that one trace request may name

// Reads a number in base 10 at the beginning of `text`, behind blanks; what follows its digits does
// not matter. False when there is none, or it does not fit 32 bits.
bool parse_number(const char *text, int32_t *number);

// The same of a value that may be missing (null): -1 unless there is a number.
int32_t number_or_minus_one(const char *text);

// The process that `text` names: a process id, which need not exist, or else the first process of
// that name. -1 when there is none of that name.
pid_t find_process(const char *text);

// Appends the processes that `token` names to the `*count` entries of `pids`: an id, if that
// exists, or else all processes of that name, at most 32. What does not fit MAX_TRACED is left out.
void add_pid_token(const char *token, pid_t *pids, int *count);

// Appends the processes that `list`, ids and names with commas between them, names. Blanks around
// the pieces do not matter; a piece of 32 bytes or more is skipped.
void add_pid_list(const char *list, pid_t *pids, int *count);

// The items that `list`, names with commas between them, stands for (see rtrace/trace_items.h);
// unknown ones are skipped, and so are pieces of 32 bytes or more. Without any: the fast set.
uint32_t parse_trace_items(const char *list);
