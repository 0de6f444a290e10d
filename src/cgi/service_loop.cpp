#include "cgi/service_loop.h"

#include <errno.h>
#include <pthread.h>
#include <stdio.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>

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

// A failed accept is passed on as well: a client that waits is then disconnected with an empty
// core, and asks again.
void take_core(int segf_socket) {
    int core_fd = accept4(segf_socket, nullptr, nullptr, SOCK_CLOEXEC);
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
        fd_set readable;
        FD_ZERO(&readable);
        FD_SET(cgi_socket, &readable);
        FD_SET(segf_socket, &readable);
        int ready =
            select(std::max(cgi_socket, segf_socket) + 1, &readable, nullptr, nullptr, nullptr);
        if (ready == -1)
            perror("select");
        if (ready <= 0)
            continue;
        if (FD_ISSET(cgi_socket, &readable) && !take_request(cgi_socket))
            continue;
        if (FD_ISSET(segf_socket, &readable)) {
            take_core(segf_socket);
            continue;
        }
        if (!spool_drained)
            check_dumps(dump_dir, &spool_drained);
    }
}
