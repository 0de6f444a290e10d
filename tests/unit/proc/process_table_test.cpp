#include "proc/process_table.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

int ready_fd;  // in a Child that is setting up: the pipe to its parent, closed afterwards

// A child process that runs `set_up` and then waits to be killed.
class Child {
  public:
    explicit Child(const std::function<void()> &set_up = [] {}) {
        int ready[2];
        EXPECT_EQ(0, pipe(ready));
        pid_ = fork();
        if (pid_ == 0) {
            close(ready[0]);
            ready_fd = ready[1];
            set_up();
            (void)!write(ready_fd, "x", 1);
            close(ready_fd);
            for (;;)
                pause();
        }
        close(ready[1]);
        char byte;
        EXPECT_EQ(1, read(ready[0], &byte, 1));
        close(ready[0]);
    }
    ~Child() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    pid_t pid() const { return pid_; }

  private:
    pid_t pid_;
};

std::string from_cmdline(std::string text) {
    text.push_back('\0');
    return name_from_cmdline(text.data()) ? text.data() : "(none)";
}

std::string from_stat(std::string text) {
    text.push_back('\0');
    return name_from_stat(text.data()) ? text.data() : "(none)";
}

// A made-up /proc directory.
struct FakeProc {
    TempDir dir;
    void process(pid_t pid, const std::string &cmdline, const std::string &stat) {
        dir.file(std::to_string(pid) + "/cmdline", cmdline);
        dir.file(std::to_string(pid) + "/stat", stat);
    }
    std::string name(pid_t pid, size_t size = 128) const {
        std::string buf(size, '#');
        return proc_name(dir.path().c_str(), pid, buf.data(), size) == 1 ? buf.c_str() : "(none)";
    }
};

const std::string NUL(1, '\0');

// Gives up a capability of this process.
bool drop_from_permitted(unsigned capability) {
    __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2];
    if (syscall(SYS_capget, &header, data) != 0)
        return false;
    uint32_t mask = ~(1u << capability % 32);
    data[capability / 32].effective &= mask;
    data[capability / 32].permitted &= mask;
    data[capability / 32].inheritable &= mask;
    return syscall(SYS_capset, &header, data) == 0;
}

// What list_pids gives, in order.
std::vector<pid_t> sorted_pids(pid_t exclude) {
    std::vector<pid_t> pids(100);
    pids.resize(static_cast<size_t>(list_pids(pids.data(), 100, exclude)));
    std::sort(pids.begin(), pids.end());
    return pids;
}

TEST(ReadFile, MakesOneReadOfAtMostTheLength) {
    TempDir dir;
    std::string path = dir.file("ten", "0123456789");
    char buf[20] = "####";
    EXPECT_EQ(4, read_file(path.c_str(), buf, 4));
    EXPECT_EQ("0123", std::string(buf, 4));
    EXPECT_EQ(10, read_file(path.c_str(), buf, sizeof buf));
    EXPECT_EQ(-1, read_file((dir / "none").c_str(), buf, sizeof buf));
    EXPECT_EQ(-1, read_file("/", buf, sizeof buf));
}

TEST(ProcName, IsTheLastPathComponentOfArgumentZero) {
    EXPECT_EQ("app", from_cmdline("/usr/bin/app" + NUL + "-x" + NUL + "/etc/file"));
    EXPECT_EQ("app", from_cmdline("./app"));
    EXPECT_EQ("(none)", from_cmdline("app" + NUL + "/usr"));
    EXPECT_EQ("(none)", from_cmdline("/usr/bin/"));
    EXPECT_EQ("(none)", from_cmdline(""));
}

TEST(ProcName, IsTheCommandNameOfTheStatFileOtherwise) {
    EXPECT_EQ("app", from_stat("12 (app) S 1 12 12"));
    EXPECT_EQ("two words", from_stat("12 (two words) S 1"));
    EXPECT_EQ("(none)", from_stat("12 () S 1"));
    EXPECT_EQ("(none)", from_stat("12 (app)"));
    EXPECT_EQ("(none)", from_stat("12 app S 1"));
    EXPECT_EQ("(none)", from_stat("12 app) S 1"));
    EXPECT_EQ("(none)", from_stat(""));
}

