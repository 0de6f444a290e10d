#include "cgi/http_reply.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <string>

#include "client_pair.h"

namespace {

template <typename Send>
std::string sent(Send send) {
    ClientPair pair;
    send(pair.server());
    pair.close_server();
    return pair.reply();
}

// The name that the header of a download of `name` tells.
std::string told_name(const std::string &name) {
    std::string header = sent([&](int fd) { EXPECT_EQ(0, send_http_ok(fd, "t", name.c_str())); });
    const std::string before =
        "HTTP/1.0 200 OK\r\nCache-Control: no-cache\r\nExpires: Thu, 01 Dec 1994 16:00:00 GMT\r\n"
        "Content-Type: t\r\nContent-Disposition: attachment; filename=\"";
    const std::string behind = "\"\r\n\r\n";
    EXPECT_EQ(before, header.substr(0, before.size()));
    EXPECT_EQ(behind, header.substr(header.size() - behind.size()));
    return header.substr(before.size(), header.size() - before.size() - behind.size());
}

TEST(HttpReply, TheHeaderOfADownloadNamesItsTypeAndItsFile) {
    EXPECT_EQ(
        "HTTP/1.0 200 OK\r\n"
        "Cache-Control: no-cache\r\n"
        "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\n"
        "Content-Type: application/x-tar\r\n"
        "Content-Disposition: attachment; filename=\"debug.tgz\"\r\n"
        "\r\n",
        sent([](int fd) { EXPECT_EQ(0, send_http_ok(fd, "application/x-tar", "debug.tgz")); }));
}

TEST(HttpReply, ABadRequestIsAnsweredIn121Bytes) {
    const std::string reply = sent(send_http_bad_request);
    EXPECT_EQ(
        "HTTP/1.0 400 Bad Request\r\nContent-Type: text/plain\r\n\r\n"
        "The request has bad syntax or was inherently impossible to satisfy\n",
        reply);
    EXPECT_EQ(121u, reply.size());
}

TEST(HttpReply, AServerErrorIsToldIn140Bytes) {
    const std::string reply = sent(send_http_server_error);
    EXPECT_EQ(
        "HTTP/1.0 500 Internal Server Error\r\nContent-Type: text/plain\r\n\r\n"
        "The server encountered an internal error and could not complete the request\n",
        reply);
    EXPECT_EQ(140u, reply.size());
}

TEST(HttpReply, AStatusPageShowsItsMessage) {
    EXPECT_EQ(
        "HTTP/1.0 503 Service Unavailable\r\n"
        "Cache-Control: no-cache\r\n"
        "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\n"
        "Content-Type: text/html\r\n"
        "\r\n"
        "<HTML><HEAD></HEAD>\r\n"
        "<BODY>\r\n"
        "later, %s perhaps \r\n"
        "</BODY></HTML>\r\n"
        "\r\n",
        sent([](int fd) {
            send_http_status_page(fd, "503 Service Unavailable", "later, %s perhaps ");
        }));
}

TEST(HttpReply, AFileNameCannotForgeAHeaderLine) {
    EXPECT_EQ("core__Set-Cookie: a=_1_", told_name("core\r\nSet-Cookie: a=\"1\""));
}

TEST(HttpReply, QuotesAndControlCharactersInAFileNameBecomeUnderscores) {
    for (int byte = 1; byte < 256; ++byte) {
        const std::string name = {'a', static_cast<char>(byte), 'z'};
        const bool replaced = byte < 32 || byte == 34 || byte == 127;
        EXPECT_EQ(replaced ? "a_z" : name, told_name(name)) << byte;
    }
}

TEST(HttpReply, AFileNameMayBeEmptyOrLong) {
    EXPECT_EQ("", told_name(""));
    const std::string name(5000, 'n');
    EXPECT_EQ(name, told_name(name));
}

TEST(HttpReply, AHeaderThatCannotBeWrittenIsAFailure) {
    signal(SIGPIPE, SIG_IGN);
    ClientPair pair;
    pair.close_client();
    EXPECT_EQ(1, send_http_ok(pair.server(), "text/plain", "name"));
    EXPECT_EQ(1, send_http_ok(-1, "text/plain", "name"));
    // Nobody is told that these could not be written.
    send_http_status_page(pair.server(), "503 Service Unavailable", "later");
    send_http_bad_request(pair.server());
    send_http_server_error(pair.server());
}

TEST(HttpReply, OfAClientThatCannotTakeItAtOnceNobodyWaits) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    const std::string page(4096, 'x');
    const int size = fcntl(ends[1], F_GETPIPE_SZ);
    for (int written = 0; written < size; written += 4096)
        ASSERT_EQ(4096, write(ends[1], page.data(), page.size()));
    alarm(10);
    send_http_status_page(ends[1], "503 Service Unavailable", "later");
    send_http_bad_request(ends[1]);
    send_http_server_error(ends[1]);
    alarm(0);
    int untaken = 0;
    EXPECT_EQ(0, ioctl(ends[0], FIONREAD, &untaken));
    EXPECT_EQ(size, untaken);
    close(ends[0]);
    close(ends[1]);
}

}  // namespace
