// What the device's configuration says about cores.
#pragma once

#include "util/unique_fd.h"

struct CoreConfig {
    bool use_ftp = false;  // else cores go to the debug service
    // For an upload; null where the configuration does not tell.
    UniqueBlock<char> target_url{};
    UniqueBlock<char> target_path{};
    long timeout_s = 0;  // for the whole transfer, never negative; 0: no limit
};

// Reads the configuration file `path`, of which only the entries from the first "CoreHandler" on
// matter. A file that cannot be opened is one without entries. Returns 0, or -ENOMEM. Prints
// nothing.
int read_core_config(const char *path, CoreConfig *config);

// The time limit that `text` tells: its decimal digits at the beginning, cut to what libcurl can
// count. 0, no limit, for a negative number or none.
long parse_timeout(const char *text);
