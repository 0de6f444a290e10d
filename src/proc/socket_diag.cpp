#include "proc/socket_diag.h"

#include <arpa/inet.h>
#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <linux/sock_diag.h>
#include <linux/unix_diag.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <utility>

#include "util/unique_fd.h"

namespace {

// More than the answer about one socket takes.
struct Reply {
    alignas(nlmsghdr) char bytes[4096];
};

// A socket that has been asked and answered, to be asked again; -1 for none, or while it is in use.
std::atomic<int> kept_fd = -1;

UniqueFd take_socket() {
    UniqueFd kept(kept_fd.exchange(-1));
    if (kept.valid())
        return kept;
    return UniqueFd(socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
}

void keep_socket(UniqueFd fd) {
    UniqueFd former(kept_fd.exchange(fd.release()));
}

// Sends `request`, which begins with its header, and gives the body of the answer, of at least
// `min_length` bytes; null when there is none.
template <typename Request>
const void *ask(Request *request, Reply *reply, size_t min_length, size_t *length) {
    UniqueFd netlink = take_socket();
    request->header.nlmsg_len = sizeof *request;
    request->header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
    request->header.nlmsg_flags = NLM_F_REQUEST;
    if (!netlink.valid() || send(netlink.get(), request, sizeof *request, 0) < 0)
        return nullptr;
    // The answer is there when the question has been sent.
    ssize_t n = recv(netlink.get(), reply->bytes, sizeof reply->bytes, MSG_DONTWAIT);
    if (n >= 0)
        keep_socket(std::move(netlink));
    nlmsghdr header;
    if (n < static_cast<ssize_t>(NLMSG_HDRLEN + min_length))
        return nullptr;
    memcpy(&header, reply->bytes, sizeof header);
    if (header.nlmsg_type != SOCK_DIAG_BY_FAMILY || header.nlmsg_len > static_cast<size_t>(n) ||
        header.nlmsg_len < NLMSG_HDRLEN + min_length)
        return nullptr;
    *length = header.nlmsg_len - NLMSG_HDRLEN;
    return reply->bytes + NLMSG_HDRLEN;
}

// Beyond this the tables' lines have their inode numbers in another column, where none is found.
constexpr uint32_t WIDEST_USER_ID = 99999;

// The kernel also answers with a listener that would take a connection with the ends that it was
// asked for, and that may be the same socket, which was connected before.
bool same_ends(const inet_diag_sockid &a, const inet_diag_sockid &b, bool ipv6) {
    const size_t address_size = ipv6 ? sizeof(in6_addr) : sizeof(in_addr);
    return a.idiag_sport == b.idiag_sport && a.idiag_dport == b.idiag_dport &&
           memcmp(a.idiag_src, b.idiag_src, address_size) == 0 &&
           memcmp(a.idiag_dst, b.idiag_dst, address_size) == 0;
}

}  // namespace

void close_diag() {
    UniqueFd kept(kept_fd.exchange(-1));
}

int diag_tcp_state(const TcpSocket &socket, unsigned long inode) {
    struct {
        nlmsghdr header;
        inet_diag_req_v2 body;
    } request = {};
    request.body.sdiag_family = socket.ipv6 ? AF_INET6 : AF_INET;
    request.body.sdiag_protocol = IPPROTO_TCP;
    request.body.idiag_states = ~0U;
    inet_diag_sockid &id = request.body.id;
    id.idiag_sport = htons(static_cast<uint16_t>(socket.local_port));
    id.idiag_dport = htons(static_cast<uint16_t>(socket.remote_port));
    std::copy(std::begin(socket.local), std::end(socket.local), id.idiag_src);
    std::copy(std::begin(socket.remote), std::end(socket.remote), id.idiag_dst);
    id.idiag_cookie[0] = id.idiag_cookie[1] = static_cast<uint32_t>(INET_DIAG_NOCOOKIE);

    Reply reply;
    size_t length;
    inet_diag_msg answer;
    const void *body = ask(&request, &reply, sizeof answer, &length);
    if (body == nullptr)
        return DIAG_UNKNOWN;
    memcpy(&answer, body, sizeof answer);
    if (answer.idiag_inode != inode || !same_ends(answer.id, id, socket.ipv6) ||
        answer.idiag_uid > WIDEST_USER_ID)
        return DIAG_UNKNOWN;
    return answer.idiag_state;
}

int diag_unix_name(unsigned long inode, char *name, size_t size) {
    struct {
        nlmsghdr header;
        unix_diag_req body;
    } request = {};
    request.body.sdiag_family = AF_UNIX;
    request.body.udiag_states = ~0U;
    request.body.udiag_ino = static_cast<uint32_t>(inode);
    request.body.udiag_show = UDIAG_SHOW_NAME;
    request.body.udiag_cookie[0] = request.body.udiag_cookie[1] = ~0U;

    Reply reply;
    size_t length;
    const void *body = ask(&request, &reply, sizeof(unix_diag_msg), &length);
    if (body == nullptr)
        return DIAG_UNKNOWN;
    unix_diag_msg answer;
    memcpy(&answer, body, sizeof answer);
    if (answer.udiag_ino != inode)
        return DIAG_UNKNOWN;
    const char *attribute = static_cast<const char *>(body) + NLMSG_ALIGN(sizeof answer);
    const char *end = static_cast<const char *>(body) + length;
    while (end - attribute >= static_cast<ptrdiff_t>(sizeof(rtattr))) {
        rtattr header;
        memcpy(&header, attribute, sizeof header);
        if (header.rta_len < sizeof header || header.rta_len > end - attribute)
            break;
        if (header.rta_type == UNIX_DIAG_NAME) {
            const size_t name_length = header.rta_len - RTA_LENGTH(0);
            if (name_length > size)
                return DIAG_UNKNOWN;
            memcpy(name, attribute + RTA_LENGTH(0), name_length);
            return static_cast<int>(name_length);
        }
        attribute += RTA_ALIGN(header.rta_len);
    }
    return 0;
}
