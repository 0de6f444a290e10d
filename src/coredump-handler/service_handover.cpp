#include "coredump-handler/service_handover.h"

#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr int ANSWER_TIMEOUT_MS = 5000;

bool connect_to(int sock, const char *path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (strlen(path) >= sizeof address.sun_path)
        return false;
    strcpy(address.sun_path, path);
    return connect(sock, reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0;
}

}  // namespace

bool hand_core_over(const char *path) {
    const UniqueFd sock(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!sock.valid())
        return false;
    if (!connect_to(sock.get(), path)) {
        fprintf(stderr, "connect to %s failed\n", path);
        return false;
    }
    // A service that has gone has taken what it wanted: without a listener it hangs up at once.
    (void)copy_fd(STDIN_FILENO, sock.get());
    // The end of the core is not told by shutting the connection down: it is the service's part to
    // close it, and one that is still reading is given the time for that.
    wait_for_answer(sock.get(), ANSWER_TIMEOUT_MS);
    return true;
}

void wait_for_answer(int sock, int timeout_ms) {
    pollfd ready = {sock, POLLIN, 0};
    const int count = poll(&ready, 1, timeout_ms);
    // Whoever reads these messages knows them under this name.
    if (count < 0)
        perror("select()");
    if (count > 0) {
        char answer[8];
        // Nothing depends on what it says.
        (void)!read(sock, answer, sizeof answer);
    }
}
