#include "cgi/http_reply.h"

#include <poll.h>
#include <stdarg.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>

#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr char OK_FORMAT[] =
    "HTTP/1.0 200 OK\r\n"
    "Cache-Control: no-cache\r\n"
    "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\n"
    "Content-Type: %s\r\n"
    "Content-Disposition: attachment; filename=\"%s\"\r\n"
    "\r\n";

constexpr char STATUS_PAGE_FORMAT[] =
    "HTTP/1.0 %s\r\n"
    "Cache-Control: no-cache\r\n"
    "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\n"
    "Content-Type: text/html\r\n"
    "\r\n"
    "<HTML><HEAD></HEAD>\r\n"
    "<BODY>\r\n"
    "%s\r\n"
    "</BODY></HTML>\r\n"
    "\r\n";

constexpr char BAD_REQUEST[] =
    "HTTP/1.0 400 Bad Request\r\n"
    "Content-Type: text/plain\r\n"
    "\r\n"
    "The request has bad syntax or was inherently impossible to satisfy\n";

constexpr char SERVER_ERROR[] =
    "HTTP/1.0 500 Internal Server Error\r\n"
    "Content-Type: text/plain\r\n"
    "\r\n"
    "The server encountered an internal error and could not complete the request\n";

// Null when there is no memory for it.
__attribute__((format(printf, 1, 2))) UniqueBlock<char> new_text(const char *format, ...) {
    char *text = nullptr;
    va_list args;
    va_start(args, format);
    int length = vasprintf(&text, format, args);
    va_end(args);
    return UniqueBlock<char>(length < 0 ? nullptr : text);
}

// Most who get a whole reply get it from the service's loop, which must wait for none of them.
// There is room for it in whatever a client has, unless that is a pipe which was full when it came.
void send_at_once(int fd, const char *reply) {
    pollfd client = {.fd = fd, .events = POLLOUT, .revents = 0};
    if (poll(&client, 1, 0) > 0)
        (void)write_all(fd, reply, static_cast<uint32_t>(strlen(reply)));
}

// So that the name of a file cannot end the header line that it stands in, and begin another.
void make_header_safe(char *name) {
    for (; *name != '\0'; ++name) {
        if (static_cast<unsigned char>(*name) < 0x20 || *name == 0x7f || *name == '"')
            *name = '_';
    }
}

}  // namespace

int send_http_ok(int fd, const char *content_type, const char *file_name) {
    UniqueBlock<char> name(strdup(file_name));
    if (name == nullptr)
        return 1;
    make_header_safe(name.get());
    UniqueBlock<char> header = new_text(OK_FORMAT, content_type, name.get());
    if (header == nullptr)
        return 1;
    return write_all(fd, header.get(), static_cast<uint32_t>(strlen(header.get()))) < 0 ? 1 : 0;
}

void send_http_status_page(int fd, const char *status, const char *message) {
    UniqueBlock<char> page = new_text(STATUS_PAGE_FORMAT, status, message);
    if (page != nullptr)
        send_at_once(fd, page.get());
}

void send_http_bad_request(int fd) {
    send_at_once(fd, BAD_REQUEST);
}

void send_http_server_error(int fd) {
    send_at_once(fd, SERVER_ERROR);
}
