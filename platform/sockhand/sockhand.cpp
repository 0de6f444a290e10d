// A server waits for its listening socket and for every connection that has not sent its message
// yet with one epoll descriptor, which is what the caller gets. So a sender that connects and sends
// nothing costs a slot, and nobody waits for it.
#include "sockhand.h"

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

namespace {

// Connections that wait for their message. When all slots are taken the oldest one loses its own:
// a sender that means it sends at once.
constexpr int MAX_WAITING = 32;
// Work for one call of sockhand_recv; what is left keeps the descriptor readable.
constexpr int MAX_EVENTS = 2 * MAX_WAITING;
constexpr int SEND_TIMEOUT_S = 5;
constexpr useconds_t SHORTAGE_PAUSE_US = 20000;

struct Connection {
    int fd;  // -1: the slot is free
    uint64_t serial;
};

struct Server {
    int epoll_fd;
    int listener;
    int reserve;  // given up for a moment to turn a sender away when no other descriptor is left
    uint64_t next_serial;
    Connection waiting[MAX_WAITING];
    Server *next;
};

// One thread at a time calls for one server, but servers come and go in any thread.
pthread_mutex_t servers_lock = PTHREAD_MUTEX_INITIALIZER;
Server *servers = nullptr;

void close_quietly(int fd) {
    if (fd < 0)
        return;
    const int saved_errno = errno;
    (void)close(fd);
    errno = saved_errno;
}

Server *find_server(int epoll_fd) {
    pthread_mutex_lock(&servers_lock);
    Server *server = servers;
    while (server != nullptr && server->epoll_fd != epoll_fd)
        server = server->next;
    pthread_mutex_unlock(&servers_lock);
    return server;
}

// Takes the server out of the list.
Server *remove_server(int epoll_fd) {
    pthread_mutex_lock(&servers_lock);
    Server **link = &servers;
    while (*link != nullptr && (*link)->epoll_fd != epoll_fd)
        link = &(*link)->next;
    Server *server = *link;
    if (server != nullptr)
        *link = server->next;
    pthread_mutex_unlock(&servers_lock);
    return server;
}

// All but the descriptor that the caller has.
void release_server(Server *server) {
    close_quietly(server->listener);
    close_quietly(server->reserve);
    for (const Connection &connection : server->waiting)
        close_quietly(connection.fd);
    free(server);
}

bool fill_address(const char *path, sockaddr_un *address) {
    const size_t length = strlen(path);
    if (length >= sizeof(address->sun_path)) {
        errno = ENAMETOOLONG;
        return false;
    }
    *address = {};
    address->sun_family = AF_UNIX;
    memcpy(address->sun_path, path, length);
    return true;
}

int listen_at(const char *path, int mode) {
    sockaddr_un address;
    if (!fill_address(path, &address))
        return -1;
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0)
        return -1;
    // The first takes effect when the file is made, which is thus never open to more than it should
    // be; the second gives what the file-creation mask took away.
    const mode_t permissions = static_cast<mode_t>(mode) & 07777;
    if (fchmod(fd, permissions) == 0 &&
        bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof(address)) == 0) {
        if (chmod(path, permissions) == 0 && listen(fd, SOMAXCONN) == 0)
            return fd;
        const int saved_errno = errno;
        (void)unlink(path);
        errno = saved_errno;
    }
    close_quietly(fd);
    return -1;
}

// `slot` is the index of a waiting connection, or MAX_WAITING for the listening socket.
bool watch(const Server *server, int fd, int slot) {
    epoll_event event = {};
    event.events = EPOLLIN;
    event.data.u32 = static_cast<uint32_t>(slot);
    return epoll_ctl(server->epoll_fd, EPOLL_CTL_ADD, fd, &event) == 0;
}

// To close it would take it out of the epoll set as well, but not as long as a child that has just
// been forked has a copy.
void drop_connection(const Server *server, Connection *connection) {
    if (connection->fd < 0)
        return;
    const int saved_errno = errno;
    (void)epoll_ctl(server->epoll_fd, EPOLL_CTL_DEL, connection->fd, nullptr);
    (void)close(connection->fd);
    errno = saved_errno;
    connection->fd = -1;
}

// A free slot, or else that of the connection that has waited longest.
int choose_slot(Server *server) {
    int chosen = 0;
    for (int i = 0; i < MAX_WAITING; ++i) {
        if (server->waiting[i].fd < 0)
            return i;
        if (server->waiting[i].serial < server->waiting[chosen].serial)
            chosen = i;
    }
    return chosen;
}

