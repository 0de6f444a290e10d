// Sends a core to an FTP server.
#pragma once

#include <stddef.h>

#include "coredump-handler/core_config.h"

// Stores standard input on the server of `config` as `name`. Returns whether all of it has arrived.
// A transfer that the time limit ends is told in the system log; nothing else is told.
bool upload_core(const CoreConfig &config, const char *name);

// The read callback of the upload: takes up to `size` times `count` bytes from standard input into
// `buf`. Returns how many there were, 0 at its end, or CURL_READFUNC_ABORT.
size_t read_core(char *buf, size_t size, size_t count, void *unused);
