// The one client that waits for the next crash dump. For the main thread only.
#pragma once

// Makes the client `client_fd` the one that waits, and takes it over. The one that waited before is
// disconnected without a reply.
void set_dump_listener(int client_fd);

// Sends everything that can be read from `source_fd` to the client that waits, as a download named
// `name`, and disconnects it. Closes `source_fd`, which may be -1. Blocks for as long as that
// takes. Returns 0, or 1 when nobody waits or something could not be read or written.
int send_dump(int source_fd, const char *name);
