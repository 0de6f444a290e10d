#include <assert.h>

#include "archive/gzip_stream.h"
#include "archive/write_archive.h"
#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "util/unique_fd.h"

std::atomic<uint32_t> archive_busy = 0;

void *run_archive_request(void *archive_request) {
    UniqueBlock<ArchiveRequest> req(static_cast<ArchiveRequest *>(archive_request));
    assert(req);
    UniqueFd client(req->client_fd);
    if (begin_worker(client.get())) {
        (void)send_http_ok(client.get(), "application/x-tar",
                           req->gzip ? "debug.tgz" : "debug.tar");
        if (req->gzip)
            write_archive_gz(client.get());
        else
            write_archive_tar(client.get());
    }
    client.reset();
    archive_busy = 0;
    return nullptr;
}
