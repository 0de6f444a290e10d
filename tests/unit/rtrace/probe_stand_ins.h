// Programs that stand where a resource trace looks for its probes. Only inside a sandbox.
#pragma once

#include <sys/types.h>

#include <string>

#include "support/run_program.h"
#include "support/sandbox.h"

// All four probes are tests/system/fixtures/probe.c.
inline void stand_in_for_probes() {
    const std::string program = fixture_path("probe");
    // First those that machines lack: making room for one hides what was bound before.
    for (const char *name : {"mediahub", "evsink", "iostat", "pidstat"})
        sandbox_bind(program, std::string("/usr/bin/") + name);
}

// The process that wrote a line of the fixture's.
inline pid_t pid_of_line(const std::string &line) {
    return line.compare(0, 4, "pid=") == 0 ? std::stoi(line.substr(4)) : -1;
}

// What follows the process id in it.
inline std::string rest_of_line(const std::string &line) {
    return line.substr(line.find(' ') + 1);
}
