// Whole debug archives, as `debugar.cgi -d` makes them of the system in a sandbox.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "support/gunzip.h"
#include "support/process_state.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service_load.h"
#include "support/slow_machine.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true};

// Member names below the archive's directory, in which each run of files from /proc is one entry:
// "proc.DATE-TIME/..." and, for the directories below it, "proc/...".
std::vector<std::string> outline(const std::vector<TarMember> &members) {
    std::vector<std::string> result;
    for (const TarMember &member : members) {
        std::string name = member.name.substr(member.name.find('/') + 1);
        if (name.rfind("proc.", 0) == 0)
            name = "proc.DATE-TIME/...";
        else if (name.rfind("proc/", 0) == 0)
            name = "proc/...";
        if (result.empty() || result.back() != name)
            result.push_back(name);
    }
    return result;
}

// The same without the kernel's memory image, which has its place behind "oopslog" on a machine
// with little memory.
std::vector<std::string> without_kcore(std::vector<std::string> names) {
    auto kcore = std::find(names.begin(), names.end(), "kcore");
    if (kcore == names.end())
        return names;
    EXPECT_EQ("oopslog", *(kcore - 1));
    names.erase(kcore);
    return names;
}

std::string directory_of(pid_t pid, const char *name) {
    return std::string(name) + "." + std::to_string(pid) + "/";
}

TEST(Archive, HoldsEveryMemberInOrder) {
    run_in_sandbox(
        [] {
            TempDir dir;
            sandbox_bind(dir.file("monitor", "status of the monitor\n"),
                         "/var/run/dbg-cgi/dbg-monitor.txt");
            sandbox_bind(dir.file("media", "[media]\n"), "/etc/ws/onvif/media/media.conf");
            sandbox_bind(dir.file("sheet", "#!/bin/sh\necho healthy\n", 0755),
                         "/usr/sbin/gen_healthsheet.sh");
            sandbox_bind(dir.file("oops", "#!/bin/sh\necho oops: $*\n", 0755), "/usr/sbin/oopslog");
            Background sleeper({"/bin/sleep", "1000"});

            RunResult result =
                run_fieldkit({"debugar.cgi", "-d", "-t", "-p", cheap_core_writer(dir)});
            EXPECT_EQ(0, result.exit_status);
            std::vector<TarMember> members = read_tar(result.out);
            std::string process = directory_of(sleeper.pid(), "sleep");
            EXPECT_EQ((std::vector<std::string>{
                          "dbg-monitor.txt", "media.conf", "proc.DATE-TIME/...", "proc/...",
                          "strace.log", "netdump.cap", "healthsheet.txt", "oopslog",
                          "proc.DATE-TIME/...", "proc/...", process + "core", process + "fdmap"}),
                      without_kcore(outline(members)));

            std::string top = members.at(0).name.substr(0, members[0].name.find('/') + 1);
            EXPECT_EQ("debug-", top.substr(0, 6));
            EXPECT_EQ("-c0/", top.substr(21)) << top;
            auto data = [&](const std::string &name) {
                return find_member(members, top + name)->data;
            };
            EXPECT_EQ("status of the monitor\n", data("dbg-monitor.txt"));
            EXPECT_EQ("[media]\n", data("media.conf"));
            EXPECT_EQ("healthy\n", data("healthsheet.txt"));
            EXPECT_EQ("oops: -r /dev/part/oops\n", data("oopslog"));
            EXPECT_EQ(204800u, data("strace.log").size());
            EXPECT_NE(std::string::npos,
                      data("strace.log").find("[" + std::to_string(sleeper.pid()) + " sleep] "));
            EXPECT_EQ(512000u, data("netdump.cap").size());
            EXPECT_EQ("core of " + std::to_string(sleeper.pid()), data(process + "core"));
            EXPECT_NE(std::string::npos, data(process + "fdmap").find(" 0 -> pipe:["));
            EXPECT_TRUE(runs_free(sleeper.pid()));
        },
        WITH_ETH0);
}

