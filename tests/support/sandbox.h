// Private namespaces for tests of things that look at, trace or signal every process in sight.
#pragma once

#include <functional>
#include <string>

struct SandboxOptions {
    bool eth0 = false;        // a network interface "eth0" (10.99.0.1/24), its other end is "eth1"
    int timeout_s = 90;       // then everything in it is killed, and the test fails
    bool own_network = true;  // else the machine's, for tests that it is set aside for
};

// Runs `body` in a child process inside new pid, mount, network and IPC namespaces (and a user
// namespace when not root), with a /proc of its own and loopback up. `body` makes GoogleTest
// assertions as usual; the test fails when any of them does. Everything that is started in there
// ends with it. For the whole body of a test, which must not have threads.
//
// On machines that refuse namespaces the test is skipped, with the kernel's reason.
void run_in_sandbox(const std::function<void()> &body, const SandboxOptions &options = {});

// Only inside a sandbox: makes `path`, a file or directory, appear as `source`, by a bind mount. A
// `path` that does not exist, or is a link, is made in a scratch layer over the nearest directory.
void sandbox_bind(const std::string &source, const std::string &path);

// Only inside a sandbox: makes the existing directory `path` writable without a trace outside: a
// scratch layer over it that ends with the sandbox.
void sandbox_scratch(const std::string &path);

// Only inside a sandbox: runs a shell command, which must succeed.
void sandbox_shell(const std::string &command);
