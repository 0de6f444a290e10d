#pragma once

// The applet `tstrace`: prints the system calls, signals and exits of processes, and the
// descriptors that they have open in the end.
int run_tstrace(int argc, char **argv);

// The applet `stopper`: holds processes at their exit until SIGINT.
int run_stopper(int argc, char **argv);
