#include "proc/known_sockets.h"

#include <pthread.h>
#include <stdint.h>
#include <string.h>
#include <sys/un.h>

#include "proc/socket_diag.h"
#include "util/line_text.h"

namespace {

constexpr size_t SLOTS = 256;  // by inode: a newer socket takes an older one's place
constexpr size_t NAME_SIZE = sizeof(sockaddr_un::sun_path);
constexpr size_t TEXT_SIZE = NAME_SIZE + 3;

// As many questions about known sockets in a row without an answer, and the kernel is taken to have
// none: also to ask costs time.
constexpr int MAX_SILENCE = 8;

enum class Kind : uint8_t { NONE, TCP, UNIX };

struct UnixSocket {
    int name_length;
    char name[NAME_SIZE];
    char text[TEXT_SIZE];
};

struct KnownSocket {
    Kind kind;
    unsigned long inode;
    union {
        TcpSocket tcp;
        UnixSocket unix_socket;
    };
};

pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
KnownSocket known[SLOTS];
int silence = 0;

class Lock {
  public:
    Lock() { (void)pthread_mutex_lock(&lock); }
    ~Lock() { (void)pthread_mutex_unlock(&lock); }
    Lock(const Lock &) = delete;
    Lock &operator=(const Lock &) = delete;
};

int describe(const KnownSocket &socket, char *buf, size_t size) {
    if (socket.kind == Kind::TCP) {
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
    if (socket.kind == Kind::NONE || socket.inode != inode)
        return NO_MATCH;
    int length = describe(socket, buf, size);
    silence = length != NO_MATCH ? 0 : silence + 1;
    if (length == NO_MATCH)
        socket.kind = Kind::NONE;
    return length;
}

void remember_tcp_socket(unsigned long inode, const TcpSocket &socket) {
    Lock guard;
    KnownSocket &slot = known[inode % SLOTS];
    slot.kind = Kind::TCP;
    slot.inode = inode;
    slot.tcp = socket;
}

void remember_unix_socket(unsigned long inode, const char *name, int name_length,
                          const char *text) {
    if (name_length < 0 || static_cast<size_t>(name_length) > NAME_SIZE ||
        strlen(text) >= TEXT_SIZE)
        return;
    Lock guard;
    KnownSocket &slot = known[inode % SLOTS];
    slot.kind = Kind::UNIX;
    slot.inode = inode;
    slot.unix_socket.name_length = name_length;
    memcpy(slot.unix_socket.name, name, static_cast<size_t>(name_length));
    memcpy(slot.unix_socket.text, text, strlen(text) + 1);
}

bool sockets_can_be_known() {
    Lock guard;
    return silence < MAX_SILENCE;
}

void forget_sockets() {
    Lock guard;
    silence = 0;
    for (KnownSocket &socket : known)
        socket.kind = Kind::NONE;
}
