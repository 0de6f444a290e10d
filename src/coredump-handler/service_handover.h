// Hands a core over to the debug service.
#pragma once

// Sends standard input, as it is, to the local socket `path`. Returns whether the service could be
// reached; whether it took all of the core is not known. When it does not close the connection or
// answer, this takes five seconds more.
//
// Prints "connect to PATH failed" or "select(): ..." on standard error. A `path` that is too long
// for a socket is one that cannot be connected to.
bool hand_core_over(const char *path);

// Waits up to `timeout_ms` for `sock` to have something to be read, or its end, and drops what it
// has. Prints "select(): ..." on standard error when that fails.
void wait_for_answer(int sock, int timeout_ms);
