// What the kernel's socket monitoring (NETLINK_SOCK_DIAG, linux/inet_diag.h and linux/unix_diag.h)
// tells of a single socket of the caller's network namespace, in a time that does not depend on how
// many there are. Not every kernel has it.
//
// A descriptor is kept between questions, and with it the network namespace in which it was first
// asked; close_diag closes it. All may be called from any thread.
#pragma once

#include <stddef.h>

#include "proc/socket_tables.h"

constexpr int DIAG_UNKNOWN = -1;

// The state of the socket `inode` that has the ends of `socket`, as the tables number states.
// DIAG_UNKNOWN when the kernel has no such socket, or cannot tell, or the socket's user id is so
// long that the tables' reader would not find it.
int diag_tcp_state(const TcpSocket &socket, unsigned long inode);

// Puts the name of the Unix socket `inode` into `name`, at most `size` bytes, and returns its
// length: 0 for one without a name. DIAG_UNKNOWN when the kernel has no such socket, or cannot
// tell.
int diag_unix_name(unsigned long inode, char *name, size_t size);

void close_diag();
