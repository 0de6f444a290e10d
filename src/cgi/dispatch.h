// What a request asks for, and who does it.
#pragma once

// Serves the request in the `length` bytes at `message`: the path by which the client called, a
// zero byte, and the query, which is terminated at `message[length]` at the latest. Takes over
// `client_fd`, the connection to the client: a fixed reply is written at once and the connection
// closed, or a thread of its own writes the reply, or the client becomes the one that waits for a
// dump. The live core of a process is written at once, too, and blocks for as long as that takes.
// For the main thread only.
void handle_request(int client_fd, const char *message, int length);
