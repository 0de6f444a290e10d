#include "support/run_program.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

namespace {

long now_ms() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * 1000 + now.tv_nsec / 1000000;
}

std::vector<char *> pointers(const std::vector<std::string> &texts) {
    std::vector<char *> result;
    for (const std::string &text : texts)
        result.push_back(const_cast<char *>(text.c_str()));
    result.push_back(nullptr);
    return result;
}

// Appends what can be read at once; closes `fd` at its end.
void drain(int &fd, std::string &text) {
    char block[65536];
    ssize_t n = read(fd, block, sizeof block);
    if (n > 0) {
        text.append(block, static_cast<size_t>(n));
    } else if (n == 0 || errno != EINTR) {
        close(fd);
        fd = -1;
    }
}

// Has the execve close all other descriptors.
void keep_standard_streams_only() {
    for (int fd = 3; fd < 1024; ++fd)
        (void)fcntl(fd, F_SETFD, FD_CLOEXEC);
}

RunResult result_of(int status) {
    RunResult result;
    if (WIFEXITED(status))
        result.exit_status = WEXITSTATUS(status);
    else
        result.signal = WTERMSIG(status);
    return result;
}

}  // namespace

Background::Background(const std::vector<std::string> &argv, const RunOptions &options) {
    int in[2], out[2], err[2], started[2];
    if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0 ||
        pipe2(started, O_CLOEXEC) != 0)
        abort();
    std::vector<std::string> words = argv;
    if (!options.argv0.empty())
        words[0] = options.argv0;
    std::vector<char *> args = pointers(words);
    std::vector<char *> env = pointers(options.env);
    fflush(stdout);
    fflush(stderr);
    pid_ = fork();
    if (pid_ == 0) {
        dup2(in[0], 0);
        dup2(out[1], 1);
        dup2(err[1], 2);
        signal(SIGPIPE, SIG_DFL);
        // SIGSEGV is left to the kernel under a sanitizer, too: tests want to see its doing.
        setenv("TSAN_OPTIONS", "handle_segv=0", 1);
        setenv("ASAN_OPTIONS",
               options.leak_check ? "handle_segv=0" : "handle_segv=0:detect_leaks=0", 1);
        keep_standard_streams_only();
        if (options.before_exec)
            options.before_exec();
        execve(argv[0].c_str(), args.data(), options.env.empty() ? environ : env.data());
        perror(argv[0].c_str());
        _exit(127);
    }
    close(in[0]);
    close(out[1]);
    close(err[1]);
    // The last copy of its other end goes when the program begins.
    close(started[1]);
    char byte;
    while (read(started[0], &byte, 1) < 0 && errno == EINTR) {
    }
    close(started[0]);
    in_ = in[1];
    out_ = out[0];
    err_ = err[0];
}

Background::~Background() {
    close_input();
    if (pid_ > 0) {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    if (out_ >= 0)
        close(out_);
    if (err_ >= 0)
        close(err_);
}

// Forgets the lines that have been read.
void Background::drop_taken() {
    pending_.erase(0, taken_);
    taken_ = 0;
}

// Takes in what `fds` has of standard output and standard error, as poll() left it.
void Background::take_in(const pollfd fds[2]) {
    drop_taken();
    if (fds[0].revents != 0)
        drain(out_, pending_);
    if (fds[1].revents != 0)
        drain(err_, pending_err_);
}

// Waits for output and takes it in; false when none came in time or both streams have ended.
bool Background::fill(int timeout_ms) {
    pollfd fds[2] = {{out_, POLLIN, 0}, {err_, POLLIN, 0}};
    if (out_ < 0 && err_ < 0)
        return false;
    int ready = poll(fds, 2, timeout_ms);
    if (ready < 0 && errno == EINTR)
        return true;
    if (ready <= 0)
        return false;
    take_in(fds);
    return true;
}

std::string Background::read_line(int timeout_s) {
    long deadline = now_ms() + timeout_s * 1000;
    size_t end;
    while ((end = pending_.find('\n', taken_)) == std::string::npos && out_ >= 0) {
        long left = deadline - now_ms();
        if (left <= 0 || !fill(static_cast<int>(left))) {
            ADD_FAILURE() << "no line within " << timeout_s
                          << " s; so far: " << pending_.substr(taken_)
                          << "\nstandard error: " << pending_err_;
            return "";
        }
    }
    std::string line = pending_.substr(taken_, end - taken_);
    taken_ = end == std::string::npos ? pending_.size() : end + 1;
    return line;
}

void Background::write_input(const std::string &text) {
    size_t done = 0;
    while (done < text.size()) {
        ssize_t n = write(in_, text.data() + done, text.size() - done);
        if (n < 0 && errno != EINTR)
            return;
        if (n > 0)
            done += static_cast<size_t>(n);
    }
}

void Background::close_input() {
    if (in_ >= 0)
        close(in_);
    in_ = -1;
}

void Background::close_output() {
    if (out_ >= 0)
        close(out_);
    out_ = -1;
    pending_.clear();
    taken_ = 0;
}

void Background::send_signal(int signo) {
    ASSERT_GT(pid_, 0);
    kill(pid_, signo);
}

RunResult Background::wait(int timeout_s) {
    close_input();
    long deadline = now_ms() + timeout_s * 1000;
    // Its output may be held open by others that live on: its own end is what counts.
    int end = open_process(pid_);
    pollfd fds[3] = {{out_, POLLIN, 0}, {err_, POLLIN, 0}, {end, POLLIN, 0}};
    while (fds[2].revents == 0) {
        long left = deadline - now_ms();
        if (left <= 0) {
            ADD_FAILURE() << "still running after " << timeout_s
                          << " s; standard output: " << pending_
                          << "\nstandard error: " << pending_err_;
            kill(pid_, SIGKILL);
            break;
        }
        if (poll(fds, 3, static_cast<int>(left)) <= 0)
            continue;
        take_in(fds);
        fds[0].fd = out_;
        fds[1].fd = err_;
    }
    close(end);
    int status = 0;
    waitpid(pid_, &status, 0);
    pid_ = -1;
    while (fill(0)) {
    }
    drop_taken();
    RunResult result = result_of(status);
    result.out = std::move(pending_);
    result.err = std::move(pending_err_);
    return result;
}

RunResult run_program(const std::vector<std::string> &argv, const RunOptions &options) {
    signal(SIGPIPE, SIG_IGN);
    Background program(argv, options);
    program.write_input(options.input);
    return program.wait(options.timeout_s);
}

RunResult run_fieldkit(const std::vector<std::string> &args, const RunOptions &options) {
    std::vector<std::string> argv = {fieldkit_path()};
    argv.insert(argv.end(), args.begin(), args.end());
    return run_program(argv, options);
}

std::string fieldkit_path() {
    const char *path = getenv("FIELDKIT");
    return path != nullptr ? path : FIELDKIT_EXECUTABLE;
}

std::string fixture_path(const std::string &name) {
    const char *dir = getenv("FIXTURES");
    return std::string(dir != nullptr ? dir : FIXTURE_DIR) + "/" + name;
}

int open_process(pid_t pid) {
    int fd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    if (fd < 0) {
        perror("pidfd_open");
        abort();
    }
    return fd;
}

bool wait_until(const std::function<bool()> &condition, int timeout_s) {
    long deadline = now_ms() + timeout_s * 1000;
    // Short waits end at once; long ones leave the processor to what they wait for.
    useconds_t pause = 1000;
    while (!condition()) {
        if (now_ms() > deadline)
            return false;
        usleep(pause);
        pause = pause < 16000 ? pause + pause / 4 : 20000;
    }
    return true;
}
