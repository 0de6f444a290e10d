// How the debug service starts: as a daemon or in the foreground, its sockets, and what it says
// when it cannot.
#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/refused_calls.h"
#include "support/replies.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/system_log.h"
#include "support/temp_dir.h"

namespace {

constexpr int DAEMON_ERROR = 3 << 3 | 3;  // facility and priority in the system log

mode_t mode_of(const std::string &path) {
    struct stat status;
    EXPECT_EQ(0, lstat(path.c_str(), &status)) << path;
    return status.st_mode;
}

std::string link_of(pid_t pid, const std::string &name) {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/" + std::to_string(pid) + "/" + name, error);
}

// A Unix socket, and the address of `path` in its full length, as the service binds it.
int unix_socket(const std::string &path, sockaddr_un *address) {
    *address = {};
    address->sun_family = AF_UNIX;
    memcpy(address->sun_path, path.data(), std::min(path.size(), sizeof address->sun_path));
    return socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
}

// The process that listens at `path`, once there is one.
pid_t listener_at(const std::string &path) {
    ucred peer = {};
    EXPECT_TRUE(wait_until([&] {
        sockaddr_un address;
        int fd = unix_socket(path, &address);
        socklen_t size = sizeof peer;
        bool connected = connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof address) == 0 &&
                         getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0;
        close(fd);
        return connected;
    })) << "nobody listens at "
        << path;
    return peer.pid;
}

// Leaves a socket at `path` that nobody serves.
void leave_socket(const std::string &path) {
    sockaddr_un address;
    int fd = unix_socket(path, &address);
    ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof address));
    close(fd);
}

// The words of `debugar.cgi -n` with these sockets.
std::vector<std::string> foreground(const std::string &cgi_socket, const std::string &segf_socket) {
    return {fieldkit_path(), "debugar.cgi", "-n", "-c", cgi_socket, "-s", segf_socket};
}

// It ends by itself, and says why in the system log only.
void expect_logged_failure(const std::vector<std::string> &words, const std::string &message) {
    SystemLog log;
    RunResult result = run_program(words);
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ("", result.err);
    LogLine line = log.read_line();
    EXPECT_EQ(message, line.message);
    EXPECT_EQ(DAEMON_ERROR, line.priority);
    EXPECT_EQ("dbg-cgi", line.tag);
    EXPECT_NE("", line.pid);
    EXPECT_TRUE(log.read_lines().empty());
}

TEST(ServiceStart, DetachesFromWhoStartedIt) {
    run_in_sandbox([] {
        TempDir dir;
        RunResult result = run_fieldkit(
            {"debugar.cgi", "-c", dir / "cgi", "-s", dir / "segf", "-k", dir / "none"});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ("", result.err);
        pid_t daemon = listener_at(dir / "segf");
        EXPECT_EQ("/", link_of(daemon, "cwd"));
        for (const char *stream : {"fd/0", "fd/1", "fd/2"})
            EXPECT_EQ("/dev/null", link_of(daemon, stream));
        EXPECT_EQ(daemon, getsid(daemon));
        kill(daemon, SIGKILL);
    });
}

TEST(ServiceStart, InTheForegroundStaysWhereItIs) {
    run_in_sandbox([] {
        Service service;
        EXPECT_NE("/", link_of(service.pid(), "cwd"));
        EXPECT_NE("/dev/null", link_of(service.pid(), "fd/0"));
        EXPECT_EQ(getsid(0), getsid(service.pid()));
    });
}

TEST(ServiceStart, SaysWhyItCannotDetach) {
    run_in_sandbox([] {
        TempDir dir;
        // The C library does not take just anything for /dev/null.
        sandbox_bind(dir.file("null", ""), "/dev/null");
        const std::string log = dir / "log";
        RunResult result =
            run_program({"/bin/sh", "-c", "exec \"$0\" debugar.cgi -c \"$1\" -s \"$2\" 2>\"$3\"",
                         fieldkit_path(), dir / "cgi", dir / "segf", log});
        EXPECT_EQ(0, result.exit_status) << "the first process does not wait for the second";
        EXPECT_TRUE(wait_until([&] { return std::filesystem::file_size(log) > 0; }));
        EXPECT_EQ("daemon\n: No such device\n", read_whole_file(log));
        EXPECT_FALSE(std::filesystem::exists(dir / "cgi"));
    });
}