TEST(Archive, InItsGzipFormHoldsTheSameMembersWithoutTheCompressor) {
    run_in_sandbox(
        [] {
            TempDir dir;
            Background sleeper({"/bin/sleep", "1000"});
            RunResult result = run_fieldkit({"debugar.cgi", "-d", "-p", cheap_core_writer(dir)});
            EXPECT_EQ(0, result.exit_status);
            std::string process = directory_of(sleeper.pid(), "sleep");
            EXPECT_EQ((std::vector<std::string>{"proc.DATE-TIME/...", "proc/...", "strace.log",
                                                "netdump.cap", "healthsheet.txt", "oopslog",
                                                "proc.DATE-TIME/...", "proc/...", process + "core",
                                                process + "fdmap"}),
                      without_kcore(outline(read_tar(gunzip(result.out)))));
        },
        WITH_ETH0);
}

TEST(Archive, LosesFilesThatAreMissingAndSaysWhichProgramsAre) {
    run_in_sandbox(
        [] {
            sandbox_scratch("/usr/sbin");
            std::filesystem::remove("/usr/sbin/oopslog");
            std::filesystem::remove("/usr/sbin/gen_healthsheet.sh");
            RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t", "-p", "/nonexistent"});
            EXPECT_EQ(0, result.exit_status);
            std::vector<TarMember> members = read_tar(result.out);
            std::vector<std::string> names = outline(members);
            EXPECT_EQ("proc.DATE-TIME/...", names.at(0));
            EXPECT_EQ(0u, result.err.find("/var/run/dbg-cgi/dbg-monitor.txt: Bad file descriptor\n"
                                          "/etc/ws/onvif/media/media.conf: Bad file descriptor\n"))
                << result.err;
            std::string top = members[0].name.substr(0, members[0].name.find('/') + 1);
            for (const char *name : {"healthsheet.txt", "oopslog"}) {
                EXPECT_EQ("execve: No such file or directory\n",
                          find_member(members, top + name)->data);
            }
        },
        WITH_ETH0);
}

TEST(Archive, StartsWithTheMediaConfigurationWhenThereIsNoMonitorStatus) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_bind(dir.file("media", "[media]\n"), "/etc/ws/onvif/media/media.conf");
        RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t", "-p", "/nonexistent"});
        EXPECT_EQ("media.conf", outline(read_tar(result.out)).at(0));
    });
}

TEST(Archive, WithoutACoreProgramHasNoCoresAndSaysSo) {
    run_in_sandbox([] {
        Background sleeper({"/bin/sleep", "1000"});
        RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t", "-p", "/nonexistent"});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("proc/...", outline(read_tar(result.out)).back());
        EXPECT_NE(std::string::npos,
                  result.err.find("dump error for pid " + std::to_string(sleeper.pid())));
        EXPECT_TRUE(runs_free(sleeper.pid()));
    });
}

TEST(Archive, LeavesTheIgnoredProcessAlone) {
    run_in_sandbox([] {
        TempDir dir;
        Background ignored({"/bin/sleep", "1000"});
        Background other({"/bin/sleep", "1000"});
        RunResult result =
            run_fieldkit({"debugar.cgi", "-d", "-t", "-p", cheap_core_writer(dir), "-i",
                          std::to_string(ignored.pid()), "these", "are", "ignored"});
        std::vector<TarMember> members = read_tar(result.out);
        std::string other_core = directory_of(other.pid(), "sleep") + "core";
        std::vector<std::string> names = outline(members);
        EXPECT_NE(names.end(), std::find(names.begin(), names.end(), other_core));
        for (const std::string &name : names)
            EXPECT_EQ(std::string::npos, name.find(directory_of(ignored.pid(), "sleep"))) << name;
    });
}

TEST(Archive, WithoutASleepProgramHasATraceThatEndsAtOnce) {
    run_in_sandbox([] {
        TempDir dir;
        TempDir copies;
        std::filesystem::copy_file("/bin/sleep", copies / "nap");
        Background sleeper({copies / "nap", "1000"}, {.argv0 = "/bin/sleep"});
        // Something that cannot be executed lies over it.
        sandbox_bind(dir.file("sleep", "", 0644), "/bin/sleep");
        RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t", "-p", "/nonexistent"});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_NE(std::string::npos, result.err.find("execve: "));
        std::vector<TarMember> members = read_tar(result.out);
        std::string top = members.at(0).name.substr(0, members[0].name.find('/') + 1);
        // Its descriptors are listed, as at the end of every trace, but there was no time for more.
        std::string log = find_member(members, top + "strace.log")->data;
        EXPECT_NE(std::string::npos, log.find(" open fds:\n"));
        EXPECT_EQ(std::string::npos, log.find(") = "));
        EXPECT_TRUE(runs_free(sleeper.pid()));
    });
}

