// Lines of the kernel's socket tables, matched against a socket's inode number.
//
// Each function looks at one terminated line of its table and, when `inode` is that socket's,
// writes the text for its connection into `buf` of `size` bytes and returns the length of the whole
// text, which may be more than fitted. Otherwise it returns NO_MATCH and writes nothing. A line may
// be cut anywhere: what is missing does not match. The layouts are those of net/ipv4/tcp_ipv4.c,
// net/ipv6/tcp_ipv6.c and net/unix/af_unix.c in the kernel's sources.
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr int NO_MATCH = -1;

// Lines are read in pieces of at most this many bytes, terminator included, and matched piece by
// piece.
constexpr size_t SOCKET_LINE_SIZE = 256;

// What a line of a TCP table says.
struct TcpSocket {
    bool ipv6;
    uint32_t local[4];  // addresses as they lie in memory, in network order; IPv4 has one word
    uint32_t remote[4];
    unsigned long local_port;
    unsigned long remote_port;
    unsigned long state;  // numbered as in include/net/tcp_states.h
};

// Takes a line of /proc/net/tcp or tcp6 apart, if it is that of the socket `inode`.
bool parse_tcp_line(const char *line, unsigned long inode, TcpSocket *socket);
bool parse_tcp6_line(const char *line, unsigned long inode, TcpSocket *socket);

// The text for `socket`. Returns the length of the whole text, which may be more than fitted.
int format_tcp_socket(const TcpSocket &socket, char *buf, size_t size);

// The tables, in the order in which they are searched.
enum class SocketTable { TCP, TCP6, UNIX };

// The inode number in a line of `table`. False when there is none in its place.
bool line_inode(SocketTable table, const char *line, unsigned long *inode);

// A line of /proc/net/tcp: "[10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]".
int match_tcp_line(const char *line, unsigned long inode, char *buf, size_t size);

// A line of /proc/net/tcp6: "[0:0:0:0:0:0:0:1:8080 -> 0:0:0:0:0:0:0:1:40312][TCP_LISTEN]".
int match_tcp6_line(const char *line, unsigned long inode, char *buf, size_t size);

// A line of /proc/net/unix: "[/run/app.sock]", or 0 and nothing for a socket without a path.
int match_unix_line(const char *line, unsigned long inode, char *buf, size_t size);

// One of the three.
int match_line(SocketTable table, const char *line, unsigned long inode, char *buf, size_t size);
