// A short memory of sockets that were found in the kernel's tables.
//
// Reading a table takes the longer the more sockets there are. A socket that was found once is
// known by its ends or its name, and then the kernel can be asked about it alone: whether it is
// still that socket, and in which state. What is told is true at the time of the call.
#pragma once

#include <stddef.h>

#include "proc/socket_tables.h"

enum class SocketKind { TCP, UNIX };

// Does what a search of the tables would do for the socket `inode`; NO_MATCH when it is not known,
// has become another, or the kernel cannot be asked.
int describe_known_socket(unsigned long inode, char *buf, size_t size);

// Remember that `inode` was found with these ends, or in the table of Unix sockets with this text:
// `name` of `name_length` bytes is what the kernel called it just before. One that it did not name
// (-1) is not remembered, nor any of a kind about which it does not answer.
void remember_tcp_socket(unsigned long inode, const TcpSocket &socket);
void remember_unix_socket(unsigned long inode, const char *name, int name_length, const char *text);

// Whether the kernel answers about sockets of this kind; it need not be asked otherwise.
bool sockets_can_be_known(SocketKind kind);

// Remembers no socket any more, and has the kernel asked again even if it did not seem to answer:
// connections that ended one after the other are answered as little as anything is by a kernel that
// never does.
void forget_sockets();
