#include "mon/monitor.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "mon/mon.h"
#include "mon/monitor_thread.h"
#include "support/process_state.h"
#include "support/refused_calls.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"
#include "util/spawn.h"

namespace {

struct DestroyMonitor {
    void operator()(MonitorContext *context) const { monitor_destroy(context); }
};
using Monitor = std::unique_ptr<MonitorContext, DestroyMonitor>;

// What `action` prints on standard error.
std::string printed(const std::function<void()> &action) {
    testing::internal::CaptureStderr();
    action();
    return testing::internal::GetCapturedStderr();
}

// No process has this id, and what has no executable counts as a kernel thread.
constexpr pid_t NOBODY = 0x7fffffff;

// Evaluates records that a test makes up. The pid matters only to those with many children: it
// tells whether they are a kernel thread.
class Evaluation : public testing::Test {
  protected:
    void SetUp() override { record_ = as_process(42); }

    static MonitorRecord as_process(pid_t pid) {
        MonitorRecord record = {};
        record.pid = pid;
        strcpy(record.name, "app");
        return record;
    }

    // The lines on standard error.
    std::string evaluate() {
        return printed([&] { monitor_evaluate(&context_, &record_); });
    }
    std::string with_descriptors(int total, int sockets) {
        record_.history[0] = {total, sockets, 0};
        return evaluate();
    }
    std::string with_children(int children) {
        record_.children = children;
        return evaluate();
    }
    // What it writes to the report, besides.
    std::string report() {
        char text[4096] = "";
        context_.report = fmemopen(text, sizeof text, "w");
        evaluate();
        fclose(context_.report);
        context_.report = nullptr;
        return text;
    }

