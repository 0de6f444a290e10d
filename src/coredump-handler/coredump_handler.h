#pragma once

// The applet `coredump-handler`, which the kernel starts for each crash with the core image on
// standard input. Returns its exit status.
int run_coredump_handler(int argc, char **argv);
