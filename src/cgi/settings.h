// The settings of the debug service, as its command line gives them.
#pragma once

#include <stdint.h>
#include <sys/types.h>

struct Settings {
    uint32_t dump_mode = 0;  // write one archive to standard output and end
    uint32_t compress = 1;   // in dump mode: gzip it
    uint32_t no_daemon = 0;  // stay in the foreground
    const char *cgi_socket_path = "/var/run/dbg-cgi/ctrl-cgi-socket";
    const char *segf_socket_path = "/var/run/dbg-cgi/ctrl-segf-socket";
    const char *core_program = "/usr/bin/snapcore";
    const char *dump_dir = "/var/spool/storage/SD_DISK/dumps";
};

// Overwrites fields of `settings` with what the options in `argv` say; strings are kept, not
// copied. The process that "-i" names goes to `ignore_pid`. Returns 0, or -1 for an unknown or
// incomplete option, with the usage text printed on standard output.
int parse_settings(int argc, char **argv, Settings *settings, pid_t *ignore_pid);
