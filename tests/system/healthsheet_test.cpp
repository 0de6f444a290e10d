// contrib/gen_healthsheet.sh, run as the archive runs it: with an empty environment.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

std::string script() {
    const char *dir = getenv("CONTRIB");
    return dir != nullptr ? std::string(dir) + "/../sbin/gen_healthsheet.sh"
                          : SOURCE_DIR "/contrib/gen_healthsheet.sh";
}

RunResult run_report(const std::vector<std::string> &argv) {
    RunOptions options;
    options.before_exec = [] { clearenv(); };
    return run_program(argv, options);
}

// The lines of a section, without its heading.
std::string section(const std::string &report, const std::string &name) {
    const std::string heading = "\n== " + name + "\n";
    const size_t at = report.find(heading);
    if (at == std::string::npos) {
        ADD_FAILURE() << "there is no section " << name << " in\n" << report;
        return "";
    }
    const size_t begin = at + heading.size();
    const size_t end = report.find("\n\n== ", begin);
    return report.substr(begin, end == std::string::npos ? end : end + 1 - begin);
}

std::string busybox() {
    for (const char *path : {"/bin/busybox", "/usr/bin/busybox"}) {
        if (access(path, X_OK) == 0)
            return path;
    }
    return "";
}

void expect_whole_report(const RunResult &result) {
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("", result.err);
    EXPECT_EQ(0U, result.out.find("status report of 2"));
    EXPECT_EQ(0U, section(result.out, "up time").find("up "));
    EXPECT_NE(std::string::npos, section(result.out, "up time").find("\nload "));
    EXPECT_EQ(0U, section(result.out, "memory").find("MemTotal:"));
    EXPECT_EQ(0U, section(result.out, "disks").find("Filesystem"));
    EXPECT_NE(std::string::npos, section(result.out, "interfaces").find("lo: received "));
    EXPECT_NE(std::string::npos, section(result.out, "processes").find("RSS kB"));
    EXPECT_NE("", section(result.out, "messages"));
}

TEST(HealthSheet, ReportsInAnyPosixShell) {
    expect_whole_report(run_report({script()}));
    expect_whole_report(run_report({"/bin/sh", script()}));
    if (access("/bin/dash", X_OK) == 0)
        expect_whole_report(run_report({"/bin/dash", script()}));
    if (!busybox().empty())
        expect_whole_report(run_report({busybox(), "sh", script()}));
}

TEST(HealthSheet, NeedsNoToolButBusybox) {
    if (busybox().empty())
        GTEST_SKIP() << "there is no busybox here";
    run_in_sandbox([] {
        TempDir copy;
        const std::string report = copy.file("report", read_whole_file(script()), 0755);
        TempDir tools;
        sandbox_shell("cp " + busybox() + " " + tools / "busybox");
        sandbox_shell("for name in $(" + tools / "busybox" +
                      " --list); do "
                      "[ $name = busybox ] || ln -s busybox " +
                      tools.path() + "/$name; done");
        TempDir none;
        sandbox_bind(none.path(), "/usr/local");
        // Where there is but one folder for all of them, each is a link to it.
        for (const char *dir : {"/sbin", "/bin", "/usr/sbin", "/usr/bin"}) {
            struct stat status;
            if (lstat(dir, &status) == 0 && S_ISDIR(status.st_mode))
                sandbox_bind(tools.path(), dir);
        }
        const RunResult result = run_report({report});
        expect_whole_report(result);
        EXPECT_NE(0, access("/usr/bin/gdb", X_OK)) << "the tools are still the machine's own";
    });
}

TEST(HealthSheet, ListsProcessesByTheirMemory) {
    run_in_sandbox([] {
        // So that there are process ids of more than one digit.
        sandbox_shell("for i in 1 2 3 4 5 6 7 8 9 10; do /bin/true; done");
        Background process({"/bin/cat"});
        const std::string list = section(run_report({script()}).out, "processes");
        std::vector<long> sizes;
        bool found = false;
        for (size_t at = list.find('\n') + 1; at < list.size(); at = list.find('\n', at) + 1) {
            int pid;
            char state;
            long resident, size;
            char name[64];
            ASSERT_EQ(5, sscanf(list.c_str() + at, "%d %c %ld %ld %63s", &pid, &state, &resident,
                                &size, name))
                << list;
            if (!sizes.empty()) {
                EXPECT_GE(sizes.back(), resident) << list;
            }
            sizes.push_back(resident);
            found = found || pid == process.pid();
        }
        EXPECT_TRUE(found) << list;
    });
}

TEST(HealthSheet, EndsWellWhenSourcesAreMissing) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("empty/proc/none", "");
        sandbox_bind(dir.file("df", "#!/bin/sh\necho asked without need\n", 0755),
                     "/usr/local/sbin/df");
        sandbox_bind(dir / "empty", "/proc");
        const RunResult result = run_report({script()});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("", result.err);
        for (const char *name : {"up time", "memory", "disks", "processes"})
            EXPECT_EQ("(not available)\n", section(result.out, name)) << name;
    });
}

TEST(HealthSheet, AsksNoServerForItsFileSystems) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("proc/mounts",
                 "server:/share /nfs nfs4 rw 0 0\n"
                 "server:/share /other ceph rw 0 0\n"
                 "//server/share /cifs cifs rw 0 0\n"
                 "someone /sshfs fuse.sshfs rw 0 0\n"
                 "/etc/auto.misc /misc autofs rw 0 0\n"
                 "/dev/root / ext4 rw 0 0\n"
                 "tmpfs /tmp tmpfs rw 0 0\n");
        sandbox_bind(dir.file("df", "#!/bin/sh\necho asked: \"$@\"\n", 0755), "/usr/local/sbin/df");
        sandbox_bind(dir / "proc", "/proc");
        EXPECT_EQ("asked: -k / /tmp\n", section(run_report({script()}).out, "disks"));
    });
}

// The kernel writes a blank as \040.
TEST(HealthSheet, AsksForMountPointsWithBlanksAndQuotes) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("proc/mounts",
                 "/dev/sda1 /media/My\\040USB\\040Stick vfat rw 0 0\n"
                 "/dev/sdb1 /media/the\\0402\"\\040one's fuseblk rw 0 0\n"
                 "/dev/root / ext4 rw 0 0\n");
        sandbox_bind(dir.file("df", "#!/bin/sh\nprintf '<%s>' \"$@\"\n", 0755),
                     "/usr/local/sbin/df");
        sandbox_bind(dir / "proc", "/proc");
        EXPECT_EQ("<-k></></media/My USB Stick></media/the 2\" one's>\n",
                  section(run_report({script()}).out, "disks"));
    });
}

}  // namespace
