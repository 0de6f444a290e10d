#include "cgi/debugar.h"

#include <fcntl.h>
#include <stdio.h>
#include <syslog.h>
#include <unistd.h>

#include "archive/gzip_stream.h"
#include "archive/process_snapshot.h"
#include "archive/write_archive.h"
#include "cgi/settings.h"
#include "proc/process_table.h"
#include "util/unique_fd.h"

namespace {

Settings settings;
int devnull_fd = -1;

// Writes one archive to what is standard output now. Standard output itself becomes standard error,
// so that a complaint which the tracer prints cannot land in the middle of the archive; and no
// program that a collector starts gets hold of the archive's descriptor.
void dump_archive() {
    UniqueFd out(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 0));
    if (!out.valid()) {
        perror("standard output");
        return;
    }
    (void)dup2(STDERR_FILENO, STDOUT_FILENO);
    if (settings.compress)
        write_archive_gz(out.get());
    else
        write_archive_tar(out.get());
}

}  // namespace

int run_debugar(int argc, char **argv) {
    openlog("dbg-cgi", LOG_PID, LOG_DAEMON);
    pid_t ignore_pid = -1;
    if (parse_settings(argc, argv, &settings, &ignore_pid) != 0)
        return 1;
    set_ignore_pid(ignore_pid);
    // Without it nothing is lost: what would be thrown away cannot be written then, either.
    devnull_fd = open("/dev/null", O_RDWR);
    set_core_program(settings.core_program, devnull_fd);
    if (settings.dump_mode) {
        dump_archive();
        return 0;  // whatever became of the archive
    }
    fputs("debugar.cgi: the service is not built yet; -d writes an archive\n", stderr);
    return 1;
}