TEST(ProcName, OfAStatNameWithParenthesesInItIsCutAtTheLastOnes) {
    EXPECT_EQ("b", from_stat("12 (a) (b) S 1"));
    EXPECT_EQ("(none)", from_stat("12 (a)b)x S 1"));
}

TEST(ProcName, SurvivesAStatFileCutAtEveryLength) {
    std::string text = "12 (app) S 1";
    for (size_t length = 0; length <= text.size(); ++length)
        EXPECT_EQ(length >= 9 ? "app" : "(none)", from_stat(text.substr(0, length))) << length;
}

TEST(ProcName, OfAProcessStartedWithAPathIsItsLastComponentAndOfABareNameComesFromStat) {
    FakeProc proc;
    proc.process(10, "/usr/bin/app" + NUL + "-v" + NUL, "10 (other) S 1");
    proc.process(11, "app" + NUL, "11 (statname) S 1");
    proc.process(12, "", "12 (kthread) S 1");
    proc.process(13, "", "");
    proc.process(14, "", "14 (a) (b) S 1");
    EXPECT_EQ("app", proc.name(10));
    EXPECT_EQ("statname", proc.name(11));
    EXPECT_EQ("kthread", proc.name(12));
    EXPECT_EQ("(none)", proc.name(13));
    EXPECT_EQ("b", proc.name(14));
    EXPECT_EQ("(none)", proc.name(15));
}

TEST(ProcName, DoesNotReadWhatTheBufferHeldBefore) {
    FakeProc proc;
    proc.process(10, std::string(20, 'a') + " (stale) x", "10 (app) S 1");
    EXPECT_EQ("app", proc.name(10, 256));
}

TEST(ProcName, FitsEveryBufferOfTwoBytesOrMore) {
    FakeProc proc;
    proc.process(10, "/bin/longname" + NUL, "10 (statname) S 1");
    for (size_t size = 2; size < 20; ++size) {
        std::string name = proc.name(10, size);
        EXPECT_LT(name.size(), std::max<size_t>(size, 7)) << name;
    }
    EXPECT_EQ("lo", proc.name(10, 8));
}

// The plain way to the two: each file is looked for, opened and read for one of them alone.
struct NameAndParent {
    int named;
    std::string name;
    pid_t parent;
    bool operator==(const NameAndParent &) const = default;
};

NameAndParent plain_name_and_parent(const std::string &root, pid_t pid, size_t size) {
    std::string directory = root + "/" + std::to_string(pid) + "/";
    std::string buf(size, '#');
    auto read_text = [&](const char *file) {
        struct stat status;
        if (stat((directory + file).c_str(), &status) != 0)
            return false;
        ssize_t n = read_file((directory + file).c_str(), buf.data(), size);
        if (n < 1)
            return false;
        buf[std::min(static_cast<size_t>(n), size - 1)] = '\0';
        return true;
    };
    if (!(read_text("cmdline") && name_from_cmdline(buf.data())) &&
        !(read_text("stat") && name_from_stat(buf.data())))
        return {0, "", -1};
    char text[257];
    ssize_t n = read_file((directory + "stat").c_str(), text, 256);
    text[n > 0 ? n : 0] = '\0';
    return {1, buf.c_str(), n > 0 ? ppid_from_stat(text) : -1};
}

NameAndParent name_and_parent(const std::string &root, pid_t pid, size_t size) {
    std::string buf(size, '#');
    pid_t parent = 4711;
    int named = proc_name_and_parent(root.c_str(), pid, buf.data(), size, &parent);
    return {named, named ? buf.c_str() : "", parent};
}

