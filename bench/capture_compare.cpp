// Sees what capture programs lose of the same traffic, and what they cost, and prints that as rows
// of a table.
//
//   capture_compare ROUNDS SIZE FRAMES RATE BLASTER NAME COMMAND... [-- NAME COMMAND...]...
//
// Each command captures on the interface eth0, whose other end is eth1, into the file that is its
// last word, until it is told to end by SIGTERM. BLASTER (frame_blaster) then sends FRAMES frames
// of SIZE bytes, RATE in a second. In every round the commands run in turn, on one processor; the
// blaster has another one. The first command is the one in question: the ratio is its processor
// time over that of each other one in the same round. All figures are medians; what got lost is
// also given for all rounds together.
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include "rounds.h"

namespace {

constexpr int BLASTER_CPU = 0;
constexpr int CAPTURE_CPU = 1;

// Programs that look at frames by the block see the last ones after a second at most.
constexpr timespec LAST_FRAMES = {1, 500000000};

struct Cost {
    double cpu_s;
    double wall_s;
    long sent;
    long captured;
};

using Command = MeasuredCommand<Cost>;

[[noreturn]] void give_up(const std::string &what) {
    fprintf(stderr, "capture_compare: %s\n", what.c_str());
    exit(1);
}

pid_t start(const std::vector<char *> &argv, int cpu) {
    const pid_t child = fork();
    if (child < 0)
        give_up("fork");
    if (child > 0)
        return child;
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    // A machine with one processor has no choice.
    (void)sched_setaffinity(0, sizeof set, &set);
    const int quiet = open("/dev/null", O_WRONLY);
    dup2(quiet, STDOUT_FILENO);
    dup2(quiet, STDERR_FILENO);
    execv(argv[0], argv.data());
    _exit(127);
}

long read_number(const char *path) {
    long ret = -1;
    std::ifstream(path) >> ret;
    if (ret < 0)
        give_up(path);
    return ret;
}

// Whether a packet socket of this network sees frames of all protocols by now.
bool capture_runs() {
    std::ifstream file("/proc/net/packet");
    std::string line;
    while (std::getline(file, line)) {
        int type = 0;
        unsigned protocol = 0;
        int interface = 0;
        int running = 0;
        if (sscanf(line.c_str(), "%*s %*d %d %x %d %d", &type, &protocol, &interface, &running) ==
                4 &&
            protocol == 3 && interface != 0 && running == 1)
            return true;
    }
    return false;
}

uint32_t le32(const uint8_t *at) {
    return at[0] | uint32_t{at[1]} << 8 | uint32_t{at[2]} << 16 | uint32_t{at[3]} << 24;
}

// The number of the blaster's frames in a pcap file.
long count_frames(const char *path) {
    const int fd = open(path, O_RDONLY);
    struct stat status;
    if (fd < 0 || fstat(fd, &status) != 0 || status.st_size < 24)
        give_up(std::string(path) + ": no capture");
    const auto size = static_cast<size_t>(status.st_size);
    void *mapped = mmap(nullptr, size, PROT_READ, MAP_PRIVATE, fd, 0);
    if (mapped == MAP_FAILED)
        give_up("mmap");
    const auto *bytes = static_cast<const uint8_t *>(mapped);
    long ret = 0;
    for (size_t at = 24; at + 16 + 14 <= size; at += 16 + le32(bytes + at + 8)) {
        if (bytes[at + 28] == 0x88 && bytes[at + 29] == 0xb5)
            ++ret;
    }
    munmap(mapped, size);
    close(fd);
    return ret;
}

Cost run(const Command &command, const std::vector<char *> &blaster) {
    const char *path = command.argv[command.argv.size() - 2];
    unlink(path);
    const pid_t capture = start(command.argv, CAPTURE_CPU);
    const double deadline = now() + 20;
    while (!capture_runs()) {
        if (now() > deadline || waitpid(capture, nullptr, WNOHANG) != 0)
            give_up(command.name + " does not capture");
        usleep(10000);
    }
    usleep(300000);

    const char *received = "/sys/class/net/eth0/statistics/rx_packets";
    const long before = read_number(received);
    const double begin = now();
    int status = -1;
    if (waitpid(start(blaster, BLASTER_CPU), &status, 0) < 0 || status != 0)
        give_up("the blaster failed");
    const double wall_s = now() - begin;
    nanosleep(&LAST_FRAMES, nullptr);
    const long sent = read_number(received) - before;

    kill(capture, SIGTERM);
    rusage usage = {};
    if (wait4(capture, &status, 0, &usage) != capture)
        give_up("wait4");
    const Cost cost = {cpu_seconds(usage), wall_s, sent, count_frames(path)};
    unlink(path);
    return cost;
}

double lost_percent(long sent, long captured) {
    return sent > 0 ? 100.0 * static_cast<double>(sent - captured) / static_cast<double>(sent) : 0;
}

void print_rows(const std::vector<Command> &commands, size_t rounds) {
    const Command &ours = commands.front();
    for (const Command &command : commands) {
        const auto &costs = command.costs;
        long sent = 0;
        long captured = 0;
        for (const Cost &cost : costs) {
            sent += cost.sent;
            captured += cost.captured;
        }
        printf(
            "| %s | %.0f | %.3f | %.3f | %.3f |", command.name.c_str(),
            median(rounds,
                   [&](size_t i) { return static_cast<double>(costs[i].sent) / costs[i].wall_s; }),
            median(rounds,
                   [&](size_t i) { return lost_percent(costs[i].sent, costs[i].captured); }),
            lost_percent(sent, captured), median(rounds, [&](size_t i) { return costs[i].cpu_s; }));
        if (&command == &ours) {
            puts(" |");
            continue;
        }
        printf(" %.2f |\n",
               median(rounds, [&](size_t i) { return ours.costs[i].cpu_s / costs[i].cpu_s; }));
    }
}

}  // namespace

int main(int argc, char **argv) {
    std::vector<Command> commands;
    const int rounds = argc > 7 ? atoi(argv[1]) : 0;
    if (rounds > 0)
        commands = read_commands<Cost>(argv + 6);
    if (commands.empty()) {
        fprintf(stderr,
                "usage: capture_compare ROUNDS SIZE FRAMES RATE BLASTER NAME COMMAND... "
                "[-- NAME COMMAND...]...\n");
        return 2;
    }
    char other_end[] = "eth1";
    const std::vector<char *> blaster = {argv[5], other_end, argv[2], argv[3], argv[4], nullptr};
    for (int round = 0; round < rounds; ++round) {
        for (Command &command : commands)
            command.costs.push_back(run(command, blaster));
    }
    print_rows(commands, static_cast<size_t>(rounds));
    return 0;
}
