// Requests, up to the thread that would serve them: start_worker is stood in for here, which is why
// the linker leaves the real one out.
#include "cgi/dispatch.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "archive/process_snapshot.h"
#include "cgi/dump_listener.h"
#include "cgi/request/requests.h"
#include "cgi/request/worker.h"
#include "client_pair.h"
#include "formvars.h"
#include "support/replies.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

struct Started {
    void *(*routine)(void *) = nullptr;
    void *argument = nullptr;
};

Started started;
bool threads_left = true;

}  // namespace

bool start_worker(void *(*routine)(void *), void *argument, pthread_t *) {
    if (!threads_left)
        return false;
    started = {routine, argument};
    return true;
}

bool begin_worker(int) {
    ADD_FAILURE() << "no worker runs here";
    return false;
}

namespace {

bool is_open(int fd) {
    return fcntl(fd, F_GETFD) != -1;
}

class Dispatch : public testing::Test {
  protected:
    void SetUp() override {
        started = {};
        threads_left = true;
        archive_busy = 0;
    }

    // Makes a request of these bytes, and nothing behind them but a terminator.
    void send(ClientPair *pair, const std::string &message) {
        handle_request(pair->release_server(), message.c_str(), static_cast<int>(message.size()));
    }

    // The reply to a request that is answered at once.
    std::string answer(const std::string &path, const std::string &query) {
        started = {};
        ClientPair pair;
        send(&pair, path + '\0' + query + '\0');
        EXPECT_EQ(nullptr, started.routine) << query;
        return pair.reply();
    }

    // The record of a request that `routine` is to serve, which has got the client.
    template <typename Record>
    UniqueBlock<Record> record_of(void *(*routine)(void *), const std::string &query,
                                  const std::string &path = "/cgi/debug.cgi") {
        ClientPair pair;
        int client = pair.server();
        started = {};
        send(&pair, path + '\0' + query + '\0');
        EXPECT_EQ(routine, started.routine) << query;
        EXPECT_TRUE(pair.is_waiting()) << query;
        UniqueBlock<Record> record(static_cast<Record *>(started.argument));
        if (record == nullptr) {
            ADD_FAILURE() << "nothing was started for " << path << "?" << query;
            record.reset(static_cast<Record *>(calloc(1, sizeof(Record))));
            return record;
        }
        EXPECT_EQ(client, record->client_fd) << query;
        close(client);
        return record;
    }

    // Whether the archive that `path` names is compressed.
    uint32_t gzip_of(const std::string &path, const std::string &query = "") {
        archive_busy = 0;
        auto record = record_of<ArchiveRequest>(run_archive_request, query, path);
        EXPECT_EQ(1u, archive_busy) << path;
        return record->gzip;
    }

