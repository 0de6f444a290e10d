// What all threads that serve a request have in common.
#pragma once

#include <pthread.h>

// Starts a thread with the given start routine; which one it is goes to `thread`, unless that is
// null. Returns whether it runs.
bool start_worker(void *(*routine)(void *), void *argument, pthread_t *thread = nullptr);

// Detaches the calling thread. False when that fails: the client has then got the 500 reply, and
// gets no other.
bool begin_worker(int client_fd);
