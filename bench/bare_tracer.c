// The floor under every tracer: stops a program twice a call, as they do, and looks at nothing.
//
//   bare_tracer COMMAND ARGUMENT...
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

int main(int argc, char **argv) {
    if (argc < 2) {
        fprintf(stderr, "usage: bare_tracer COMMAND ARGUMENT...\n");
        return 2;
    }
    const pid_t child = fork();
    if (child < 0) {
        perror("fork");
        return 1;
    }
    if (child == 0) {
        ptrace(PTRACE_TRACEME, 0, NULL, NULL);
        execv(argv[1], argv + 1);
        perror(argv[1]);
        _exit(127);
    }
    int status;
    while (waitpid(child, &status, 0) == child && WIFSTOPPED(status)) {
        // The stops of system calls and of the execve are the tracer's own, not the program's.
        const int signo = WSTOPSIG(status) == SIGTRAP ? 0 : WSTOPSIG(status);
        if (ptrace(PTRACE_SYSCALL, child, NULL, (void *)(intptr_t)signo) != 0) {
            perror("ptrace");
            return 1;
        }
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
