#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sockhand.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/temp_dir.h"

namespace {

// The file that a descriptor stands for, whatever its number.
std::pair<dev_t, ino_t> identity(int fd) {
    struct stat status = {};
    EXPECT_EQ(fstat(fd, &status), 0) << strerror(errno);
    return {status.st_dev, status.st_ino};
}

struct Received {
    int length;
    std::string text;
    int fd;
};

class SockHand : public testing::Test {
  protected:
    void SetUp() override {
        descriptors_before_ = count_descriptors(getpid());
        server_ = sockhand_server_socket(path().c_str(), 0666);
        ASSERT_GE(server_, 0) << strerror(errno);
        ASSERT_EQ(pipe2(pipe_, O_CLOEXEC), 0);
    }

    void TearDown() override {
        close(pipe_[0]);
        close(pipe_[1]);
        sockhand_close(server_);
        EXPECT_EQ(count_descriptors(getpid()), descriptors_before_)
            << "a descriptor was left behind";
    }

    std::string path() const { return dir_ / "socket"; }

    bool readable(int timeout_ms = 0) const {
        pollfd poll_fd = {server_, POLLIN, 0};
        return poll(&poll_fd, 1, timeout_ms) == 1;
    }

    int send(const std::string &text) const {
        return sockhand_send(path().c_str(), text.data(), static_cast<int>(text.size()), pipe_[1]);
    }

    Received receive(int max = 4095) const {
        std::string buffer(static_cast<size_t>(max) + 1, '\x55');
        int fd = 12345;
        const int length = sockhand_recv(server_, buffer.data(), max, &fd);
        EXPECT_EQ(buffer.back(), '\x55') << "wrote past the end of the buffer";
        return {length, length > 0 ? buffer.substr(0, static_cast<size_t>(length)) : "", fd};
    }

    // What a service does: it waits until the socket is readable, takes what there is, and so on,
    // until a message has come or nothing is left.
    Received receive_next(int max = 4095) const {
        Received received = {-1, "", -1};
        while (received.length < 0 && readable())
            received = receive(max);
        return received;
    }

    int connect_raw() const {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        memcpy(address.sun_path, path().c_str(), path().size());
        const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        EXPECT_EQ(connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof(address)), 0)
            << strerror(errno);
        return fd;
    }

    // One sendmsg with any number of descriptors.
    static void send_raw(int sock, const std::string &text, const std::vector<int> &fds) {
        std::vector<char> control(CMSG_SPACE(fds.size() * sizeof(int)));
        iovec piece = {const_cast<char *>(text.data()), text.size()};
        msghdr message = {};
        message.msg_iov = &piece;
        message.msg_iovlen = 1;
        if (!fds.empty()) {
            message.msg_control = control.data();
            message.msg_controllen = control.size();
            cmsghdr *header = CMSG_FIRSTHDR(&message);
            header->cmsg_level = SOL_SOCKET;
            header->cmsg_type = SCM_RIGHTS;
            header->cmsg_len = CMSG_LEN(fds.size() * sizeof(int));
            memcpy(CMSG_DATA(header), fds.data(), fds.size() * sizeof(int));
        }
        EXPECT_EQ(sendmsg(sock, &message, MSG_NOSIGNAL), static_cast<ssize_t>(text.size()))
            << strerror(errno);
    }

    TempDir dir_;
    int server_ = -1;
    int pipe_[2] = {-1, -1};
    int descriptors_before_ = 0;
};

TEST_F(SockHand, DeliversTheMessageAndTheDescriptor) {
    const std::string message("/cgi/debug.tgz\0cmd=ps\0", 22);
    ASSERT_EQ(send(message), 0) << strerror(errno);
    EXPECT_TRUE(readable());
    const Received received = receive();
    EXPECT_EQ(received.length, 22);
    EXPECT_EQ(received.text, message);
    ASSERT_GE(received.fd, 0);
    EXPECT_EQ(identity(received.fd), identity(pipe_[1]));
    EXPECT_EQ(fcntl(received.fd, F_GETFD), FD_CLOEXEC);
    close(received.fd);
    EXPECT_FALSE(readable());
}