    MonitorContext context_ = {};
    MonitorRecord record_ = {};
};

TEST_F(Evaluation, ReportsAnFdScoreOf38Of40FilesAnd300SocketsTheFirstTime) {
    EXPECT_EQ("pid 42 name app fd_score 38 [+38] sk=300\n", with_descriptors(340, 300));
    EXPECT_EQ("", with_descriptors(340, 300));
}

TEST_F(Evaluation, SaysNothingOf40FilesAnd8Sockets) {
    EXPECT_EQ("", with_descriptors(48, 8));
    EXPECT_EQ(2, record_.last_fd_score);
    EXPECT_EQ("", report());
}

TEST_F(Evaluation, ReportsAnFdScoreOf33FirstButShowsTheHistoryFrom32On) {
    EXPECT_EQ("", with_descriptors(31 * 8, 31 * 8));
    EXPECT_EQ("", report());
    EXPECT_EQ("", with_descriptors(32 * 8, 32 * 8));
    EXPECT_NE(std::string::npos, report().find("fdstats for pid=42 score=32:\n"));
    EXPECT_EQ("pid 42 name app fd_score 33 [+1] sk=264\n", with_descriptors(33 * 8, 33 * 8));
}

TEST_F(Evaluation, ShowsARiseFrom10To45AsABracketedPlus35) {
    EXPECT_EQ("", with_descriptors(10 * 8, 10 * 8));
    EXPECT_EQ("pid 42 name app fd_score 45 [+35] sk=360\n", with_descriptors(360, 360));
}

TEST_F(Evaluation, ShowsAFallWithoutAPlusSign) {
    // No score can fall and be new at once; but the peak could have been one of another rule.
    record_ = as_process(getpid());
    const std::string start = "pid " + std::to_string(getpid()) + " name app ";
    record_.last_fd_score = 50;
    EXPECT_EQ(start + "fd_score 45 [-5] sk=360\n", with_descriptors(360, 360));
    record_.last_children = 20;
    EXPECT_EQ(start + "fork_score 17 [-3]\n", with_children(17));
}

TEST_F(Evaluation, ShowsNoChangeAsABareZero) {
    record_ = as_process(getpid());
    const std::string start = "pid " + std::to_string(getpid()) + " name app ";
    record_.last_fd_score = 45;
    EXPECT_EQ(start + "fd_score 45 [0] sk=360\n", with_descriptors(360, 360));
    record_.last_children = 16;
    EXPECT_EQ(start + "fork_score 16 [0]\n", with_children(16));
}

TEST_F(Evaluation, ReportsAnFdScoreAgainOnlyAfterARiseByMoreThan32AboveTheLastReport) {
    EXPECT_NE("", with_descriptors(33 * 8, 33 * 8));
    EXPECT_EQ("", with_descriptors(0, 0));
    EXPECT_EQ("", with_descriptors(33 * 8, 33 * 8));
    EXPECT_EQ("", with_descriptors(65 * 8, 65 * 8));
    EXPECT_EQ("", with_descriptors(20 * 8, 20 * 8));
    EXPECT_EQ("pid 42 name app fd_score 66 [+46] sk=528\n", with_descriptors(66 * 8, 66 * 8));
}

TEST_F(Evaluation, ReportsAForkScoreAgainAfterARiseByTheThresholdAlone) {
    record_ = as_process(getpid());
    const std::string start = "pid " + std::to_string(getpid()) + " name app fork_score ";
    EXPECT_EQ("", with_children(15));
    EXPECT_EQ(start + "16 [+1]\n", with_children(16));
    EXPECT_EQ("", with_children(3));
    EXPECT_EQ("", with_children(31));
    EXPECT_EQ(start + "32 [+1]\n", with_children(32));
    EXPECT_EQ("", with_children(47));
}

TEST_F(Evaluation, OfExactly16ChildrenGivesAReportAndALineInTheFile) {
    record_ = as_process(getpid());
    const std::string pid = std::to_string(getpid());
    EXPECT_EQ("", with_children(15));
    EXPECT_EQ("", report());
    EXPECT_EQ("pid " + pid + " name app fork_score 16 [+1]\n", with_children(16));
    EXPECT_EQ("forkstats for pid=" + pid + ": score=16 nr_childs=16\n", report());
}

TEST_F(Evaluation, OfAKernelThreadWants32Children) {
    record_ = as_process(NOBODY);
    EXPECT_EQ("", with_children(16));
    EXPECT_EQ("", with_children(31));
    EXPECT_EQ("", report());
    EXPECT_EQ("pid 2147483647 name app fork_score 32 [+1]\n", with_children(32));
    EXPECT_EQ("forkstats for pid=2147483647: score=32 nr_childs=32\n", report());
    EXPECT_EQ("", with_children(63));
    EXPECT_EQ("pid 2147483647 name app fork_score 64 [+1]\n", with_children(64));
}

TEST_F(Evaluation, WritesTheHistoryWithItsHours) {
    record_ = as_process(getpid());
    for (int i = 0; i < 8; ++i)
        record_.history[static_cast<size_t>(i)] = {1000 + i, 800 + i, i};
    record_.children = 17;
    const std::string pid = std::to_string(getpid());
    // 100 for 800 sockets, 6 for 200 others.
    EXPECT_EQ("fdstats for pid=" + pid +
                  " score=106:\n"
                  "0h nr_fd=1000 nr_sock=800 nr_pipe=0\n"
                  "1h nr_fd=1001 nr_sock=801 nr_pipe=1\n"
                  "2h nr_fd=1002 nr_sock=802 nr_pipe=2\n"
                  "3h nr_fd=1003 nr_sock=803 nr_pipe=3\n"
                  "4h nr_fd=1004 nr_sock=804 nr_pipe=4\n"
                  "37h nr_fd=1005 nr_sock=805 nr_pipe=5\n"
                  "70h nr_fd=1006 nr_sock=806 nr_pipe=6\n"
                  "103h nr_fd=1007 nr_sock=807 nr_pipe=7\n"
                  "forkstats for pid=" +
                  pid + ": score=17 nr_childs=17\n",
              report());
}

TEST_F(Evaluation, MarksTheRecordAsEvaluated) {
    record_.seen_round = 7;
    record_.evaluated_round = 7;
    evaluate();
    EXPECT_EQ(7u, record_.seen_round);
    EXPECT_EQ(8u, record_.evaluated_round);
}

TEST(Monitor, BeginsWithRound1AndATableOf1024Buckets) {
    Monitor monitor(monitor_create(nullptr));
    EXPECT_EQ(1u, monitor->round);
    EXPECT_EQ(1024u, monitor->table->bucket_count);
    EXPECT_EQ(0u, monitor->table->count);
    EXPECT_EQ(nullptr, monitor->report);
}

// A shell that does what it is told, line by line, and answers "done" to each.
class Shell {
  public:
    Shell() : shell_({"/bin/sh", "-c", "while read line; do eval \"$line\"; echo done; done"}) {}
    pid_t pid() const { return shell_.pid(); }
    void run(const std::string &command) {
        shell_.write_input(command + "\n");
        ASSERT_EQ("done", shell_.read_line());
    }
    // Becomes another program.
    void become(const std::string &command) { shell_.write_input("exec " + command + "\n"); }
    void close_input() { shell_.close_input(); }
    void wait() { shell_.wait(); }