#if !defined(__SANITIZE_THREAD__)  // whose run-time library has a thread of its own
// No process or thread can be started any more, a sanitizer's search for leaks included.
void refuse_clones() {
    (void)refuse_call(SYS_clone, EAGAIN);
    (void)refuse_call(SYS_clone3, EAGAIN);
}

TEST(ServiceStart, SaysWhyItCannotFork) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    TempDir dir;
    const RunResult result = run_fieldkit({"debugar.cgi", "-c", dir / "cgi", "-s", dir / "segf"},
                                          {.leak_check = false, .before_exec = refuse_clones});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("daemon\n: Resource temporarily unavailable\n", result.err);
}

TEST(ServiceStart, EndsWhenItCannotHaveItsMonitor) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    TempDir dir;
    const RunResult result =
        run_fieldkit({"debugar.cgi", "-n", "-c", dir / "cgi", "-s", dir / "segf"},
                     {.leak_check = false, .before_exec = refuse_clones});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("pthread_create: Resource temporarily unavailable\n", result.err);
}
#endif

TEST(ServiceStart, WorksAlsoWithAThousandDescriptorsThatItWasLeft) {
    run_in_sandbox([] {
        ServiceOptions options;
        options.run.before_exec = [] {
            const rlimit room = {2000, 2000};
            setrlimit(RLIMIT_NOFILE, &room);
            while (open("/dev/null", O_RDONLY) < 1100) {
            }
        };
        Service service(options);
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        const Client listener = service.request("/x", "listen");
        EXPECT_TRUE(listener.is_waiting());
    });
}

TEST(ServiceStart, DoesWithoutANullDevice) {
    run_in_sandbox([] {
        TempDir dir;
        leave_socket(dir / "socket");  // which cannot be opened
        sandbox_bind(dir / "socket", "/dev/null");
        ASSERT_EQ(-1, open("/dev/null", O_RDWR | O_CLOEXEC));
        Service service;
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
    });
}

TEST(ServiceStart, IgnoresBrokenPipesAndAlarms) {
    run_in_sandbox([] {
        Service service;
        unsigned long ignored = std::stoul(status_field(service.pid(), "SigIgn:"), nullptr, 16);
        EXPECT_TRUE(ignored >> (SIGPIPE - 1) & 1);
        EXPECT_TRUE(ignored >> (SIGALRM - 1) & 1);
        for (int i = 0; i < 20; ++i)
            service.request("/x", "cmd=ps").close();
        service.process().send_signal(SIGALRM);
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceStart, RequestsAreOpenToAllAndCoresAsTheMaskHasIt) {
    const struct { mode_t mask, of_segf; } CASES[] = {{0, 0777}, {022, 0755}, {077, 0700}};
    for (const auto &row : CASES) {
        run_in_sandbox([&row] {
            Service service({.run = {.before_exec = [&row] { umask(row.mask); }}});
            EXPECT_EQ(S_IFSOCK | 0666u, mode_of(service.cgi_socket()));
            EXPECT_EQ(S_IFSOCK | row.of_segf, mode_of(service.segf_socket()));
        });
    }
}

TEST(ServiceStart, RemovesStaleSocketFilesSoThatARestartAfterACrashSucceeds) {
    run_in_sandbox([] {
        TempDir dir;
        for (int i = 0; i < 3; ++i) {
            Background service(foreground(dir / "cgi", dir / "segf"));
            // By its id: a stale socket cannot be connected to.
            EXPECT_EQ(service.pid(), listener_at(dir / "segf"));
            service.send_signal(SIGKILL);
            EXPECT_EQ(SIGKILL, service.wait().signal);
            EXPECT_TRUE(S_ISSOCK(mode_of(dir / "cgi")));
            EXPECT_TRUE(S_ISSOCK(mode_of(dir / "segf")));
        }
    });
}

TEST(ServiceStart, RemovesPlainFilesAndLinksInTheWayToo) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("cgi", "");
        ASSERT_EQ(0, symlink("elsewhere", (dir / "segf").c_str()));
        Background service(foreground(dir / "cgi", dir / "segf"));
        EXPECT_EQ(service.pid(), listener_at(dir / "segf"));
        EXPECT_TRUE(S_ISSOCK(mode_of(dir / "cgi")));
        EXPECT_TRUE(S_ISSOCK(mode_of(dir / "segf")));
        EXPECT_FALSE(std::filesystem::exists(dir / "elsewhere"));
    });
}

