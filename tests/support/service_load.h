// What tests of the debug service under load have in common.
#pragma once

#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/temp_dir.h"

// Takes what a service prints, while nobody reads from its pipes.
class ServiceLog {
  public:
    // To run the service with.
    RunOptions run() const;
    // What a sanitizer has reported there; empty when there is none.
    std::string report() const;

  private:
    TempDir dir_;
};

// A core-image writer in `dir`: "core of PID" as the core of each process. It starts no further
// program.
std::string cheap_core_writer(const TempDir &dir);

// More bytes than a connection over loopback holds that nobody reads from; a multiple of 64 KiB.
size_t more_than_buffers_hold();

// The processes in sight that some process traces.
std::vector<int> traced_processes();
// Waits until there is none.
bool nothing_is_traced(int timeout_s = 20);
