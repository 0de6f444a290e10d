#include "support/service_load.h"

#include <fcntl.h>
#include <gtest/gtest.h>
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

size_t more_than_buffers_hold() {
    size_t held = 0;
    for (const char *name : {"tcp_wmem", "tcp_rmem"}) {
        const std::string sizes = read_whole_file(std::string("/proc/sys/net/ipv4/") + name);
        size_t largest = 0;
        EXPECT_EQ(1, sscanf(sizes.c_str(), "%*u %*u %zu", &largest)) << name;
        held += largest;
    }
    return (held / 65536 + 32) * 65536;
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
