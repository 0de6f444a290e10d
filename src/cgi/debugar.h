#pragma once

// The applet `debugar.cgi`, the debug service. Returns its exit status.
int run_debugar(int argc, char **argv);
