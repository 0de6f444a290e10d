#include "cgi/client_connection.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

namespace {

struct IntOption {
    int level;
    int name;
    int value;
};

// Together two minutes on an idle connection; the user time-out is for one with data under way, in
// milliseconds.
constexpr IntOption OPTIONS[] = {
    {SOL_SOCKET, SO_KEEPALIVE, 1},           {IPPROTO_TCP, TCP_KEEPIDLE, 60},
    {IPPROTO_TCP, TCP_KEEPINTVL, 15},        {IPPROTO_TCP, TCP_KEEPCNT, 4},
    {IPPROTO_TCP, TCP_USER_TIMEOUT, 120000},
};

}  // namespace

void prepare_client(int fd) {
    (void)fcntl(fd, F_SETFD, FD_CLOEXEC);
    // These fail, as they may, on what is no TCP socket.
    for (const IntOption &option : OPTIONS)
        (void)setsockopt(fd, option.level, option.name, &option.value, sizeof option.value);
}
