// Adds files to an archive on standard output the way a snapshot of /proc does.
//
//   proc_files FILE...
#include <unistd.h>

#include "archive/tar_members.h"

int main(int, char **argv) {
    TarWriter *tw = tar_open(STDOUT_FILENO, "bench/");
    if (tw == nullptr)
        return 1;
    for (char **path = argv + 1; *path != nullptr; ++path) {
        if (tar_add_small_file(tw, STDOUT_FILENO, *path, *path, 0) != 0)
            return 1;
    }
    tar_close(tw);
    return 0;
}
