// Copies the frames seen on a network interface into a stream in the classic pcap format.
#pragma once

#include <linux/filter.h>
#include <stdint.h>

// Captures on `interface` (an unknown name: on all) into `out_fd`, which stays the caller's, until
//
//   - `time_limit` seconds have passed (0: no limit),
//   - the next frame would leave too little of `size_limit` bytes for a filler (0: no limit),
//   - the interface fails, for instance because it went down, or,
//   - with neither limit, the reader of `out_fd`, a socket, has closed its end.
//
// With a `size_limit` the stream is then padded with filler records to exactly that size. Every
// record holds `cut_length` bytes (at most 1536), or as many as its frame when that is 0. `filter`,
// which may be null, says which frames are seen. The interface is made promiscuous if `promiscuous`
// says so, and is never promiscuous afterwards, even if it had been so before.
//
// Returns the number of bytes written, -1 when a write failed, or the negated system error number
// when the capture could not be set up. Prints "bind: ...", "setsockopt attach filter: ..." or
// "select: ..." on standard error when those fail.
int64_t capture_packets(const char *interface, int out_fd, uint32_t size_limit, uint32_t cut_length,
                        uint32_t time_limit, bool promiscuous, const sock_fprog *filter);

// Switches the promiscuous flag of `interface` on or off, through any socket. Failures are ignored.
void set_promiscuous(int socket_fd, const char *interface, bool on);

// Seconds since boot. Time limits are measured with it, so that setting the clock does not matter.
long uptime_seconds();
