#pragma once

// The applet `oopslog [-r] DEVICE`: says on standard error where the newest entry of the kernel's
// oops log on DEVICE is, and prints all entries on standard output, the newest one last; in the
// order in which they were written or, with -r, in the reverse. Returns the exit status: 0, also
// for an empty log, or 1 for a missing argument or a device that cannot be opened or tells no size.
int run_oopslog(int argc, char **argv);
