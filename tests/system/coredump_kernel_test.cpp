// The applet coredump-handler, started by the kernel for a real crash. The setting that makes the
// kernel do so counts for the whole machine, so this runs only where the kernel is the tests' own:
// FIELDKIT_KERNEL in the environment says so, as on the emulated board.
#include <elf.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <link.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "core_runs.h"

namespace {

const char *const CORE_SETTINGS[] = {"/proc/sys/kernel/core_pattern",
                                     "/proc/sys/kernel/core_pipe_limit"};

bool write_setting(const char *path, const std::string &text) {
    const int fd = open(path, O_WRONLY | O_CLOEXEC);
    const bool done =
        fd >= 0 && write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    if (fd >= 0)
        close(fd);
    return done;
}

// Sees to it that the kernel's settings for cores are, in the end, what they were when it was made:
// also when the test is killed, by a process of its own that waits for the test's end.
class CoreSettingsKept {
  public:
    CoreSettingsKept() {
        for (const char *path : CORE_SETTINGS)
            before_.push_back(read_whole_file(path));
        int ends[2];
        if (pipe2(ends, O_CLOEXEC) != 0)
            abort();
        pid_ = fork();
        if (pid_ == 0) {
            // Whoever kills the test kills its process group.
            setsid();
            close(ends[1]);
            char byte;
            while (read(ends[0], &byte, 1) < 0 && errno == EINTR) {
            }
            bool done = true;
            for (size_t i = 0; i < before_.size(); ++i)
                done = write_setting(CORE_SETTINGS[i], before_[i]) && done;
            _exit(done ? 0 : 1);
        }
        close(ends[0]);
        alive_ = ends[1];
    }
    ~CoreSettingsKept() {
        close(alive_);
        int status = -1;
        EXPECT_EQ(pid_, waitpid(pid_, &status, 0));
        EXPECT_EQ(0, status);
        for (size_t i = 0; i < before_.size(); ++i)
            EXPECT_EQ(before_[i], read_whole_file(CORE_SETTINGS[i]));
    }

  private:
    std::vector<std::string> before_;
    pid_t pid_ = -1;
    int alive_ = -1;
};

// The settings that contrib has for a device.
void set_as_on_a_device() {
    const char *bin = getenv("CONTRIB");
    const std::string file =
        std::string(bin != nullptr ? bin : "/usr/bin") + "/../lib/sysctl.d/60-coredump.conf";
    const RunResult result = run_program({"/bin/sh", "-c", "PATH=$PATH:/sbin sysctl -p " + file});
    ASSERT_EQ(0, result.exit_status) << result.out << result.err;
    ASSERT_EQ("|/usr/sbin/coredump-handler core.%p.%t %c %E %e\n",
              read_whole_file(CORE_SETTINGS[0]));
    ASSERT_EQ("0\n", read_whole_file(CORE_SETTINGS[1]));
}

// Ends by SIGSEGV, with this size limit for its core and `marker` in its memory.
RunResult crash(rlim_t limit, const std::string &marker, const std::function<void()> &meanwhile) {
    RunOptions options;
    options.before_exec = [limit] {
        const rlimit cores = {limit, limit};
        if (setrlimit(RLIMIT_CORE, &cores) != 0)
            abort();
    };
    Background program({fieldkit_path(), "segfault", marker}, options);
    meanwhile();
    return program.wait();
}

// The core that has `marker` in it, among those of whatever else crashes meanwhile.
std::string take_core(const FakeService &service, const std::string &marker) {
    for (int i = 0; i < 100 && !testing::Test::HasFailure(); ++i) {
        Connection connection = service.take_caller();
        if (!connection.valid())
            return "";
        // The answer is there when the handler has sent all, so it need not wait.
        connection.say("x");
        std::string core = connection.take_all();
        if (core.find(marker) != std::string::npos)
            return core;
    }
    return "";
}

// Where the memory that the core tells of ends in it.
size_t end_of_segments(const std::string &core) {
    ElfW(Ehdr) header;
    memcpy(&header, core.data(), sizeof header);
    size_t end = 0;
    for (size_t i = 0; i < header.e_phnum; ++i) {
        ElfW(Phdr) segment;
        memcpy(&segment, core.data() + header.e_phoff + i * sizeof segment, sizeof segment);
        end = std::max(end, static_cast<size_t>(segment.p_offset + segment.p_filesz));
    }
    return end;
}

void expect_whole_elf_core(const std::string &core) {
    ASSERT_GT(core.size(), sizeof(ElfW(Ehdr)));
    EXPECT_EQ(
        "\x7f"
        "ELF",
        core.substr(0, 4));
    ElfW(Ehdr) header;
    memcpy(&header, core.data(), sizeof header);
    EXPECT_EQ(ET_CORE, header.e_type);
    ASSERT_LE(header.e_phoff + header.e_phnum * sizeof(ElfW(Phdr)), core.size());
    EXPECT_EQ(end_of_segments(core), core.size());
}

bool is_kernel_ours() {
    return getenv("FIELDKIT_KERNEL") != nullptr;
}
const char *const NOT_OURS = "the core pattern of a machine in use is left alone";

}  // namespace

TEST(CoredumpOfACrash, ReachesTheServiceAsAWholeElfCore) {
    if (!is_kernel_ours())
        GTEST_SKIP() << NOT_OURS;
    std::filesystem::create_directories("/var/run/dbg-cgi");
    FakeService service;
    CoreSettingsKept kept;
    ASSERT_NO_FATAL_FAILURE(set_as_on_a_device());
    const std::string marker = "marker of " + std::to_string(getpid());
    std::string core;
    const RunResult result =
        crash(RLIM_INFINITY, marker, [&] { core = take_core(service, marker); });
    EXPECT_EQ(SIGSEGV, result.signal);
    expect_whole_elf_core(core);
}

TEST(CoredumpOfACrash, IsLoggedAndDroppedWithoutALimitForIt) {
    if (!is_kernel_ours())
        GTEST_SKIP() << NOT_OURS;
    SystemLog log("/dev/log");
    CoreSettingsKept kept;
    ASSERT_NO_FATAL_FAILURE(set_as_on_a_device());
    std::string message;
    const RunResult result = crash(0, "marker", [&] {
        // What the kernel tells as the path includes the name.
        while (message != "core dumps disabled for '/usr/sbin/fieldkit/fieldkit'") {
            message = log.read_line().message;
            ASSERT_FALSE(testing::Test::HasFailure());
        }
    });
    EXPECT_EQ(SIGSEGV, result.signal);
}