TEST(ProcNameAndParent, AreThoseOfThePlainReadersForEveryFileAndBuffer) {
    FakeProc proc;
    const std::string long_arguments = "/usr/bin/" + std::string(300, 'n');
    const std::string long_name = "(" + std::string(300, 'n') + ") S 9 1";
    const std::string cmdlines[] = {
        "",         "/usr/bin/app" + NUL + "-v", "app" + NUL, "app/", NUL + "/x", long_arguments,
        "\xff/\xfe"};
    const std::string stats[] = {"",
                                 "10 (stat name) S 7 8",
                                 "10 (app) S 7",
                                 "10 (a) (b) S 7 8",
                                 "10 (app)",
                                 "10 () S 7",
                                 "(" + NUL + ") S 7",
                                 long_name,
                                 "10 (app) " + std::string(244, ' ') + "S 71234 5",
                                 std::string(300, ' '),
                                 "1 2 3 99999999999999999999"};
    pid_t pid = 10;
    for (const std::string &cmdline : cmdlines) {
        for (const std::string &stat : stats)
            proc.process(pid++, cmdline, stat);
    }
    proc.dir.file(std::to_string(pid++) + "/cmdline", "/usr/bin/app");  // without a stat file
    proc.dir.file(std::to_string(pid++) + "/stat", "10 (app) S 7 8");
    proc.dir.file(std::to_string(pid) + "/stat/x", "a directory in the file's place");
    proc.dir.file(std::to_string(pid++) + "/cmdline/x", "");
    for (; pid >= 9; --pid) {
        for (size_t size : {2, 3, 4, 8, 9, 13, 14, 20, 128, 255, 256})
            ASSERT_EQ(plain_name_and_parent(proc.dir.path(), pid, size),
                      name_and_parent(proc.dir.path(), pid, size))
                << pid << " " << size;
    }
    EXPECT_EQ((NameAndParent{1, "stat name", 0}), name_and_parent(proc.dir.path(), 11, 128));
    EXPECT_EQ((NameAndParent{1, "app", 7}), name_and_parent(proc.dir.path(), 12, 128));
    EXPECT_EQ((NameAndParent{0, "", -1}), name_and_parent(proc.dir.path(), 0x7fffffff, 128));
}

TEST(ProcNameAndParent, TellsOfRealProcesses) {
    Child child([] { prctl(PR_SET_NAME, "a b"); });
    EXPECT_EQ((NameAndParent{1, "unit_proc", getppid()}), name_and_parent("/proc", getpid(), 128));
    EXPECT_EQ((NameAndParent{1, "unit_proc", 0}), name_and_parent("/proc", child.pid(), 128));
}

TEST(PidName, TellsOurOwnName) {
    char buf[128];
    ASSERT_EQ(1, pid_name(getpid(), buf, sizeof buf));
    EXPECT_STREQ("unit_proc", buf);
    EXPECT_EQ(0, pid_name(0x7fffffff, buf, sizeof buf));
}

TEST(ListPids, LeavesOutInitTheCallerItsParentAndThoseNamed) {
    run_in_sandbox([] {
        // Below init, which is 1: 2 is the body, and the list is made by a child of it.
        Child first;
        Child second;
        Child third;
        pid_t lister = fork();
        if (lister == 0) {
            std::vector<pid_t> all = {first.pid(), second.pid(), third.pid()};
            EXPECT_EQ(all, sorted_pids(-1));
            EXPECT_EQ((std::vector<pid_t>{first.pid(), third.pid()}), sorted_pids(second.pid()));
            set_ignore_pid(third.pid());
            EXPECT_EQ((std::vector<pid_t>{first.pid()}), sorted_pids(second.pid()));
            set_ignore_pid(-1);
            EXPECT_EQ(all, sorted_pids(-1));
            _exit(testing::Test::HasFailure());
        }
        int status;
        waitpid(lister, &status, 0);
        EXPECT_EQ(0, status);
    });
}

TEST(ListPids, FillsAFullArrayToExactlyItsCapacity) {
    run_in_sandbox([] {
        Child children[5];
        pid_t pids[4] = {-7, -7, -7, -7};
        EXPECT_EQ(3, list_pids(pids, 3, -1));
        EXPECT_GT(pids[2], 0);
        EXPECT_EQ(-7, pids[3]);
        EXPECT_EQ(0, list_pids(pids, 0, -1));
    });
}

TEST(ListPids, ListsADirectoryEntryZeroAndNoneThatIsNotANumber) {
    run_in_sandbox([] {
        TempDir fake;
        for (const char *name : {"0/x", "1/x", "self/x", "sys/x", "77/x"})
            fake.file(name, "");
        sandbox_bind(fake.path(), "/proc");
        EXPECT_EQ((std::vector<pid_t>{0, 77}), sorted_pids(-1));
    });
}

