// Private namespaces for tests of things that look at, trace or signal every process in sight.
#pragma once

#include <functional>
#include <string>

struct SandboxOptions {
    bool eth0 = false;    // a network interface "eth0" (10.99.0.1/24), its other end is "eth1"
    int timeout_s = 90;   // then everything in it is killed, and the test fails
};

// Runs `body` in a child process inside new pid, mount, network and IPC namespaces, with a /proc of
// its own, loopback up, and a private writable copy-on-write-free /tmp and /run. `body` makes
// GoogleTest assertions as usual; the test fails when any of them does. Everything that is started
// in there ends with it. Must not be used from a test that has threads.
//
// On machines that refuse namespaces the test is skipped, with the kernel's reason.
void run_in_sandbox(const std::function<void()> &body, const SandboxOptions &options = {});

// Only inside a sandbox: makes `path`, a file or directory, appear as `source` there, by a bind
// mount. A missing `path` is made below a writable overlay of its parent directory.
void sandbox_bind(const std::string &source, const std::string &path);

// Only inside a sandbox: runs a shell command, which must succeed.
void sandbox_shell(const std::string &command);
