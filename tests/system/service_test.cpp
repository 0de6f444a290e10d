// The debug service, as the web server's front end sees it: what each request gets.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sockhand.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/gunzip.h"
#include "support/process_state.h"
#include "support/replies.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/system_log.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true};

// The reply to the request for an archive, once no other one is in the way: the client of the last
// sees its end a moment before the service takes the next.
std::string archive_reply(Service &service, const std::string &path) {
    std::string reply;
    EXPECT_TRUE(wait_until([&] {
        reply = service.reply(path, "");
        return reply != BUSY;
    }));
    return reply;
}

// The first `size` bytes of such a reply, whose client leaves then.
std::string archive_begin(Service &service, const std::string &path, size_t size) {
    std::string begin;
    EXPECT_TRUE(wait_until(
        [&] {
            Client client = service.request(path, "");
            begin =
                client.read_until([size](const std::string &text) { return text.size() >= size; });
            return begin.find("HTTP/1.0 503 ") != 0;
        },
        60));
    return begin.substr(0, size);
}

void expect_whole_archive(const std::string &tar) {
    std::vector<TarMember> members = read_tar(tar);
    bool traced = false;
    for (const TarMember &member : members)
        traced = traced || member.name.find("/strace.log") != std::string::npos;
    EXPECT_GT(members.size(), 3u);
    EXPECT_TRUE(traced);
}

TEST(Service, AnswersAnUnknownCommandAsABadRequest) {
    run_in_sandbox([] {
        SystemLog log;
        Service service;
        for (const char *command : {"pcap", "", "PS", "coredum", "listen"})
            EXPECT_EQ(BAD_REQUEST, service.reply("/cgi/debug.cgi", std::string("cmd=") + command));
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(log.read_lines().empty());
    });
}

TEST(Service, AnswersAMessageWithoutAZeroByteAsAServerError) {
    run_in_sandbox([] {
        SystemLog log;
        Service service;
        EXPECT_EQ(SERVER_ERROR, service.send("/debug.tgz").read_all());
        EXPECT_EQ(SERVER_ERROR, service.send(std::string(4095, 'x')).read_all());
        // What an earlier, longer message left behind it does not matter.
        EXPECT_EQ(SERVER_ERROR, service.send("/x").read_all());
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(log.read_lines().empty());
    });
}

