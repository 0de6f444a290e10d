// Copies a packet capture from standard input to standard output, with each record clipped to the
// length that its frame had.
//
// A record of fieldkit's is as long as the cut length that the capture was asked for, also when the
// frame was shorter; its header says how long. Readers that take such a record for damaged show it
// whole after this.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

enum { FILE_HEADER = 24, RECORD_HEADER = 16, MAX_RECORD = 65536 };

static unsigned char buffer[MAX_RECORD];

// Reads all `size` bytes; what is cut short ends the program, with what was whole written.
static void need(size_t size) {
    if (fread(buffer, 1, size, stdin) != size)
        exit(ferror(stdin) || fflush(stdout) != 0 ? 1 : 0);
}

static void put(size_t size) {
    if (fwrite(buffer, 1, size, stdout) != size) {
        perror("clip_capture");
        exit(1);
    }
}

static uint32_t get32(const unsigned char *at) {
    return (uint32_t)at[0] | (uint32_t)at[1] << 8 | (uint32_t)at[2] << 16 | (uint32_t)at[3] << 24;
}

int main(void) {
    need(FILE_HEADER);
    put(FILE_HEADER);
    for (;;) {
        need(RECORD_HEADER);
        const uint32_t captured = get32(buffer + 8);
        const uint32_t original = get32(buffer + 12);
        const uint32_t clipped = original < captured ? original : captured;
        for (int i = 0; i < 4; ++i)
            buffer[8 + i] = (unsigned char)(clipped >> (8 * i));
        if (captured > MAX_RECORD) {
            fprintf(stderr, "clip_capture: a record of %u bytes\n", (unsigned)captured);
            return 1;
        }
        put(RECORD_HEADER);
        need(captured);
        put(clipped);
    }
}
