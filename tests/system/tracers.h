// What the tests of the tracers share: looking at processes, and text with its changing parts
// replaced.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>

#include <regex>
#include <string>

#include "support/process_state.h"
#include "support/run_program.h"

inline bool wait_for_state(pid_t pid, char state) {
    return wait_until([&] { return process_state(pid) == state; });
}

// Reads lines until one contains `part`, and returns that one.
inline std::string read_line_with(Background &program, const std::string &part) {
    std::string line;
    for (int i = 0; i < 100000 && !testing::Test::HasFailure(); ++i) {
        line = program.read_line();
        if (line.find(part) != std::string::npos)
            return line;
    }
    ADD_FAILURE() << "no line with " << part << ", but at last " << line;
    return line;
}

// The name that a trace shows for a program started with this first word: what follows the last
// slash in its first 31 characters.
inline std::string shown_name(const std::string &word) {
    std::string start = word.substr(0, 31);
    return start.substr(start.rfind('/') + 1);
}

// What a failed call shows as its result.
inline std::string failure(int error) {
#if defined(__mips__)
    return std::to_string(error);
#else
    return std::to_string(-error);
#endif
}

// Replaces process ids in front of a line, code and data addresses and inode numbers.
inline std::string masked(std::string text) {
    text = std::regex_replace(text, std::regex("\\[[0-9]+ ([^\\]]*)\\] \\[[0-9a-f]+ [0-9a-f]+\\]"),
                              "[PID $1] [PC RA]");
    text = std::regex_replace(text, std::regex("\\[[0-9]+ ([^\\]]*)\\]( +[0-9]+ open|  ?---)"),
                              "[PID $1]$2");
    text = std::regex_replace(text, std::regex("0x[0-9a-f]{5,}"), "ADDRESS");
    return std::regex_replace(text, std::regex("(pipe|socket):\\[[0-9]+\\]"), "$1:[INODE]");
}