TEST(Service, AnswersAPathWithoutASlashAsAServerError) {
    run_in_sandbox([] {
        Service service;
        EXPECT_EQ(SERVER_ERROR, service.reply("debug.tgz", ""));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, DoesNotTakeTheEndOfAnEarlierQueryForThatOfThisOne) {
    run_in_sandbox([] {
        Service service;
        Background process({fixture_path("behave"), "sleep"});
        const std::string pid = std::to_string(process.pid());
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcaped&pid=nobody," + pid));
        // As long as that up to the comma, from a sender that does not terminate its query.
        EXPECT_EQ(BAD_REQUEST,
                  service.send(std::string("/x") + '\0' + "cmd=strace&pid=nobody").read_all());
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, TakesMessagesOf4095BytesAndNotOfMore) {
    run_in_sandbox([] {
        Service service;
        std::string message = std::string("/x") + '\0' + "cmd=pcap&";
        message.resize(4095, 'x');
        EXPECT_EQ(BAD_REQUEST, service.send(message).read_all());
        EXPECT_EQ("", service.send(message + "x").read_all());
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, PsAndPsxBothListTheProcesses) {
    run_in_sandbox([] {
        TempDir dir;
        sandbox_bind(dir.file("ps", "#!/bin/sh\necho \"$# arguments\"\necho complaint >&2\n", 0755),
                     "/bin/ps");
        Service service;
        for (const char *command : {"ps", "psx"})
            EXPECT_EQ(ok_header("text/plain", "psdump.txt") + "0 arguments\ncomplaint\n",
                      service.reply("/cgi/debug.cgi", std::string("cmd=") + command));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, ListsItselfAmongTheProcessesWithTheRealPs) {
    run_in_sandbox([] {
        Service service;
        std::string reply = service.reply("/cgi/debug.cgi", "cmd=ps");
        body_of(reply, ok_header("text/plain", "psdump.txt"));
        EXPECT_NE(std::string::npos, reply.find("PID"));
        EXPECT_NE(std::string::npos, reply.find("fieldkit")) << reply;
    });
}

TEST(Service, SendsTheCoreOfALiveProcess) {
    run_in_sandbox([] {
        TempDir dir;
        Service service({.core_program = cheap_core_writer(dir)});
        Background process({fixture_path("behave"), "sleep"}, {.argv0 = "/bin/media hub"});
        std::string pid = std::to_string(process.pid());
        const std::string expected =
            ok_header("application/octet-stream", "core") + "core of " + pid;
        EXPECT_EQ(expected, service.reply("/cgi/debug.cgi", "cmd=coredump&pid=" + pid));
        EXPECT_EQ(expected, service.reply("/cgi/debug.cgi", "cmd=coredump&pid=" + pid + "abc"));
        EXPECT_EQ(expected, service.reply("/x", "cmd=coredump&pid=+media%20hub+"));
        EXPECT_EQ(expected, service.reply("/x", "cmd=coredump.gz&pid=" + pid));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, TheCoreOfAnUnknownANegativeOrADeadProcessIsABadRequest) {
    run_in_sandbox([] {
        SystemLog log;
        TempDir dir;
        Service service({.core_program = cheap_core_writer(dir)});
        pid_t dead = fork();
        if (dead == 0)
            _exit(0);
        ASSERT_EQ(dead, waitpid(dead, nullptr, 0));
        for (const std::string &pid : {std::string("nobody"), std::string(""), std::string("-2"),
                                       std::string("-1"), std::to_string(dead)})
            EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=coredump&pid=" + pid)) << pid;
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(log.read_lines().empty());
    });
}

TEST(Service, WithoutACoreProgramALiveCoreIsEmpty) {
    run_in_sandbox([] {
        Service service({.core_program = "/no/such/program"});
        std::string reply = service.reply("/x", "cmd=coredump&pid=" + std::to_string(getpid()));
        EXPECT_EQ(ok_header("application/octet-stream", "core"), reply);
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(Service, AnArchiveIsCompressedOrNotAsItsNameSays) {
    run_in_sandbox(
        [] {
            TempDir dir;
            // This option is about archives on standard output, and not about those.
            Service service({.core_program = cheap_core_writer(dir), .options = {"-t"}});
            const std::string gzip_header = ok_header("application/x-tar", "debug.tgz");
            const std::string tar_header = ok_header("application/x-tar", "debug.tar");
            expect_whole_archive(
                gunzip(body_of(archive_reply(service, "/cgi/debug.tgz"), gzip_header)));
            expect_whole_archive(body_of(archive_reply(service, "/cgi/debug.tar"), tar_header));
            // Of others the beginning tells.
            EXPECT_EQ(gzip_header + "\x1f\x8b",
                      archive_begin(service, "/cgi/coredumps.tgz", gzip_header.size() + 2));
            EXPECT_EQ(tar_header + "debug-",
                      archive_begin(service, "/whatever", tar_header.size() + 6));
            EXPECT_TRUE(service.is_at_rest(60));
        },
        WITH_ETH0);
}

TEST(Service, ASecondArchiveIsToldToComeBackWhileTheFirstIsStreaming) {
    run_in_sandbox(
        [] {
            TempDir dir;
            Service service({.core_program = cheap_core_writer(dir)});
            Client first = service.request("/debug.tgz", "");
            EXPECT_EQ(BUSY, service.reply("/debug.tgz", ""));
            EXPECT_EQ(BUSY, service.reply("/debug.tar", "x=y"));
            // Other requests are served meanwhile.
            EXPECT_EQ(BAD_REQUEST, service.reply("/debug.tgz", "cmd=pcap"));
            expect_whole_archive(
                gunzip(body_of(first.read_all(), ok_header("application/x-tar", "debug.tgz"))));
            // After its end the next one is taken.
            const std::string header = ok_header("application/x-tar", "debug.tar");
            EXPECT_EQ(header, archive_begin(service, "/debug.tar", header.size()));
            EXPECT_TRUE(service.is_at_rest(60));
        },
        WITH_ETH0);
}

TEST(Service, AClientThatLeavesItsArchiveMakesRoomForTheNext) {
    run_in_sandbox(
        [] {
            TempDir dir;
            Service service({.core_program = cheap_core_writer(dir)});
            for (const char *path : {"/debug.tgz", "/debug.tar"}) {
                Client client = service.request(path, "");
                client.read_until_text("\r\n\r\n");
                client.close();
                EXPECT_TRUE(service.is_at_rest(60)) << path;
            }
            expect_whole_archive(body_of(archive_reply(service, "/debug.tar"),
                                         ok_header("application/x-tar", "debug.tar")));
        },
        WITH_ETH0);
}

TEST(Service, AHeaderThatCannotBeWrittenDoesNotStopTheArchive) {
    run_in_sandbox(
        [] {
            TempDir dir;
            const std::string conf = dir.file("conf", "[media]\n");
            sandbox_bind(conf, "/etc/ws/onvif/media/media.conf");
            Service service({.core_program = cheap_core_writer(dir)});
            int events = inotify_init1(IN_CLOEXEC);
            ASSERT_GE(inotify_add_watch(events, conf.c_str(), IN_OPEN), 0);
            // A connection on which the service cannot write a single byte.
            int pair[2];
            ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair));
            close(pair[0]);
            const std::string message = std::string("/debug.tgz") + '\0' + '\0';
            ASSERT_EQ(0, sockhand_send(service.cgi_socket().c_str(), message.data(),
                                       static_cast<int>(message.size()), pair[1]));
            close(pair[1]);
            // It sets out to fill the archive all the same, and fails by itself.
            pollfd readable = {events, POLLIN, 0};
            EXPECT_EQ(1, poll(&readable, 1, 20000));
            EXPECT_TRUE(service.is_at_rest(60));
            close(events);
            EXPECT_NE(BUSY, archive_reply(service, "/debug.tgz"));
        },
        WITH_ETH0);
}

TEST(Service, AMessageWithoutADescriptorGetsNobodyAnywhere) {
    run_in_sandbox([] {
        Service service;
        int fd = service.connect_cgi();
        ASSERT_GE(fd, 0);
        ASSERT_EQ(11, write(fd, "/debug.tgz", 11));
        char byte;
        EXPECT_LE(read(fd, &byte, 1), 0);
        close(fd);
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
    });
}

}  // namespace
