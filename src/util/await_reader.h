// Waiting for the reader of an output while processes stand still for it.
#pragma once

#include <stdint.h>

#include <atomic>

// Waits until `fd` can be written to. A tracer does so before it writes: the processes that it
// holds stand still meanwhile, and the one that is to read, such as a web server, may be among
// them. Then nothing would ever move again.
//
// Returns false when the reader has taken nothing at all for `patience_s` seconds; or when a signal
// comes and `*wanted`, unless that is null, is 0.
bool await_reader(int fd, int patience_s, const std::atomic<uint32_t> *wanted);