  private:
    Background shell_;
};

const MonitorRecord *record_of(const Monitor &monitor, pid_t pid) {
    return find_record(monitor->table, pid);
}

TEST(MonitorRound, WatchesNeitherInitNorItselfNorItsParent) {
    run_in_sandbox([] {
        Monitor monitor(monitor_create(nullptr));
        // The parent of this process is process 1 here; a child of it has both.
        pid_t child = fork();
        if (child == 0) {
            monitor_round(monitor.get());
            _exit(monitor->table->count == 0 && monitor->round == 2 ? 0 : 1);
        }
        int status = -1;
        EXPECT_EQ(child, wait_for_child(child, &status));
        EXPECT_EQ(0, status);
    });
}

TEST(MonitorRound, RemembersWhatItSawOfEachProcess) {
    run_in_sandbox([] {
        Monitor monitor(monitor_create(nullptr));
        Shell shell;
        shell.run("/bin/sleep 1000 & exec 4</dev/null 5</dev/null");
        const std::string children = "/proc/" + std::to_string(shell.pid()) + "/task/" +
                                     std::to_string(shell.pid()) + "/children";
        monitor_round(monitor.get());
        const MonitorRecord *record = record_of(monitor, shell.pid());
        ASSERT_NE(nullptr, record);
        EXPECT_EQ(shell.pid(), record->pid);
        EXPECT_EQ(getpid(), record->ppid);
        EXPECT_EQ(nullptr, record->parent);
        EXPECT_STREQ("sh", record->name);
        EXPECT_EQ(5, record->history[0].total);
        EXPECT_EQ(0, record->history[0].sockets);
        EXPECT_EQ(0, record->history[0].pipes) << "though it has three";
        EXPECT_EQ(1u, record->seen_round);
        EXPECT_EQ(2u, record->evaluated_round);
        EXPECT_EQ(2u, monitor->table->count);

        HashCursor cursor = {};
        while (const MonitorRecord *other = next_record(monitor->table, &cursor)) {
            if (other->pid != shell.pid()) {
                EXPECT_EQ(shell.pid(), other->ppid);
            }
        }
        monitor_round(monitor.get());
        EXPECT_EQ(record, record_of(monitor, shell.pid())) << "the same record";
        EXPECT_EQ(1, record->children);
        EXPECT_EQ(2u, record->seen_round);
        EXPECT_EQ(5, record->history[1].total);
    });
}

TEST(MonitorRound, ForgetsAProcessThatHasGoneAndItsChildrenForgetTheParent) {
    run_in_sandbox([] {
        Monitor monitor(monitor_create(nullptr));
        Shell shell;
        shell.run("/bin/sleep 1000 >/dev/null 2>&1 &");
        monitor_round(monitor.get());
        monitor_round(monitor.get());
        EXPECT_EQ(2u, monitor->table->count);
        EXPECT_EQ(1, record_of(monitor, shell.pid())->children);
        shell.close_input();
        shell.wait();
        monitor_round(monitor.get());
        EXPECT_EQ(nullptr, record_of(monitor, shell.pid()));
        ASSERT_EQ(1u, monitor->table->count);
        HashCursor cursor = {};
        const MonitorRecord *sleeper = next_record(monitor->table, &cursor);
        EXPECT_EQ(nullptr, sleeper->parent);
        EXPECT_EQ(1, sleeper->ppid);
        EXPECT_EQ(4u, sleeper->evaluated_round) << "evaluated all the same";
    });
}

TEST(MonitorRound, BeginsAnewWhenAPidHasAnotherName) {
    run_in_sandbox([] {
        Monitor monitor(monitor_create(nullptr));
        Shell shell;
        shell.run("exec 4</dev/null");
        for (int i = 0; i < 3; ++i)
            monitor_round(monitor.get());
        MonitorRecord *record = find_record(monitor->table, shell.pid());
        ASSERT_NE(nullptr, record);
        EXPECT_EQ(4, record->history[2].total);
        record->reported_fd_score = 1000;
        record->reported_children = 1000;
        shell.become("/bin/sleep 1000");
        ASSERT_TRUE(wait_until([&] { return status_field(shell.pid(), "Name:\t") == "sleep"; }));
        monitor_round(monitor.get());
        record = find_record(monitor->table, shell.pid());
        ASSERT_NE(nullptr, record);
        EXPECT_STREQ("sleep", record->name);
        EXPECT_EQ(4, record->history[0].total);
        EXPECT_EQ(0, record->history[1].total);
        EXPECT_EQ(0, record->history[2].total);
        EXPECT_EQ(1, record->history[4].total);
        EXPECT_EQ(0, record->reported_fd_score);
        EXPECT_EQ(0, record->reported_children);
        EXPECT_EQ(1u, monitor->table->count);
    });
}

TEST(MonitorUpdate, DropsAProcessThatCannotBeNamed) {
    Monitor monitor(monitor_create(nullptr));
    monitor_update(monitor.get(), NOBODY);
    EXPECT_EQ(0u, monitor->table->count);
    // Also one that it knew.
    auto *record = static_cast<MonitorRecord *>(calloc(1, sizeof(MonitorRecord)));
    record->pid = NOBODY;
    ASSERT_EQ(0, insert_record(monitor->table, record));
    monitor_update(monitor.get(), NOBODY);
    EXPECT_EQ(0u, monitor->table->count);
}

// The inode, which tells a new report from an old one.
ino_t inode_of(const std::string &path) {
    struct stat status = {};
    EXPECT_EQ(0, stat(path.c_str(), &status)) << path;
    return status.st_ino;
}

std::vector<std::string> files_in(const TempDir &dir) {
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(dir.path()))
        names.push_back(entry.path().filename());
    return names;
}

