// Requests to the debug service that get in each other's way.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "support/gunzip.h"
#include "support/process_state.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/slow_machine.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;

const SandboxOptions WITH_ETH0 = {.eth0 = true, .timeout_s = 110};

constexpr char DEBUG_CGI[] = "/cgi/debug.cgi";
constexpr char ARCHIVE[] = "/cgi/debug.tgz";

std::string core_reply(const std::string &pid) {
    return ok_header("application/octet-stream", "core") + "core of " + pid;
}

bool exists(const std::string &path) {
    return access(path.c_str(), F_OK) == 0;
}

// A program that says that it runs, by making the file NAME.runs, and then waits until somebody has
// the pipe NAME.go open.
std::string held_program(const TempDir &dir, const std::string &name, const std::string &then) {
    EXPECT_EQ(0, mkfifo((dir / (name + ".go")).c_str(), 0600));
    return dir.file(
        name,
        "#!/bin/sh\n: >" + dir / (name + ".runs") + "\n: <" + dir / (name + ".go") + "\n" + then,
        0755);
}

bool await_run(const TempDir &dir, const std::string &name) {
    return wait_until([&] { return exists(dir / (name + ".runs")); });
}

// Also those that come later: the pipe stays open.
void let_go(const TempDir &dir, const std::string &name) {
    EXPECT_LE(0, open((dir / (name + ".go")).c_str(), O_RDWR | O_CLOEXEC));
}

// ---- Traces and the service's own children

// Reads from a client until `stop` is set, so that its sender is never held up.
class Reader {
  public:
    explicit Reader(Client client) : client_(std::move(client)), thread_([this] { run(); }) {}
    ~Reader() { stop(); }
    Reader(const Reader &) = delete;
    Reader &operator=(const Reader &) = delete;

    // Disconnects; returns how much has come.
    size_t stop() {
        stopped_ = true;
        if (thread_.joinable())
            thread_.join();
        client_.close();
        return size_;
    }

  private:
    void run() {
        char block[65536];
        while (!stopped_) {
            ssize_t n = recv(client_.fd(), block, sizeof block, MSG_DONTWAIT);
            if (n > 0)
                size_ += static_cast<size_t>(n);
            else
                usleep(1000);
        }
    }

    Client client_;
    std::atomic<bool> stopped_ = false;
    size_t size_ = 0;
    std::thread thread_;
};

// One of each request that starts a child, with its reply looked at.
void ask_for_children(Service *service, const std::string &pid) {
    EXPECT_EQ(core_reply(pid), service->reply(DEBUG_CGI, "cmd=coredump&pid=" + pid));
    std::string listing = service->reply(DEBUG_CGI, "cmd=ps");
    EXPECT_EQ(0u, listing.find(ok_header("text/plain", "psdump.txt"))) << listing;
    EXPECT_NE(std::string::npos, listing.find(pid)) << listing;
    Client trace = service->request(DEBUG_CGI, "cmd=rtrace&interval=1&trace=iostat");
    EXPECT_NE(std::string::npos, trace.read_until_text("probe text").find("probe text"));
}

// The next trace shows what `talker` does, and nothing stays traced.
void expect_traces_work_as_before(Service *service, const Background &talker) {
    Client trace = service->request(DEBUG_CGI, "cmd=strace&pid=" + std::to_string(talker.pid()));
    trace.read_until_text("getppid");
    trace.close();
    EXPECT_TRUE(service->is_at_rest());
    EXPECT_TRUE(nothing_is_traced());
}

