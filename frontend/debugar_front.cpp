// debugar-front, the CGI program between a web server and the debug service: hands its own standard
// output to the service, which writes the whole reply to it, and ends. The connection stays open as
// long as the service holds it.
//
// Its own replies begin with a status line, like all those of the service. A web server that wants
// to write that line itself has to start this as "nph-..."; what a server asks of a program of that
// name is just this, and some then give it the client's own connection.
#include <errno.h>
#include <sockhand.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include "request_message.h"

namespace {

constexpr char DEFAULT_SOCKET[] = "/var/run/dbg-cgi/ctrl-cgi-socket";

struct Refusal {
    const char *status;
    const char *more_headers;
    const char *message;
};

constexpr Refusal METHOD_NOT_ALLOWED = {
    "405 Method Not Allowed", "Allow: GET\r\n",
    "Ask with GET. A HEAD request is refused as well: answering it would take the same work."};
constexpr Refusal URI_TOO_LONG = {"414 URI Too Long", "",
                                  "The request is longer than the debug service takes."};
constexpr Refusal SERVICE_UNAVAILABLE = {
    "503 Service Unavailable", "",
    "The debug service does not answer. It may not be running, or be about to start."};

void refuse(const Refusal &refusal) {
    // Nobody is told when this fails: the client has gone, and standard error may be its connection
    // as well.
    (void)printf(
        "HTTP/1.0 %s\r\n"
        "Cache-Control: no-cache\r\n"
        "%s"
        "Content-Type: text/html\r\n"
        "\r\n"
        "<!DOCTYPE html>\n"
        "<html lang=\"en\">\n"
        "<title>%s</title>\n"
        "<h1>%s</h1>\n"
        "<p>%s</p>\n"
        "</html>\n",
        refusal.status, refusal.more_headers, refusal.status, refusal.status, refusal.message);
    (void)fflush(stdout);
}

}  // namespace

// The arguments are not looked at: some servers make them of the query, and so a client does.
int main() {
    const char *method = getenv("REQUEST_METHOD");
    if (method == nullptr || strcmp(method, "GET") != 0) {
        refuse(METHOD_NOT_ALLOWED);
        return 0;
    }
    char message[MAX_MESSAGE];
    const int length = compose_message(getenv("SCRIPT_NAME"), getenv("PATH_INFO"),
                                       getenv("QUERY_STRING"), message);
    if (length < 0) {
        refuse(URI_TOO_LONG);
        return 0;
    }
    // A client cannot set it: what comes from its headers has names that begin with "HTTP_".
    const char *path = getenv("DEBUGAR_SOCKET");
    if (path == nullptr)
        path = DEFAULT_SOCKET;
    if (sockhand_send(path, message, length, STDOUT_FILENO) != 0) {
        openlog("debugar-front", LOG_PID, LOG_DAEMON);
        syslog(LOG_ERR, "%s: %m", path);
        refuse(SERVICE_UNAVAILABLE);
    }
    return 0;
}
