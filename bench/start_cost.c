// Compares how long two commands take to start and end, on a machine without much to measure with.
//
//   start_cost ROUNDS STARTS COMMAND [ARGUMENT...] -- COMMAND [ARGUMENT...]
//
// The two run in turn, STARTS times each in a round, with their output to /dev/null. Prints the
// median milliseconds of one start of each, and the median of the rounds' ratios.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

enum { MAX_ROUNDS = 101 };

static double now_ms(void) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return (double)now.tv_sec * 1e3 + (double)now.tv_nsec / 1e6;
}

// The time of one start. The exit status is the command's own affair, its not starting is not.
static double run(char *const *argv) {
    const double start = now_ms();
    const pid_t child = vfork();
    if (child == 0) {
        execv(argv[0], argv);
        _exit(127);
    }
    int status;
    if (child < 0 || waitpid(child, &status, 0) != child || !WIFEXITED(status) ||
        WEXITSTATUS(status) == 127) {
        fprintf(stderr, "start_cost: %s cannot be run\n", argv[0]);
        exit(1);
    }
    return now_ms() - start;
}

static int compare(const void *left, const void *right) {
    const double difference = *(const double *)left - *(const double *)right;
    return (difference > 0) - (difference < 0);
}

static double median(double *numbers, int count) {
    qsort(numbers, (size_t)count, sizeof(*numbers), compare);
    return numbers[count / 2];
}

int main(int argc, char **argv) {
    int second = 3;
    while (second < argc && strcmp(argv[second], "--") != 0)
        ++second;
    const int rounds = argc > 3 ? atoi(argv[1]) : 0;
    const int starts = argc > 3 ? atoi(argv[2]) : 0;
    if (second + 1 >= argc || second == 3 || rounds < 1 || rounds > MAX_ROUNDS || starts < 1) {
        fprintf(stderr, "usage: start_cost ROUNDS STARTS COMMAND... -- COMMAND...\n");
        return 2;
    }
    argv[second] = NULL;
    const int saved = dup(STDOUT_FILENO);
    const int null = open("/dev/null", O_WRONLY);
    if (saved < 0 || null < 0 || dup2(null, STDOUT_FILENO) < 0)
        return 1;
    static double first_ms[MAX_ROUNDS];
    static double second_ms[MAX_ROUNDS];
    static double ratio[MAX_ROUNDS];
    for (int round = 0; round < rounds; ++round) {
        for (int i = 0; i < starts; ++i) {
            first_ms[round] += run(argv + 3) / starts;
            second_ms[round] += run(argv + second + 1) / starts;
        }
        ratio[round] = first_ms[round] / second_ms[round];
    }
    if (dup2(saved, STDOUT_FILENO) < 0)
        return 1;
    printf("%.2f %.2f %.2f\n", median(first_ms, rounds), median(second_ms, rounds),
           median(ratio, rounds));
    return 0;
}
