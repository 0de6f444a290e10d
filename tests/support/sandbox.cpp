#include "support/sandbox.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <exception>
#include <filesystem>
#include <set>
#include <utility>
#include <vector>

#include "support/run_program.h"
#include "support/temp_dir.h"

namespace {

constexpr int SKIPPED = 77;  // exit status of a sandbox that skips its test

bool write_file(const char *path, const std::string &text) {
    int fd = open(path, O_WRONLY | O_CLOEXEC);
    bool done = fd >= 0 && write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    if (fd >= 0)
        close(fd);
    return done;
}

[[noreturn]] void skip(const char *what) {
    fprintf(stderr, "no sandbox on this machine: %s: %s\n", what, strerror(errno));
    _exit(SKIPPED);
}

void enter_namespaces(const SandboxOptions &options) {
    uid_t uid = getuid();
    gid_t gid = getgid();
    int flags = CLONE_NEWPID | CLONE_NEWNS | CLONE_NEWIPC;
    if (options.own_network)
        flags |= CLONE_NEWNET;
    if (uid != 0)
        flags |= CLONE_NEWUSER;
    if (unshare(flags) != 0)
        skip("unshare");
    if (uid == 0)
        return;
    if (!write_file("/proc/self/setgroups", "deny") ||
        !write_file("/proc/self/uid_map", "0 " + std::to_string(uid) + " 1") ||
        !write_file("/proc/self/gid_map", "0 " + std::to_string(gid) + " 1"))
        skip("user namespace");
}

void set_up(const SandboxOptions &options) {
    if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
        skip("private mounts");
    if (mount("proc", "/proc", "proc", 0, nullptr) != 0)
        skip("mount /proc");
    // What runs on the machine keeps its state there, and a monitor's report may lie in it.
    if (mount("run", "/var/run", "tmpfs", 0, "mode=755") != 0)
        skip("mount /var/run");
    if (!options.own_network)
        return;
    sandbox_shell("ip link set lo up");
    if (!options.eth0)
        return;
    sandbox_shell("ip link add eth0 type veth peer name eth1");
    // The kernel's own neighbour discovery would disturb tests that want a quiet network.
    for (const char *name : {"eth0", "eth1"})
        write_file(("/proc/sys/net/ipv6/conf/" + std::string(name) + "/disable_ipv6").c_str(), "1");
    sandbox_shell(
        "ip addr add 10.99.0.1/24 dev eth0 && ip link set eth0 up && ip link set eth1 up");
}

[[noreturn]] void run_body(const std::function<void()> &body, const SandboxOptions &options) {
    set_up(options);
    // Caught by the framework it would have this process go on with the tests that follow.
    try {
        body();
    } catch (const std::exception &e) {
        ADD_FAILURE() << e.what();
    }
    fflush(stdout);
    fflush(stderr);
    _exit(testing::Test::IsSkipped() ? SKIPPED : testing::Test::HasFailure() ? 1 : 0);
}

// Process 1 of the sandbox: reaps orphans until the body has ended, and takes all others with it.
[[noreturn]] void run_init(pid_t body_pid) {
    for (;;) {
        int status;
        pid_t pid = waitpid(-1, &status, 0);
        if (pid == body_pid) {
            if (WIFSIGNALED(status))
                fprintf(stderr, "the sandbox died of signal %d\n", WTERMSIG(status));
            _exit(WIFEXITED(status) ? WEXITSTATUS(status) : 1);
        }
    }
}

[[noreturn]] void run_sandbox(const std::function<void()> &body, const SandboxOptions &options) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    enter_namespaces(options);
    pid_t init = fork();
    if (init == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        pid_t body_pid = fork();
        if (body_pid == 0)
            run_body(body, options);
        run_init(body_pid);
    }
    int status;
    while (waitpid(init, &status, 0) < 0 && errno == EINTR) {
    }
    _exit(WIFEXITED(status) ? WEXITSTATUS(status) : 1);
}

void mount_on(const std::string &source, const std::string &path) {
    ASSERT_EQ(0, mount(source.c_str(), path.c_str(), nullptr, MS_BIND, nullptr)) << strerror(errno);
}

}  // namespace

void run_in_sandbox(const std::function<void()> &body, const SandboxOptions &options) {
    fflush(stdout);
    fflush(stderr);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0)
        run_sandbox(body, options);
    pollfd end = {open_process(pid), POLLIN, 0};
    const bool ended = poll(&end, 1, options.timeout_s * 1000) == 1;
    close(end.fd);
    if (!ended)
        kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    if (!ended) {
        FAIL() << "the sandbox was still running after " << options.timeout_s << " s";
    }
    ASSERT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == SKIPPED)
        GTEST_SKIP() << "skipped inside the sandbox, for the reason above";
    EXPECT_EQ(0, WEXITSTATUS(status)) << "failed inside the sandbox, see above";
}

void sandbox_shell(const std::string &command) {
    RunResult result = run_program({"/bin/sh", "-c", "PATH=$PATH:/sbin:/usr/sbin; " + command});
    ASSERT_EQ(0, result.exit_status) << command << "\n" << result.out << result.err;
}

void sandbox_scratch(const std::string &path) {
    // A file system of its own: an overlay cannot lie on one that it covers.
    TempDir dir;
    ASSERT_EQ(0, mount("scratch", dir.path().c_str(), "tmpfs", 0, nullptr)) << strerror(errno);
    for (const char *name : {"upper", "work"})
        ASSERT_TRUE(std::filesystem::create_directory(dir / name));
    std::string layers =
        "lowerdir=" + path + ",upperdir=" + dir / "upper" + ",workdir=" + dir / "work";
    ASSERT_EQ(0, mount("overlay", path.c_str(), "overlay", 0, layers.c_str())) << strerror(errno);
    // The layers stay in use by the overlay; only their name goes.
    ASSERT_EQ(0, umount2(dir.path().c_str(), MNT_DETACH)) << strerror(errno);
}

void sandbox_bind(const std::string &source, const std::string &path) {
    namespace fs = std::filesystem;
    static std::vector<std::pair<std::string, std::string>> bound;
    // A link gives way too: what it points to may be everything, as with busybox.
    if (!fs::exists(path) || fs::is_symlink(path)) {
        fs::path base = fs::path(path).parent_path();
        while (!fs::exists(base))
            base = base.parent_path();
        // Through the links of a merged /usr, to the directory itself; and once only, since a
        // second layer would hide what is mounted in the first.
        static std::set<fs::path> layered;
        base = fs::canonical(base);
        if (layered.insert(base).second) {
            sandbox_scratch(base);
            // The layer hides what was bound below it before.
            for (const auto &[earlier, target] : bound) {
                if (fs::canonical(target).string().compare(0, base.string().size() + 1,
                                                           base.string() + "/") == 0)
                    mount_on(earlier, target);
            }
        }
        fs::create_directories(fs::path(path).parent_path());
        fs::remove(path);
        if (fs::is_directory(source))
            fs::create_directory(path);
        else
            fclose(fopen(path.c_str(), "w"));
    }
    mount_on(source, path);
    bound.emplace_back(source, path);
}
