// What goes into an archive about the system as a whole: the kernel's memory image, a packet
// capture and a system-call trace.
//
// The collectors return 0 to let the archive go on or 1 when its output is broken; a source that
// cannot be read costs its own member only, but for a capture that cannot be set up.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "archive/tar_writer.h"

// Adds "kcore", unless it is empty or larger than 10 MiB.
int add_kcore(TarWriter *tw, int fd);

// Captures on `interface` for `duration` seconds into the member "netdump.cap" of exactly `size`
// bytes or, when `tw` is null, into `size` bytes of plain output. When `fd` is a connected socket
// its own connection is left out. Returns 1 also when the capture cannot be set up: the archive
// then ends behind the member's header.
int add_netdump(TarWriter *tw, int fd, const char *interface, int32_t duration, int32_t size);

// A capture on "eth0" without an archive; negative arguments stand for 5 seconds, 5120000 bytes.
int pcap_request(int fd, int32_t duration, int32_t size);

// Traces the processes `pids` for 5 seconds into the member "strace.log" of exactly 204800 bytes:
// cut, or filled up with blank lines. The trace ends early when the archive's reader takes nothing
// for 5 seconds, for it may be one of them. Ended processes become -1.
int add_strace_log(TarWriter *tw, pid_t *pids, int count);

// Writes `n` bytes of blank lines of 80 characters to `fd`, less when a write fails.
void write_space_lines(int fd, int32_t n);

// Runs /bin/ps with its output and errors on `fd`.
void run_ps(int fd);
