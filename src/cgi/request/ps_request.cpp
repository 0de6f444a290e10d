#include <assert.h>

#include "archive/system_snapshot.h"
#include "cgi/http_reply.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "util/unique_fd.h"

void *run_ps_request(void *data) {
    assert(data);
    UniqueFd client(static_cast<int>(reinterpret_cast<intptr_t>(data)));
    if (begin_worker(client.get())) {
        (void)send_http_ok(client.get(), "text/plain", "psdump.txt");
        run_ps(client.get());
    }
    return nullptr;
}
