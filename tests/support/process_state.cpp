#include "support/process_state.h"

#include <stdio.h>
#include <string.h>

#include "support/run_program.h"

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
