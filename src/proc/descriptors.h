// What the open descriptors of a process refer to.
//
// Nothing is printed. All functions may be called from any thread.
#pragma once

#include <stddef.h>
#include <sys/types.h>

#include "proc/socket_snapshot.h"

// Stores the numbers of the open descriptors of `pid` in `fds`, in the order of /proc/PID/fd and at
// most `max`, and returns how many; 0 when they cannot be listed.
int list_fds(pid_t pid, int *fds, int max);

// Writes a text for descriptor `fd` of `pid` into `buf` of `size` bytes: the target of its link
// and, for a socket, describe_socket_inode's text behind it.
//
// Returns the length of the whole text, which may be more than fitted: rely on the terminator. -1
// when the link cannot be read, and then `buf` is left alone.
//
// With `sockets`, sockets are looked up there, which is for many descriptors at one moment.
//
// Keeps descriptors to be quick for the same process, and for sockets, again; forget_last_process
// closes them, and has everything tried anew.
int describe_fd(pid_t pid, int fd, char *buf, size_t size, SocketSnapshot *sockets = nullptr);
void forget_last_process();

// Writes the connection of the socket with the inode number `inode`, found in the socket tables of
// the caller's own network namespace (`pid` does not matter), into `buf` of `size` bytes:
//
//     [10.0.0.2:80 -> 10.0.0.9:51334][TCP_ESTABLISHED]
//     [0:0:0:0:0:0:0:1:8080 -> 0:0:0:0:0:0:0:1:40312][TCP_ESTABLISHED]
//     [/run/app.sock]
//
// Returns the length of the whole text, which may be more than fitted, or 0, with nothing written,
// for a socket that is in none of the tables or has no path.
int describe_socket_inode(pid_t pid, unsigned long inode, char *buf, size_t size);

// The same on another directory than /proc/net that holds files "tcp", "tcp6" and "unix".
int describe_socket_inode_in(const char *net_dir, unsigned long inode, char *buf, size_t size);