TEST(ListPids, GivesNothingWithoutProc) {
    run_in_sandbox([] {
        TempDir empty;
        sandbox_bind(empty.path(), "/proc");
        pid_t pids[10];
        EXPECT_EQ(0, list_pids(pids, 10, -1));
    });
}

TEST(DropPid, ReplacesTheFirstMatchInTheRange) {
    pid_t pids[] = {5, 6, 5, 5};
    drop_pid(pids, 1, 4, 5);
    EXPECT_EQ((std::vector<pid_t>{5, 6, -1, 5}), std::vector<pid_t>(pids, pids + 4));
    drop_pid(pids, 0, 4, 9);
    drop_pid(pids, 3, 3, 5);
    EXPECT_EQ((std::vector<pid_t>{5, 6, -1, 5}), std::vector<pid_t>(pids, pids + 4));
}

TEST(ExeLink, IsTerminatedOnlyWhenItIsCut) {
    char whole[4096];
    ssize_t length = exe_link(getpid(), whole, sizeof whole);
    ASSERT_GT(length, 4);
    char buf[4096];
    memset(buf, '#', sizeof buf);
    EXPECT_EQ(3, exe_link(getpid(), buf, 4));
    EXPECT_EQ(std::string(whole, 3), buf);
    memset(buf, '#', sizeof buf);
    EXPECT_EQ(length, exe_link(getpid(), buf, sizeof buf));
    EXPECT_EQ('#', buf[length]);
    EXPECT_EQ(-1, exe_link(0x7fffffff, buf, sizeof buf));
}

TEST(IsKernelThread, SaysYesOnlyOfProcessesWithoutAnExecutable) {
    EXPECT_EQ(0, is_kernel_thread(getpid()));
    EXPECT_EQ(1, is_kernel_thread(0x7fffffff));
}

TEST(ProcPpid, TellsTheParent) {
    Child child;
    EXPECT_EQ(getpid(), proc_ppid(child.pid()));
    EXPECT_EQ(-1, proc_ppid(0x7fffffff));
}

TEST(ProcPpid, IsAnotherFieldForACommandNameWithABlankInIt) {
    EXPECT_EQ(77, ppid_from_stat("12 (app) S 77 12 13"));
    EXPECT_EQ(0, ppid_from_stat("12 (my app) S 77 12 13"));
    EXPECT_EQ(5, ppid_from_stat("12 (a b) 5 77 9"));
    Child child([] { prctl(PR_SET_NAME, "a b"); });
    EXPECT_EQ(0, proc_ppid(child.pid()));
}

TEST(ProcPpid, NeedsFourFields) {
    std::string text = "12 (app) S 77";
    for (size_t length = 0; length < text.size() - 2; ++length)
        EXPECT_EQ(-1, ppid_from_stat(text.substr(0, length).c_str())) << length;
    EXPECT_EQ(7, ppid_from_stat("12 (app) S 7"));
    EXPECT_EQ(77, ppid_from_stat("12\t(app)\n\nS  77"));
}

TEST(FindPidsByName, ComparesExactlyAndStopsAtTheCapacity) {
    FakeProc proc;
    proc.process(10, "/usr/bin/app" + NUL, "10 (app) S 1");
    proc.process(11, "", "11 (app) S 1");
    proc.process(12, "/usr/bin/App" + NUL, "12 (App) S 1");
    proc.process(13, "/usr/bin/apps" + NUL, "13 (apps) S 1");
    proc.dir.file("x14/cmdline", "/usr/bin/app" + NUL);
    pid_t pids[10];
    int count = -1;
    find_pids_by_name(proc.dir.path().c_str(), "app", pids, &count, 10);
    ASSERT_EQ(2, count);
    std::sort(pids, pids + 2);
    EXPECT_EQ(10, pids[0]);
    EXPECT_EQ(11, pids[1]);
    find_pids_by_name(proc.dir.path().c_str(), "app", pids, &count, 1);
    EXPECT_EQ(1, count);
    find_pids_by_name((proc.dir / "none").c_str(), "app", pids, &count, 10);
    EXPECT_EQ(0, count);
}