using Names = std::vector<std::string>;

TEST(MonitorReport, OfAQuietSystemIsTheHeaderAndABlankLine) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "report.txt";
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        EXPECT_EQ("Debug monitor status round=1\n\n", read_whole_file(path));
        EXPECT_EQ(nullptr, monitor->report);
        const ino_t first = inode_of(path);
        monitor->round = 0xabcdef01;
        monitor_round(monitor.get());
        EXPECT_EQ("Debug monitor status round=abcdef01\n\n", read_whole_file(path));
        EXPECT_NE(first, inode_of(path)) << "another file, not other contents";
        EXPECT_EQ(Names{"report.txt"}, files_in(dir));
    });
}

TEST(MonitorReport, IsForItsOwnerAlone) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "report.txt";
        umask(0);
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        struct stat status = {};
        ASSERT_EQ(0, stat(path.c_str(), &status));
        EXPECT_EQ(0600u, status.st_mode & 07777);
    });
}

TEST(MonitorReport, TakesThePlaceOfALinkAndLeavesItsTarget) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("target", "precious");
        const std::string path = dir / "report.txt";
        std::filesystem::create_symlink(dir / "target", path);
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        EXPECT_EQ("precious", read_whole_file(dir / "target"));
        EXPECT_EQ("Debug monitor status round=1\n\n", read_whole_file(path));
    });
}

TEST(MonitorReport, IsNotMadeWithoutAPath) {
    run_in_sandbox([] {
        Monitor monitor(monitor_create(nullptr));
        Shell shell;
        monitor_round(monitor.get());
        EXPECT_NE(nullptr, record_of(monitor, shell.pid()));
        EXPECT_EQ(2u, monitor->round);
    });
}

TEST(MonitorReport, ComesOnceItsFolderIsThere) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "folder/report.txt";
        Monitor monitor(monitor_create(path.c_str()));
        Shell shell;
        monitor_round(monitor.get());
        EXPECT_NE(nullptr, record_of(monitor, shell.pid())) << "the round is made all the same";
        EXPECT_EQ(Names{}, files_in(dir));
        ASSERT_TRUE(std::filesystem::create_directory(dir / "folder"));
        monitor_round(monitor.get());
        EXPECT_EQ("Debug monitor status round=2\n\n", read_whole_file(path));
    });
}

TEST(MonitorReport, StaysAsItWasWithNothingBesideItWhenItCannotBeReplaced) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "report.txt";
        ASSERT_TRUE(std::filesystem::create_directory(path));
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        EXPECT_EQ(Names{"report.txt"}, files_in(dir));
        EXPECT_TRUE(std::filesystem::is_directory(path));
    });
}

TEST(MonitorReport, StaysAsItWasWithNothingBesideItWhenTheDiskIsFull) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "report.txt";
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        signal(SIGXFSZ, SIG_IGN);
        rlimit none = {10, 10};
        ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &none));
        monitor_round(monitor.get());
        EXPECT_EQ("Debug monitor status round=1\n\n", read_whole_file(path));
        EXPECT_EQ(Names{"report.txt"}, files_in(dir));
    });
}

