#include "main/fault_applets.h"

#include <fcntl.h>
#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string_view>

namespace {

// Argument `index` as strtoul reads it, in decimal, "0x" hexadecimal or leading-"0" octal form, 0
// for text that is no number; `absent` when there is no such argument.
unsigned long number_argument(int argc, char **argv, int index, unsigned long absent) {
    return index < argc ? strtoul(argv[index], nullptr, 0) : absent;
}

[[noreturn]] void spin() {
    for (;;)
        asm volatile("");
}

}  // namespace

int run_ctest(int, char **) {
    // Not through stdio, which would take a tenth of all the time from its start to its end.
    constexpr std::string_view TEXT = "call exit\n";
    (void)write(STDOUT_FILENO, TEXT.data(), TEXT.size());
    exit(0);
}

// Under a sanitizer, too, the fault itself is what is wanted.
__attribute__((no_sanitize("null"))) int run_segfault(int, char **) {
    // Volatile twice over, so that the compiler neither drops the store nor puts its own trap
    // there.
    volatile int *volatile null_pointer = nullptr;
    *null_pointer = 0;  // NOLINT(clang-analyzer-core.NullDereference)
    __builtin_trap();
}

int run_forkbomb(int argc, char **argv) {
    unsigned long delay_us = number_argument(argc, argv, 1, 0);
    unsigned long depth = number_argument(argc, argv, 2, 1);
    // By lines even into a pipe: a child must not print again what its parent had buffered.
    setlinebuf(stdout);
    unsigned long forks = 0;
    unsigned long level = 0;
    for (;;) {
        pid_t pid = fork();
        ++forks;
        if (pid == 0 && ++level >= depth)
            spin();
        printf("forks %ld\n", static_cast<long>(forks));
        if (delay_us != 0)
            usleep(static_cast<useconds_t>(delay_us));
    }
}

int run_fdleak(int argc, char **argv) {
    unsigned long delay_us = number_argument(argc, argv, 1, 0);
    setlinebuf(stdout);  // its progress is to be seen, also through a pipe
    for (uint64_t n = 0;;) {
        int fd = n % 2 == 0 ? socket(AF_INET, SOCK_STREAM, 0) : open("/dev/null", O_RDONLY);
        if (fd == -1) {
            perror("open");  // of whichever kind: one line to look for
            exit(0);
        }
        usleep(static_cast<useconds_t>(delay_us));  // of 0, too: it gives way to others
        if (++n % 16 == 0)
            printf("leaked %" PRIu64 "\n", n);
    }
}
