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

// Whether the decimal number that begins just at `column` is `inode`. A field further left that is
// wider than usual, such as a user id of six digits, moves the number away and it does not match.
bool inode_at(const char *line, size_t column, unsigned long inode) {
    return strlen(line) > column && line[column - 1] == ' ' &&
           isdigit(static_cast<unsigned char>(line[column])) &&
           strtoul(line + column, nullptr, 10) == inode;
}

unsigned long hex_at(const char *line, size_t column) {
    return strtoul(line + column, nullptr, 16);
}

struct Ipv4Text {
    char text[INET_ADDRSTRLEN];
};

// The kernel prints the address as a number of this machine's byte order, so it is in network order
// again once parsed.
Ipv4Text ipv4_at(const char *line, size_t column) {
    in_addr address = {static_cast<in_addr_t>(hex_at(line, column))};
    Ipv4Text result;
    (void)inet_ntop(AF_INET, &address, result.text, sizeof result.text);
    return result;
}

// All eight groups, each with a colon behind it, and no "::" in place of zeros: unlike the IPv4
// form this is not what inet_ntop gives, and readers of traces rely on it.
void add_ipv6(LineText *text, const char *line, size_t column) {
    for (size_t word = 0; word < 4; ++word) {
        char digits[9];
        memcpy(digits, line + column + 8 * word, 8);
        digits[8] = '\0';
        uint32_t groups = ntohl(static_cast<uint32_t>(strtoul(digits, nullptr, 16)));
        text->add("%x:%x:", groups >> 16, groups & 0xffff);
    }
}

}  // namespace

int match_tcp_line(const char *line, unsigned long inode, char *buf, size_t size) {
    const TcpColumns &columns = TCP_COLUMNS;
    if (!inode_at(line, columns.inode, inode))
        return NO_MATCH;
    LineText text(buf, size);
    text.add("[%s:%d -> %s:%d][%s]", ipv4_at(line, columns.local_address).text,
             static_cast<int>(hex_at(line, columns.local_port)),
             ipv4_at(line, columns.remote_address).text,
             static_cast<int>(hex_at(line, columns.remote_port)),
             tcp_state_name(hex_at(line, columns.state)).text);
    return text.length();
}

int match_tcp6_line(const char *line, unsigned long inode, char *buf, size_t size) {
    const TcpColumns &columns = TCP6_COLUMNS;
    if (!inode_at(line, columns.inode, inode))
        return NO_MATCH;
    LineText text(buf, size);
    text.add("[");
    add_ipv6(&text, line, columns.local_address);
    text.add("%d -> ", static_cast<int>(hex_at(line, columns.local_port)));
    add_ipv6(&text, line, columns.remote_address);
    text.add("%d][%s]", static_cast<int>(hex_at(line, columns.remote_port)),
             tcp_state_name(hex_at(line, columns.state)).text);
    return text.length();
}

int match_unix_line(const char *line, unsigned long inode, char *buf, size_t size) {
    for (int separators = 0; separators < 6; ++separators) {
        while (*line != '\0' && !isspace(static_cast<unsigned char>(*line)))
            ++line;
        if (*line == '\0')
            return NO_MATCH;
        while (isspace(static_cast<unsigned char>(*line)))
            ++line;
    }
    char *end;
    if (!isdigit(static_cast<unsigned char>(*line)) || strtoul(line, &end, 10) != inode)
        return NO_MATCH;
    if (*end == '\n' || *end == '\0')
        return 0;
    const char *path = end + 1;
    LineText text(buf, size);
    text.add("[%.*s]", static_cast<int>(strcspn(path, "\n")), path);
    return text.length();
}
