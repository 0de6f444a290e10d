// What /proc tells a test about a process.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

// The rest of the line of /proc/PID/status that begins with `field`; empty when it has gone.
std::string status_field(pid_t pid, const std::string &field);

// Its state letter, '?' when it has gone.
char process_state(pid_t pid);

// Its children, those that have ended and are not waited for yet among them.
std::vector<pid_t> children_of(pid_t pid);

// How many descriptors it has open. In the test itself, that for looking is one of them.
int count_descriptors(pid_t pid);

int count_threads(pid_t pid);

// Whether the process is neither traced nor stopped. The kernel may take a moment to let it go on.
bool runs_free(pid_t pid);
