// Runs a command among many processes with many descriptors, which end with it.
//
//   herd PROCESSES DESCRIPTORS COMMAND ARGUMENT...
//
// Of every eight descriptors of such a process two are sockets, two are pipes, and four are files.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

static _Noreturn void give_up(const char *what) {
    perror(what);
    exit(1);
}

// Opens descriptors in place of all that this process has but `kept`, which is above them.
static void open_descriptors(int count, int kept) {
    for (long fd = sysconf(_SC_OPEN_MAX) - 1; fd >= 0; --fd) {
        if (fd != kept)
            close((int)fd);
    }
    for (int fd = 0; fd < count; ++fd) {
        int pair[2] = {-1, -1};
        const int kind = fd % 8;
        // The second end of a pair takes the next number.
        if (kind == 1 || kind == 3)
            continue;
        if ((kind == 0 && socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) ||
            (kind == 2 && pipe(pair) != 0) || (kind > 3 && open("/dev/null", O_RDWR) != fd))
            _exit(1);
    }
    close(count);  // of a pair of which only one end was wanted
}

static void start_one(int descriptors) {
    int ready[2];
    if (pipe(ready) != 0)
        give_up("pipe");
    const pid_t child = fork();
    if (child < 0)
        give_up("fork");
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        const int told = fcntl(ready[1], F_DUPFD, descriptors + 1);
        open_descriptors(descriptors, told);
        if (write(told, "x", 1) != 1)
            _exit(1);
        close(told);
        for (;;)
            pause();
    }
    close(ready[1]);
    // What it is told with is closed, too, when the pipe ends.
    char byte;
    if (read(ready[0], &byte, 1) != 1 || read(ready[0], &byte, 1) != 0) {
        fprintf(stderr, "herd: a process has not got its descriptors\n");
        exit(1);
    }
    close(ready[0]);
}

int main(int argc, char **argv) {
    if (argc < 4) {
        fprintf(stderr, "usage: herd PROCESSES DESCRIPTORS COMMAND ARGUMENT...\n");
        return 2;
    }
    for (int i = atoi(argv[1]); i > 0; --i)
        start_one(atoi(argv[2]));
    const pid_t command = fork();
    if (command < 0)
        give_up("fork");
    if (command == 0) {
        execv(argv[3], argv + 3);
        perror(argv[3]);
        _exit(127);
    }
    int status;
    if (waitpid(command, &status, 0) != command)
        give_up("waitpid");
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
