// What one pass of a resource trace reads for itself, in contrast to the output of the probes.
#pragma once

#include <stdint.h>

#include "rtrace/record_stream.h"

// Sends the records of those `items` (trace_items.h) that are read from files, in the order of a
// pass. False when the stream is broken.
bool send_samples(RecordStream *stream, uint32_t items);
