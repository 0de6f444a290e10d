// The applet `tstrace`.
#include "trace/trace_request.h"
#include "trace/tracer_applets.h"
#include "trace/tracer_command_line.h"

namespace {

constexpr char USAGE[] =
    "USAGE: tstrace [ -ppid ] [ command [ arg ... ] ]\n"
    "\n"
    "-p<pid>\tAdd a pid to trace, can be given multiple times.";

constexpr uint32_t EVERYTHING = UINT32_MAX;

}  // namespace

int run_tstrace(int argc, char **argv) {
    TraceRequest request = {};
    request.output_cb = trace_write_cb;
    request.flags = EVERYTHING;
    return run_tracer(argc, argv, USAGE, &request);
}
