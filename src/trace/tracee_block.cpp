#include <sys/uio.h>

#include "trace/backend.h"

ssize_t read_tracee_block(pid_t pid, unsigned long address, void *buf, size_t len) {
    const iovec local = {buf, len};
    const iovec remote = {reinterpret_cast<void *>(address), len};
    return process_vm_readv(pid, &local, 1, &remote, 1, 0);
}