TEST(MonitorReport, IsNotBegunUnderANameThatIsTooLong) {
    run_in_sandbox([] {
        const std::string path = "/tmp" + std::string(5000, '/') + "report.txt";
        Monitor monitor(monitor_create(path.c_str()));
        monitor_round(monitor.get());
        EXPECT_EQ(nullptr, monitor->report);
        EXPECT_EQ(2u, monitor->round);
    });
}

TEST(MonitorReport, LeavesNoDescriptorOpen) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string path = dir / "report.txt";
        Monitor monitor(monitor_create(path.c_str()));
        const int before = dup(0);
        ASSERT_GE(before, 0);
        close(before);
        for (int i = 0; i < 5; ++i)
            monitor_round(monitor.get());
        const int after = dup(0);
        EXPECT_EQ(before, after);
        close(after);
    });
}

TEST(MonInterval, IsReadInEveryUsualBase) {
    struct Row {
        const char *argument;
        unsigned long interval_us;
    };
    const Row rows[] = {{"0x3e8", 1000}, {"1000", 1000}, {"01750", 1000}, {"0", 0},
                        {"word", 0},     {"", 0},        {"5000us", 5000}};
    for (const Row &row : rows) {
        std::string name = "mon";
        std::string argument = row.argument;
        char *argv[] = {name.data(), argument.data(), nullptr};
        EXPECT_EQ(row.interval_us, mon_interval_us(2, argv)) << row.argument;
    }
}

TEST(MonInterval, IsAMillisecondWhenNotGiven) {
    std::string name = "mon";
    char *argv[] = {name.data(), nullptr};
    EXPECT_EQ(1000ul, mon_interval_us(1, argv));
}

constexpr char SERVICE_REPORT[] = "/var/run/dbg-cgi/dbg-monitor.txt";

// The scheduling policy, field 41 of its stat file: 5 is the idle class.
std::string policy_of(pid_t thread) {
    const std::string stat = read_whole_file("/proc/self/task/" + std::to_string(thread) + "/stat");
    std::string rest = stat.substr(stat.rfind(')') + 2);
    for (int field = 3; field < 41; ++field)
        rest = rest.substr(rest.find(' ') + 1);
    return rest.substr(0, rest.find(' '));
}

// The thread of this process that is not its first one.
pid_t other_thread() {
    for (const auto &entry : std::filesystem::directory_iterator("/proc/self/task")) {
        const pid_t id = std::stoi(entry.path().filename());
        // The run-time library of the thread sanitizer has a thread of its own.
        if (id != getpid() && policy_of(id) == "5")
            return id;
    }
    return -1;
}

std::atomic<int> alarms;

TEST(MonitorThread, ReportsAtOnceFromTheIdleClassAndThenSleepsThroughSignals) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_bind(dir.path(), "/var/run/dbg-cgi");
        pthread_t thread;
        ASSERT_EQ(0, pthread_create(&thread, nullptr, monitor_thread, nullptr));
        ASSERT_TRUE(wait_until([] { return access(SERVICE_REPORT, F_OK) == 0; }));
        EXPECT_EQ("Debug monitor status round=1\n\n", read_whole_file(SERVICE_REPORT));
        EXPECT_NE(-1, other_thread()) << "there is no thread of the idle class";

        signal(SIGUSR2, [](int) { ++alarms; });
        for (int i = 1; i <= 3; ++i) {
            ASSERT_EQ(0, pthread_kill(thread, SIGUSR2));
#if defined(__SANITIZE_THREAD__)
            break;  // handlers may be put off until a sleep has ended
#endif
            ASSERT_TRUE(wait_until([&] { return alarms == i; }));
        }
        EXPECT_EQ("Debug monitor status round=1\n\n", read_whole_file(SERVICE_REPORT));
        EXPECT_EQ(Names{"dbg-monitor.txt"}, files_in(dir));
    });
}

TEST(MonitorThread, EndsWithAWordWhenItCannotHaveTheIdleClass) {
    run_in_sandbox([] {
        if (!refuse_call(SYS_sched_setscheduler, EPERM))
            GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
        TempDir dir;
        sandbox_bind(dir.path(), "/var/run/dbg-cgi");
        EXPECT_EQ("setschedparam: Operation not permitted\n", printed([] {
                      pthread_t thread;
                      ASSERT_EQ(0, pthread_create(&thread, nullptr, monitor_thread, nullptr));
                      ASSERT_EQ(0, pthread_join(thread, nullptr));
                  }));
        EXPECT_EQ(Names{}, files_in(dir));
    });
}

}  // namespace
