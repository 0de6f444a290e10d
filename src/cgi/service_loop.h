// The service's main loop.
#pragma once

// Starts the monitor thread, then serves for ever: requests from `cgi_socket` (see
// platform/sockhand), crash cores from the listening socket `segf_socket`, and the dumps in the
// folder `dump_dir`. Returns 1 when the monitor thread cannot be started, with
// "pthread_create: ..." printed on standard error.
int service_loop(int cgi_socket, int segf_socket, const char *dump_dir);
