// Sends frames over an interface.
//
//   frame_blaster INTERFACE SIZE FRAMES RATE
//
// RATE is in frames per second, or 0: as fast as it goes. The frames are of a type that is set
// aside for experiments; no protocol reacts to them.
#define _GNU_SOURCE
#include <linux/if_packet.h>
#include <net/if.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <time.h>

enum { AT_ONCE = 32, LARGEST = 9000 };

static const unsigned char ETHERNET_HEADER[14] = {2, 0, 0, 0, 0, 1, 2, 0, 0, 0, 0, 2, 0x88, 0xb5};

static _Noreturn void give_up(const char *what) {
    perror(what);
    exit(1);
}

static double now(void) {
    struct timespec time;
    clock_gettime(CLOCK_MONOTONIC, &time);
    return (double)time.tv_sec + (double)time.tv_nsec / 1e9;
}

static int open_socket(const char *interface) {
    const int fd = socket(AF_PACKET, SOCK_RAW, 0);
    struct sockaddr_ll address = {.sll_family = AF_PACKET,
                                  .sll_ifindex = (int)if_nametoindex(interface)};
    if (fd < 0 || bind(fd, (const struct sockaddr *)&address, sizeof address) != 0)
        give_up(interface);
    // Straight to the interface: frames that wait in its queue would be dropped there.
    const int on = 1;
    if (setsockopt(fd, SOL_PACKET, PACKET_QDISC_BYPASS, &on, sizeof on) != 0)
        give_up("PACKET_QDISC_BYPASS");
    return fd;
}

int main(int argc, char **argv) {
    const size_t size = argc == 5 ? strtoul(argv[2], NULL, 10) : 0;
    if (size < sizeof ETHERNET_HEADER || size > LARGEST) {
        fprintf(stderr, "usage: frame_blaster INTERFACE SIZE FRAMES RATE\n");
        return 2;
    }
    const long frames = atol(argv[3]);
    const double rate = atof(argv[4]);
    const int fd = open_socket(argv[1]);

    static unsigned char frame[LARGEST];
    memcpy(frame, ETHERNET_HEADER, sizeof ETHERNET_HEADER);
    struct iovec bytes = {.iov_base = frame, .iov_len = size};
    struct mmsghdr messages[AT_ONCE];
    memset(messages, 0, sizeof messages);
    for (int i = 0; i < AT_ONCE; ++i) {
        messages[i].msg_hdr.msg_iov = &bytes;
        messages[i].msg_hdr.msg_iovlen = 1;
    }

    const double start = now();
    for (long sent = 0; sent < frames;) {
        // It must not sleep: it would wake up too late, and send a burst.
        while (rate > 0 && (double)sent > (now() - start) * rate)
            continue;
        const long left = frames - sent;
        const int count = sendmmsg(fd, messages, left < AT_ONCE ? (unsigned)left : AT_ONCE, 0);
        if (count < 0)
            give_up("sendmmsg");
        sent += count;
    }
    return 0;
}
