// Captures an interface into a file the plain way, one read and one write for each frame.
//
//   plain_capture INTERFACE FILE
#include <fcntl.h>
#include <stdio.h>

#include "unit/pcap/plain_capture.h"

int main(int argc, char **argv) {
    const int fd = argc == 3 ? open(argv[2], O_WRONLY | O_CREAT | O_TRUNC, 0600) : -1;
    if (fd < 0) {
        fprintf(stderr, "usage: plain_capture INTERFACE FILE\n");
        return 2;
    }
    return plain_capture(argv[1], fd, 0, 0, 1000000, true, nullptr) < 0 ? 1 : 0;
}