TEST(CountFds, OfThreeSocketsAndTwoPipesGivesThreeSocketsAndNoPipes) {
    Child child([] {
        for (int fd = 0; fd < 1000; ++fd) {
            if (fd != ready_fd)
                close(fd);
        }
        int ends[2];
        (void)!pipe(ends);
        for (int i = 0; i < 3; ++i)
            (void)socket(AF_INET, SOCK_DGRAM, 0);
    });
    // The pipe that tells us of its being ready is closed a moment later.
    ASSERT_TRUE(wait_until([&] { return count_fds(child.pid(), nullptr, nullptr) == 5; }));
    int sockets = -1, pipes = -1;
    EXPECT_EQ(5, count_fds(child.pid(), &sockets, &pipes));
    EXPECT_EQ(3, sockets);
    EXPECT_EQ(0, pipes);
    EXPECT_EQ(5, count_fds(child.pid(), nullptr, nullptr));
}

// What count_fds gives, and the plain way to it: a directory stream and a link at a time.
using Counts = std::array<int, 3>;

Counts counted(pid_t pid) {
    int sockets = -1, pipes = -1;
    int all = count_fds(pid, &sockets, &pipes);
    return {all, sockets, pipes};
}

Counts plainly_counted(pid_t pid) {
    Counts counts = {};
    UniqueDir dir(opendir(("/proc/" + std::to_string(pid) + "/fd").c_str()));
    while (const dirent *entry = dir != nullptr ? readdir(dir.get()) : nullptr) {
        if (entry->d_name[0] == '.')
            continue;
        ++counts[0];
        char target[128];
        ssize_t n = readlinkat(dirfd(dir.get()), entry->d_name, target, sizeof target - 1);
        target[std::max<ssize_t>(n, 0)] = '\0';
        if (strncmp(target, "socket:[", 8) == 0)
            ++counts[1];
        else if (strcmp(target, "pipe:[") == 0)
            ++counts[2];
    }
    return counts;
}

TEST(CountFds, GivesWhatADirectoryStreamShowsForTablesOfAnyKindAndSize) {
    TempDir dir;
    const std::string decoy = dir.file("socket:[1]", "");
    const std::string long_path = dir.file(std::string(200, 'l'), "");
    for (int count : {0, 1, 5, 40, 350, 900}) {
        Child child([&] {
            rlimit limit = {2048, 2048};
            (void)setrlimit(RLIMIT_NOFILE, &limit);
            for (int fd = 0; fd < 2048; ++fd) {
                if (fd != ready_fd)
                    close(fd);
            }
            for (int i = 0; i < count; ++i) {
                switch (i % 4) {
                    case 0:
                        (void)socket(AF_UNIX, SOCK_STREAM, 0);
                        break;
                    case 1:
                        (void)open(decoy.c_str(), O_RDONLY);
                        break;
                    case 2:
                        (void)open(long_path.c_str(), O_RDONLY);
                        break;
                    case 3:
                        (void)memfd_create("socket:[2]", 0);
                        break;
                }
            }
            // One far away from the others, and a gap.
            (void)dup2(0, 1500);
            if (count > 20)
                close(1);
        });
        const int all = count == 0 ? 0 : count > 20 ? count : count + 1;
        const int sockets = count == 0 ? 0 : (count + 3) / 4 + 1;
        // What tells us of its being ready is closed a moment later.
        ASSERT_TRUE(wait_until([&] { return plainly_counted(child.pid())[0] == all; })) << count;
        EXPECT_EQ((Counts{all, sockets, 0}), counted(child.pid()));
        EXPECT_EQ(plainly_counted(child.pid()), counted(child.pid()));
    }
}

// Leaves a process with exactly those of the descriptors 0 to 255 that `wanted` wants, each third
// of them a socket.
void keep_descriptors(const std::function<bool(int)> &wanted) {
    ready_fd = fcntl(ready_fd, F_DUPFD, 500);
    for (int fd = 0; fd < 500; ++fd)
        close(fd);
    int socket_fd = fcntl(socket(AF_UNIX, SOCK_STREAM, 0), F_DUPFD, 300);
    int file_fd = fcntl(open("/dev/null", O_RDONLY), F_DUPFD, 300);
    close(0);
    close(1);
    for (int fd = 0; fd < 256; ++fd) {
        if (wanted(fd))
            (void)dup2(fd % 3 == 0 ? socket_fd : file_fd, fd);
    }
    close(socket_fd);
    close(file_fd);
}

