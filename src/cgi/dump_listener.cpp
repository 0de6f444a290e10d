#include "cgi/dump_listener.h"

#include <errno.h>
#include <stdint.h>
#include <sys/types.h>
#include <unistd.h>

#include <utility>

#include "cgi/http_reply.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr size_t BLOCK_SIZE = 65536;

int dump_listener_fd = -1;

// What has come is passed on at once, and not only when a block is full: the sender of a core keeps
// its connection open for seconds behind the last byte.
int copy_dump(int source_fd, int client_fd) {
    static char block[BLOCK_SIZE];
    for (;;) {
        ssize_t length = read(source_fd, block, sizeof block);
        if (length < 0 && errno == EINTR)
            continue;
        if (length <= 0)
            return length < 0 ? 1 : 0;
        if (write_all(client_fd, block, static_cast<uint32_t>(length)) < 0)
            return 1;
    }
}

}  // namespace

void set_dump_listener(int client_fd) {
    UniqueFd former(std::exchange(dump_listener_fd, client_fd));
}

int send_dump(int source_fd, const char *name) {
    UniqueFd source(source_fd);
    if (dump_listener_fd == -1)
        return 1;
    UniqueFd client(std::exchange(dump_listener_fd, -1));
    if (send_http_ok(client.get(), "application/octet-stream", name) != 0)
        return 1;
    return copy_dump(source.get(), client.get());
}
