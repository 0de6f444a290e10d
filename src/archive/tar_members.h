// Adds files of the file system, and the output of programs, to a tar stream.
#pragma once

#include <stdint.h>

#include "archive/tar_writer.h"

constexpr uint32_t SMALL_FILE_LIMIT = 102400;  // bytes kept of a file that is read whole

// Adds the file `path` as member `name` with the size that fstat tells, copied straight to `fd`,
// the writer's descriptor. A file that shrinks meanwhile is filled up with zeros; one that grows is
// copied to its end all the same. Returns 0, also when the file cannot be opened (no member), or 1
// when the output is broken.
int tar_add_file(TarWriter *tw, int fd, const char *name, const char *path);

// Adds the contents of the open file `source` likewise: header with `size`, then everything from
// its start, with zeros for what is missing if `fill` is set. Returns 0, or 1 when the output is
// broken.
int tar_add_open_file(TarWriter *tw, int fd, const char *name, int source, int64_t size, bool fill);

// Adds the file `path` as member `name`, read whole into memory first and cut to `limit` bytes (0:
// SMALL_FILE_LIMIT), as suits files of /proc. An empty file or a directory adds nothing; a file
// that cannot be read adds nothing and is named on standard error. Returns 0, or 1 when memory is
// short; output errors are not told.
int tar_add_small_file(TarWriter *tw, int fd, const char *name, const char *path, uint32_t limit);

// Runs `argv` with output and errors into an unlinked temporary file made from the mkstemp template
// `name_template` (which is changed), and adds that as `member`. Returns 0,
// also when there is no temporary file (no member), or 1 when the output is broken.
int add_command_output(TarWriter *tw, int fd, const char *member, char *const argv[],
                       char *name_template);
