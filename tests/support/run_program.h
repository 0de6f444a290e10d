// Runs programs as a user would and collects what came of it.
#pragma once

#include <poll.h>
#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

struct RunOptions {
    std::string argv0{};             // instead of the path, when not empty
    std::string input{};             // all of standard input
    std::vector<std::string> env{};  // the whole environment; the test's own when empty
    int timeout_s = 60;              // then it is killed, and the test fails
    // A program built with a sanitizer: false where the search for leaks cannot work at its end,
    // for want of /proc, descriptors or the right to trace.
    bool leak_check = true;
    std::function<void()> before_exec{};  // runs in the child
};

struct RunResult {
    int exit_status = -1;  // -1 when a signal ended it
    int signal = 0;
    std::string out;
    std::string err;
};

// Runs `argv` (a full path first) to its end.
RunResult run_program(const std::vector<std::string> &argv, const RunOptions &options = {});

// Runs fieldkit as applet `args[0]`.
RunResult run_fieldkit(const std::vector<std::string> &args, const RunOptions &options = {});

// A program that has only its standard streams, and runs while the test does, and has begun when
// the object is made. Its standard output is read line by line; it is killed and reaped at the end
// of the object's life.
class Background {
  public:
    explicit Background(const std::vector<std::string> &argv, const RunOptions &options = {});
    ~Background();
    Background(const Background &) = delete;
    Background &operator=(const Background &) = delete;

    pid_t pid() const { return pid_; }
    // The next line of its standard output without the newline; what is left when it ends. Fails
    // the test, and gives "", when none has come after `timeout_s`.
    std::string read_line(int timeout_s = 20);
    // Writes to its standard input.
    void write_input(const std::string &text);
    void close_input();
    // Stops reading its standard output.
    void close_output();
    void send_signal(int signo);
    // Waits for its end and returns everything that it wrote meanwhile.
    RunResult wait(int timeout_s = 60);

  private:
    void drop_taken();
    void take_in(const pollfd fds[2]);
    bool fill(int timeout_ms);
    pid_t pid_ = -1;
    int in_ = -1;
    int out_ = -1;
    int err_ = -1;
    std::string pending_;
    size_t taken_ = 0;  // of it, by read_line()
    std::string pending_err_;
};

// The executable under test: FIELDKIT in the environment, else the one that was built.
std::string fieldkit_path();
// A program of tests/system/fixtures: below FIXTURES in the environment, else as built.
std::string fixture_path(const std::string &name);
// A descriptor of the process `pid` that can be read once it has ended.
int open_process(pid_t pid);
// Waits until `condition` holds, at most `timeout_s`; returns whether it did.
bool wait_until(const std::function<bool()> &condition, int timeout_s = 20);
