// One pass of a resource trace over the processes' files, onto standard output.
#include <unistd.h>

#include "rtrace/samples.h"
#include "rtrace/trace_items.h"

int main() {
    RecordStream stream = {.fd = STDOUT_FILENO};
    return send_samples(&stream, ITEM_SMAPS | ITEM_STATUS) ? 0 : 1;
}
