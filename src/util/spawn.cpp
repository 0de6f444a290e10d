#include "util/spawn.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/ptrace.h>
#include <unistd.h>

namespace {

// Makes `given` the child's descriptor `standard`. The calls may fail without harm: the program
// then starts with that descriptor closed, as it would find it for itself.
void redirect(int given, int standard) {
    if (given == standard) {
        (void)fcntl(standard, F_SETFD, 0);  // to be kept over the execve, whatever it was before
        return;
    }
    (void)close(standard);
    (void)dup2(given, standard);
}

[[noreturn]] void run_child(const char *path, char *const argv[], char *const envp[], int in_fd,
                            int out_fd, int err_fd, bool trace_me) {
    redirect(in_fd, STDIN_FILENO);
    redirect(out_fd, STDOUT_FILENO);
    redirect(err_fd, STDERR_FILENO);
    if (trace_me)
        (void)ptrace(PTRACE_TRACEME, 0, 0, 0);
    execve(path, argv, envp);
    perror("execve");
    // The buffered exit, so that text which the caller had not flushed still comes out.
    exit(1);
}

}  // namespace

pid_t spawn_process(const char *path, char *const argv[], char *const envp[], int in_fd, int out_fd,
                    int err_fd, bool trace_me) {
    pid_t pid = fork_child(trace_me);
    if (pid == -1)
        perror("fork");
    if (pid == 0)
        run_child(path, argv, envp, in_fd, out_fd, err_fd, trace_me);
    return pid;
}

pid_t spawn_process_noenv(const char *path, char *const argv[], int in_fd, int out_fd, int err_fd,
                          bool trace_me) {
    return spawn_process(path, argv, nullptr, in_fd, out_fd, err_fd, trace_me);
}

int run_process_wait(const char *path, char *const argv[], int in_fd, int out_fd, int err_fd,
                     bool trace_me) {
    int status = 1;
    pid_t pid = spawn_process(path, argv, nullptr, in_fd, out_fd, err_fd, trace_me);
    (void)wait_for_child(pid, &status);
    if (trace_me)
        forget_child(pid);  // it may only have stopped
    return (status >> 8) & 0xff;
}
