#pragma once

// The service's monitor thread, for pthread_create: takes the idle scheduling class, then runs a
// round at once and one every hour, keeping "/var/run/dbg-cgi/dbg-monitor.txt". Takes no argument.
// Returns only when the class cannot be had, or there is no memory, with "setschedparam: ..." or
// "monitor_create: ..." printed on standard error.
void *monitor_thread(void *);
