#include "support/refused_calls.h"

#include <errno.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/prctl.h>

bool can_refuse_calls() {
    // Where the kernel knows filters it is the missing one that it complains about.
    return prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, nullptr, 0, 0) == 0 || errno == EFAULT;
}

bool refuse_call(long number, int error, std::optional<CallArgument> argument) {
    const CallArgument wanted = argument.value_or(CallArgument{0, 0});
    const uint8_t unless_equal = argument ? 1 : 0;
    sock_filter code[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<uint32_t>(number), 0, 3),
        // The low half of the argument on these little-endian machines.
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS,
                 static_cast<uint32_t>(offsetof(seccomp_data, args) + wanted.index * 8)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, wanted.value, 0, unless_equal),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | static_cast<uint32_t>(error)),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
    };
    const sock_fprog program = {.len = 6, .filter = code};
    return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0) == 0;
}