TEST(ServiceStart, UsesItsUsualPathsWithoutOptions) {
    run_in_sandbox([] {
        TempDir dir;
        mkdir((dir / "run").c_str(), 0755);
        sandbox_bind(dir / "run", "/var/run/dbg-cgi");
        Background service({fieldkit_path(), "debugar.cgi", "-n"});
        EXPECT_EQ(service.pid(), listener_at("/var/run/dbg-cgi/ctrl-segf-socket"));
        EXPECT_TRUE(S_ISSOCK(mode_of(dir / "run/ctrl-cgi-socket")));
        // The monitor is at work as well.
        EXPECT_TRUE(
            wait_until([&] { return std::filesystem::exists(dir / "run/dbg-monitor.txt"); }));
    });
}

TEST(ServiceStart, LogsThatTheRequestSocketCannotBeMade) {
    run_in_sandbox([] {
        TempDir dir;
        expect_logged_failure(
            foreground(dir / "none/cgi", dir / "segf"),
            "Could not open " + (dir / "none/cgi") + ": No such file or directory");
        EXPECT_FALSE(std::filesystem::exists(dir / "segf"));
    });
}

TEST(ServiceStart, LogsThatTheCoreSocketCannotBeMade) {
    run_in_sandbox([] {
        TempDir dir;
        expect_logged_failure(
            foreground(dir / "cgi", dir / "none/segf"),
            "Could not open " + (dir / "none/segf") + ": No such file or directory");
    });
}

TEST(ServiceStart, LogsThatAFolderIsInTheWay) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("segf/file", "");
        expect_logged_failure(foreground(dir / "cgi", dir / "segf"),
                              "Could not open " + (dir / "segf") + ": Address already in use");
    });
}

TEST(ServiceStart, ThePathOfTheCoreSocketMayFillItsAddressAndNoMore) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string longest =
            dir.path() + "/" + std::string(108 - dir.path().size() - 1, 's');
        ASSERT_EQ(108u, longest.size());
        Background service(foreground(dir / "cgi", longest));
        EXPECT_EQ(service.pid(), listener_at(longest));
        EXPECT_EQ(SIGABRT, run_program(foreground(dir / "cgi", longest + "s")).signal);
    });
}

TEST(ServiceStart, KeepsThreeCrashesWaitingWhileItIsBusy) {
    run_in_sandbox([] {
        Service service;
        service.process().send_signal(SIGSTOP);
        EXPECT_TRUE(wait_until([&] { return process_state(service.pid()) == 'T'; }));
        // A backlog of two, and the kernel takes one more.
        std::vector<int> waiting;
        int error = 0;
        while (error == 0 && waiting.size() < 20) {
            sockaddr_un address;
            int fd = unix_socket(service.segf_socket(), &address);
            fcntl(fd, F_SETFL, O_NONBLOCK);
            if (connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0)
                error = errno;
            waiting.push_back(fd);
        }
        EXPECT_EQ(EAGAIN, error);
        EXPECT_EQ(4u, waiting.size());
        for (int fd : waiting)
            close(fd);
        service.process().send_signal(SIGCONT);
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceStart, AcceptsAndIgnoresArgumentsBehindTheOptions) {
    run_in_sandbox([] {
        Service service({.options = {"17", "none"}});
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
    });
}

}  // namespace
