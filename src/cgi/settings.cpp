#include "cgi/settings.h"

#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

namespace {

// Kept as it is known: the "[pids...]" are not read, and "-k" and "-n" are not told.
constexpr char USAGE[] =
    "dbg-cgi 0.1\n"
    "dbg-cgi [options] [pids...]\n"
    "\n"
    "-d\tdump tar archive with core-files for pids to stdout.\n"
    "-t\tonly tar the archive.\n"
    "-i\tignore pid\n"
    "-p\tprogram to create coredumps [/usr/bin/snapcore]\n"
    "-c\tcgi control socket name [/var/run/dbg-cgi/ctrl-cgi-socket]\n"
    "-s\tsegfault control socket name [/var/run/dbg-cgi/ctrl-segf-socket]\n"
    "-h\thelp";

}  // namespace

int parse_settings(int argc, char **argv, Settings *settings, pid_t *ignore_pid) {
    // "-h" has no case of its own: a request for help is answered like a mistake, with status 1.
    for (int option; (option = getopt(argc, argv, "di:np:s:c:k:ht")) != -1;) {
        switch (option) {
            case 'd':
                settings->dump_mode = 1;
                break;
            case 't':
                settings->compress = 0;
                break;
            case 'i':
                *ignore_pid = static_cast<pid_t>(strtoul(optarg, nullptr, 0));
                break;
            case 'n':
                settings->no_daemon = 1;
                break;
            case 'p':
                settings->core_program = optarg;
                break;
            case 'c':
                settings->cgi_socket_path = optarg;
                break;
            case 's':
                settings->segf_socket_path = optarg;
                break;
            case 'k':
                settings->dump_dir = optarg;
                break;
            default:
                puts(USAGE);
                return -1;
        }
    }
    return 0;
}
