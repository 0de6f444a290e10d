// What all threads that serve a request have in common.
#pragma once

// Starts a thread with the given start routine. Returns whether it runs.
bool start_worker(void *(*routine)(void *), void *argument);

// Detaches the calling thread. False when that fails: the client has then got the 500 reply, and
// gets no other.
bool begin_worker(int client_fd);
