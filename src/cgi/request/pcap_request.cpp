#include <assert.h>

#include "archive/system_snapshot.h"
#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "util/unique_fd.h"

void *run_pcap_request(void *pcap_request_record) {
    UniqueBlock<PcapRequest> req(static_cast<PcapRequest *>(pcap_request_record));
    assert(req);
    UniqueFd client(req->client_fd);
    if (begin_worker(client.get())) {
        (void)send_http_ok(client.get(), "application/octet-stream", "pcapdump.cap");
        (void)pcap_request(client.get(), req->duration, req->totalsize);
    }
    return nullptr;
}
