#include "support/process_state.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <filesystem>

#include "support/run_program.h"

namespace {

// In the folder `name` of the process.
int count_entries(pid_t pid, const std::string &name) {
    std::error_code error;
    int count = 0;
    for (std::filesystem::directory_iterator it("/proc/" + std::to_string(pid) + name, error), end;
         !error && it != end; it.increment(error))
        ++count;
    return count;
}

}  // namespace

std::string status_field(pid_t pid, const std::string &field) {
    std::string path = "/proc/" + std::to_string(pid) + "/status";
    FILE *file = fopen(path.c_str(), "r");
    if (file == nullptr)
        return "";
    std::string found;
    char line[512];
    while (fgets(line, sizeof line, file) != nullptr) {
        if (strncmp(line, field.c_str(), field.size()) == 0)
            found = std::string(line + field.size(), strcspn(line + field.size(), "\n"));
    }
    fclose(file);
    return found;
}

char process_state(pid_t pid) {
    return (status_field(pid, "State:\t") + "?")[0];
}

bool runs_free(pid_t pid) {
    return status_field(pid, "TracerPid:\t") == "0" && wait_until([&] {
               char state = process_state(pid);
               return state == 'R' || state == 'S' || state == 'D';
           });
}

// Not from /proc/PID/task/TID/children, which few kernels have.
std::vector<pid_t> children_of(pid_t pid) {
    std::vector<pid_t> children;
    std::error_code error;
    for (std::filesystem::directory_iterator it("/proc", error), end; !error && it != end;
         it.increment(error)) {
        const pid_t child = atoi(it->path().filename().c_str());
        if (child > 0 && atoi(status_field(child, "PPid:\t").c_str()) == pid)
            children.push_back(child);
    }
    return children;
}

int count_descriptors(pid_t pid) {
    return count_entries(pid, "/fd");
}

int count_threads(pid_t pid) {
    return count_entries(pid, "/task");
}
