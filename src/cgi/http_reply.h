// The replies of the service: HTTP/1.0, ended by the closing of the connection.
//
// All write to the client descriptor `fd` and leave it open.
#pragma once

// The header of a download named `file_name`, whose body is to follow. In the name, quotes and
// control characters become "_". Returns 0, or 1 when it could not be built or written.
int send_http_ok(int fd, const char *content_type, const char *file_name);

// The others are whole replies. Whether they could be written is not told: there is nobody else to
// tell. They never wait: a client that cannot take one at once gets none.

// A small page with `message`, under a status such as "503 Service Unavailable".
void send_http_status_page(int fd, const char *status, const char *message);

// The fixed replies 400 and 500.
void send_http_bad_request(int fd);
void send_http_server_error(int fd);
