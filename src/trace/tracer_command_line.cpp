#include "trace/tracer_command_line.h"

#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <string_view>

#include "trace/trace_engine.h"
#include "util/spawn.h"
#include "util/stream.h"

namespace {

constexpr size_t MAX_PATH_SIZE = 4096;
constexpr const char *DEFAULT_PATH = "/bin:/sbin:/usr/bin:/usr/sbin:/usr/local/bin";
constexpr unsigned SLEEP_STEP_S = 999;

std::atomic<bool> stop_flag;

// Sends SIGINT again and again once one has come, until the trace has ended. The first may have
// come just before the engine's wait for an event, or a sleep, which it then did not interrupt; and
// while the traced processes sleep, nothing else would.
timer_t repeat_timer;
std::atomic<bool> repeating;
constexpr itimerspec REPEAT_AFTER = {.it_interval = {.tv_sec = 0, .tv_nsec = 0},
                                     .it_value = {.tv_sec = 0, .tv_nsec = 50 * 1000 * 1000}};

void on_interrupt(int) {
    int error = errno;
    stop_flag = true;
    if (repeating)
        (void)timer_settime(repeat_timer, 0, &REPEAT_AFTER, nullptr);
    errno = error;
}

// Without SA_RESTART, so that the wait for the next event ends and the engine asks the callback.
void catch_interrupt() {
    sigevent event = {};
    event.sigev_notify = SIGEV_SIGNAL;
    event.sigev_signo = SIGINT;
    repeating = timer_create(CLOCK_MONOTONIC, &event, &repeat_timer) == 0;
    struct sigaction action = {};
    action.sa_handler = on_interrupt;
    sigemptyset(&action.sa_mask);
    (void)sigaction(SIGINT, &action, nullptr);
}

void stop_repeating() {
    if (repeating.exchange(false))
        (void)timer_delete(repeat_timer);
}

// The path of `command` in `directory` if that is a regular file, else null. The slash between them
// is put there in any case: the path may be seen by the command, as a script's $0.
UniqueBlock<char> file_in(std::string_view directory, std::string_view command) {
    if (directory.size() + command.size() >= MAX_PATH_SIZE)
        return nullptr;
    UniqueBlock<char> path(static_cast<char *>(malloc(directory.size() + command.size() + 2)));
    if (path == nullptr)
        return nullptr;
    char *end = path.get();
    end = static_cast<char *>(mempcpy(end, directory.data(), directory.size()));
    *end++ = '/';
    end = static_cast<char *>(mempcpy(end, command.data(), command.size()));
    *end = '\0';
    struct stat status;
    if (stat(path.get(), &status) == -1 || !S_ISREG(status.st_mode))
        return nullptr;
    return path;
}

UniqueBlock<char> file_in_working_directory(const char *command) {
    char directory[MAX_PATH_SIZE + 1];
    if (getcwd(directory, MAX_PATH_SIZE) == nullptr)
        return nullptr;
    size_t len = strlen(directory);
    directory[len++] = '/';
    return file_in({directory, len}, command);
}

// Whether `pid` is a child that has not been reaped, and so cannot be the number of a stranger.
bool is_own_child(pid_t pid) {
    siginfo_t info;
    return waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0;
}

void trace_processes(TraceRequest *request, pid_t *pids, int nr_pids) {
    request->cookie = STDOUT_FILENO;
    request->timeout_s = -1;
    request->pids = pids;
    request->nr_pids = nr_pids;
    trace_run(request);
    stop_repeating();
}

int trace_command(TraceRequest *request, char **command) {
    UniqueBlock<char> path = find_in_path(command[0]);
    if (path == nullptr)
        return 1;
    pid_t pid =
        spawn_process_noenv(path.get(), command, STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO, true);
    if (pid == -1)
        return 1;
    forget_child(pid);  // this thread both traces it and waits for it
    // Not before the start: an ignored signal stays ignored in the command.
    (void)signal(SIGALRM, SIG_IGN);
    // The stop that the kernel makes at the execve. A command that could not be executed has ended
    // instead, and the engine finds that out.
    while (waitpid(pid, nullptr, 0) == -1 && errno == EINTR) {
    }
    pid_t traced = pid;
    request->attached = 1;
    trace_processes(request, &traced, 1);
    if (is_own_child(pid)) {
        (void)kill(pid, SIGINT);
        // Another SIGINT of the user ends the wait for a command that takes no notice of it.
        (void)waitpid(pid, nullptr, 0);
    }
    return 0;
}

}  // namespace

bool stop_requested() {
    return stop_flag;
}

void sleep_until_stop_requested() {
    while (!stop_requested())
        (void)sleep(SLEEP_STEP_S);
}

uint32_t trace_write_cb(intptr_t fd, const char *text, uint32_t len) {
    if (len != 0 && len <= INT32_MAX)
        (void)write_all(static_cast<int>(fd), text, len);
    return stop_requested() ? 0 : 1;
}

UniqueBlock<char> find_in_path(const char *command) {
    if (command[0] == '/')
        return file_in("/", command);
    if (command[0] == '.')
        return file_in_working_directory(command);
    const char *directories = getenv("PATH");
    if (directories == nullptr)
        directories = DEFAULT_PATH;
    for (;;) {
        // An empty element is the empty string, and so in effect the root directory.
        size_t len = strcspn(directories, ":");
        UniqueBlock<char> path = file_in({directories, len}, command);
        if (path != nullptr || directories[len] == '\0')
            return path;
        directories += len + 1;
    }
}

int parse_tracer_options(int argc, char **argv, TracerOptions *options) {
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; i += 2) {
        if (argv[i][1] != 'p')
            return -EINVAL;
        // The number is the next word; what is glued to the "-p" is not looked at, although the
        // usage text writes it so.
        if (i + 1 == argc)
            break;
        size_t size = static_cast<size_t>(options->nr_pids + 1) * sizeof(pid_t);
        void *grown = realloc(options->pids.get(), size);
        if (grown == nullptr)
            return -ENOMEM;
        (void)options->pids.release();
        options->pids.reset(static_cast<pid_t *>(grown));
        options->pids.get()[options->nr_pids++] =
            static_cast<pid_t>(strtoul(argv[i + 1], nullptr, 0));
    }
    if (i < argc && argv[i][0] != '-')
        options->command = argv + i;
    return options->nr_pids == 0 && options->command == nullptr ? -EINVAL : 0;
}

int run_tracer(int argc, char **argv, const char *usage, TraceRequest *request) {
    TracerOptions options;
    int error = parse_tracer_options(argc, argv, &options);
    if (error == -EINVAL) {
        puts(usage);
        return 0;
    }
    if (error != 0) {
        errno = -error;
        perror("realloc");
        return 1;
    }
    catch_interrupt();
    if (options.nr_pids == 0)
        return trace_command(request, options.command);
    (void)signal(SIGALRM, SIG_IGN);
    trace_processes(request, options.pids.get(), options.nr_pids);
    return 0;
}
