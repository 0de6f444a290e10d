#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "rtrace/rtrace.h"
#include "util/unique_fd.h"

void *run_rtrace_request(void *rtrace_request) {
    UniqueBlock<RtraceRequest> req(static_cast<RtraceRequest *>(rtrace_request));
    UniqueFd client(req->client_fd);
    if (!begin_worker(client.get()))
        return nullptr;
    Rtrace *trace = rtrace_create(client.get(), req->interval, req->items);
    if (trace == nullptr) {
        send_http_server_error(client.get());
        return nullptr;
    }
    (void)send_http_ok(client.get(), "application/octet-stream", "rtrace");
    rtrace_run(trace);
    rtrace_free(trace);
    return nullptr;
}
