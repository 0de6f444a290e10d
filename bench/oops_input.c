// Writes an oops log to standard output in which every page is full.
//
//   oops_input PAGES
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

enum { PAGE_SIZE = 4096, HEADER_SIZE = 8 };

int main(int argc, char **argv) {
    static const unsigned char magic[] = {0, 0x5d, 0, 0x5d};
    const unsigned pages = argc == 2 ? (unsigned)atoi(argv[1]) : 0;
    for (unsigned count = 0; count < pages; ++count) {
        for (unsigned i = 0; i < 4; ++i)
            putchar((int)(count >> (8 * i) & 0xff));
        fwrite(magic, 1, sizeof(magic), stdout);
        char line[80];
        const int length =
            snprintf(line, sizeof(line),
                     "<4>[%5u.345678] Call Trace: [<80012345>] show_stack+0x48/0x70\n", count);
        for (int i = HEADER_SIZE; i < PAGE_SIZE; ++i)
            putchar(line[i % length]);
    }
    return ferror(stdout) || fclose(stdout) != 0;
}
