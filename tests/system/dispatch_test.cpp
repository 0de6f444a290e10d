// The dispatcher, and the applets that provoke faults.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/temp_dir.h"

namespace {

TEST(Dispatcher, UnderItsOwnNameAloneSaysNothingAndFails) {
    RunResult result = run_fieldkit({});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ("", result.err);
}

TEST(Dispatcher, LooksItsOwnNameUpOnlyOnce) {
    for (const char *name : {"fieldkit", "/usr/bin/fieldkit"}) {
        RunResult result = run_fieldkit({name, "ctest"});
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("fieldkit: unknown fieldkit applet\n", result.out);
        EXPECT_EQ("", result.err);
    }
}

TEST(Dispatcher, UnderItsOwnNameWithItsOwnNameAsTheOnlyArgumentKnowsNoSuchApplet) {
    RunResult result = run_fieldkit({"fieldkit"});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("fieldkit: unknown fieldkit applet\n", result.out);
}

TEST(Dispatcher, NamesAnUnknownApplet) {
    for (const char *name : {"nosuch", "/some/dir/nosuch"}) {
        RunResult result = run_fieldkit({name});
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("nosuch: unknown fieldkit applet\n", result.out);
    }
    EXPECT_EQ(": unknown fieldkit applet\n", run_fieldkit({""}).out);
    EXPECT_EQ(": unknown fieldkit applet\n", run_fieldkit({"dir/"}).out);
}

TEST(Dispatcher, ComparesNamesExactly) {
    for (const char *name : {"CTEST", "ctest ", "ctes", "ctestx"})
        EXPECT_EQ(std::string(name) + ": unknown fieldkit applet\n", run_fieldkit({name}).out);
}

TEST(Dispatcher, PicksTheAppletByTheNameItIsStartedUnder) {
    for (const char *name : {"ctest", "/usr/sbin/ctest", "./ctest"}) {
        RunResult result = run_program({fieldkit_path()}, {.argv0 = name});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("call exit\n", result.out);
    }
    EXPECT_EQ("other: unknown fieldkit applet\n",
              run_program({fieldkit_path(), "ctest"}, {.argv0 = "other"}).out);
}

TEST(Dispatcher, FollowsALinkToIt) {
    TempDir dir;
    std::filesystem::create_symlink(fieldkit_path(), dir / "ctest");
    EXPECT_EQ("call exit\n", run_program({dir / "ctest"}).out);
}

TEST(Dispatcher, GivesTheAppletItsOwnNameAndArguments) {
    // The usage text shows that there was one argument too few behind the name.
    RunResult result = run_fieldkit({"/some/dir/pcapdump", "eth0"});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("USAGE: pcapdump netif dumpname\n", result.out);
    result = run_fieldkit({"/some/dir/pcapdump", "lo", "/nonexistent/file"});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("/nonexistent/file: No such file or directory\n", result.err);
}

TEST(Dispatcher, IgnoresABrokenPipeInEveryApplet) {
    // A reader that has gone: the applet would die of SIGPIPE, were it not ignored.
    int ends[2];
    ASSERT_EQ(0, pipe(ends));
    close(ends[0]);
    RunOptions options;
    options.before_exec = [&] {
        signal(SIGPIPE, SIG_DFL);
        dup2(ends[1], 1);
        rlimit tight = {40, 40};
        setrlimit(RLIMIT_NOFILE, &tight);
    };
    const std::vector<std::string> applets[] = {{"ctest"},
                                                {"fdleak"},
                                                {"pcapdump"},
                                                {"tstrace"},
                                                {"tstrace", "/bin/true"},
                                                {"stopper"},
                                                {"debugar.cgi", "-h"},
                                                {"oopslog"}};
    for (const std::vector<std::string> &applet : applets)
        EXPECT_EQ(0, run_fieldkit(applet, options).signal) << applet[0];
    close(ends[1]);
}

TEST(Dispatcher, HearsOfItsChildrenAlsoWhereItsStarterIgnoredThem) {
    Background applet({fieldkit_path(), "fdleak", "1000"},
                      {.leak_check = false, .before_exec = [] { signal(SIGCHLD, SIG_IGN); }});
    EXPECT_EQ("leaked 16", applet.read_line());
    const std::string ignored = status_field(applet.pid(), "SigIgn:");
    EXPECT_EQ(0u, std::stoull(ignored, nullptr, 16) >> (SIGCHLD - 1) & 1) << ignored;
}

TEST(Ctest, PrintsOneLineAndExitsWithZero) {
    RunResult result = run_fieldkit({"ctest", "ignored"});
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("call exit\n", result.out);
    EXPECT_EQ("", result.err);
}

TEST(Segfault, DiesOfSigsegv) {
    RunResult result = run_fieldkit({"segfault"}, {.before_exec = [] {
                                        rlimit none = {0, 0};
                                        setrlimit(RLIMIT_CORE, &none);
                                    }});
    EXPECT_EQ(SIGSEGV, result.signal);
    EXPECT_EQ("", result.out);
}

// fdleak with room for `limit` descriptors.
RunResult run_fdleak(rlim_t limit, const std::vector<std::string> &arguments = {}) {
    std::vector<std::string> words = {"fdleak"};
    words.insert(words.end(), arguments.begin(), arguments.end());
    return run_fieldkit(words, {.leak_check = false, .before_exec = [limit] {
                                    rlimit tight = {limit, limit};
                                    setrlimit(RLIMIT_NOFILE, &tight);
                                }});
}

TEST(Fdleak, PrintsItsCounterAfterEvery16Descriptors) {
    RunResult result = run_fdleak(3 + 50);
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ("leaked 16\nleaked 32\nleaked 48\n", result.out);
    EXPECT_EQ("open: Too many open files\n", result.err);
}

TEST(Fdleak, EndsWithTheOpenErrorWhicheverCallFails) {
    for (rlim_t limit : {3 + 16, 3 + 17, 3 + 18}) {
        RunResult result = run_fdleak(limit, {"1"});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("leaked 16\n", result.out);
        EXPECT_EQ("open: Too many open files\n", result.err);
    }
}

TEST(Fdleak, LeaksASocketAndAFileInTurn) {
    Background leak({fieldkit_path(), "fdleak", "1000"});
    EXPECT_EQ("leaked 16", leak.read_line());
    leak.send_signal(SIGSTOP);
    std::string fds = "/proc/" + std::to_string(leak.pid()) + "/fd/";
    for (int fd = 3; fd < 19; ++fd) {
        std::string target = std::filesystem::read_symlink(fds + std::to_string(fd));
        EXPECT_EQ(fd % 2 == 1 ? "socket:[" : "/dev/nul", target.substr(0, 8)) << fd;
    }
}

TEST(Fdleak, TakesItsDelayInAnyBase) {
    for (const char *delay : {"0x10", "020", "16", "none"})
        EXPECT_EQ("leaked 16\n", run_fdleak(3 + 16, {delay}).out);
}

// Processes in the sandbox's own table whose name is "fieldkit", and those of them that run.
struct Herd {
    int all = 0;
    int running = 0;
};
Herd count_herd() {
    Herd herd;
    for (const auto &entry : std::filesystem::directory_iterator("/proc")) {
        std::string name = entry.path().filename();
        if (name.find_first_not_of("0123456789") != std::string::npos)
            continue;
        std::string stat = read_whole_file(entry.path() / "stat");
        size_t at = stat.find("(fieldkit) ");
        if (at == std::string::npos)
            continue;
        ++herd.all;
        herd.running += stat[at + 11] == 'R';
    }
    return herd;
}

TEST(Forkbomb, CountsItsForksFromOneAndEveryChildSpinsAtOnce) {
    run_in_sandbox([] {
        Background bomb({fieldkit_path(), "forkbomb", "20000"});
        EXPECT_EQ("forks 1", bomb.read_line());
        EXPECT_EQ("forks 2", bomb.read_line());
        EXPECT_EQ("forks 3", bomb.read_line());
        bomb.send_signal(SIGSTOP);
        // The children, and not the one that forks and is stopped.
        EXPECT_TRUE(wait_until([] {
            Herd herd = count_herd();
            return herd.all >= 4 && herd.running == herd.all - 1;
        }));
    });
}

TEST(Forkbomb, WithoutArgumentsForksWithoutPauseAndEveryChildSpins) {
    run_in_sandbox([] {
        // A limit, so that the machine lives: further forks fail silently and are counted as well.
        RunOptions options;
        options.before_exec = [] {
            rlimit few = {20, 20};
            setrlimit(RLIMIT_NPROC, &few);
            (void)!setuid(65534);
        };
        // Where an unprivileged user may have it: the build folder may be somebody's own.
        TempDir dir;
        EXPECT_EQ(0, chmod(dir.path().c_str(), 0755));
        std::filesystem::copy_file(fieldkit_path(), dir / "fieldkit");
        Background bomb({dir / "fieldkit", "forkbomb"}, options);
        for (int i = 1; i <= 200; ++i)
            EXPECT_EQ("forks " + std::to_string(i), bomb.read_line());
        bomb.send_signal(SIGSTOP);
        EXPECT_TRUE(wait_until([] {
            Herd herd = count_herd();
            return herd.all >= 4 && herd.running == herd.all - 1;
        }));
    });
}

TEST(Forkbomb, OfDepthTwoHasChildrenThatForkAndCountOn) {
    run_in_sandbox([] {
        Background bomb({fieldkit_path(), "forkbomb", "50000", "0x2"});
        std::vector<std::string> lines;
        for (int i = 0; i < 4; ++i)
            lines.push_back(bomb.read_line());
        bomb.send_signal(SIGSTOP);
        // The starting process and its first child both say 1: the child inherits the count.
        EXPECT_EQ(2, std::count(lines.begin(), lines.end(), "forks 1"));
        EXPECT_EQ(2, std::count(lines.begin(), lines.end(), "forks 2"));
    });
}

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
// With a sanitizer all of them are linked.
TEST(Libraries, AreNotLoadedBeforeAnAppletNeedsThem) {
    const RunResult result = run_program(
        {fieldkit_path(), "ctest"}, {.env = {"LD_TRACE_LOADED_OBJECTS=1"}, .leak_check = false});
    EXPECT_NE(std::string::npos, result.out.find("libc.so")) << result.out;
    for (const char *name : {"libsockhand", "libformvars", "libcfgstore", "libz.so", "curl"})
        EXPECT_EQ(std::string::npos, result.out.find(name)) << result.out;
}

// The executable alone, in a folder that has none of its libraries beside it.
std::string copy_executable(const TempDir &dir) {
    dir.file("sbin/fieldkit", read_whole_file(fieldkit_path()), 0755);
    EXPECT_EQ(0, symlink("fieldkit", (dir / "sbin/debugar.cgi").c_str()));
    return dir / "sbin/debugar.cgi";
}

// Makes the dynamic linker find something else than `library` where it looks first.
RunOptions with_broken(const std::string &library, const TempDir &dir) {
    dir.file("broken/" + library, "no library");
    RunOptions options;
    options.env = {"LD_LIBRARY_PATH=" + dir / "broken"};
    return options;
}

// That this program itself has loaded.
std::string path_of_sockhand() {
    std::ifstream maps("/proc/self/maps");
    for (std::string line; std::getline(maps, line);) {
        if (line.find("/libsockhand.so") != std::string::npos)
            return line.substr(line.find('/'));
    }
    ADD_FAILURE() << "no libsockhand.so in this program";
    return "";
}

TEST(Libraries, ThatAreBrokenEndTheAppletThatNeedsThem) {
    run_in_sandbox([] {
        const TempDir dir;
        const std::string program = copy_executable(dir);
        const RunOptions options = with_broken("libsockhand.so", dir);
        const RunResult service =
            run_program({program, "-n", "-c", dir / "cgi", "-s", dir / "segf"}, options);
        EXPECT_EQ(127, service.exit_status);
        EXPECT_EQ(0u, service.err.find("fieldkit: ")) << service.err;
        EXPECT_NE(std::string::npos, service.err.find("broken/libsockhand.so")) << service.err;
        EXPECT_EQ("call exit\n", run_fieldkit({"ctest"}, options).out);
    });
}

TEST(Libraries, ThatAreBrokenAreToldOfByTheServiceBeforeItDetaches) {
    run_in_sandbox([] {
        const TempDir dir;
        const std::string program = copy_executable(dir);
        const RunResult service = run_program({program, "-c", dir / "cgi", "-s", dir / "segf"},
                                              with_broken("libformvars.so", dir));
        EXPECT_EQ(127, service.exit_status);
        EXPECT_NE(std::string::npos, service.err.find("broken/libformvars.so")) << service.err;
        EXPECT_NE(0, access((dir / "cgi").c_str(), F_OK));
    });
}

TEST(Libraries, AreTakenFromBesideTheExecutableWhereTheUsualOnesCannotBeOpened) {
    run_in_sandbox([] {
        const TempDir dir;
        const std::string program = copy_executable(dir);
        const RunOptions options = with_broken("libsockhand.so", dir);
        dir.file(LIBRARY_FOLDER "/libsockhand.so", read_whole_file(path_of_sockhand()), 0755);
        const Background service({program, "-n", "-c", dir / "cgi", "-s", dir / "segf"}, options);
        EXPECT_TRUE(wait_until([&] { return access((dir / "segf").c_str(), F_OK) == 0; }));
    });
}

#endif

}  // namespace
