// A packet filter that hides one connection.
#pragma once

#include <linux/filter.h>
#include <sys/socket.h>

#include <array>

// Makes a classic BPF program that drops the frames of the TCP connection of `socket_fd` and passes
// all others, so that a client which receives a capture does not see its own connection in it.
//
// Returns the program, to be freed with free(), and its length in `length` (8 instructions for
// IPv4, also over mapped IPv6 addresses, and 9 for IPv6); null when `socket_fd` is no connected
// IPv4 or IPv6 socket or memory is short. Prints nothing.
sock_filter *make_connection_filter(int socket_fd, unsigned *length);

constexpr unsigned CONNECTION_FILTER_MAX_LENGTH = 9;

// The same from the two addresses of the connection: fills `program` and returns its length, or 0
// when the families differ or are neither IPv4 nor IPv6. Touches nothing else.
unsigned build_connection_filter(const sockaddr_storage &own, const sockaddr_storage &peer,
                                 std::array<sock_filter, CONNECTION_FILTER_MAX_LENGTH> *program);
