// Messages to the service, from the dispatcher to the thread that would serve them. The input: a
// byte that tells what is the case meanwhile, then the message as a front end sends it.
//
// Nothing is started, signalled or looked up: the workers, and the readers of the process table,
// are stood in for here, so that the linker leaves the real ones out; kill() is replaced with the
// linker's --wrap.
#include <fcntl.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "archive/process_snapshot.h"
#include "cgi/dispatch.h"
#include "cgi/dump_listener.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "proc/process_table.h"

namespace {

constexpr size_t MAX_REQUEST = 4095;

bool threads_left;
bool someone_runs;

void require(bool holds) {
    if (!holds)
        abort();
}

template <typename Request>
int check(const Request *request) {
    return request->client_fd;
}

int check_strace(const StraceRequest *request) {
    require(request->nr_pids >= 1 && request->nr_pids <= 512 && request->running == 1);
    // None but those that the stand-ins know.
    for (uint32_t i = 0; i < request->nr_pids; ++i)
        require(request->pids[i] != -1);
    return request->client_fd;
}

int check_pcap(const PcapRequest *request) {
    require(request->duration >= 0 && request->totalsize >= 0);
    return request->client_fd;
}

int check_rtrace(const RtraceRequest *request) {
    require(request->items != 0 && (request->items & ~0x7ffu) == 0);
    return request->client_fd;
}

// The descriptor of the client that a worker was given, whose record is checked and released.
int take(void *(*routine)(void *), void *argument) {
    if (routine == run_ps_request)
        return static_cast<int>(reinterpret_cast<intptr_t>(argument));
    int client = -1;
    if (routine == run_strace_request)
        client = check_strace(static_cast<StraceRequest *>(argument));
    else if (routine == run_pcap_request)
        client = check_pcap(static_cast<PcapRequest *>(argument));
    else if (routine == run_rtrace_request)
        client = check_rtrace(static_cast<RtraceRequest *>(argument));
    else if (routine == run_archive_request)
        client = static_cast<ArchiveRequest *>(argument)->client_fd;
    else
        abort();
    free(argument);
    return client;
}

[[noreturn]] void *never() {
    abort();
}

bool is_reply(const std::string &reply) {
    return reply.empty() || reply.rfind("HTTP/1.0 200 OK\r\n", 0) == 0 ||
           reply.rfind("HTTP/1.0 400 Bad Request\r\n", 0) == 0 ||
           reply.rfind("HTTP/1.0 500 Internal Server Error\r\n", 0) == 0 ||
           reply.rfind("HTTP/1.0 503 Service Unavailable\r\n", 0) == 0;
}

}  // namespace

// ---- The stand-ins

std::atomic<uint32_t> archive_busy = 0;

bool start_worker(void *(*routine)(void *), void *argument, pthread_t *) {
    if (!threads_left)
        return false;
    const int client = take(routine, argument);
    require(fcntl(client, F_GETFD) != -1);
    close(client);
    return true;
}

void *run_archive_request(void *) {
    never();
}
void *run_pcap_request(void *) {
    never();
}
void *run_ps_request(void *) {
    never();
}
void *run_rtrace_request(void *) {
    never();
}
void *run_strace_request(void *) {
    never();
}

int dump_core_to_fd(int out_fd, pid_t pid) {
    require(fcntl(out_fd, F_GETFD) != -1 && pid >= 0);
    return 0;
}

int list_pids(pid_t *pids, int capacity, pid_t) {
    require(capacity == 512);
    const int count = someone_runs ? capacity : 0;
    std::fill(pids, pids + count, 17);
    return count;
}

void find_pids_by_name(const char *root, const char *name, pid_t *pids, int *count, int capacity) {
    require(strcmp(root, "/proc") == 0 && (capacity == 1 || capacity == 32));
    // As many as the length of the name says.
    const int found = static_cast<int>(strlen(name) % 40);
    *count = someone_runs ? std::min(found, capacity) : 0;
    std::fill(pids, pids + *count, 17);
}

extern "C" int __wrap_kill(pid_t pid, int signo);
extern "C" int __wrap_kill(pid_t pid, int signo) {
    require(signo == 0 && pid != -1);
    return someone_runs && pid % 2 == 0 ? 0 : -1;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 2)
        return 0;
    threads_left = (data[0] & 1) == 0;
    someone_runs = (data[0] & 2) == 0;
    archive_busy = (data[0] & 4) != 0;
    // A block of its own size, terminated as the service does, so that the sanitizer sees a byte
    // too many.
    const size_t length = std::min(size - 1, MAX_REQUEST);
    std::vector<char> message(data + 1, data + 1 + length);
    message.push_back('\0');

    int pair[2];
    require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) == 0);
    handle_request(pair[1], message.data(), static_cast<int>(length));
    // Who waits for a dump gets none.
    (void)send_dump(-1, "core");

    std::string reply;
    char block[1024];
    for (ssize_t n; (n = read(pair[0], block, sizeof block)) > 0;)
        reply.append(block, static_cast<size_t>(n));
    close(pair[0]);
    require(is_reply(reply));
    require(fcntl(pair[1], F_GETFD) == -1);
    return 0;
}
