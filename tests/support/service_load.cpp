#include "support/service_load.h"

#include <fcntl.h>
#include <unistd.h>

#include <filesystem>

#include "support/process_state.h"

RunOptions ServiceLog::run() const {
    std::string path = dir_ / "log";
    return {.before_exec = [path] {
        int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
        dup2(fd, 1);
        dup2(fd, 2);
        close(fd);
    }};
}

std::string ServiceLog::report() const {
    std::string text = read_whole_file(dir_ / "log");
    for (const char *begin :
         {"WARNING: ThreadSanitizer", "ERROR: AddressSanitizer", "runtime error:", "Assertion "}) {
        size_t at = text.find(begin);
        if (at != std::string::npos)
            return text.substr(at, 5000);
    }
    return "";
}

std::string cheap_core_writer(const TempDir &dir) {
    return dir.file("writer",
                    "#!/bin/sh\n"
                    "core=\"core of $3\"\n"
                    "echo \"CORELEN ${#core} bytes, of processes:$3\" >&2\n"
                    "printf %s \"$core\"\n",
                    0755);
}

std::vector<int> traced_processes() {
    std::vector<int> traced;
    std::error_code error;
    for (std::filesystem::directory_iterator it("/proc", error), end; !error && it != end;
         it.increment(error)) {
        int pid = atoi(it->path().filename().c_str());
        if (pid <= 0)
            continue;
        std::string tracer = status_field(pid, "TracerPid:");
        if (!tracer.empty() && atoi(tracer.c_str()) != 0)
            traced.push_back(pid);
    }
    return traced;
}

bool nothing_is_traced(int timeout_s) {
    return wait_until([] { return traced_processes().empty(); }, timeout_s);
}
