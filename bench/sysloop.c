// The program that the tracers trace: one system call, over and over.
//
//   sysloop KIND COUNT    KIND 0: getppid; 1: a write of 64 bytes to /dev/null; 2: access of a path
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <unistd.h>

int main(int argc, char **argv) {
    if (argc != 3) {
        fprintf(stderr, "usage: sysloop KIND COUNT\n");
        return 2;
    }
    const int kind = atoi(argv[1]);
    const long count = atol(argv[2]);
    char text[64];
    memset(text, 'x', sizeof(text));
    const int fd = open("/dev/null", O_WRONLY);
    if (fd < 0) {
        perror("/dev/null");
        return 1;
    }
    for (long i = 0; i < count; ++i) {
        switch (kind) {
            case 0:
                // The C library's own would be a call, too, but it promises that to nobody.
                (void)syscall(SYS_getppid);
                break;
            case 1:
                if (write(fd, text, sizeof(text)) != (ssize_t)sizeof(text))
                    return 1;
                break;
            default:
                (void)access("/usr/lib/locale/no-such-place", R_OK);
                break;
        }
    }
    return 0;
}
