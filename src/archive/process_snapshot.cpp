#include "archive/process_snapshot.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "archive/control_line.h"
#include "archive/tar_members.h"
#include "proc/process_table.h"
#include "util/spawn.h"
#include "util/stream.h"
#include "util/unique_fd.h"

namespace {

constexpr size_t NAME_SIZE = 100;      // of a member, below the archive's directory
constexpr size_t DIRECTORY_SIZE = 90;  // of a process's directory
constexpr size_t CMDLINE_SIZE = 80;    // bytes of a command line that are looked at
constexpr int MAX_COVERED = 128;       // as many ids as a control line can hold

const char *core_program;
int sink_fd = -1;  // takes what is read only to be thrown away

// A core-image writer at work, and our ends of its pipes.
struct CoreWriter {
    pid_t pid = -1;
    UniqueFd control;  // its standard error
    UniqueFd data;     // its standard output
};

// Prints "pipes: ..." when it fails.
bool make_pipe(UniqueFd *read_end, UniqueFd *write_end) {
    int ends[2];
    // The writer gets its ends as its standard streams and must hold no other copies: closing its
    // standard error is how it says that no control line will come.
    if (pipe2(ends, O_CLOEXEC) != 0) {
        perror("pipes");
        return false;
    }
    read_end->reset(ends[0]);
    write_end->reset(ends[1]);
    return true;
}

bool start_core_writer(pid_t pid, CoreWriter *writer) {
    UniqueFd control_end;
    UniqueFd data_end;
    if (!make_pipe(&writer->control, &control_end) || !make_pipe(&writer->data, &data_end))
        return false;
    char option[] = "-c";
    char output[] = "/dev/stdout";
    char id[100];
    (void)snprintf(id, sizeof id, "%d", pid);
    char *argv[] = {const_cast<char *>(core_program), option, output, id, nullptr};
    writer->pid = spawn_process_noenv(core_program, argv, STDIN_FILENO, data_end.get(),
                                      control_end.get(), false);
    return true;
}

// Whether the writer has ended, and well.
bool finish_core_writer(const CoreWriter &writer) {
    int status;
    return wait_for_child(writer.pid, &status) != -1 && status == 0;
}

// Reads the control line into `line`. False when there is none.
bool read_control_line(int fd, char (&line)[CONTROL_LINE_SIZE + 1]) {
    size_t length = 0;
    while (length < CONTROL_LINE_SIZE) {
        ssize_t n = read(fd, line + length, CONTROL_LINE_SIZE - length);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            return false;
        const void *newline = memchr(line + length, '\n', static_cast<size_t>(n));
        length += static_cast<size_t>(n);
        if (newline != nullptr) {
            line[length] = '\0';
            return true;
        }
    }
    fputs("failed to read ctl line.\n", stderr);
    return false;
}

// "NAME.PID/", from the command line of `pid`: NAME is the last path component of its first word,
// empty for a kernel thread.
void process_directory(pid_t pid, char (&dir)[DIRECTORY_SIZE]) {
    char path[64];
    char cmdline[CMDLINE_SIZE + 1];
    (void)snprintf(path, sizeof path, "/proc/%d/cmdline", pid);
    ssize_t n = read_file(path, cmdline, CMDLINE_SIZE);
    const char *name = "unknown";
    if (n >= 0) {
        cmdline[n] = '\0';
        const char *slash = strrchr(cmdline, '/');
        name = slash != nullptr ? slash + 1 : cmdline;
    }
    (void)snprintf(dir, sizeof dir, "%s.%d/", name, pid);
}

// Copies the core of `length` announced bytes into the member `name`. Returns 0, or
// SNAPSHOT_BROKEN.
int add_core(TarWriter *tw, int fd, const char *name, const CoreWriter &writer, int64_t length,
             pid_t pid) {
    int result = 0;
    tar_header(tw, name, length);
    int64_t copied = copy_fd(writer.data.get(), fd);
    if (copied != length) {
        if (copied < 0) {
            fputs("ABORT!\n", stderr);
            result = SNAPSHOT_BROKEN;
        } else {
            fprintf(stderr, "WARNING: err=%d clen=%d pid=%d\n", static_cast<int>(copied),
                    static_cast<int>(length), pid);
        }
        (void)copy_fd(writer.data.get(), sink_fd);
        (void)copy_fd(writer.control.get(), STDERR_FILENO);
    }
    // What was announced, not what came: a short core leaves its member short, as the warning says,
    // and the padding that follows is the announced one's.
    tar_account(tw, static_cast<uint32_t>(length));
    return result;
}

// Takes the processes that `line` says are covered out of the list from entry `i` on.
void drop_covered(const char *line, pid_t *pids, int i, int count) {
    pid_t covered[MAX_COVERED];
    int nr_covered = control_line_pids(line, covered, MAX_COVERED);
    for (int k = 0; k < nr_covered; ++k)
        drop_pid(pids, i, count, covered[k]);
}

}  // namespace

void set_core_program(const char *program, int devnull_fd) {
    core_program = program;
    sink_fd = devnull_fd;
}

void snapshot_processes(TarWriter *tw, int fd, pid_t *pids, int count) {
    for (int i = 0; i < count; ++i) {
        if (pids[i] != -1 && snapshot_process(tw, fd, pids, i, count) == SNAPSHOT_BROKEN)
            return;
    }
}

int snapshot_process(TarWriter *tw, int fd, pid_t *pids, int i, int count) {
    pid_t pid = pids[i];
    CoreWriter writer;
    if (!start_core_writer(pid, &writer))
        return 0;
    char dir[DIRECTORY_SIZE];
    char name[NAME_SIZE];
    process_directory(pid, dir);

    char line[CONTROL_LINE_SIZE + 1];
    int64_t length = 0;
    if (read_control_line(writer.control.get(), line)) {
        length = control_line_core_length(line);
        drop_covered(line, pids, i, count);
    }
    // One that no header can announce would be lost together with all that is behind it.
    if (length > TAR_SIZE_LIMIT)
        length = 0;

    int result = 0;
    if (length > 0) {
        (void)snprintf(name, sizeof name, "%score", dir);
        result = add_core(tw, fd, name, writer, length, pid);
    } else {
        (void)copy_fd(writer.data.get(), sink_fd);
    }
    (void)copy_fd(writer.control.get(), sink_fd);

    if (!finish_core_writer(writer)) {
        fprintf(stderr, "dump error for pid %d", pid);
    } else if (length > 0) {
        (void)snprintf(name, sizeof name, "%sfdmap", dir);
        add_fdmap(tw, name, pid, fd);
    }
    return result;
}

int dump_core_to_fd(int out_fd, pid_t pid) {
    CoreWriter writer;
    if (!start_core_writer(pid, &writer))
        return 0;
    (void)copy_fd(writer.data.get(), out_fd);
    (void)copy_fd(writer.data.get(), sink_fd);
    (void)copy_fd(writer.control.get(), sink_fd);
    if (!finish_core_writer(writer))
        fprintf(stderr, "dump error for pid %d\n", pid);
    return 0;
}

void add_fdmap(TarWriter *tw, const char *name, pid_t pid, int fd) {
    char name_template[] = "/tmp/.fdmapXXXXXX";
    char path[] = "/bin/ls";
    char option[] = "-l";
    char dir[64];
    (void)snprintf(dir, sizeof dir, "/proc/%ld/fd", static_cast<long>(pid));
    char *argv[] = {path, option, dir, nullptr};
    (void)add_command_output(tw, fd, name, argv, name_template);
}
