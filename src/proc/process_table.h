// Readers of the kernel's process table in /proc.
//
// Each call opens, reads and closes what it needs; nothing is cached and nothing is printed. A
// process may end between any two of them: what is then returned is told below, and callers treat
// it as a process that has gone. All may be called from any thread.
#pragma once

#include <stddef.h>
#include <sys/types.h>

constexpr size_t STAT_SIZE = 256;  // bytes of a stat file that are looked at for the parent

// Opens `path`, makes one read of at most `len` bytes and closes it. Returns the number of bytes
// read, or -1 if the file could not be opened or read. The text is not terminated.
ssize_t read_file(const char *path, char *buf, size_t len);

// Puts the short name of `pid`, a process below the directory `root` (normally "/proc"), into `buf`
// of `len` (at least 2) bytes: the last path component of its argument 0 or, when that holds no
// "/" or ends in one, the command name from its stat file. Returns 1, or 0 when there is no name;
// `buf` then holds nothing of use.
int proc_name(const char *root, pid_t pid, char *buf, size_t len);

// proc_name in "/proc".
int pid_name(pid_t pid, char *buf, size_t len);

// proc_name, with a `len` of at most STAT_SIZE, and the parent as proc_ppid tells it (-1 when there
// is no name) in `parent`, for whoever wants both of many processes: reads the stat file once.
int proc_name_and_parent(const char *root, pid_t pid, char *buf, size_t len, pid_t *parent);

// Names a process that list_pids leaves out from now on; -1, as at the start, for none. Set once at
// start-up, before there are threads.
void set_ignore_pid(pid_t pid);

// Stores the ids of the running processes in `pids`, in the directory's order, and returns how many
// (at most `capacity`; what does not fit is dropped). Left out are process 1, the caller, its
// parent, `exclude_pid` and the process that set_ignore_pid named.
int list_pids(pid_t *pids, int capacity, pid_t exclude_pid);

// Replaces the first element of `pids` in [first, end) that equals `pid` by -1, if there is one.
void drop_pid(pid_t *pids, int first, int end, pid_t pid);

// Reads the link /proc/PID/exe into `buf`. Returns its length, or -1. The text is terminated only
// when it had to be cut to `size` - 1 bytes; otherwise the returned length alone tells its end.
ssize_t exe_link(pid_t pid, char *buf, size_t size);

// 1 for a process without a readable executable link (a kernel thread, or a process that has gone),
// else 0.
int is_kernel_thread(pid_t pid);

// The parent's process id, or -1 when it cannot be told. A command name with blanks in it makes
// this another field of the stat file.
pid_t proc_ppid(pid_t pid);

// Stores the ids of the processes below `root` whose proc_name is exactly `name` in `pids`, and
// their number, at most `capacity`, in `count`.
void find_pids_by_name(const char *root, const char *name, pid_t *pids, int *count, int capacity);

// Returns the number of open descriptors of `pid`, and stores in `sockets` and `pipes`, either of
// which may be null, how many of them are sockets and pipes. (The latter is always 0: see
// the source.) All are 0 when they cannot be listed.
int count_fds(pid_t pid, int *sockets, int *pipes);

// The parsing behind them, on terminated texts.

// Reduces `text`, the contents of a cmdline file, to the last path component of argument 0. False
// when that holds no "/" or ends in one; `text` is then as it was.
bool name_from_cmdline(char *text);

// Reduces `text`, the contents of a stat file, to the command name: what follows the last "("
// before the last ")", behind which a blank must stand. False when there is none.
bool name_from_stat(char *text);

// The fourth of the blank-separated fields of a stat file, or -1 when there are fewer. The fields
// are counted without regard to parentheses, so a command name with blanks in it shifts them.
pid_t ppid_from_stat(const char *text);
