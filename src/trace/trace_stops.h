// What a trace does at each stop of a traced process.
#pragma once

#include "trace/trace_state.h"

// Hands out what the stop tells, and lets the process go on, or leaves it stopped where its own
// signal asks for that. `status` is what a wait gave for the process at `index`.
void on_stop(Trace *trace, int index, int status);
