// The applet pcapdump: everything that an interface sees, into a file.
#include "pcap/pcapdump.h"

#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>

#include "pcap/capture.h"
#include "util/unique_fd.h"

namespace {

// As good as no limit, and not 0: without any limit the capture would take an output that it cannot
// read from, as this file, for a client that has gone.
constexpr uint32_t TIME_LIMIT_S = 2147483647;

}  // namespace

int run_pcapdump(int argc, char **argv) {
    if (argc < 3) {
        printf("USAGE: pcapdump netif dumpname\n");
        return 1;
    }
    const char *interface = argv[1];
    const char *path = argv[2];

    const UniqueFd file(open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    if (!file.valid()) {
        perror(path);
        return 1;
    }
    // However the capture ends, what it could see is in the file: that is never a failure.
    (void)capture_packets(interface, file.get(), 0, 0, TIME_LIMIT_S, true, nullptr);
    return 0;
}
