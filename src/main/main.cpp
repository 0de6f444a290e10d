// The entry point: picks the applet by the name under which the executable was started.
#include <signal.h>
#include <stdio.h>
#include <string.h>

#include "cgi/debugar.h"
#include "coredump-handler/coredump_handler.h"
#include "main/fault_applets.h"
#include "mon/mon.h"
#include "oops/oopslog.h"
#include "pcap/pcapdump.h"
#include "trace/tracer_applets.h"

namespace {

struct Applet {
    const char *name;
    int (*run)(int argc, char **argv);
};

constexpr Applet APPLETS[] = {
#define APPLET(name, run) {name, run},
#include "main/applets.def"
#undef APPLET
};

constexpr char TOOLBOX_NAME[] = "fieldkit";

// What follows the last "/".
const char *base_name(const char *path) {
    const char *slash = strrchr(path, '/');
    return slash != nullptr ? slash + 1 : path;
}

}  // namespace

int main(int argc, char **argv) {
    // A reader that goes away is an error of the write, in every applet.
    (void)signal(SIGPIPE, SIG_IGN);
    // Some who start programs ignore it, and that would be inherited: nothing would be told of
    // children that have ended.
    (void)signal(SIGCHLD, SIG_DFL);

    const char *name = argc > 0 ? base_name(argv[0]) : TOOLBOX_NAME;
    if (strcmp(name, TOOLBOX_NAME) == 0) {
        if (argc < 2)
            return 1;
        --argc;
        ++argv;
        name = base_name(argv[0]);
    }
    for (const Applet &applet : APPLETS) {
        if (strcmp(name, applet.name) == 0)
            return applet.run(argc, argv);
    }
    printf("%s: unknown fieldkit applet\n", name);
    return 1;
}