TEST(CountFds, OfNumbersWithGapsAnywhereIsThatOfTheDescriptorsInUse) {
    struct {
        const char *numbers;
        bool (*wanted)(int fd);
        Counts counts;
    } const cases[] = {
        {"all", [](int) { return true; }, {256, 86, 0}},
        {"all but the first", [](int fd) { return fd > 0; }, {255, 85, 0}},
        {"all but the first forty", [](int fd) { return fd >= 40; }, {216, 72, 0}},
        {"all but the first hundred", [](int fd) { return fd >= 100; }, {156, 52, 0}},
        {"the even ones", [](int fd) { return fd % 2 == 0; }, {128, 43, 0}},
        {"all but each sixth", [](int fd) { return fd % 6 != 5; }, {214, 86, 0}},
        {"a shell's", [](int fd) { return fd < 3 || fd == 255; }, {4, 2, 0}},
        {"the first", [](int fd) { return fd == 0; }, {1, 1, 0}},
        {"the last", [](int fd) { return fd == 255; }, {1, 1, 0}},
        {"none", [](int) { return false; }, {0, 0, 0}},
    };
    for (const auto &[numbers, wanted, counts] : cases) {
        Child child([&] { keep_descriptors(wanted); });
        // What tells us of its being ready is closed a moment later.
        ASSERT_TRUE(wait_until([&] { return plainly_counted(child.pid()) == counts; })) << numbers;
        EXPECT_EQ(counts, counted(child.pid())) << numbers;
    }
}

TEST(CountFds, EndsForProcessesThatEndMeanwhile) {
    for (int i = 0; i < 50; ++i) {
        auto child = std::make_unique<Child>([] {
            for (int fd = 0; fd < 200; ++fd)
                (void)dup(0);
        });
        pid_t pid = child->pid();
        std::thread end([&] { child.reset(); });
        int sockets = -1, pipes = -1;
        int all = 0;
        do {
            all = count_fds(pid, &sockets, &pipes);
            EXPECT_GE(all, sockets);
        } while (all != 0);
        EXPECT_EQ(0, sockets);
        EXPECT_EQ(0, pipes);
        end.join();
    }
}

TEST(CountFds, OfAProcessThatHasGoneIsZeroThroughout) {
    int sockets = 7, pipes = 7;
    EXPECT_EQ(0, count_fds(0x7fffffff, &sockets, &pipes));
    EXPECT_EQ(0, sockets);
    EXPECT_EQ(0, pipes);
}

TEST(CountFds, CountsDescriptorsWhoseLinksMayNotBeRead) {
    run_in_sandbox([] {
        // /proc/PID/fd is open to root, but its links only to those who might trace the process.
        Child child;
        pid_t looker = fork();
        if (looker == 0) {
            if (prctl(PR_CAPBSET_DROP, CAP_SYS_PTRACE) != 0 || !drop_from_permitted(CAP_SYS_PTRACE))
                _exit(77);
            int sockets = -1, pipes = -1;
            int total = count_fds(child.pid(), &sockets, &pipes);
            _exit(total >= 3 && sockets == 0 && pipes == 0 ? 0 : 1);
        }
        int status;
        waitpid(looker, &status, 0);
        if (WEXITSTATUS(status) == 77)
            GTEST_SKIP() << "no capability to give up here";
        EXPECT_EQ(0, status);
    });
}

TEST(CountFds, SurvivesDescriptorsThatComeAndGo) {
    std::atomic<bool> stop = false;
    std::thread churn([&] {
        while (!stop) {
            int fd = open("/dev/null", O_RDONLY);
            close(fd);
        }
    });
    for (int i = 0; i < 200; ++i) {
        int sockets, pipes;
        EXPECT_GE(count_fds(getpid(), &sockets, &pipes), 3);
    }
    stop = true;
    churn.join();
}

}  // namespace
