#include "cgi/debugar.h"

#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include "archive/gzip_stream.h"
#include "archive/process_snapshot.h"
#include "archive/write_archive.h"
#include "cgi/service_loop.h"
#include "cgi/settings.h"
#include "formvars.h"
#include "proc/process_table.h"
#include "sockhand.h"
#include "util/standard_streams.h"
#include "util/unique_fd.h"

namespace {

constexpr int SEGF_BACKLOG = 2;

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

// Listens for requests at `path`, where an earlier run may have left its socket. -1 on failure.
int open_cgi_socket(const char *path) {
    (void)unlink(path);
    int cgi_socket = sockhand_server_socket(path, 0666);
    if (cgi_socket < 0)
        syslog(LOG_ERR, "Could not open %s: %m", path);
    return cgi_socket;
}

// The same for crash cores. Who may send them is up to the file-creation mask.
int open_segf_socket(const char *path) {
    (void)unlink(path);
    UniqueFd segf_socket(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!segf_socket.valid())
        return -1;
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (strlen(path) > sizeof address.sun_path)
        abort();  // a mistake in how the service was set up
    memcpy(address.sun_path, path, strlen(path));
    if (bind(segf_socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) !=
        0) {
        syslog(LOG_ERR, "Could not open %s: %m", path);
        return -1;
    }
    (void)listen(segf_socket.get(), SEGF_BACKLOG);
    return segf_socket.release();
}

// Ends the service if it cannot have the library: better at the start, where somebody looks, than
// at the first request.
void try_form_variables() {
    CGI_set_query("");
    CGI_save_env();
    CGI_cleanup();
}

int serve() {
    try_form_variables();
    if (!settings.no_daemon && daemon(0, 0) != 0) {
        perror("daemon\n");
        return 1;
    }
    // A client that goes away is an error of a write.
    (void)signal(SIGPIPE, SIG_IGN);
    (void)signal(SIGALRM, SIG_IGN);
    UniqueFd cgi_socket(open_cgi_socket(settings.cgi_socket_path));
    if (!cgi_socket.valid())
        return 1;
    UniqueFd segf_socket(open_segf_socket(settings.segf_socket_path));
    if (!segf_socket.valid())
        return 1;
    return service_loop(cgi_socket.get(), segf_socket.get(), settings.dump_dir);
}

}  // namespace

int run_debugar(int argc, char **argv) {
    fill_standard_streams();
    openlog("dbg-cgi", LOG_PID, LOG_DAEMON);
    pid_t ignore_pid = -1;
    if (parse_settings(argc, argv, &settings, &ignore_pid) != 0)
        return 1;
    set_ignore_pid(ignore_pid);
    // Without it nothing is lost: what would be thrown away cannot be written then, either.
    devnull_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
    set_core_program(settings.core_program, devnull_fd);
    if (settings.dump_mode) {
        dump_archive();
        return 0;  // whatever became of the archive
    }
    return serve();
}
