// Applets that provoke faults on purpose, so that the watchdogs of a device can be exercised.
#pragma once

// `ctest`: prints "call exit" and exits with 0.
int run_ctest(int argc, char **argv);

// `forkbomb [DELAY_US [DEPTH]]`: forks for ever, with a pause of DELAY_US microseconds (0) after
// each fork, and prints "forks N" each time. A child DEPTH (1) generations down spins for ever;
// those above it fork too. Failed forks are not told.
int run_forkbomb(int argc, char **argv);

// `fdleak [DELAY_US]`: opens a TCP socket and /dev/null in turn, with a pause of DELAY_US
// microseconds (0) after each, and never closes them. Prints "leaked N" after every 16th. Ends the
// process with 0 once no more can be opened, with "open: ..." on standard error.
int run_fdleak(int argc, char **argv);

// `segfault`: dies of SIGSEGV.
[[noreturn]] int run_segfault(int argc, char **argv);
