// Sends a core through the path that it takes from the kernel to a client over the network: a pipe,
// a Unix socket, a TCP connection. Stands for the kernel at one end and the client at the other.
//
//   core_path MEGABYTES FIELDKIT    the core handler and the service pass it on
//   core_path MEGABYTES             two processes of socat do
//
// Only in mount, network and process namespaces of its own: it puts an empty file system on /run.
#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <sockhand.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <initializer_list>
#include <vector>

namespace {

constexpr char CGI_SOCKET[] = "/run/dbg-cgi/ctrl-cgi-socket";
constexpr char CORE_SOCKET[] = "/run/dbg-cgi/ctrl-segf-socket";
constexpr size_t PIECE_SIZE = 65536;

char block[PIECE_SIZE];

[[noreturn]] void give_up(const char *what) {
    perror(what);
    exit(1);
}

struct Connection {
    int client;
    int server;
};

Connection connect_over_loopback() {
    const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    auto *generic = reinterpret_cast<sockaddr *>(&address);
    socklen_t length = sizeof address;
    const int client = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (bind(listener, generic, length) != 0 || listen(listener, 1) != 0 ||
        getsockname(listener, generic, &length) != 0 || connect(client, generic, length) != 0)
        give_up("loopback");
    const int server = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    close(listener);
    return {client, server};
}

// With `input` and `output` as its standard ones.
pid_t start(std::initializer_list<const char *> words, int input, int output) {
    std::vector<char *> argv;
    for (const char *word : words)
        argv.push_back(const_cast<char *>(word));
    argv.push_back(nullptr);
    const pid_t child = fork();
    if (child == 0) {
        (void)dup2(input, STDIN_FILENO);
        (void)dup2(output, STDOUT_FILENO);
        execv(argv[0], argv.data());
        perror(argv[0]);
        _exit(127);
    }
    return child;
}

void wait_for_socket(const char *path) {
    while (access(path, F_OK) != 0)
        usleep(10000);
}

// The client of a service that has it waiting for a core.
int wait_for_core() {
    constexpr char QUERY[] = "/debug.tgz\0listen";
    wait_for_socket(CORE_SOCKET);
    int clients[2];
    for (int &client : clients) {
        const Connection connection = connect_over_loopback();
        if (sockhand_send(CGI_SOCKET, QUERY, sizeof QUERY, connection.server) != 0)
            give_up(CGI_SOCKET);
        close(connection.server);
        client = connection.client;
    }
    // The first one is sent away when the second is taken.
    if (read(clients[0], block, 1) != 0)
        give_up("the first client");
    close(clients[0]);
    return clients[1];
}

[[noreturn]] void feed(int fd, int megabytes) {
    for (uint64_t left = static_cast<uint64_t>(megabytes) << 20; left > 0; left -= sizeof block) {
        if (write(fd, block, sizeof block) != sizeof block)
            give_up("feeding");
    }
    _exit(0);
}

// Takes the reply's header, if there is one, and the core.
void take(int client, int megabytes, bool has_header) {
    uint64_t left = static_cast<uint64_t>(megabytes) << 20;
    const char *header_end = "\r\n\r\n";
    while (has_header && *header_end != '\0') {
        char byte;
        if (read(client, &byte, 1) != 1)
            give_up("the header");
        header_end = byte == *header_end ? header_end + 1 : "\r\n\r\n";
    }
    while (left > 0) {
        const ssize_t n = read(client, block, sizeof block);
        if (n <= 0) {
            fprintf(stderr, "core_path: %llu bytes have not come\n",
                    static_cast<unsigned long long>(left));
            exit(1);
        }
        left -= static_cast<uint64_t>(n);
    }
}

}  // namespace

int main(int argc, char **argv) {
    const int megabytes = argc == 2 || argc == 3 ? atoi(argv[1]) : 0;
    if (megabytes < 1) {
        fprintf(stderr, "usage: core_path MEGABYTES [FIELDKIT]\n");
        return 2;
    }
    if (mount("none", "/run", "tmpfs", 0, nullptr) != 0 || mkdir("/run/dbg-cgi", 0755) != 0 ||
        mkdir("/run/dumps", 0755) != 0)
        give_up("/run");
    const bool ours = argc == 3;
    int core[2];
    if (pipe2(core, O_CLOEXEC) != 0)
        give_up("pipe");

    int client;
    pid_t helpers[2];
    if (ours) {
        helpers[0] = start({argv[2], "debugar.cgi", "-n", "-c", CGI_SOCKET, "-s", CORE_SOCKET, "-k",
                            "/run/dumps", "-p", "/bin/false"},
                           STDIN_FILENO, STDOUT_FILENO);
        client = wait_for_core();
        helpers[1] = start({argv[2], "coredump-handler", "core"}, core[0], STDOUT_FILENO);
    } else {
        const Connection connection = connect_over_loopback();
        client = connection.client;
        helpers[0] = start({"/usr/bin/socat", "-u", "-b", "65536",
                            "UNIX-LISTEN:/run/dbg-cgi/ctrl-segf-socket", "STDOUT"},
                           STDIN_FILENO, connection.server);
        close(connection.server);
        wait_for_socket(CORE_SOCKET);
        helpers[1] = start({"/usr/bin/socat", "-u", "-b", "65536", "STDIN",
                            "UNIX-CONNECT:/run/dbg-cgi/ctrl-segf-socket,retry=50,interval=0.01"},
                           core[0], STDOUT_FILENO);
    }
    close(core[0]);
    const pid_t feeder = fork();
    if (feeder == 0)
        feed(core[1], megabytes);
    close(core[1]);
    take(client, megabytes, ours);
    // Up to the last byte: the handler would stay for the service's answer, five seconds.
    for (const pid_t helper : helpers)
        kill(helper, SIGTERM);
    for (const pid_t child : {helpers[0], helpers[1], feeder})
        waitpid(child, nullptr, 0);
    return 0;
}