TEST_F(SockHand, IsReadableForSelectAsWell) {
    ASSERT_EQ(send("x"), 0);
    fd_set set;
    FD_ZERO(&set);
    FD_SET(server_, &set);
    timeval now = {0, 0};
    EXPECT_EQ(select(server_ + 1, &set, nullptr, nullptr, &now), 1);
    close(receive().fd);
}

TEST_F(SockHand, DeliversSeveralMessagesInTheOrderOfTheirSenders) {
    for (const char *text : {"one", "two", "three"})
        ASSERT_EQ(send(text), 0);
    for (const char *text : {"one", "two", "three"}) {
        const Received received = receive_next();
        EXPECT_EQ(received.text, text);
        close(received.fd);
    }
}

TEST_F(SockHand, WithoutASenderThereIsNothingToTake) {
    const Received received = receive();
    EXPECT_EQ(received.length, -1);
    EXPECT_EQ(received.fd, -1);
}

TEST_F(SockHand, AMessageThatComesLongAfterTheConnectionIsTaken) {
    const int sender = connect_raw();
    EXPECT_EQ(receive_next().length, -1);
    EXPECT_FALSE(readable()) << "a silent connection must not keep the caller awake";
    send_raw(sender, "late", {pipe_[1]});
    EXPECT_TRUE(readable());
    const Received received = receive_next();
    EXPECT_EQ(received.text, "late");
    close(received.fd);
    close(sender);
}

TEST_F(SockHand, SilentSendersNeitherStopNorSlowTheOthers) {
    std::vector<int> silent;
    for (int i = 0; i < 100; ++i)
        silent.push_back(connect_raw());
    const auto start = std::chrono::steady_clock::now();
    for (int i = 0; i < 50; ++i) {
        ASSERT_EQ(send("request"), 0);
        const Received received = receive_next();
        ASSERT_EQ(received.text, "request");
        close(received.fd);
    }
    // Waiting for the silent ones, however shortly, would show; the limit is far above the work.
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    for (const int fd : silent)
        close(fd);
}

TEST_F(SockHand, SilentSendersHoldABoundedNumberOfDescriptors) {
    const int before = count_descriptors(getpid());
    std::vector<int> silent;
    for (int i = 0; i < 100; ++i) {
        silent.push_back(connect_raw());
        (void)receive_next();
    }
    EXPECT_LE(count_descriptors(getpid()) - before, 100 + 32);
    for (const int fd : silent)
        close(fd);
    (void)receive_next();
    EXPECT_EQ(count_descriptors(getpid()), before) << "connections that ended are let go";
}

TEST_F(SockHand, OfSilentSendersTheOneThatCameFirstIsLetGoFirst) {
    std::vector<int> silent;
    for (int i = 0; i < 60; ++i) {
        silent.push_back(connect_raw());
        (void)receive_next();
    }
    send_raw(silent[40], "late", {pipe_[1]});
    const Received received = receive_next();
    EXPECT_EQ(received.text, "late");
    close(received.fd);
    for (const int fd : silent)
        close(fd);
}

TEST_F(SockHand, ASenderThatLeavesWithoutAWordIsForgotten) {
    close(connect_raw());
    EXPECT_EQ(receive_next().length, -1);
    EXPECT_FALSE(readable());
}

TEST_F(SockHand, AMessageWithoutADescriptorIsRefused) {
    const int sender = connect_raw();
    send_raw(sender, "no descriptor", {});
    const Received received = receive_next();
    EXPECT_EQ(received.length, -1);
    EXPECT_EQ(received.fd, -1);
    char byte;
    EXPECT_EQ(recv(sender, &byte, 1, 0), 0) << "its connection is closed";
    close(sender);
}

TEST_F(SockHand, TheFirstOfSeveralDescriptorsIsTakenAndTheOthersAreClosed) {
    int other[2];
    ASSERT_EQ(pipe2(other, O_CLOEXEC), 0);
    for (const size_t extra : {1, 2, 30, 252}) {
        std::vector<int> fds(extra, other[0]);
        fds.insert(fds.begin(), pipe_[1]);
        const int sender = connect_raw();
        send_raw(sender, "several", fds);
        close(sender);
        const int before = count_descriptors(getpid());
        const Received received = receive_next();
        EXPECT_EQ(received.text, "several");
        ASSERT_GE(received.fd, 0);
        EXPECT_EQ(identity(received.fd), identity(pipe_[1]));
        EXPECT_EQ(count_descriptors(getpid()), before + 1) << extra;
        close(received.fd);
    }
    close(other[0]);
    close(other[1]);
}

