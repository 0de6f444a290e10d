// Crash dumps on their way through the service: from a process that just died, or from the spool,
// to the client that waits for one.
#include <errno.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <numeric>
#include <string>
#include <vector>

#include "support/process_state.h"
#include "support/refused_calls.h"
#include "support/replies.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/system_log.h"
#include "support/temp_dir.h"

namespace {

constexpr int DAEMON_ERROR = 3 << 3 | 3;  // facility and priority in the system log

std::string download(const std::string &name, const std::string &contents) {
    return ok_header("application/octet-stream", name) + contents;
}

// The names in the folder of a spool, in the order of the directory.
std::vector<std::string> entries(const std::string &dir) {
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(dir))
        names.push_back(entry.path().filename());
    return names;
}

// Who sends the core of a crash.
class Crash {
  public:
    explicit Crash(const Service &service) : fd_(service.connect_segf()) { EXPECT_GE(fd_, 0); }
    Crash(const Crash &) = delete;
    Crash &operator=(const Crash &) = delete;
    ~Crash() { end(); }
    void send(const std::string &bytes) {
        size_t done = 0;
        while (done < bytes.size()) {
            ssize_t n = ::send(fd_, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
            ASSERT_GT(n, 0);
            done += static_cast<size_t>(n);
        }
    }
    // Whether the service still holds its end of the connection.
    bool try_to_send(const std::string &bytes) {
        return ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL) > 0;
    }
    // Waits until the service closes the connection. Nothing is ever sent on it.
    void expect_dismissal() {
        char byte;
        EXPECT_EQ(0, read(fd_, &byte, 1));
    }
    void end() {
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }

  private:
    int fd_;
};

// Has the service take a core that nobody waits for: it has then done all that was to do before.
void let_it_catch_up(const Service &service) {
    Crash(service).expect_dismissal();
}

Client wait_for_dump(Service &service) {
    return service.request("/cgi/debug.cgi", "cmd=coredump");
}

// A process crashes, and the client gets its core.
void expect_core_forwarded(const Service &service, Client *client, const std::string &core) {
    Crash crash(service);
    crash.send(core);
    crash.end();
    EXPECT_EQ(download("core", core), client->read_all());
}

void expect_not_sent(SystemLog *log, const Service &service, const std::string &name) {
    LogLine line = log->read_line();
    EXPECT_EQ("Failed to send dump: " + name, line.message);
    EXPECT_EQ(DAEMON_ERROR, line.priority);
    EXPECT_EQ("dbg-cgi", line.tag);
    EXPECT_EQ(std::to_string(service.pid()), line.pid);
}

unsigned lowest_free_descriptor(pid_t pid) {
    unsigned fd = 0;
    while (
        std::filesystem::is_symlink("/proc/" + std::to_string(pid) + "/fd/" + std::to_string(fd)))
        ++fd;
    return fd;
}

std::string large_core() {
    std::vector<int> words(750000);
    std::iota(words.begin(), words.end(), 0);
    return std::string(reinterpret_cast<const char *>(words.data()), words.size() * sizeof(int));
}

TEST(ServiceDumps, ACrashCoreThatNobodyWaitsForIsReadByNobodyAndDismissedAtOnce) {
    run_in_sandbox([] {
        SystemLog log;
        Service service;
        Crash crash(service);
        crash.expect_dismissal();
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(log.read_lines().empty());
    });
}

