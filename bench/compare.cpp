// Runs commands in turn, round after round, so that whatever else goes on in the machine meets all
// of them alike, and prints what they cost as rows of a table.
//
//   compare ROUNDS INPUT NAME COMMAND... [-- NAME COMMAND...]...
//
// Each command reads the file INPUT and writes to /dev/null; its first word is a full path.
// Processor time is that of the whole process tree, user and system. The first command is the one
// in question: the ratios are its cost over the cost of each other one in the same round. All
// figures are medians.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "rounds.h"

namespace {

struct Cost {
    double cpu_s;
    double wall_s;
};

using Command = MeasuredCommand<Cost>;

void redirect(const char *path, int flags, int fd) {
    const int opened = open(path, flags);
    if (opened < 0 || dup2(opened, fd) != fd) {
        perror(path);
        _exit(126);
    }
    close(opened);
}

Cost run(const Command &command, const char *input) {
    const double start = now();
    const pid_t child = fork();
    if (child == 0) {
        redirect(input, O_RDONLY, STDIN_FILENO);
        redirect("/dev/null", O_WRONLY, STDOUT_FILENO);
        execv(command.argv[0], command.argv.data());
        perror(command.argv[0]);
        _exit(127);
    }
    int status = -1;
    rusage usage = {};
    if (child < 0 || wait4(child, &status, 0, &usage) != child || status != 0) {
        fprintf(stderr, "compare: %s failed (status %#x)\n", command.name.c_str(),
                static_cast<unsigned>(status));
        exit(1);
    }
    return {cpu_seconds(usage), now() - start};
}

void print_rows(const std::vector<Command> &commands, size_t rounds) {
    const Command &ours = commands.front();
    for (const Command &command : commands) {
        const auto &costs = command.costs;
        printf("| %s | %.3f | %.3f |", command.name.c_str(),
               median(rounds, [&](size_t i) { return costs[i].cpu_s; }),
               median(rounds, [&](size_t i) { return costs[i].wall_s; }));
        if (&command == &ours) {
            puts(" | |");
            continue;
        }
        printf(" %.2f | %.2f |\n",
               median(rounds, [&](size_t i) { return ours.costs[i].cpu_s / costs[i].cpu_s; }),
               median(rounds, [&](size_t i) { return ours.costs[i].wall_s / costs[i].wall_s; }));
    }
}

}  // namespace

int main(int argc, char **argv) {
    std::vector<Command> commands;
    const int rounds = argc > 4 ? atoi(argv[1]) : 0;
    if (rounds > 0)
        commands = read_commands<Cost>(argv + 3);
    if (commands.empty()) {
        fprintf(stderr, "usage: compare ROUNDS INPUT NAME COMMAND... [-- NAME COMMAND...]...\n");
        return 2;
    }
    for (int round = 0; round < rounds; ++round) {
        for (Command &command : commands)
            command.costs.push_back(run(command, argv[2]));
    }
    print_rows(commands, static_cast<size_t>(rounds));
    return 0;
}