TEST(ServiceRaces, TracesOfAllProcessesLeaveTheServicesOwnChildrenToThoseWhoWaitForThem) {
    run_in_sandbox(
        [] {
            TempDir dir;
            sandbox_bind(
                dir.file("probe", "#!/bin/sh\necho probe text\nexec /bin/sleep 1000\n", 0755),
                "/usr/bin/iostat");
            Background process({fixture_path("behave"), "sleep"});
            std::string pid = std::to_string(process.pid());
            ServiceLog log;
            Service service({.core_program = cheap_core_writer(dir), .run = log.run()});

            const int passes = is_slow_machine() ? 2 : 3;
            for (int round = 0; round < passes; ++round) {
                // The compressor is there when the first trace begins; that of the archive follows.
                Client archive = service.request("/cgi/debug.tgz", "");
                archive.read_until_text("\r\n\r\n");
                Client trace = service.request(DEBUG_CGI, "cmd=strace");
                trace.read_until_text("\r\n\r\n");
                Reader reader(std::move(trace));
                for (int i = 0; i < 3; ++i)
                    ask_for_children(&service, pid);
                reader.stop();
                if (round == 0) {
                    std::string reply = archive.read_all(90);
                    std::vector<TarMember> members = read_tar(gunzip(body_of(reply)));
                    EXPECT_LT(10u, members.size());
                }
                archive.close();
                EXPECT_TRUE(service.is_at_rest(60));
            }

            Background talker({fixture_path("behave"), "talk"});
            expect_traces_work_as_before(&service, talker);
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

TEST(ServiceRaces, AListingThatATraceOfAllProcessesTakesHoldOfIsWhole) {
    run_in_sandbox(
        [] {
            TempDir dir;
            sandbox_bind(held_program(dir, "ps", "echo a process\n"), "/bin/ps");
            Background talker({fixture_path("behave"), "talk"});
            ServiceLog log;
            Service service({.run = log.run()});
            Client listing = service.request(DEBUG_CGI, "cmd=ps");
            ASSERT_TRUE(await_run(dir, "ps"));
            std::vector<pid_t> children = children_of(service.pid());
            ASSERT_EQ(1u, children.size());
            Client trace = service.request(DEBUG_CGI, "cmd=strace");
            trace.read_until_text("\n[" + std::to_string(children[0]) + " ");
            Reader reader(std::move(trace));
            let_go(dir, "ps");
            EXPECT_EQ(ok_header("text/plain", "psdump.txt") + "a process\n", listing.read_all(20));
            reader.stop();
            EXPECT_TRUE(service.is_at_rest());
            expect_traces_work_as_before(&service, talker);
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

TEST(ServiceRaces, ATraceWhoseClientLeavesEndsAtOnceThoughItsProcessIsQuiet) {
    run_in_sandbox(
        [] {
            ServiceLog log;
            Background process({fixture_path("behave"), "sleep"});
            process.read_line();
            Service service({.run = log.run()});
            const int threads = service.threads();
            std::minstd_rand random(1);
            std::uniform_int_distribution<useconds_t> moment(0, is_slow_machine() ? 20000 : 1500);
            for (int i = 0; i < rounds(200); ++i) {
                Client client =
                    service.request(DEBUG_CGI, "cmd=strace&pid=" + std::to_string(process.pid()));
                if (i % 2 == 0)
                    client.read_until_text("\r\n\r\n");
                usleep(moment(random));
                client.close();
                ASSERT_TRUE(wait_until([&] { return service.threads() == threads; }))
                    << "in round " << i;
            }
            EXPECT_TRUE(service.is_at_rest())
                << service.descriptors() << " descriptors, " << service.threads() << " threads";
            EXPECT_TRUE(runs_free(process.pid()));
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

// ---- Descriptors

TEST(ServiceRaces, AReplyEndsWithItsWorkerWhileTheCompressorOfAnArchiveLives) {
    run_in_sandbox(
        [] {
            TempDir dir;
            sandbox_bind(held_program(dir, "ps", "echo a process\n"), "/bin/ps");
            Background process({fixture_path("behave"), "sleep"});
            Service service({.core_program = held_program(dir, "core", ":\n")});
            // The compressor is forked while the listing is under way.
            Client listing = service.request(DEBUG_CGI, "cmd=ps");
            ASSERT_TRUE(await_run(dir, "ps"));
            Client archive = service.request(ARCHIVE, "");
            archive.read_until_text("\x1f\x8b");
            let_go(dir, "ps");
            EXPECT_EQ(ok_header("text/plain", "psdump.txt") + "a process\n", listing.read_all(10));
            // The archive is not done.
            EXPECT_EQ(0u, service.reply(ARCHIVE, "").find("HTTP/1.0 503 "));
            let_go(dir, "core");
            archive.close();
            EXPECT_TRUE(service.is_at_rest(60));
        },
        WITH_ETH0);
}

// Where the descriptors of `pid` lead, from `first` on.
// What a child of the service has open, but for its standard streams and files: a shell has its
// script open. A line for each.
std::string foreign_descriptors(pid_t pid) {
    std::string targets;
    std::error_code error;
    for (fs::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", error), end;
         !error && it != end; it.increment(error)) {
        std::error_code gone;
        const std::string target = fs::read_symlink(it->path(), gone);
        const bool is_file = target[0] == '/' && target != "/dev/null";
        if (!gone && !is_file && atoi(it->path().filename().c_str()) > STDERR_FILENO)
            targets += target + "\n";
    }
    return targets;
}

TEST(ServiceRaces, ChildrenOfTheServiceHoldNothingButTheirStandardStreams) {
    run_in_sandbox(
        [] {
            TempDir dir;
            sandbox_bind(held_program(dir, "iostat", ":\n"), "/usr/bin/iostat");
            sandbox_bind(held_program(dir, "ps", ":\n"), "/bin/ps");
            sandbox_bind(held_program(dir, "sheet", ":\n"), "/usr/sbin/gen_healthsheet.sh");
            Background process({fixture_path("behave"), "sleep"});
            Service service({.core_program = held_program(dir, "core", ":\n")});
            // Clients and sockets of all kinds are open whenever a child starts.
            Client listener = service.request("/cgi/debug", "listen");
            Client strace =
                service.request(DEBUG_CGI, "cmd=strace&pid=" + std::to_string(process.pid()));
            strace.read_until_text("\r\n\r\n");
            Client capture = service.request(DEBUG_CGI, "cmd=pcapdump");
            capture.read_until_text("\r\n\r\n");
            Client rtrace = service.request(DEBUG_CGI, "cmd=rtrace&trace=iostat");
            ASSERT_TRUE(await_run(dir, "iostat"));
            Client listing = service.request(DEBUG_CGI, "cmd=ps");
            ASSERT_TRUE(await_run(dir, "ps"));
            Client archive = service.request(ARCHIVE, "");
            archive.read_until_text("\x1f\x8b");

            std::string seen;
            auto look = [&] {
                for (pid_t child : children_of(service.pid())) {
                    seen += read_whole_file("/proc/" + std::to_string(child) + "/comm");
                    // One that was just forked has all that the service has, for a moment.
                    EXPECT_TRUE(wait_until([&] { return foreign_descriptors(child).empty(); }))
                        << foreign_descriptors(child) << "in\n"
                        << seen;
                }
            };
            look();
            // Its trace comes when this one has ended; its timer is to be seen, too.
            strace.close();
            EXPECT_TRUE(wait_until([&] {
                look();
                return seen.find("sleep\n") != std::string::npos;
            }));
            ASSERT_TRUE(await_run(dir, "sheet"));
            look();
            let_go(dir, "sheet");
            ASSERT_TRUE(await_run(dir, "core"));
            look();
            for (const char *name : {"iostat\n", "ps\n", "fieldkit\n", "core\n"})
                EXPECT_NE(std::string::npos, seen.find(name)) << name << seen;
            for (const char *name : {"iostat", "ps", "core"})
                let_go(dir, name);
        },
        WITH_ETH0);
}

TEST(ServiceRaces, AnArchiveEndsForItsClientThoughAProgramThatItStartedLivesOn) {
    run_in_sandbox(
        [] {
            TempDir dir;
            std::string writer = dir.file("writer",
                                          "#!/bin/sh\n"
                                          "echo \"CORELEN 4 bytes, of processes:$3\" >&2\n"
                                          "printf core\n"
                                          "/bin/sleep 1000 </dev/null >/dev/null 2>&1 &\n"
                                          "echo $! >>" +
                                              dir / "left" + "\n",
                                          0755);
            Background process({fixture_path("behave"), "sleep"});
            Service service({.core_program = writer});
            std::string reply = service.reply("/cgi/debug.tar", "");
            EXPECT_LT(10u, read_tar(body_of(reply)).size());
            pid_t left = atoi(read_whole_file(dir / "left").c_str());
            EXPECT_EQ('S', process_state(left));
            EXPECT_TRUE(service.is_at_rest());
        },
        WITH_ETH0);
}

// ---- The directories of /proc

TEST(ServiceRaces, RequestsThatListDirectoriesAtOnceDoNotDisturbEachOther) {
    run_in_sandbox(
        [] {
            TempDir dir;
            ServiceLog log;
            Background process({fixture_path("behave"), "sleep"});
            std::string pid = std::to_string(process.pid());
            Service service({.core_program = cheap_core_writer(dir), .run = log.run()});

            std::atomic<bool> archived = false;
            std::vector<std::thread> clients;
            for (int kind = 0; kind < 4; ++kind) {
                clients.emplace_back([&, kind] {
                    while (!archived) {
                        if (kind == 0) {
                            EXPECT_EQ(core_reply(pid),
                                      service.reply(DEBUG_CGI, "cmd=coredump&pid=behave"));
                        } else if (kind == 1) {
                            Client client = service.request(DEBUG_CGI, "cmd=strace&pid=behave");
                            std::string header = ok_header("text/plain", "stracedump.txt");
                            EXPECT_EQ(0u, client.read_until_text("\r\n\r\n").find(header));
                        } else if (kind == 2) {
                            Client client = service.request(
                                DEBUG_CGI, "cmd=rtrace&interval=1&trace=smaps,status");
                            std::string header = ok_header("application/octet-stream", "rtrace");
                            EXPECT_EQ(0u, client.read_until_text("Name:").find(header));
                        } else {
                            std::string reply = service.reply(DEBUG_CGI, "cmd=ps");
                            EXPECT_EQ(0u, reply.find(ok_header("text/plain", "psdump.txt")));
                        }
                        // The archive is to have its share of such a machine.
                        if (is_slow_machine())
                            usleep(500000);
                    }
                });
            }
            std::string archive = service.reply("/cgi/debug.tar", "", 100);
            EXPECT_LT(10u, read_tar(body_of(archive)).size());
            archived = true;
            for (std::thread &client : clients)
                client.join();
            EXPECT_TRUE(service.is_at_rest());
            EXPECT_TRUE(nothing_is_traced());
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

}  // namespace
