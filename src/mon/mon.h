// The applet `mon [INTERVAL_US]`: the debug monitor, run by hand.
#pragma once

// Makes a round every INTERVAL_US microseconds (1000 if not given; see mon_interval_us) until
// SIGINT comes, keeping its report in "/tmp/dbg-report.txt". Returns the exit status.
int run_mon(int argc, char **argv);

// The pause between two rounds in microseconds that the arguments ask for: decimal, hexadecimal
// with "0x", octal with "0"; 0 for text that is no number.
unsigned long mon_interval_us(int argc, char **argv);
