#include "cgi/request/worker.h"

#include "cgi/http_reply.h"

namespace {

// The default of several MiB would let a 32-bit device run out of addresses after some hundred
// requests.
constexpr size_t STACK_SIZE = 512 * 1024;

}  // namespace

bool start_worker(void *(*routine)(void *), void *argument, pthread_t *thread) {
    pthread_attr_t attributes;
    if (pthread_attr_init(&attributes) != 0)
        return false;
    (void)pthread_attr_setstacksize(&attributes, STACK_SIZE);
    pthread_t unnamed;
    pthread_t *started_thread = thread != nullptr ? thread : &unnamed;
    bool started = pthread_create(started_thread, &attributes, routine, argument) == 0;
    (void)pthread_attr_destroy(&attributes);
    return started;
}

bool begin_worker(int client_fd) {
    if (pthread_detach(pthread_self()) == 0)
        return true;
    send_http_server_error(client_fd);
    return false;
}