TEST(Archive, SurvivesAnEmptyProc) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "a sanitizer's run-time library needs /proc";
#endif
    run_in_sandbox([] {
        TempDir empty;
        sandbox_bind(empty.path(), "/proc");
        RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t", "-p", "/nonexistent"});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ(
            (std::vector<std::string>{"strace.log", "netdump.cap", "healthsheet.txt", "oopslog"}),
            outline(read_tar(result.out)));
    });
}

TEST(Archive, IsMadeWithTwentyDescriptorsLeft) {
    run_in_sandbox([] {
        TempDir dir;
        Background sleeper({"/bin/sleep", "1000"});
        RunOptions options;
        options.before_exec = [] {
            rlimit tight = {3 + 20, 3 + 20};
            setrlimit(RLIMIT_NOFILE, &tight);
        };
        RunResult result =
            run_fieldkit({"debugar.cgi", "-d", "-p", cheap_core_writer(dir)}, options);
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ(directory_of(sleeper.pid(), "sleep") + "fdmap",
                  outline(read_tar(gunzip(result.out))).back());
    });
}

TEST(Archive, EndsQuietlyWithHardlyAnyDescriptorsLeft) {
    run_in_sandbox([] {
        // The program's own loader needs one.
        for (rlim_t left = 1; left < 5; ++left) {
            RunOptions options;
            options.leak_check = false;
            options.before_exec = [left] {
                for (int fd = 3; fd < 1000; ++fd)
                    close(fd);
                rlimit tight = {3 + left, 3 + left};
                setrlimit(RLIMIT_NOFILE, &tight);
            };
            RunResult result = run_fieldkit({"debugar.cgi", "-d", "-t"}, options);
            EXPECT_EQ(0, result.exit_status);
            EXPECT_EQ(0, result.signal);
        }
    });
}

// Sees to it that a broken archive leaves nothing behind it in the sandbox but `sleeper`.
void expect_nothing_left(const Background &sleeper) {
    EXPECT_TRUE(wait_until([&] {
        int others = 0;
        for (const auto &entry : std::filesystem::directory_iterator("/proc")) {
            std::string name = entry.path().filename();
            if (name.find_first_not_of("0123456789") == std::string::npos)
                others += name != "1" && name != std::to_string(getpid()) &&
                          name != std::to_string(sleeper.pid());
        }
        return others == 0;
    }));
    EXPECT_TRUE(runs_free(sleeper.pid()));
}

TEST(Archive, EndsQuietlyWhenItsReaderGoesAwayDuringTheFirstSnapshot) {
    for (const char *form : {"-d", "-dt"}) {
        run_in_sandbox([form] {
            Background sleeper({"/bin/sleep", "1000"});
            RunResult result = run_program(
                {"/bin/sh", "-c",
                 "{ \"$0\" debugar.cgi $1 -p /nonexistent; echo $? >&2; } | head -c 20000 | wc -c",
                 fieldkit_path(), form});
            EXPECT_EQ("20000\n", result.out);
            EXPECT_EQ("0\n", result.err.substr(result.err.size() - 2)) << result.err;
            expect_nothing_left(sleeper);
        });
    }
}

TEST(Archive, EndsQuietlyWhenItsReaderGoesAwayDuringTheTrace) {
    run_in_sandbox([] {
        Background sleeper({"/bin/sleep", "1000"});
        {
            Background busy({"/bin/sh", "-c", "while :; do echo text; done >/dev/null"});
            Background archive({fieldkit_path(), "debugar.cgi", "-dt", "-p", "/nonexistent"});
            std::string line;
            do {
                line = archive.read_line();
            } while (line.find("\"text\\n\", 5) = 5") == std::string::npos &&
                     !testing::Test::HasFailure());
            archive.close_output();
            EXPECT_EQ(0, archive.wait(4).exit_status);
        }
        expect_nothing_left(sleeper);
    });
}

