// Plays the kernel of a MIPS machine for the MIPS backend: one tracee with registers and memory.
#pragma once

#include <errno.h>
#include <stdint.h>
#include <string.h>
#include <sys/ptrace.h>
#include <sys/types.h>

#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "trace/backend.h"
#include "trace/backend_mips_ptrace.h"

// There is one at a time; it is in place as long as it lives.
class MadeUpMipsKernel {
  public:
    struct Poke {
        int request;
        unsigned long address;
        uint32_t data;
        bool operator==(const Poke &) const = default;
    };

    std::map<unsigned long, uint32_t> user;  // by number; one that is not there cannot be read
    std::map<unsigned long, unsigned char> memory;
    std::vector<Poke> pokes;
    std::vector<int> requests;  // every request that is no poke
    bool getregs_fails = false;
    pid_t last_pid = 0;

    MadeUpMipsKernel() : before_(mips_ptrace) {
        current() = this;
        mips_ptrace = call;
    }
    ~MadeUpMipsKernel() {
        mips_ptrace = before_;
        current() = nullptr;
    }
    MadeUpMipsKernel(const MadeUpMipsKernel &) = delete;
    MadeUpMipsKernel &operator=(const MadeUpMipsKernel &) = delete;

    void put(unsigned long address, std::string_view bytes) {
        for (char c : bytes)
            memory[address++] = static_cast<unsigned char>(c);
    }
    void put_word(unsigned long address, uint32_t word) {
        for (unsigned i = 0; i < 4; i++)
            memory[address + i] = static_cast<unsigned char>(word >> (8 * i));
    }

  private:
    static MadeUpMipsKernel *&current() {
        static MadeUpMipsKernel *kernel = nullptr;
        return kernel;
    }

    static long call(int request, pid_t pid, unsigned long address, unsigned long data) {
        return current()->handle(request, pid, address, data);
    }

    static long fail() {
        errno = EIO;
        return -1;
    }

    long handle(int request, pid_t pid, unsigned long address, unsigned long data) {
        last_pid = pid;
        if (request == PTRACE_POKEUSER || request == PTRACE_POKEDATA) {
            pokes.push_back({request, address, static_cast<uint32_t>(data)});
            return 0;
        }
        requests.push_back(request);
        if (request == PTRACE_GETREGS) {
            if (getregs_fails)
                return fail();
            auto *slots = reinterpret_cast<uint64_t *>(data);
            for (uint64_t i = 0; i < 38; i++)
                slots[i] = 0x1111000000000000 + i;
            // Sign-extended, with the program counter behind the general registers, lo and hi.
            for (const auto &[number, value] : user)
                slots[number == 64 ? 34 : number] =
                    static_cast<uint64_t>(static_cast<int64_t>(static_cast<int32_t>(value)));
            return 0;
        }
        if (request == PTRACE_PEEKUSER) {
            const auto found = user.find(address);
            return found != user.end() ? static_cast<int32_t>(found->second) : fail();
        }
        if (request == PTRACE_PEEKDATA)
            return peek_word(address);
        return fail();
    }

    long peek_word(unsigned long address) {
        uint32_t word = 0;
        for (unsigned i = 0; i < 4; i++) {
            const auto found = memory.find(address + i);
            if (found == memory.end())
                return fail();
            word |= static_cast<uint32_t>(found->second) << (8 * i);
        }
        return static_cast<int32_t>(word);
    }

    MipsPtrace before_;
};
