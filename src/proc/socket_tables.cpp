#include "proc/socket_tables.h"

#include <arpa/inet.h>
#include <ctype.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <iterator>

#include "util/line_text.h"

namespace {

// Where the fields of a TCP table's line stand, in characters from its start.
struct TcpColumns {
    size_t local_address;
    size_t local_port;
    size_t remote_address;
    size_t remote_port;
    size_t state;
    size_t inode;
};
constexpr TcpColumns TCP_COLUMNS = {6, 15, 20, 29, 34, 91};
constexpr TcpColumns TCP6_COLUMNS = {6, 39, 44, 77, 82, 139};

// Indexed by the state number of include/net/tcp_states.h.
constexpr const char *TCP_STATE_NAMES[] = {
    "DESTROYED",      "TCP_ESTABLISHED", "TCP_SYN_SENT",  "TCP_SYN_RECV",
    "TCP_FIN_WAIT1",  "TCP_FIN_WAIT2",   "TCP_TIME_WAIT", "TCP_CLOSE",
    "TCP_CLOSE_WAIT", "TCP_LAST_ACK",    "TCP_LISTEN",    "TCP_CLOSING",
};

// The name of a TCP state; its number for one without a name.
struct StateName {
    char text[24];
};

StateName tcp_state_name(unsigned long state) {
    StateName name;
    if (state < std::size(TCP_STATE_NAMES))
        (void)snprintf(name.text, sizeof name.text, "%s", TCP_STATE_NAMES[state]);
    else
        (void)snprintf(name.text, sizeof name.text, "%lu", state);
    return name;
}

// The decimal number that begins just at `column`. A field further left that is wider than usual,
// such as a user id of six digits, moves the number away, and then there is none.
bool number_at(const char *line, size_t column, unsigned long *number) {
    if (strlen(line) <= column || line[column - 1] != ' ' ||
        !isdigit(static_cast<unsigned char>(line[column])))
        return false;
    *number = strtoul(line + column, nullptr, 10);
    return true;
}

// The number that stands behind six separators; `end` is what follows it.
bool unix_inode(const char *line, unsigned long *inode, char **end) {
    for (int separators = 0; separators < 6; ++separators) {
        while (*line != '\0' && !isspace(static_cast<unsigned char>(*line)))
            ++line;
        if (*line == '\0')
            return false;
        while (isspace(static_cast<unsigned char>(*line)))
            ++line;
    }
    if (!isdigit(static_cast<unsigned char>(*line)))
        return false;
    *inode = strtoul(line, end, 10);
    return true;
}

unsigned long hex_at(const char *line, size_t column) {
    return strtoul(line + column, nullptr, 16);
}

uint32_t word_at(const char *line, size_t column) {
    char digits[9];
    memcpy(digits, line + column, 8);
    digits[8] = '\0';
    return static_cast<uint32_t>(strtoul(digits, nullptr, 16));
}

bool parse_line(const char *line, const TcpColumns &columns, size_t words, unsigned long inode,
                TcpSocket *socket) {
    unsigned long found;
    if (!number_at(line, columns.inode, &found) || found != inode)
        return false;
    *socket = {};
    socket->ipv6 = words > 1;
    // The kernel prints an address in numbers of this machine's byte order, so that they are in
    // network order again once parsed.
    for (size_t i = 0; i < words; ++i) {
        socket->local[i] = word_at(line, columns.local_address + 8 * i);
        socket->remote[i] = word_at(line, columns.remote_address + 8 * i);
    }
    socket->local_port = hex_at(line, columns.local_port);
    socket->remote_port = hex_at(line, columns.remote_port);
    socket->state = hex_at(line, columns.state);
    return true;
}

void add_ipv4(LineText *text, uint32_t address) {
    char digits[INET_ADDRSTRLEN];
    in_addr in = {address};
    text->add("%s:", inet_ntop(AF_INET, &in, digits, sizeof digits));
}

// All eight groups, each with a colon behind it, and no "::" in place of zeros: unlike the IPv4
// form this is not what inet_ntop gives, and readers of traces rely on it.
void add_ipv6(LineText *text, const uint32_t (&address)[4]) {
    for (uint32_t word : address) {
        uint32_t groups = ntohl(word);
        text->add("%x:%x:", groups >> 16, groups & 0xffff);
    }
}

void add_end(LineText *text, const TcpSocket &socket, const uint32_t (&address)[4],
             unsigned long port) {
    if (socket.ipv6)
        add_ipv6(text, address);
    else
        add_ipv4(text, address[0]);
    text->add("%d", static_cast<int>(port));
}

}  // namespace

bool parse_tcp_line(const char *line, unsigned long inode, TcpSocket *socket) {
    return parse_line(line, TCP_COLUMNS, 1, inode, socket);
}

bool parse_tcp6_line(const char *line, unsigned long inode, TcpSocket *socket) {
    return parse_line(line, TCP6_COLUMNS, 4, inode, socket);
}

int format_tcp_socket(const TcpSocket &socket, char *buf, size_t size) {
    LineText text(buf, size);
    text.add("[");
    add_end(&text, socket, socket.local, socket.local_port);
    text.add(" -> ");
    add_end(&text, socket, socket.remote, socket.remote_port);
    text.add("][%s]", tcp_state_name(socket.state).text);
    return text.length();
}

int match_tcp_line(const char *line, unsigned long inode, char *buf, size_t size) {
    TcpSocket socket;
    return parse_tcp_line(line, inode, &socket) ? format_tcp_socket(socket, buf, size) : NO_MATCH;
}

int match_tcp6_line(const char *line, unsigned long inode, char *buf, size_t size) {
    TcpSocket socket;
    return parse_tcp6_line(line, inode, &socket) ? format_tcp_socket(socket, buf, size) : NO_MATCH;
}

int match_unix_line(const char *line, unsigned long inode, char *buf, size_t size) {
    unsigned long found;
    char *end;
    if (!unix_inode(line, &found, &end) || found != inode)
        return NO_MATCH;
    if (*end == '\n' || *end == '\0')
        return 0;
    const char *path = end + 1;
    LineText text(buf, size);
    text.add("[%.*s]", static_cast<int>(strcspn(path, "\n")), path);
    return text.length();
}

bool line_inode(SocketTable table, const char *line, unsigned long *inode) {
    char *end;
    switch (table) {
        case SocketTable::TCP:
            return number_at(line, TCP_COLUMNS.inode, inode);
        case SocketTable::TCP6:
            return number_at(line, TCP6_COLUMNS.inode, inode);
        case SocketTable::UNIX:
            return unix_inode(line, inode, &end);
    }
    return false;
}

int match_line(SocketTable table, const char *line, unsigned long inode, char *buf, size_t size) {
    switch (table) {
        case SocketTable::TCP:
            return match_tcp_line(line, inode, buf, size);
        case SocketTable::TCP6:
            return match_tcp6_line(line, inode, buf, size);
        case SocketTable::UNIX:
            return match_unix_line(line, inode, buf, size);
    }
    return NO_MATCH;
}
