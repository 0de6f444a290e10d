// A process that sends and receives a message over and over on one of its many connections, and a
// tracer that is given it once they are all made.
//
//   socketloop SOCKETS COUNT TRACER [ARGUMENT...]    runs TRACER ARGUMENT... -p PID
#include <arpa/inet.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

static int fail(const char *what) {
    perror(what);
    return 1;
}

static int is_traced(void) {
    char line[256];
    int tracer = 0;
    FILE *status = fopen("/proc/self/status", "r");
    while (status != NULL && fgets(line, sizeof(line), status) != NULL) {
        if (sscanf(line, "TracerPid: %d", &tracer) == 1)
            break;
    }
    if (status != NULL)
        fclose(status);
    return tracer != 0;
}

// Tells of readiness by closing `ready`, and begins when it is traced.
static int run(int sockets, long count, int ready) {
    struct sockaddr_in address = {.sin_family = AF_INET};
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    struct sockaddr *generic = (struct sockaddr *)&address;
    const int listener = socket(AF_INET, SOCK_STREAM, 0);
    if (listener < 0 || bind(listener, generic, length) != 0 || listen(listener, 16) != 0 ||
        getsockname(listener, generic, &length) != 0)
        return fail("listener");
    int ours = -1;
    int theirs = -1;
    for (int i = 0; i < sockets; i += 2) {
        ours = socket(AF_INET, SOCK_STREAM, 0);
        if (ours < 0 || connect(ours, generic, length) != 0)
            return fail("connect");
        theirs = accept(listener, NULL, NULL);
        if (theirs < 0)
            return fail("accept");
    }
    close(ready);
    while (!is_traced())
        usleep(1000);

    char text[64];
    memset(text, 'x', sizeof(text));
    for (long i = 0; i < count; ++i) {
        if (send(ours, text, sizeof(text), 0) != (ssize_t)sizeof(text) ||
            recv(theirs, text, sizeof(text), 0) != (ssize_t)sizeof(text))
            return fail("send and recv");
    }
    return 0;
}

int main(int argc, char **argv) {
    if (argc < 4) {
        fprintf(stderr, "usage: socketloop SOCKETS COUNT TRACER [ARGUMENT...]\n");
        return 2;
    }
    struct rlimit descriptors;
    if (getrlimit(RLIMIT_NOFILE, &descriptors) == 0) {
        descriptors.rlim_cur = descriptors.rlim_max;
        (void)setrlimit(RLIMIT_NOFILE, &descriptors);
    }
    int ready[2];
    if (pipe(ready) != 0)
        return fail("pipe");
    const pid_t pid = fork();
    if (pid < 0)
        return fail("fork");
    if (pid == 0) {
        close(ready[0]);
        _exit(run(atoi(argv[1]), atol(argv[2]), ready[1]));
    }
    close(ready[1]);
    char nothing;
    (void)!read(ready[0], &nothing, 1);
    close(ready[0]);

    char number[16];
    snprintf(number, sizeof(number), "%d", (int)pid);
    char **tracer = calloc((size_t)argc, sizeof(char *));
    if (tracer == NULL)
        return fail("calloc");
    memcpy(tracer, argv + 3, (size_t)(argc - 3) * sizeof(char *));
    tracer[argc - 3] = "-p";
    tracer[argc - 2] = number;
    execv(tracer[0], tracer);
    return fail(tracer[0]);
}