TEST(Archive, GivesItsOutputToNoProgramThatItStarts) {
    run_in_sandbox([] {
        TempDir dir;
        // One that lives on, and would keep the archive's reader waiting.
        sandbox_bind(
            dir.file("sheet", "#!/bin/sh\n/bin/sleep 1000 </dev/null >/dev/null 2>&1 &\n", 0755),
            "/usr/sbin/gen_healthsheet.sh");
        for (const char *form : {"-d", "-dt"}) {
            RunResult result = run_program(
                {"/bin/sh", "-c", "\"$0\" debugar.cgi $1 -p /nonexistent | tail -c 1 | wc -c",
                 fieldkit_path(), form},
                {.timeout_s = 60});
            EXPECT_EQ("1\n", result.out);
        }
    });
}

TEST(Archive, EndsQuietlyOnAFullDisk) {
    for (const char *form : {"-d", "-dt"}) {
        run_in_sandbox([form] {
            TempDir dir;
            TempDir disk;
            Background sleeper({"/bin/sleep", "1000"});
            ASSERT_EQ(0, mount("none", disk.path().c_str(), "tmpfs", 0, "size=65536"));
            RunResult result =
                run_program({"/bin/sh", "-c", "\"$0\" debugar.cgi $1 -p \"$2\" >\"$3\"",
                             fieldkit_path(), form, cheap_core_writer(dir), disk / "archive"});
            EXPECT_EQ(0, result.exit_status);
            EXPECT_EQ(65536u, std::filesystem::file_size(disk / "archive"));
            expect_nothing_left(sleeper);
            umount2(disk.path().c_str(), MNT_DETACH);
        });
    }
}

TEST(Archive, SurvivesProcessesThatComeAndGoWhileItIsMade) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string pause = is_slow_machine() ? "0.03" : "0.002";
        Background churn({"/bin/sh", "-c", "while :; do /bin/sleep " + pause + "; done"});
        Background brief({"/bin/sleep", "2"});
        RunResult result = run_fieldkit({"debugar.cgi", "-d", "-p", cheap_core_writer(dir)});
        EXPECT_EQ(0, result.exit_status);
        std::vector<std::string> names = outline(read_tar(gunzip(result.out)));
        EXPECT_NE(names.end(),
                  std::find(names.begin(), names.end(), directory_of(churn.pid(), "sh") + "core"));
        EXPECT_TRUE(runs_free(churn.pid()));
    });
}

TEST(Archive, IsMixedWithNoMessagesWhenStandardErrorIsClosed) {
    run_in_sandbox([] {
        RunOptions options;
        options.before_exec = [] {
            close(STDIN_FILENO);
            close(STDERR_FILENO);
        };
        RunResult result = run_fieldkit({"debugar.cgi", "-dt", "-p", "/nonexistent"}, options);
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ(std::string::npos, result.out.find(": Bad file descriptor\n"));
    });
}

TEST(Archive, IsReadByTarAndGzip) {
    run_in_sandbox([] {
        TempDir dir;
        RunResult result =
            run_program({"/bin/sh", "-c",
                         "\"$0\" debugar.cgi -d -p /nonexistent >\"$1/a.tgz\" 2>/dev/null && "
                         "cd \"$1\" && gzip -t a.tgz && tar xzf a.tgz && ls debug-*/netdump.cap",
                         fieldkit_path(), dir.path()});
        EXPECT_EQ(0, result.exit_status) << result.err;
        EXPECT_EQ("/netdump.cap\n", result.out.substr(result.out.find('/')));
    });
}

TEST(Debugar, AnswersHelpLikeAnUnknownOption) {
    RunResult help = run_fieldkit({"debugar.cgi", "-h"});
    RunResult unknown = run_fieldkit({"debugar.cgi", "-x"});
    EXPECT_EQ(1, help.exit_status);
    EXPECT_EQ(1, unknown.exit_status);
    EXPECT_EQ("dbg-cgi 0.1\n", help.out.substr(0, 12));
    EXPECT_EQ(help.out, unknown.out);
}

}  // namespace
