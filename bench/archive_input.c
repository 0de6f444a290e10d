// Writes files as a debug archive holds them, the same bytes every time: many small ones like those
// of /proc, and one like the core of a process.
//
//   archive_input FOLDER PROC_FILES CORE_PAGES
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

enum { PAGE = 4096, LINES = 700 };

static uint64_t state = 0x9e3779b97f4a7c15U;

static uint64_t next_random(void) {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    return state;
}

static FILE *create(const char *folder, const char *name) {
    char path[4096];
    snprintf(path, sizeof(path), "%s/%s", folder, name);
    FILE *file = fopen(path, "w");
    if (file == NULL) {
        perror(path);
        exit(1);
    }
    return file;
}

static void finish(FILE *file) {
    if (fclose(file) != 0) {
        perror("archive_input");
        exit(1);
    }
}

// Lines of names and counters.
static void write_proc_file(FILE *file) {
    static const char *const NAMES[] = {"MemFree", "cpu",  "eth0", "tcp",  "ctxt",
                                        "pgfault", "intr", "sda1", "udp6", "Slab"};
    for (int i = 0; i < LINES; ++i) {
        const uint64_t random = next_random();
        fprintf(file, "%12s: %8u %4u 0 0 %04X:%08X\n", NAMES[random % 10],
                (unsigned)(random >> 20) % 100000, (unsigned)(random >> 40) % 100,
                (unsigned)(random >> 50) % 64, (unsigned)(random >> 32));
    }
}

// Memory: untouched pages, arrays of pointers, text, and what looks like noise.
static void fill_page(unsigned char *page) {
    static const char WORDS[] =
        "the connection was closed by the other side; retrying in a while. ";
    const uint64_t kind = next_random() % 10;
    memset(page, 0, PAGE);
    if (kind < 4)
        return;
    for (size_t i = 0; i < PAGE; i += 8) {
        uint64_t word = 0;
        if (kind < 7)
            word = next_random() % 4 == 0 ? 0 : 0x7f55aa000000U + (next_random() & 0xfff8);
        else if (kind < 9)
            memcpy(&word, WORDS + next_random() % (sizeof(WORDS) - 8), 8);
        else
            word = next_random();
        memcpy(page + i, &word, 8);
    }
}

int main(int argc, char **argv) {
    if (argc != 4) {
        fprintf(stderr, "usage: archive_input FOLDER PROC_FILES CORE_PAGES\n");
        return 2;
    }
    for (int i = 0; i < atoi(argv[2]); ++i) {
        char name[32];
        snprintf(name, sizeof(name), "proc-%04d", i);
        FILE *file = create(argv[1], name);
        write_proc_file(file);
        finish(file);
    }
    FILE *core = create(argv[1], "core");
    for (long i = 0; i < atol(argv[3]); ++i) {
        unsigned char page[PAGE];
        fill_page(page);
        fwrite(page, 1, sizeof(page), core);
    }
    finish(core);
    return 0;
}
