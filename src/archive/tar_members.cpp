#include "archive/tar_members.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include "util/spawn.h"
#include "util/stream.h"
#include "util/unique_fd.h"

int tar_add_file(TarWriter *tw, int fd, const char *name, const char *path) {
    UniqueFd source(open(path, O_RDONLY | O_CLOEXEC));
    struct stat status;
    if (fstat(source.get(), &status) != 0)
        return 0;
    return tar_add_open_file(tw, fd, name, source.get(), status.st_size, true);
}

int tar_add_open_file(TarWriter *tw, int fd, const char *name, int source, int64_t size,
                      bool fill) {
    tar_header(tw, name, size);
    (void)lseek(source, 0, SEEK_SET);
    int64_t copied = copy_fd(source, fd);
    if (copied < 0)
        return 1;
    if (fill && copied < size)
        (void)write_zeros(fd, size - copied);
    // The zeros are left out of the account on purpose, and with them from the padding that
    // follows: the layout of such a member is kept as it has always been.
    tar_account(tw, static_cast<uint32_t>(copied));
    return 0;
}

int tar_add_small_file(TarWriter *tw, int, const char *name, const char *path, uint32_t limit) {
    if (limit == 0)
        limit = SMALL_FILE_LIMIT;
    UniqueBlock<void> contents(malloc(limit));
    if (contents == nullptr)
        return 1;
    // An open that fails shows as a read that fails, "Bad file descriptor": that is how the members
    // that are missing are reported.
    UniqueFd source(open(path, O_RDONLY | O_CLOEXEC));
    int32_t n = read_all(source.get(), contents.get(), limit);
    if (n > 0) {
        tar_header(tw, name, n);
        (void)tar_write(tw, contents.get(), static_cast<uint32_t>(n));
    } else if (n < 0 && errno != EISDIR) {
        perror(path);
    }
    return 0;
}

int add_command_output(TarWriter *tw, int fd, const char *member, char *const argv[],
                       char *name_template) {
    UniqueFd output(mkostemp(name_template, O_CLOEXEC));
    if (output.valid())
        (void)unlink(name_template);
    (void)run_process_wait(argv[0], argv, STDIN_FILENO, output.get(), output.get(), false);
    struct stat status;
    if (fstat(output.get(), &status) != 0)
        return 0;
    // No fill: the file does not change any more.
    return tar_add_open_file(tw, fd, member, output.get(), status.st_size, false);
}
