#include <assert.h>
#include <poll.h>
#include <signal.h>
#include <time.h>

#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "trace/trace_engine.h"
#include "util/await_reader.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr int PATIENCE_S = 20;  // with a client that takes nothing
constexpr long REPEAT_NS = 50 * 1000000L;

void do_nothing(int) {}

// Without SA_RESTART, so that the signal ends the engine's waits.
void install_wake_up_signal() {
    struct sigaction action = {};
    action.sa_handler = do_nothing;
    (void)sigemptyset(&action.sa_mask);
    (void)sigaction(SIGUSR1, &action, nullptr);
}

// What the engine has to say. A failed write is no end: that is the watcher's to notice.
uint32_t cb_strace(intptr_t cookie, const char *text, uint32_t length) {
    auto *req = reinterpret_cast<StraceRequest *>(cookie);
    assert(req);
    if (static_cast<int32_t>(length) <= 0 || req->stuck)
        return req->running;
    if (await_reader(req->client_fd, PATIENCE_S, &req->running)) {
        (void)write_all(req->client_fd, text, length);
    } else {
        req->stuck = 1;
        req->running = 0;
    }
    return req->running;
}

// Waits until the client has gone (it has nothing to say after its request, so anything that can
// be read means that) or `running` is cleared. SIGUSR1 reaches this thread only while it waits, so
// that none comes in vain.
void await_end(const StraceRequest &req) {
    sigset_t none;
    (void)sigemptyset(&none);
    pollfd client = {.fd = req.client_fd, .events = POLLIN, .revents = 0};
    while (ppoll(&client, 1, nullptr, &none) <= 0) {
        if (!req.running)
            return;
    }
}

void *run_strace_watcher(void *strace_request) {
    auto *req = static_cast<StraceRequest *>(strace_request);
    assert(req);
    await_end(*req);
    req->running = 0;
    // A signal that comes just before the engine begins to wait wakes nobody.
    while (!req->traced) {
        (void)pthread_kill(req->tracer_thread, SIGUSR1);
        timespec pause = {.tv_sec = 0, .tv_nsec = REPEAT_NS};
        (void)nanosleep(&pause, nullptr);
    }
    return nullptr;
}

bool start_watcher(StraceRequest *req, pthread_t *watcher) {
    sigset_t wake_up;
    sigset_t before;
    (void)sigemptyset(&wake_up);
    (void)sigaddset(&wake_up, SIGUSR1);
    (void)pthread_sigmask(SIG_BLOCK, &wake_up, &before);  // the new thread's mask
    bool started = start_worker(run_strace_watcher, req, watcher);
    (void)pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return started;
}

void trace(StraceRequest *req) {
    TraceRequest request = {};
    request.output_cb = cb_strace;
    request.cookie = reinterpret_cast<intptr_t>(req);
    request.flags = static_cast<uint32_t>(-1);
    request.pids = req->pids;
    request.nr_pids = static_cast<int32_t>(req->nr_pids);
    request.timeout_s = -1;
    trace_run(&request);
}

}  // namespace

void *run_strace_request(void *strace_request) {
    UniqueBlock<StraceRequest> req(static_cast<StraceRequest *>(strace_request));
    assert(req);
    UniqueFd client(req->client_fd);
    req->tracer_thread = pthread_self();
    install_wake_up_signal();
    pthread_t watcher;
    if (!begin_worker(client.get()))
        return nullptr;
    if (!start_watcher(req.get(), &watcher)) {
        send_http_server_error(client.get());
        return nullptr;
    }
    (void)send_http_ok(client.get(), "text/plain", "stracedump.txt");
    trace(req.get());
    req->running = 0;
    req->traced = 1;
    (void)pthread_kill(watcher, SIGUSR1);
    (void)pthread_join(watcher, nullptr);
    return nullptr;
}