int accept_nonblocking(const Server *server) {
    return accept4(server->listener, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
}

int open_reserve() {
    return open("/dev/null", O_RDONLY | O_CLOEXEC);
}

// Accepts when no descriptor is left. Those who connected and have not sent anything by now must
// not keep out those who may; and when nobody waits, the sender is turned away, since a caller that
// waits for the listening socket would otherwise spin.
int accept_without_descriptors(Server *server) {
    bool freed = false;
    for (Connection &connection : server->waiting) {
        freed = freed || connection.fd >= 0;
        drop_connection(server, &connection);
    }
    if (freed)
        return accept_nonblocking(server);
    close_quietly(server->reserve);
    close_quietly(accept_nonblocking(server));
    server->reserve = open_reserve();
    // Another thread was faster. Until it gives one back there is nobody to be turned away.
    if (server->reserve < 0)
        (void)usleep(SHORTAGE_PAUSE_US);
    return -1;
}

// Whether an accept that failed with `error` will fail again at once, and the listening socket stay
// readable.
bool is_shortage(int error) {
    return error == ENOMEM || error == ENOBUFS;
}

// Accepts one connection. Returns its slot, or -1.
int accept_connection(Server *server) {
    int fd = accept_nonblocking(server);
    if (fd < 0 && (errno == EMFILE || errno == ENFILE))
        fd = accept_without_descriptors(server);
    if (fd < 0) {
        if (is_shortage(errno))
            (void)usleep(SHORTAGE_PAUSE_US);
        return -1;
    }
    const int slot = choose_slot(server);
    Connection *connection = &server->waiting[slot];
    drop_connection(server, connection);
    if (!watch(server, fd, slot)) {
        close_quietly(fd);
        return -1;
    }
    connection->fd = fd;
    connection->serial = server->next_serial++;
    return slot;
}

// The first descriptor in the control data of `message`; closes the others. -1 when there is none.
int take_descriptor(msghdr *message) {
    int taken = -1;
    for (cmsghdr *control = CMSG_FIRSTHDR(message); control != nullptr;
         control = CMSG_NXTHDR(message, control)) {
        if (control->cmsg_level != SOL_SOCKET || control->cmsg_type != SCM_RIGHTS)
            continue;
        const size_t count = (control->cmsg_len - CMSG_LEN(0)) / sizeof(int);
        for (size_t i = 0; i < count; ++i) {
            int fd;
            memcpy(&fd, CMSG_DATA(control) + i * sizeof(int), sizeof(int));
            if (taken < 0)
                taken = fd;
            else
                close_quietly(fd);
        }
    }
    return taken;
}

// Receives the message of a connection. Returns its length with the descriptor in `*fd`; -1 with
// EAGAIN when it has not come yet; -1 with any other error when this sender will not send one.
int receive_message(int connection, void *buf, int max, int *fd) {
    // What does not fit is refused: half a request is a different request.
    char overflow;
    iovec pieces[2] = {{buf, static_cast<size_t>(max)}, {&overflow, 1}};
    // Room for one descriptor. The kernel closes those that do not fit, but alignment may leave
    // room for a second.
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))];
    msghdr message = {};
    message.msg_iov = pieces;
    message.msg_iovlen = 2;
    message.msg_control = control;
    message.msg_controllen = sizeof(control);

    ssize_t got;
    do {
        got = recvmsg(connection, &message, MSG_CMSG_CLOEXEC);
    } while (got < 0 && errno == EINTR);
    if (got < 0)
        return -1;
    *fd = take_descriptor(&message);
    if (*fd >= 0 && got > 0 && got <= max)
        return static_cast<int>(got);
    close_quietly(*fd);
    *fd = -1;
    errno = EPROTO;
    return -1;
}

}  // namespace

int sockhand_server_socket(const char *path, int mode) {
    Server *server = static_cast<Server *>(calloc(1, sizeof(Server)));
    const int epoll_fd = server != nullptr ? epoll_create1(EPOLL_CLOEXEC) : -1;
    if (epoll_fd < 0) {
        free(server);
        return -1;
    }
    // A caller that closed an earlier descriptor of this number by itself left its server behind.
    Server *forgotten = remove_server(epoll_fd);
    if (forgotten != nullptr)
        release_server(forgotten);

    server->epoll_fd = epoll_fd;
    server->reserve = open_reserve();
    for (Connection &connection : server->waiting)
        connection.fd = -1;
    server->listener = listen_at(path, mode);
    if (server->listener < 0 || !watch(server, server->listener, MAX_WAITING)) {
        if (server->listener >= 0)
            (void)unlink(path);
        release_server(server);
        close_quietly(epoll_fd);
        return -1;
    }
    pthread_mutex_lock(&servers_lock);
    server->next = servers;
    servers = server;
    pthread_mutex_unlock(&servers_lock);
    return epoll_fd;
}

int sockhand_recv(int sock, void *buf, int max, int *fd) {
    *fd = -1;
    Server *server = find_server(sock);
    if (server == nullptr || max <= 0) {
        errno = server == nullptr ? EBADF : EINVAL;
        return -1;
    }
    for (int i = 0; i < MAX_EVENTS; ++i) {
        epoll_event event;
        const int ready = epoll_wait(server->epoll_fd, &event, 1, 0);
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            break;
        int slot = static_cast<int>(event.data.u32);
        if (slot == MAX_WAITING)
            slot = accept_connection(server);
        if (slot < 0)
            break;  // whoever else is there keeps the descriptor readable
        Connection *connection = &server->waiting[slot];
        const int length = receive_message(connection->fd, buf, max, fd);
        if (length < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            continue;  // its message is still to come
        drop_connection(server, connection);
        return length;
    }
    errno = EAGAIN;
    return -1;
}

void sockhand_close(int sock) {
    Server *server = remove_server(sock);
    if (server != nullptr)
        release_server(server);
    close_quietly(sock);
}

int sockhand_send(const char *path, const void *buf, int len, int fd) {
    sockaddr_un address;
    if (!fill_address(path, &address))
        return -1;
    if (len <= 0) {
        errno = EINVAL;
        return -1;
    }
    const int sock = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (sock < 0)
        return -1;
    // This bounds the connecting as well.
    const timeval timeout = {SEND_TIMEOUT_S, 0};
    (void)setsockopt(sock, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof(timeout));

    iovec piece = {const_cast<void *>(buf), static_cast<size_t>(len)};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message = {};
    message.msg_iov = &piece;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof(control);
    cmsghdr *header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int));
    memcpy(CMSG_DATA(header), &fd, sizeof(int));

    int result = -1;
    if (connect(sock, reinterpret_cast<const sockaddr *>(&address), sizeof(address)) == 0) {
        const ssize_t sent = sendmsg(sock, &message, MSG_NOSIGNAL);
        if (sent == len)
            result = 0;
        else if (sent >= 0)
            errno = EMSGSIZE;
    }
    close_quietly(sock);
    return result;
}
