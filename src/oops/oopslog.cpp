// The applet oopslog: what the kernel wrote into its log on flash before it died.
#include "oops/oopslog.h"

#include <stdio.h>
#include <string.h>

#include "oops/log_scan.h"
#include "oops/oops_device.h"

int run_oopslog(int argc, char **argv) {
    LogDirection direction = LogDirection::FORWARD;
    int path_index = 1;
    if (argc > 1 && strcmp(argv[1], "-r") == 0) {
        direction = LogDirection::BACKWARD;
        path_index = 2;
    }
    if (path_index >= argc) {
        // The empty line behind it is part of the text that others know.
        puts("USAGE: oopslog [options] mtdblock-device\n");
        return 1;
    }

    OopsDevice device;
    if (!open_oops_device(argv[path_index], &device))
        return 1;
    const LogSource source = log_source(&device);
    NewestEntry newest;
    if (!find_newest_entry(source, &newest)) {
        fputs("No logs present\n", stderr);
        return 0;
    }
    fprintf(stderr, "Last log is at position %d with count %d\n", static_cast<int>(newest.position),
            static_cast<int>(newest.count));
    // Whether anyone takes the entries is not this program's business: 0 either way.
    print_log(source, newest.position, direction, stdout);
    return 0;
}
