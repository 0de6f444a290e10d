#include "cgi/service_loop.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <stdio.h>
#include <sys/socket.h>
#include <unistd.h>

#include "cgi/client_connection.h"
#include "cgi/dispatch.h"
#include "cgi/dump_listener.h"
#include "cgi/spool.h"
#include "mon/monitor_thread.h"
#include "sockhand.h"

namespace {

constexpr int MAX_REQUEST = 4095;
constexpr useconds_t SHORTAGE_PAUSE_US = 100000;

char request_buffer[MAX_REQUEST + 1];

// False when it cannot be started.
bool start_monitor() {
    pthread_t thread;
    int error = pthread_create(&thread, nullptr, monitor_thread, nullptr);
    if (error == 0)
        return true;
    errno = error;
    perror("pthread_create");
    return false;
}

// False when there was none after all.
bool take_request(int cgi_socket) {
    int client_fd = -1;
    int length = sockhand_recv(cgi_socket, request_buffer, MAX_REQUEST, &client_fd);
    if (length <= 0)
        return false;
    prepare_client(client_fd);
    // The sender terminates its query; without this a shorter message from one that does not would
    // end in the query before it.
    request_buffer[length] = '\0';
    handle_request(client_fd, request_buffer, length);
    return true;
}

int accept_connection(int listener) {
    int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd == -1 && errno == ENOSYS) {  // MIPS before Linux 2.6.33
        fd = accept(listener, nullptr, nullptr);
        if (fd != -1)
            (void)fcntl(fd, F_SETFD, FD_CLOEXEC);
    }
    return fd;
}

// A failed accept is passed on as well: a client that waits is then disconnected with an empty
// core, and asks again.
void take_core(int segf_socket) {
    int core_fd = accept_connection(segf_socket);
    (void)send_dump(core_fd, "core");
    // For want of descriptors, mostly. The connection waits on, and the loop must not spin on it.
    if (core_fd == -1)
        (void)usleep(SHORTAGE_PAUSE_US);
}

}  // namespace

int service_loop(int cgi_socket, int segf_socket, const char *dump_dir) {
    if (!start_monitor())
        return 1;
    // Once found empty, the spool is never looked at again: what is put there later waits for the
    // next start of the service.
    bool spool_drained = false;
    for (;;) {
        pollfd sockets[] = {{.fd = cgi_socket, .events = POLLIN, .revents = 0},
                            {.fd = segf_socket, .events = POLLIN, .revents = 0}};
        const auto &[requests, cores] = sockets;
        int ready = poll(sockets, 2, -1);
        // The message is older than the call. select() itself has no room for large descriptors,
        // such as the service gets where it was started with a thousand open ones.
        if (ready == -1)
            perror("select");
        if (ready <= 0)
            continue;
        if (requests.revents != 0 && !take_request(cgi_socket))
            continue;
        if (cores.revents != 0) {
            take_core(segf_socket);
            continue;
        }
        if (!spool_drained)
            check_dumps(dump_dir, &spool_drained);
    }
}