TEST_F(SockHand, AMessageThatDoesNotFitIsRefusedWhole) {
    ASSERT_EQ(send(std::string(100, 'a')), 0);
    const Received fits = receive_next(100);
    EXPECT_EQ(fits.length, 100);
    close(fits.fd);
    ASSERT_EQ(send(std::string(101, 'b')), 0);
    const Received over = receive_next(100);
    EXPECT_EQ(over.length, -1);
    EXPECT_EQ(over.fd, -1);
}

TEST_F(SockHand, AMessageOfTheLargestLengthArrivesWhole) {
    const std::string message(4095, 'q');
    ASSERT_EQ(send(message), 0);
    const Received received = receive_next(4095);
    EXPECT_EQ(received.text, message);
    close(received.fd);
}

TEST_F(SockHand, WithoutDescriptorsLeftASenderIsTurnedAwayAndTheNextIsServed) {
    rlimit whole = {};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &whole), 0);
    const int sender = connect_raw();
    send_raw(sender, "first", {pipe_[1]});
    const int highest = dup(0);
    const rlimit none = {static_cast<rlim_t>(highest), whole.rlim_max};
    close(highest);
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
    const Received refused = receive_next();
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &whole), 0);
    EXPECT_EQ(refused.length, -1);
    EXPECT_FALSE(readable()) << "the caller would spin";
    close(sender);

    ASSERT_EQ(send("second"), 0);
    const Received received = receive_next();
    EXPECT_EQ(received.text, "second");
    close(received.fd);
}

TEST_F(SockHand, TheSocketFileHasTheModeWhateverTheMask) {
    const mode_t mask = umask(077);
    const std::string other = dir_ / "other";
    const int server = sockhand_server_socket(other.c_str(), 0666);
    umask(mask);
    struct stat status = {};
    ASSERT_EQ(stat(other.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0666U);
    sockhand_close(server);
}

TEST_F(SockHand, TheServerSocketIsCloseOnExec) {
    EXPECT_EQ(fcntl(server_, F_GETFD), FD_CLOEXEC);
}

TEST_F(SockHand, ATakenOrImpossiblePathGivesNoServer) {
    EXPECT_EQ(sockhand_server_socket(path().c_str(), 0666), -1);
    EXPECT_EQ(errno, EADDRINUSE);
    EXPECT_EQ(sockhand_server_socket((dir_ / "none/socket").c_str(), 0666), -1);
    EXPECT_EQ(errno, ENOENT);
    EXPECT_EQ(sockhand_server_socket(std::string(200, 'x').c_str(), 0666), -1);
    EXPECT_EQ(errno, ENAMETOOLONG);
}

TEST_F(SockHand, AServerThatWasOnlyClosedIsReleasedWhenItsNumberComesBack) {
    const std::string other = dir_ / "other";
    const int before = count_descriptors(getpid());
    int server = -1;
    for (int i = 0; i < 10; ++i) {
        server = sockhand_server_socket(other.c_str(), 0600);
        ASSERT_GE(server, 0);
        if (i < 9)
            close(server);
        unlink(other.c_str());
    }
    EXPECT_LT(count_descriptors(getpid()) - before, 12);
    sockhand_close(server);
}

TEST_F(SockHand, SendingWithoutAServerFails) {
    EXPECT_EQ(sockhand_send((dir_ / "none").c_str(), "x", 1, 0), -1);
    EXPECT_EQ(errno, ENOENT);
}

TEST_F(SockHand, SendingABadDescriptorFails) {
    EXPECT_EQ(sockhand_send(path().c_str(), "x", 1, -1), -1);
    EXPECT_EQ(errno, EBADF);
    EXPECT_EQ(receive_next().length, -1);
}

}  // namespace
