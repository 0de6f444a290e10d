#include "proc/known_sockets.h"

#include <pthread.h>
#include <string.h>
#include <sys/un.h>

#include <algorithm>

#include "proc/socket_diag.h"
#include "util/line_text.h"

namespace {

constexpr size_t SLOTS = 256;  // by inode: a newer socket takes an older one's place
constexpr size_t NAME_SIZE = sizeof(sockaddr_un::sun_path);
constexpr size_t TEXT_SIZE = NAME_SIZE + 3;

// As many questions in a row about sockets that are in the tables without an answer, and the kernel
// is taken to have none: also to ask costs time, much where it looks for a module each time.
constexpr int MAX_SILENCE = 8;

struct UnixSocket {
    int name_length;
    char name[NAME_SIZE];
    char text[TEXT_SIZE];
};

struct KnownSocket {
    bool known;
    SocketKind kind;
    unsigned long inode;
    union {
        TcpSocket tcp;
        UnixSocket unix_socket;
    };
};

pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
KnownSocket known[SLOTS];
int silence[2];  // by kind

class Lock {
  public:
    Lock() { (void)pthread_mutex_lock(&lock); }
    ~Lock() { (void)pthread_mutex_unlock(&lock); }
    Lock(const Lock &) = delete;
    Lock &operator=(const Lock &) = delete;
};

void note_answer(SocketKind kind, bool answered) {
    int &count = silence[static_cast<size_t>(kind)];
    count = answered ? 0 : std::min(count + 1, MAX_SILENCE);
}

bool answers(SocketKind kind) {
    return silence[static_cast<size_t>(kind)] < MAX_SILENCE;
}

KnownSocket *remember(unsigned long inode, SocketKind kind) {
    KnownSocket &slot = known[inode % SLOTS];
    slot.known = true;
    slot.kind = kind;
    slot.inode = inode;
    return &slot;
}

int describe(const KnownSocket &socket, char *buf, size_t size) {
    if (socket.kind == SocketKind::TCP) {
        int state = diag_tcp_state(socket.tcp, socket.inode);
        if (state == DIAG_UNKNOWN)
            return NO_MATCH;
        TcpSocket now = socket.tcp;
        now.state = static_cast<unsigned long>(state);
        return format_tcp_socket(now, buf, size);
    }
    char name[NAME_SIZE];
    int length = diag_unix_name(socket.inode, name, sizeof name);
    const UnixSocket &before = socket.unix_socket;
    if (length != before.name_length || memcmp(name, before.name, static_cast<size_t>(length)) != 0)
        return NO_MATCH;
    if (*before.text == '\0')
        return 0;
    LineText text(buf, size);
    text.add("%s", before.text);
    return text.length();
}

}  // namespace

int describe_known_socket(unsigned long inode, char *buf, size_t size) {
    Lock guard;
    KnownSocket &socket = known[inode % SLOTS];
    if (!socket.known || socket.inode != inode)
        return NO_MATCH;
    int length = describe(socket, buf, size);
    socket.known = length != NO_MATCH;
    note_answer(socket.kind, socket.known);
    return length;
}

void remember_tcp_socket(unsigned long inode, const TcpSocket &socket) {
    Lock guard;
    if (answers(SocketKind::TCP))
        remember(inode, SocketKind::TCP)->tcp = socket;
}

void remember_unix_socket(unsigned long inode, const char *name, int name_length,
                          const char *text) {
    Lock guard;
    note_answer(SocketKind::UNIX, name_length >= 0);
    if (name_length < 0 || static_cast<size_t>(name_length) > NAME_SIZE ||
        strlen(text) >= TEXT_SIZE)
        return;
    UnixSocket &socket = remember(inode, SocketKind::UNIX)->unix_socket;
    socket.name_length = name_length;
    memcpy(socket.name, name, static_cast<size_t>(name_length));
    memcpy(socket.text, text, strlen(text) + 1);
}

bool sockets_can_be_known(SocketKind kind) {
    Lock guard;
    return answers(kind);
}

void forget_sockets() {
    Lock guard;
    silence[0] = silence[1] = 0;
    for (KnownSocket &socket : known)
        socket.known = false;
}
