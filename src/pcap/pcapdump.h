#pragma once

// The applet `pcapdump INTERFACE FILE`: captures everything that INTERFACE sees into FILE (made
// with mode 0600) until the interface fails or the process is killed. Returns the exit status: 0,
// or 1 for a missing argument or a file that cannot be made.
int run_pcapdump(int argc, char **argv);
