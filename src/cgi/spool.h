// The folder in which finished crash dumps lie until a client asks for one.
#pragma once

// Offers the first entry of the folder `dump_dir`, in the order of the directory, to the client
// that waits for a dump, and removes it once it has been sent completely. Sets `*spool_drained`
// when the directory has nothing behind that entry: the spool need not be looked at again. Without
// a client the entry stays, and the system log says that it could not be sent; that `dump_dir` is
// null is logged, too. Other failures are printed on standard error with the prefix "check_dumps";
// a folder that cannot be opened is none.
void check_dumps(const char *dump_dir, bool *spool_drained);
