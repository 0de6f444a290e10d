#include "cgi/dispatch.h"

#include <signal.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <utility>

#include "archive/process_snapshot.h"
#include "cgi/dump_listener.h"
#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "cgi/request_values.h"
#include "formvars.h"
#include "proc/process_table.h"
#include "rtrace/trace_items.h"
#include "util/unique_fd.h"

namespace {

constexpr int32_t DEFAULT_INTERVAL = 10;  // seconds

bool begins_with(const char *text, const char *prefix) {
    return strncmp(text, prefix, strlen(prefix)) == 0;
}

// Hands `client` and `request`, which holds it, over to a thread. When there is none, the client
// gets the 500 reply. Returns whether it runs.
template <typename Request>
bool start(void *(*routine)(void *), UniqueBlock<Request> request, UniqueFd client) {
    if (request == nullptr || !start_worker(routine, request.get())) {
        send_http_server_error(client.get());
        return false;
    }
    (void)request.release();
    (void)client.release();
    return true;
}

template <typename Request>
UniqueBlock<Request> new_request(const UniqueFd &client) {
    UniqueBlock<Request> request(static_cast<Request *>(calloc(1, sizeof(Request))));
    if (request != nullptr)
        request->client_fd = client.get();
    return request;
}

// ---- The commands. The variables of the query are there while they run.

void serve_core(UniqueFd client) {
    const char *process = CGI_get_value("pid");
    if (process == nullptr) {
        set_dump_listener(client.release());
        return;
    }
    pid_t pid = find_process(process);
    if (pid < 0 || kill(pid, 0) != 0) {
        send_http_bad_request(client.get());
        return;
    }
    (void)send_http_ok(client.get(), "application/octet-stream", "core");
    (void)dump_core_to_fd(client.get(), pid);
}

void serve_pcap(UniqueFd client) {
    auto request = new_request<PcapRequest>(client);
    if (request != nullptr) {
        request->duration = std::max(number_or_minus_one(CGI_get_value("duration")), 0);
        request->totalsize = std::max(number_or_minus_one(CGI_get_value("totalsize")), 0);
    }
    (void)start(run_pcap_request, std::move(request), std::move(client));
}

void serve_ps(UniqueFd client) {
    // The descriptor itself is the argument.
    if (start_worker(run_ps_request, reinterpret_cast<void *>(static_cast<intptr_t>(client.get()))))
        (void)client.release();
    else
        send_http_server_error(client.get());
}

void serve_strace(UniqueFd client) {
    auto request = new_request<StraceRequest>(client);
    if (request == nullptr) {
        send_http_server_error(client.get());
        return;
    }
    const char *processes = CGI_get_value("pid");
    int count = 0;
    if (processes == nullptr)
        count = list_pids(request->pids, MAX_TRACED, -1);
    else
        add_pid_list(processes, request->pids, &count);
    if (count == 0) {
        send_http_bad_request(client.get());
        return;
    }
    request->nr_pids = static_cast<uint32_t>(count);
    request->running = 1;
    (void)start(run_strace_request, std::move(request), std::move(client));
}

void serve_rtrace(UniqueFd client) {
    auto request = new_request<RtraceRequest>(client);
    if (request != nullptr) {
        const char *interval = CGI_get_value("interval");
        request->interval = interval != nullptr ? number_or_minus_one(interval) : DEFAULT_INTERVAL;
        const char *items = CGI_get_value("trace");
        request->items = items != nullptr ? parse_trace_items(items) : ITEMS_FAST;
    }
    (void)start(run_rtrace_request, std::move(request), std::move(client));
}

struct Command {
    const char *prefix;  // of the value of "cmd"
    void (*serve)(UniqueFd client);
};

// A value only needs to begin like one of these; the first one counts.
constexpr Command COMMANDS[] = {
    {"coredump", serve_core}, {"pcapdump", serve_pcap}, {"ps", serve_ps},
    {"strace", serve_strace}, {"rtrace", serve_rtrace},
};

void serve_command(const char *name, UniqueFd client) {
    for (const Command &command : COMMANDS) {
        if (begins_with(name, command.prefix)) {
            command.serve(std::move(client));
            return;
        }
    }
    send_http_bad_request(client.get());
}

// ---- Without a command

void serve_archive(const char *file, UniqueFd client) {
    if (archive_busy.exchange(1) != 0) {
        send_http_status_page(client.get(), "503 Service Unavailable",
                              "Another Crash Report generation is in progress. "
                              "Please try again later ... ");
        return;
    }
    auto request = new_request<ArchiveRequest>(client);
    if (request != nullptr)
        request->gzip = begins_with(file, "debug.tgz") || begins_with(file, "coredumps.tgz");
    if (!start(run_archive_request, std::move(request), std::move(client)))
        archive_busy = 0;
}

void serve_path(const char *path, const char *query, UniqueFd client) {
    const char *slash = strrchr(path, '/');
    if (slash == nullptr)
        send_http_server_error(client.get());
    else if (begins_with(query, "listen"))
        set_dump_listener(client.release());
    else
        serve_archive(slash + 1, std::move(client));
}

}  // namespace

void handle_request(int client_fd, const char *message, int length) {
    UniqueFd client(client_fd);
    const void *path_end = memchr(message, '\0', static_cast<size_t>(length));
    if (path_end == nullptr) {
        send_http_server_error(client.get());
        return;
    }
    const char *query = static_cast<const char *>(path_end) + 1;
    CGI_set_query(query);
    CGI_save_env();
    const char *command = CGI_get_value("cmd");
    if (command != nullptr)
        serve_command(command, std::move(client));
    else
        serve_path(message, query, std::move(client));
    CGI_cleanup();
}
