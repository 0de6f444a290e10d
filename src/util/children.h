// The children of this process that some thread waits for, while another thread may trace them.
//
// A tracer waits for any child at all, and so takes the end of children that are not its own; and
// to a thread that waits for a child by its pid the kernel reports also the stops that a tracer in
// the same process is to handle. This module keeps the two out of each other's way: a waiter leaves
// stops to the tracer, and a tracer that has reaped a child leaves its status here for the waiter.
// It works for all who start children with fork_child, wait for them with wait_for_child, and trace
// with claim_child, wait_as_tracer and release_child. Any thread may call each of them. SIGCHLD
// must not be ignored: the kernel would keep no status of any child.
#pragma once

#include <sys/types.h>

// fork, of a child that will be waited for with wait_for_child or given to forget_child. With
// `trace_me` the child is going to make itself a tracee of the calling thread, which then claims
// it.
pid_t fork_child(bool trace_me);

// Waits for the end of the child `pid`, once, resuming after signals. Returns `pid` with the wait
// status in `status` (which may be null), whoever has reaped it; or -1, also for a `pid` of -1.
// If the calling thread itself has claimed the child, its next stop is a result, too.
pid_t wait_for_child(pid_t pid, int *status);

// Sends `sig` to the child `pid`, unless a tracer has reaped it: the number may be another
// process's by now. To a `pid` of -1, which the kernel would take for every process, it sends
// nothing.
void signal_child(pid_t pid, int sig);

// Keeps no status for the child `pid`: its parent waits for it in another way, in the thread that
// traces, or not at all any more.
void forget_child(pid_t pid);

// To be called before PTRACE_ATTACH: from here on wait_for_child in other threads leaves the child
// `pid` alone, its end included, until release_child or until wait_as_tracer has reaped it. Returns
// whether that is new: false for what is nobody's child here, or is claimed already.
bool claim_child(pid_t pid);

// To be called after PTRACE_DETACH, or when there is nothing to detach. Does nothing unless the
// calling thread has claimed `pid`.
void release_child(pid_t pid);

// waitpid for a thread that traces, with a `status` that is not null: hands on the status of what
// has ended to whoever waits for it.
pid_t wait_as_tracer(pid_t pid, int *status, int options);
