// Ordinary processes for scripts/demo to gather material from. The name under which it is started
// says what it does, over and over, ten times a second:
//
//   log-writer FILE              appends to a file
//   pipe-pair                    two processes with a pipe between them
//   unix-pair PATH               two processes with a connected Unix socket between them
//   tcp-server ADDRESS PORT      echoes what its one client sends
//   tcp-client ADDRESS PORT      sends lines and reads them back
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

static const struct timespec PERIOD = {0, 100000000};

static void fail(const char *what) {
    perror(what);
    exit(1);
}

static void rest(void) {
    nanosleep(&PERIOD, NULL);
}

static void write_log(const char *path) {
    const int fd = open(path, O_WRONLY | O_CREAT | O_APPEND, 0600);
    if (fd < 0)
        fail(path);
    for (unsigned count = 1;; ++count) {
        struct stat status;
        char line[64];
        const int length = snprintf(line, sizeof(line), "entry %u\n", count);
        if (write(fd, line, (size_t)length) != length || fstat(fd, &status) != 0)
            fail(path);
        if (status.st_size > 10000 && ftruncate(fd, 0) != 0)
            fail(path);
        rest();
    }
}

// Sends numbered lines and, where the other end answers, reads what comes back.
static void send_lines(int fd, int answered) {
    for (unsigned count = 1;; ++count) {
        char line[64];
        char answer[64];
        const int length = snprintf(line, sizeof(line), "request number %u\n", count);
        if (write(fd, line, (size_t)length) != length)
            fail("write");
        if (answered && read(fd, answer, sizeof(answer)) <= 0)
            fail("read");
        rest();
    }
}

// Reads until the end, and sends everything back where `answer` says so.
static void take_lines(int fd, int answer) {
    char text[256];
    ssize_t length;
    while ((length = read(fd, text, sizeof(text))) > 0) {
        if (answer && write(fd, text, (size_t)length) != length)
            fail("write");
    }
}

static void run_pipe_pair(void) {
    int ends[2];
    if (pipe(ends) != 0)
        fail("pipe");
    const pid_t reader = fork();
    if (reader < 0)
        fail("fork");
    if (reader == 0) {
        close(ends[1]);
        take_lines(ends[0], 0);
        exit(0);
    }
    close(ends[0]);
    send_lines(ends[1], 0);
}

static int listen_at(int domain, const struct sockaddr *address, socklen_t size) {
    const int fd = socket(domain, SOCK_STREAM, 0);
    if (fd < 0 || bind(fd, address, size) != 0 || listen(fd, 1) != 0)
        fail("listen");
    return fd;
}

// The server may not be there yet.
static int connect_to(int domain, const struct sockaddr *address, socklen_t size) {
    for (int attempt = 0; attempt < 100; ++attempt) {
        const int fd = socket(domain, SOCK_STREAM, 0);
        if (fd < 0)
            fail("socket");
        if (connect(fd, address, size) == 0)
            return fd;
        close(fd);
        rest();
    }
    fail("connect");
    return -1;
}

static void serve(int listener) {
    const int fd = accept(listener, NULL, NULL);
    if (fd < 0)
        fail("accept");
    take_lines(fd, 1);
}

static void run_unix_pair(const char *path) {
    struct sockaddr_un address = {.sun_family = AF_UNIX};
    snprintf(address.sun_path, sizeof(address.sun_path), "%s", path);
    const struct sockaddr *generic = (const struct sockaddr *)&address;
    const int listener = listen_at(AF_UNIX, generic, sizeof(address));
    const pid_t client = fork();
    if (client < 0)
        fail("fork");
    if (client == 0) {
        close(listener);
        send_lines(connect_to(AF_UNIX, generic, sizeof(address)), 1);
    }
    serve(listener);
}

static void run_tcp(int server, const char *host, const char *port) {
    struct sockaddr_in address = {.sin_family = AF_INET};
    address.sin_port = htons((uint16_t)atoi(port));
    if (inet_pton(AF_INET, host, &address.sin_addr) != 1)
        fail(host);
    const struct sockaddr *generic = (const struct sockaddr *)&address;
    if (server)
        serve(listen_at(AF_INET, generic, sizeof(address)));
    else
        send_lines(connect_to(AF_INET, generic, sizeof(address)), 1);
}

int main(int argc, char **argv) {
    const char *slash = strrchr(argv[0], '/');
    const char *name = slash != NULL ? slash + 1 : argv[0];
    if (strcmp(name, "log-writer") == 0 && argc == 2) {
        write_log(argv[1]);
    } else if (strcmp(name, "pipe-pair") == 0 && argc == 1) {
        run_pipe_pair();
    } else if (strcmp(name, "unix-pair") == 0 && argc == 2) {
        run_unix_pair(argv[1]);
    } else if (strcmp(name, "tcp-server") == 0 && argc == 3) {
        run_tcp(1, argv[1], argv[2]);
    } else if (strcmp(name, "tcp-client") == 0 && argc == 3) {
        run_tcp(0, argv[1], argv[2]);
    } else {
        fprintf(stderr, "%s: not a name that this program knows, or not its arguments\n", argv[0]);
        return 1;
    }
    return 0;
}
