// What the programs share that measure several things in turn, round after round.
#pragma once

#include <string.h>
#include <sys/resource.h>
#include <time.h>

#include <algorithm>
#include <string>
#include <vector>

// A program to be run once in every round.
template <typename Cost>
struct MeasuredCommand {
    std::string name;
    std::vector<char *> argv;  // ends with null
    std::vector<Cost> costs;   // one of each round
};

// Of words such as NAME COMMAND... [-- NAME COMMAND...]..., that end with null. Nothing when a name
// has no command.
template <typename Cost>
std::vector<MeasuredCommand<Cost>> read_commands(char **words) {
    std::vector<MeasuredCommand<Cost>> commands;
    while (*words != nullptr) {
        MeasuredCommand<Cost> command = {*words++, {}, {}};
        while (*words != nullptr && strcmp(*words, "--") != 0)
            command.argv.push_back(*words++);
        if (command.argv.empty())
            return {};
        command.argv.push_back(nullptr);
        commands.push_back(command);
        if (*words != nullptr)
            ++words;
    }
    return commands;
}

inline double now() {
    timespec time;
    clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

// User and system time together.
inline double cpu_seconds(const rusage &usage) {
    return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
           static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

inline double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    const size_t middle = values.size() / 2;
    return values.size() % 2 == 1 ? values[middle] : (values[middle - 1] + values[middle]) / 2;
}

// Of `value(round)` over the rounds.
template <typename Value>
double median(size_t rounds, Value value) {
    std::vector<double> values;
    for (size_t i = 0; i < rounds; ++i)
        values.push_back(value(i));
    return median(values);
}