TEST(ServiceDumps, AClientThatAsksForACoreWithoutAProcessGetsTheNextCrash) {
    run_in_sandbox([] {
        Service service;
        Client client = wait_for_dump(service);
        const std::string core = large_core();
        Crash crash(service);
        crash.send(core.substr(0, 1000));
        // It need not wait for the end, which comes seconds later.
        EXPECT_EQ(download("core", core.substr(0, 1000)),
                  client.read_until([&](const std::string &received) {
                      return received.size() >= download("core", "").size() + 1000;
                  }));
        std::string reply;
        pid_t sender = fork();
        if (sender == 0) {
            crash.send(core.substr(1000));
            crash.end();
            _exit(0);
        }
        crash.end();
        EXPECT_TRUE(download("core", core) == client.read_all());
        // One dump for one client.
        let_it_catch_up(service);
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, ACrashIsTakenAlsoByAKernelWithoutAccept4) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    run_in_sandbox([] {
        ServiceOptions options;
        options.run.before_exec = [] { (void)refuse_call(SYS_accept4, ENOSYS); };
        Service service(options);
        Crash(service).expect_dismissal();
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, AClientThatSaysListenGetsTheNextCrashWhateverThePath) {
    run_in_sandbox([] {
        Service service;
        Client client = service.request("/no/archive/at all", "listen");
        expect_core_forwarded(service, &client, "the core");
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, ASecondClientThatWaitsReplacesTheFirstWithoutAReply) {
    run_in_sandbox([] {
        Service service;
        Client first = wait_for_dump(service);
        Client second = service.request("/debug.tgz", "listen");
        EXPECT_EQ("", first.read_all());
        Client third = wait_for_dump(service);
        EXPECT_EQ("", second.read_all());
        expect_core_forwarded(service, &third, "for the third");
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, AnEmptyCoreIsADumpToo) {
    run_in_sandbox([] {
        Service service;
        Client client = wait_for_dump(service);
        expect_core_forwarded(service, &client, "");
    });
}

TEST(ServiceDumps, NoRequestIsTakenWhileADumpIsForwarded) {
    run_in_sandbox([] {
        Service service;
        Client listener = wait_for_dump(service);
        Crash crash(service);
        crash.send("half");
        listener.read_until_text("half");
        Client other = service.request("/x", "cmd=pcap");
        crash.send(" and half");
        listener.read_until_text(" and half");
        EXPECT_TRUE(other.is_waiting());
        crash.end();
        EXPECT_EQ(download("core", "half and half"), listener.read_all());
        EXPECT_EQ(BAD_REQUEST, other.read_all());
    });
}

TEST(ServiceDumps, AClientThatHasLeftCostsTheCoreAndNothingElse) {
    run_in_sandbox([] {
        Service service;
        wait_for_dump(service).close();
        Crash crash(service);
        // That nobody is there is noticed with one of the first writes.
        while (crash.try_to_send("more of the core")) {
        }
        Client client = wait_for_dump(service);
        expect_core_forwarded(service, &client, "the next");
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, IfACrashCannotBeAcceptedTheClientGetsAnEmptyCore) {
    run_in_sandbox([] {
        Service service;
        const int at_start = service.descriptors();
        Client client = wait_for_dump(service);
        EXPECT_TRUE(client.is_waiting());
        // An answer tells that nothing else is open any more that was for the client. There may be
        // a gap below the client's own.
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        const int with_client = at_start + 1;
        EXPECT_TRUE(wait_until([&] { return service.descriptors() == with_client; }));
        const unsigned first_free = lowest_free_descriptor(service.pid());
        service.limit_descriptors(first_free);
        Crash crash(service);
        EXPECT_EQ(download("core", ""), client.read_all());
        // The crash is accepted as soon as that is possible, for nobody.
        service.limit_descriptors(1024);
        crash.expect_dismissal();
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, AClientGetsTheFirstFileOfTheSpoolWhichIsThenRemoved) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        for (const char *name : {"one", "two", "three"})
            dir.file(std::string("dumps/") + name, std::string("dump ") + name);
        Service service({.dump_dir = dir / "dumps"});
        for (size_t left = 3; left > 0; --left) {
            std::vector<std::string> before = entries(dir / "dumps");
            ASSERT_EQ(left, before.size());
            EXPECT_EQ(download(before[0], "dump " + before[0]), wait_for_dump(service).read_all());
            let_it_catch_up(service);
            before.erase(before.begin());
            EXPECT_EQ(before, entries(dir / "dumps"));
        }
        EXPECT_TRUE(log.read_lines().empty());
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceDumps, WithoutAClientEachRequestFindsTheSpoolAndLeavesIt) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        dir.file("dumps/a dump", "material");
        Service service({.dump_dir = dir / "dumps"});
        for (int i = 0; i < 2; ++i) {
            EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
            expect_not_sent(&log, service, "a dump");
        }
        EXPECT_EQ("material", read_whole_file(dir / "dumps/a dump"));
        EXPECT_EQ(download("a dump", "material"), wait_for_dump(service).read_all());
    });
}

TEST(ServiceDumps, TheSpoolIsNotLookedAtForACrashOrAMessageThatIsNone) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        dir.file("dumps/a dump", "material");
        Service service({.dump_dir = dir / "dumps"});
        let_it_catch_up(service);
        close(service.connect_cgi());
        let_it_catch_up(service);
        EXPECT_TRUE(log.read_lines().empty());
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        expect_not_sent(&log, service, "a dump");
    });
}

TEST(ServiceDumps, OnceFoundEmptyTheSpoolIsNeverLookedAtAgainUntilARestart) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        mkdir((dir / "dumps").c_str(), 0755);
        {
            Service service({.dump_dir = dir / "dumps"});
            EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
            let_it_catch_up(service);
            dir.file("dumps/late", "material");
            EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
            Client client = wait_for_dump(service);
            // Cores of crashes are forwarded all the same.
            expect_core_forwarded(service, &client, "a core");
        }
        EXPECT_TRUE(log.read_lines().empty());
        EXPECT_EQ("material", read_whole_file(dir / "dumps/late"));
        Service service({.dump_dir = dir / "dumps"});
        EXPECT_EQ(download("late", "material"), wait_for_dump(service).read_all());
    });
}

TEST(ServiceDumps, ASpoolThatComesLaterIsFoundAsLongAsThereWasNone) {
    run_in_sandbox([] {
        TempDir dir;
        Service service({.dump_dir = dir / "card/dumps"});
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        let_it_catch_up(service);
        dir.file("card/dumps/dump", "material");
        EXPECT_EQ(download("dump", "material"), wait_for_dump(service).read_all());
    });
}

TEST(ServiceDumps, AFailingEntryIsComplainedOfAndTheServiceGoesOn) {
    run_in_sandbox([] {
        TempDir dir;
        mkdir((dir / "dumps").c_str(), 0755);
        ASSERT_EQ(0, symlink("nowhere", (dir / "dumps/link").c_str()));
        Service service({.dump_dir = dir / "dumps"});
        Client client = wait_for_dump(service);
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
        Crash(service).end();  // for which the spool is not looked at
        EXPECT_EQ(download("core", ""), client.read_all());
        service.process().send_signal(SIGTERM);
        EXPECT_EQ(
            "check_dumps: No such file or directory\ncheck_dumps: No such file or directory\n",
            service.process().wait().err);
    });
}

TEST(ServiceDumps, TheNameOfASpoolFileCannotForgeAHeaderLine) {
    run_in_sandbox([] {
        TempDir dir;
        dir.file("dumps/a\"\r\nX-Forged: 1\r\n\r\nbody", "material");
        Service service({.dump_dir = dir / "dumps"});
        EXPECT_EQ(download("a___X-Forged: 1____body", "material"),
                  wait_for_dump(service).read_all());
        let_it_catch_up(service);
        EXPECT_TRUE(entries(dir / "dumps").empty());
    });
}

TEST(ServiceDumps, AFileWhoseClientLeavesHalfWayStaysWhole) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        const std::string material(more_than_buffers_hold(), 'm');
        dir.file("dumps/big", material);
        Service service({.dump_dir = dir / "dumps"});
        Client client = wait_for_dump(service);
        client.read_until_text("mmmm");
        client.close();
        expect_not_sent(&log, service, "big");
        EXPECT_TRUE(material == read_whole_file(dir / "dumps/big"));
        EXPECT_TRUE(download("big", material) == wait_for_dump(service).read_all());
        let_it_catch_up(service);
        EXPECT_TRUE(entries(dir / "dumps").empty());
    });
}

TEST(ServiceDumps, AServiceThatIsKilledInTheMiddleOfASpoolFileLeavesItWhole) {
    run_in_sandbox([] {
        TempDir dir;
        const std::string material(more_than_buffers_hold(), 'm');
        dir.file("dumps/big", material);
        Service service({.dump_dir = dir / "dumps"});
        Client client = wait_for_dump(service);
        // It cannot have come to the end.
        client.read_until_text("mmmm");
        service.process().send_signal(SIGKILL);
        EXPECT_EQ(SIGKILL, service.process().wait().signal);
        EXPECT_TRUE(material == read_whole_file(dir / "dumps/big"));
    });
}

}  // namespace