    // Makes a request that makes its client wait for a dump, and sees that it does.
    void expect_listener(const std::string &path, const std::string &query) {
        ClientPair pair;
        send(&pair, path + '\0' + query + '\0');
        EXPECT_TRUE(pair.is_waiting()) << query;
        EXPECT_EQ(1, send_dump(-1, "core")) << "there is no source";
        EXPECT_EQ(ok_header("application/octet-stream", "core"), pair.reply()) << query;
        EXPECT_EQ(nullptr, started.routine) << query;
    }
};

TEST_F(Dispatch, AMessageWithoutAZeroByteIsAServerError) {
    for (const std::string &message : {std::string("/debug.tgz"), std::string(4095, 'x'),
                                       std::string("/cgi?cmd=ps"), std::string("x")}) {
        ClientPair pair;
        send(&pair, message);
        EXPECT_EQ(SERVER_ERROR, pair.reply());
    }
    EXPECT_EQ(0u, archive_busy);
}

TEST_F(Dispatch, TheZeroByteMustLieInsideTheLength) {
    ClientPair pair;
    handle_request(pair.release_server(), "/debug.tgz\0cmd=ps", 10);
    EXPECT_EQ(SERVER_ERROR, pair.reply());
    EXPECT_EQ(nullptr, started.routine);
}

TEST_F(Dispatch, TheQueryMayLackItsZeroByte) {
    ClientPair pair;
    std::string message = std::string("/x") + '\0' + "cmd=pcap";
    send(&pair, message);
    EXPECT_EQ(BAD_REQUEST, pair.reply());
}

TEST_F(Dispatch, AnUnknownCommandIsABadRequest) {
    for (const char *command : {"pcap", "pcapdum", "PS", "p", "", "coredum", "Coredump", "strac",
                                "rtrac", " ps", "xps", "archive", "listen", "debug.tgz"})
        EXPECT_EQ(BAD_REQUEST, answer("/debug.tgz", std::string("cmd=") + command)) << command;
    EXPECT_EQ(BAD_REQUEST, answer("/debug.tgz", "cmd"));
    EXPECT_EQ(BAD_REQUEST, answer("no slash", "cmd=pcap"));
}

TEST_F(Dispatch, ACommandOnlyNeedsToBeginLikeAKnownOne) {
    (void)record_of<PcapRequest>(run_pcap_request, "cmd=pcapdumped");
    (void)record_of<RtraceRequest>(run_rtrace_request, "cmd=rtraces");
    (void)record_of<StraceRequest>(run_strace_request,
                                   "cmd=straceXYZ&pid=" + std::to_string(getpid()));
    EXPECT_EQ(BAD_REQUEST, answer("/x", "cmd=coredump!&pid=nobody"));
}

TEST_F(Dispatch, TheFirstOfRepeatedCommandsCounts) {
    EXPECT_EQ(BAD_REQUEST, answer("/x", "cmd=nothing&cmd=ps"));
    (void)record_of<PcapRequest>(run_pcap_request, "cmd=%70capdump&cmd=ps");
}

TEST_F(Dispatch, PsAndPsxAskForTheProcesses) {
    for (const char *command : {"ps", "psx", "psstrace", "ps aux"}) {
        ClientPair pair;
        int client = pair.server();
        started = {};
        send(&pair, std::string("/x") + '\0' + "cmd=" + command + '\0');
        EXPECT_EQ(run_ps_request, started.routine) << command;
        EXPECT_EQ(client, static_cast<int>(reinterpret_cast<intptr_t>(started.argument)));
        EXPECT_TRUE(pair.is_waiting());
        close(client);
    }
}

TEST_F(Dispatch, ACaptureWithoutNumbersHasNoLimits) {
    const struct {
        const char *query;
        int32_t duration, totalsize;
    } CASES[] = {
        {"cmd=pcapdump", 0, 0},
        {"cmd=pcapdump&duration=5&totalsize=6000", 5, 6000},
        {"cmd=pcapdump&totalsize=6000s&duration=+5", 5, 6000},
        {"cmd=pcapdump&duration=-5&totalsize=-2147483648", 0, 0},
        {"cmd=pcapdump&duration=abc&totalsize=", 0, 0},
        {"cmd=pcapdump&duration=2147483647&totalsize=2147483647", 2147483647, 2147483647},
        {"cmd=pcapdump&duration=2147483648&totalsize=4294967297", 0, 0},
        {"cmd=pcapdump&duration=0x10&totalsize=010", 0, 10},
    };
    for (const auto &row : CASES) {
        auto record = record_of<PcapRequest>(run_pcap_request, row.query);
        EXPECT_EQ(row.duration, record->duration) << row.query;
        EXPECT_EQ(row.totalsize, record->totalsize) << row.query;
    }
}

TEST_F(Dispatch, AResourceTraceHasDefaults) {
    const struct {
        const char *query;
        int32_t interval;
        uint32_t items;
    } CASES[] = {
        {"cmd=rtrace", 10, 0x67c},
        {"cmd=rtrace&interval=3&trace=smaps,status", 3, 0x3},
        {"cmd=rtrace&trace=no,known,item", 10, 0x67c},
        {"cmd=rtrace&interval=abc", -1, 0x67c},
        {"cmd=rtrace&interval=&trace=", -1, 0x67c},
        {"cmd=rtrace&interval=0", 0, 0x67c},
        {"cmd=rtrace&interval=-7&trace=all", -7, 0x67b},
        {"cmd=rtrace&interval=2147483648", -1, 0x67c},
        {"cmd=rtrace&interval=60s&trace=+fast+%2C%20mediahub", 60, 0x77c},
    };
    for (const auto &row : CASES) {
        auto record = record_of<RtraceRequest>(run_rtrace_request, row.query);
        EXPECT_EQ(row.interval, record->interval) << row.query;
        EXPECT_EQ(row.items, record->items) << row.query;
    }
}

TEST_F(Dispatch, ATraceIsOfTheNamedProcesses) {
    auto record = record_of<StraceRequest>(
        run_strace_request, "cmd=strace&pid=" + std::to_string(getpid()) +
                                ",%20,nobody,2147483647,+" + std::to_string(getppid()) + "+");
    EXPECT_EQ(2u, record->nr_pids);
    EXPECT_EQ(getpid(), record->pids[0]);
    EXPECT_EQ(getppid(), record->pids[1]);
    EXPECT_EQ(1u, record->running);
}

TEST_F(Dispatch, ATraceOfNobodyIsABadRequest) {
    for (const char *pids : {"", ",", "nobody", "2147483647", "nobody,,none"})
        EXPECT_EQ(BAD_REQUEST, answer("/x", std::string("cmd=strace&pid=") + pids)) << pids;
}

TEST_F(Dispatch, ATraceWithoutProcessesIsOfAllButInitTheServiceAndItsParent) {
    run_in_sandbox([] {
        Background first({fixture_path("behave"), "sleep"});
        Background second({fixture_path("behave"), "sleep"});
        // A grandchild of init, as the service is not: its parent is this process.
        pid_t pid = fork();
        if (pid == 0) {
            ClientPair pair;
            std::string message = std::string("/x") + '\0' + "cmd=strace" + '\0';
            handle_request(pair.release_server(), message.c_str(),
                           static_cast<int>(message.size()));
            auto *record = static_cast<StraceRequest *>(started.argument);
            bool right = record != nullptr && record->nr_pids == 2 &&
                         record->pids[0] == first.pid() && record->pids[1] == second.pid();
            _exit(right ? 0 : 1);
        }
        int status = -1;
        EXPECT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_EQ(0, status);
    });
}

TEST_F(Dispatch, ATraceOfNobodyAtAllIsABadRequest) {
    run_in_sandbox([] {
        // Only init, this process and its parent are there.
        ClientPair pair;
        std::string message = std::string("/x") + '\0' + "cmd=strace" + '\0';
        handle_request(pair.release_server(), message.c_str(), static_cast<int>(message.size()));
        EXPECT_EQ(BAD_REQUEST, pair.reply());
        EXPECT_EQ(nullptr, started.routine);
    });
}

TEST_F(Dispatch, ThePathTellsWhetherAnArchiveIsCompressed) {
    EXPECT_EQ(1u, gzip_of("/cgi/debug.tgz"));
    EXPECT_EQ(1u, gzip_of("/debug.tgz.old"));
    EXPECT_EQ(1u, gzip_of("/cgi/coredumps.tgz"));
    EXPECT_EQ(1u, gzip_of("//a/b/coredumps.tgzip"));
    EXPECT_EQ(0u, gzip_of("/cgi/debug.tar"));
    EXPECT_EQ(0u, gzip_of("/debug.tg"));
    EXPECT_EQ(0u, gzip_of("/mydebug.tgz"));
    EXPECT_EQ(0u, gzip_of("/Debug.tgz"));
    EXPECT_EQ(0u, gzip_of("/cgi/coredumps.tg"));
    EXPECT_EQ(0u, gzip_of("/debug.tgz/"));
    EXPECT_EQ(0u, gzip_of("/debug.tgz/other"));
    EXPECT_EQ(0u, gzip_of("/"));
}

TEST_F(Dispatch, AnArchiveDoesNotMindOtherVariables) {
    EXPECT_EQ(1u, gzip_of("/debug.tgz", "pid=1&x=cmd&cm=ps"));
    EXPECT_EQ(1u, gzip_of("/debug.tgz", "x&listen"));
    EXPECT_EQ(1u, gzip_of("/debug.tgz", "Listen"));
    EXPECT_EQ(1u, gzip_of("/debug.tgz", "%6cisten"));
}

TEST_F(Dispatch, APathWithoutASlashIsAServerError) {
    EXPECT_EQ(SERVER_ERROR, answer("debug.tgz", ""));
    EXPECT_EQ(SERVER_ERROR, answer("", ""));
    EXPECT_EQ(SERVER_ERROR, answer("debug.tgz", "listen"));
    EXPECT_EQ(0u, archive_busy);
}

TEST_F(Dispatch, AnArchiveDuringAnotherIsToldToComeBack) {
    archive_busy = 1;
    EXPECT_EQ(BUSY, answer("/debug.tgz", ""));
    EXPECT_EQ(1u, archive_busy);
    // Only archives.
    (void)record_of<PcapRequest>(run_pcap_request, "cmd=pcapdump");
    EXPECT_EQ(1u, archive_busy);
}

TEST_F(Dispatch, ACoreWithoutAProcessMakesTheClientWait) {
    expect_listener("/x", "cmd=coredump");
    expect_listener("no slash", "cmd=coredump&pids=1");
}

TEST_F(Dispatch, AQueryThatBeginsWithListenMakesTheClientWaitWhateverThePath) {
    expect_listener("/debug.tgz", "listen");
    expect_listener("/no archive", "listening=1");
    archive_busy = 1;
    expect_listener("/debug.tar", "listen&x");
}

TEST_F(Dispatch, ALaterListenerReplacesTheFirstWithoutAReply) {
    ClientPair first, second;
    send(&first, std::string("/x") + '\0' + "cmd=coredump" + '\0');
    send(&second, std::string("/x") + '\0' + "listen" + '\0');
    EXPECT_EQ("", first.reply());
    EXPECT_TRUE(second.is_waiting());
    EXPECT_EQ(1, send_dump(-1, "core"));
}

TEST_F(Dispatch, TheCoreOfNobodyIsABadRequest) {
    for (const char *pid : {"", "nobody", "-2", "-1", "-2147483648", "2147483647", "2147483648"})
        EXPECT_EQ(BAD_REQUEST, answer("/x", std::string("cmd=coredump&pid=") + pid)) << pid;
}

TEST_F(Dispatch, ALiveCoreIsWrittenAtOnce) {
    TempDir dir;
    const std::string writer = dir.file("writer", "#!/bin/sh\nprintf '%s' \"$*\"\n", 0755);
    UniqueFd devnull(open("/dev/null", O_RDWR | O_CLOEXEC));
    set_core_program(writer.c_str(), devnull.get());
    const std::string pid = std::to_string(getpid());
    const std::string reply = ok_header("application/octet-stream", "core") + "-c /dev/stdout ";
    EXPECT_EQ(reply + pid, answer("/x", "cmd=coredump&pid=" + pid));
    EXPECT_EQ(reply + pid, answer("/x", "cmd=coredump&pid=" + pid + "abc"));
}

TEST_F(Dispatch, WithoutAThreadARequestIsAServerErrorAndTheArchiveFree) {
    threads_left = false;
    const std::string self = std::to_string(getpid());
    for (const std::string &query :
         {std::string("cmd=ps"), std::string("cmd=pcapdump"), std::string("cmd=rtrace"),
          "cmd=strace&pid=" + self, std::string()}) {
        EXPECT_EQ(SERVER_ERROR, answer("/debug.tgz", query)) << query;
        EXPECT_EQ(0u, archive_busy);
    }
}

TEST_F(Dispatch, ARequestLeavesNothingToTheNext) {
    EXPECT_EQ(BAD_REQUEST, answer("/x", "cmd=strace&pid=nobody"));
    EXPECT_EQ(nullptr, CGI_get_value("cmd"));
    EXPECT_EQ(10, record_of<RtraceRequest>(run_rtrace_request, "cmd=rtrace")->interval);
    EXPECT_EQ(5, record_of<RtraceRequest>(run_rtrace_request, "cmd=rtrace&interval=5")->interval);
    EXPECT_EQ(10, record_of<RtraceRequest>(run_rtrace_request, "cmd=rtrace")->interval);
    EXPECT_EQ(0u, gzip_of("/debug.tar"));
}

TEST_F(Dispatch, TheClientIsClosedWithItsReply) {
    ClientPair pair;
    int client = pair.server();
    send(&pair, std::string("/x") + '\0' + "cmd=pcap" + '\0');
    EXPECT_FALSE(is_open(client));
    EXPECT_EQ(BAD_REQUEST, pair.reply());
}

}  // namespace
