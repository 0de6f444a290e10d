// The system log, for tests of what is written there.
#pragma once

#include <string>
#include <string_view>
#include <vector>

struct LogLine {
    int priority = -1;  // facility and level together, as the number that is sent
    std::string tag{};  // the name that the line was logged under
    std::string pid{};  // "" where the line does not tell
    std::string message{};
};

// Takes apart a line as the C library sends it: "<11>Nov  5 09:00:00 tag[pid]: message". Fails the
// running test where it is something else.
LogLine parse_log_line(std::string_view text);

// Takes the place of the system's log. The kernel holds about ten lines that nobody has read;
// whoever logs more waits.
class SystemLog {
  public:
    // Only inside a sandbox, see support/sandbox.h.
    SystemLog();
    // At `path`, where nothing may be yet.
    explicit SystemLog(const std::string &path);
    ~SystemLog();
    SystemLog(const SystemLog &) = delete;
    SystemLog &operator=(const SystemLog &) = delete;

    // The next line. Fails the test when none has come after `timeout_s`.
    LogLine read_line(int timeout_s = 20);
    // What has come and not been read: all of a program that has ended.
    std::vector<LogLine> read_lines();

  private:
    bool receive(int timeout_ms, LogLine *line);
    int fd_ = -1;
    std::string path_{};  // to be removed
};
