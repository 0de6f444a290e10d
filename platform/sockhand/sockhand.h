// Hands an open descriptor, with a short message, from one process to another over a local socket.
//
// On the wire: a Unix stream socket. A sender connects, makes one sendmsg whose data is the message
// and whose control data is one SCM_RIGHTS descriptor, and closes.
#pragma once

#ifdef __cplusplus
extern "C" {
#endif

// Makes a listening socket at `path`, with the permissions `mode`; nothing may be at `path` yet.
// Returns a descriptor that becomes readable for select and poll when there is something for
// sockhand_recv to take, or -1 with errno set. It is close-on-exec.
//
// Closing the descriptor is enough for a process that ends; one that goes on also releases what
// stands behind it, with sockhand_close instead.
int sockhand_server_socket(const char *path, int mode);

// Takes one message from `sock`, a descriptor that sockhand_server_socket gave, into the `max`
// bytes at `buf`. Returns its length, above 0, with the descriptor that came with it in `*fd`: the
// caller's to close, close-on-exec. Does not wait for a sender; only when descriptors or memory are
// short does it pause, for an instant.
//
// Returns -1 with -1 in `*fd` when there is none: the sender has only connected so far, left
// without a word, sent no descriptor with its message, or sent more than `max` bytes. A further
// descriptor in a message is closed. A sender that connects and sends nothing keeps nobody waiting,
// and loses its connection when 32 newer ones do the same, or when descriptors are short.
int sockhand_recv(int sock, void *buf, int max, int *fd);

// Closes `sock` and everything behind it. The file at the socket's path stays.
void sockhand_close(int sock);

// Sends the `len` bytes at `buf` with the descriptor `fd`, which stays the caller's, to the server
// at `path`. Returns 0, or -1 with errno set; waits at most five seconds for the server.
int sockhand_send(const char *path, const void *buf, int len, int fd);

#ifdef __cplusplus
}
#endif
