// A file that a test writes an archive to.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "archive/tar_writer.h"
#include "support/refused_calls.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

struct ArchiveFile {
    TempDir dir;
    UniqueFd fd{open((dir / "archive").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600)};
    TarWriter *tw = tar_open(fd.get(), "top/");

    // Ends the archive and takes it apart.
    std::vector<TarMember> close() {
        tar_close(tw);
        return read_tar(bytes());
    }
    std::string bytes() const { return read_whole_file(dir / "archive"); }
};

// A writer onto a pipe whose reader has gone.
struct BrokenArchive {
    BrokenArchive() {
        signal(SIGPIPE, SIG_IGN);
        int ends[2];
        if (pipe(ends) != 0)
            abort();
        close(ends[0]);
        fd.reset(ends[1]);
        tw = tar_open(fd.get(), nullptr);
    }
    ~BrokenArchive() { tar_abandon(tw); }
    UniqueFd fd;
    TarWriter *tw;
};

// From here on no range of descriptors can be closed with one call, as before Linux 5.9.
inline void be_an_old_kernel() {
#ifdef SYS_close_range
    if (!refuse_call(SYS_close_range, ENOSYS))
        perror("seccomp");
#endif
}
