// The debug service under load, and with clients and senders that mean no good.
#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sched.h>
#include <signal.h>
#include <sockhand.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "support/gunzip.h"
#include "support/process_state.h"
#include "support/replies.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/service_load.h"
#include "support/slow_machine.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true, .timeout_s = 110};

constexpr char DEBUG_CGI[] = "/cgi/debug.cgi";

bool begins_with(const std::string &text, const std::string &prefix) {
    return text.compare(0, prefix.size(), prefix) == 0;
}

// Frames on eth0, for captures.
class Traffic {
  public:
    Traffic() : thread_([this] { run(); }) {}
    ~Traffic() {
        stopped_ = true;
        thread_.join();
    }
    Traffic(const Traffic &) = delete;
    Traffic &operator=(const Traffic &) = delete;

  private:
    void run() {
        int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        int yes = 1;
        setsockopt(fd, SOL_SOCKET, SO_BROADCAST, &yes, sizeof yes);
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(9);
        inet_pton(AF_INET, "10.99.0.255", &address.sin_addr);
        while (!stopped_) {
            (void)sendto(fd, "frame", 5, 0, reinterpret_cast<sockaddr *>(&address), sizeof address);
            usleep(5000);
        }
        close(fd);
    }

    std::atomic<bool> stopped_ = false;
    std::thread thread_;
};

// ---- Many clients

struct Kind {
    int weight;
    std::string path;
    std::string query;
    bool ends;  // by itself; the client of any other goes at some time
    bool (*is_whole)(const std::string &body, const std::string &subject);
    std::string type;
    std::string name;
};

bool any_body(const std::string &, const std::string &) {
    return true;
}

std::vector<Kind> all_kinds(const std::string &pid) {
    const char *octets = "application/octet-stream";
    auto core = [](const std::string &body, const std::string &subject) {
        return body == "core of " + subject || body.empty();
    };
    // A program that a trace of all processes takes hold of before its execve is killed by it.
    auto listing = [](const std::string &body, const std::string &subject) {
        return body.find(subject) != std::string::npos || body.empty();
    };
    auto capture = [](const std::string &body, const std::string &) {
        return body.size() == 4000 && begins_with(body, "\xd4\xc3\xb2\xa1");
    };
    auto archive = [](const std::string &body, const std::string &) {
        return read_tar(body).size() > 10;
    };
    auto packed = [](const std::string &body, const std::string &) {
        return read_tar(gunzip(body)).size() > 10;
    };
    return {
        {30, DEBUG_CGI, "cmd=ps", true, listing, "text/plain", "psdump.txt"},
        {15, DEBUG_CGI, "cmd=coredump&pid=" + pid, true, core, octets, "core"},
        {5, DEBUG_CGI, "cmd=coredump&pid=behave", true, core, octets, "core"},
        {10, DEBUG_CGI, "cmd=rtrace&interval=1&trace=all", false, any_body, octets, "rtrace"},
        {3, DEBUG_CGI, "cmd=rtrace&interval=-1", false, any_body, octets, "rtrace"},
        {3, DEBUG_CGI, "cmd=rtrace&interval=1&trace=iostat", false, any_body, octets, "rtrace"},
        {8, DEBUG_CGI, "cmd=strace&pid=" + pid, false, any_body, "text/plain", "stracedump.txt"},
        {2, DEBUG_CGI, "cmd=strace", false, any_body, "text/plain", "stracedump.txt"},
        {5, DEBUG_CGI, "cmd=pcapdump&totalsize=4000&duration=1", true, capture, octets,
         "pcapdump.cap"},
        {4, DEBUG_CGI, "cmd=pcapdump", false, any_body, octets, "pcapdump.cap"},
        {3, "/cgi/debug.tgz", "", true, packed, "application/x-tar", "debug.tgz"},
        {2, "/cgi/debug.tar", "", true, archive, "application/x-tar", "debug.tar"},
        {5, "/cgi/debug.cgi", "listen", true, any_body, octets, "core"},
        {5, "/cgi/debug.cgi", "cmd=unknown", true, any_body, "", BAD_REQUEST},
        {3, "no slash", "", true, any_body, "", SERVER_ERROR},
    };
}

// What is wrong with a whole reply, or with what came of one, to a request of `kind`.
std::string fault_of(const Kind &kind, const std::string &subject, const std::string &reply,
                     bool whole) {
    auto is = [&](const std::string &text) {
        return whole ? reply == text : begins_with(text, reply);
    };
    if (kind.type.empty())
        return is(kind.name) ? "" : "not the fixed reply";
    if (kind.type == "application/x-tar" && begins_with(reply, "HTTP/1.0 503"))
        return is(BUSY) ? "" : "not the page of a busy service";
    // Replaced as the client that waits for a core.
    if (kind.query == "listen" && reply.empty())
        return "";
    std::string header = ok_header(kind.type, kind.name);
    if (!whole && reply.size() < header.size())
        return begins_with(header, reply) ? "" : "not the beginning of the header";
    if (!begins_with(reply, header))
        return "not the header";
    return !whole || kind.is_whole(reply.substr(header.size()), subject) ? "" : "not the body";
}

struct Load {
    Service *service;
    std::vector<Kind> kinds;
    std::string subject;
    std::atomic<int> left;
    std::atomic<int> whole_replies = 0;
};

// Makes requests until enough have been made by all.
void make_requests(Load *load, unsigned seed) {
    std::mt19937 random(seed);
    auto below = [&random](int limit) {
        return static_cast<int>(random() % static_cast<unsigned>(limit));
    };
    int weights = 0;
    for (const Kind &kind : load->kinds)
        weights += kind.weight;
    while (load->left-- > 0) {
        int chosen = below(weights);
        size_t index = 0;
        while (chosen >= load->kinds[index].weight)
            chosen -= load->kinds[index++].weight;
        const Kind &kind = load->kinds[index];

        Client client = load->service->request(kind.path, kind.query);
        bool leaves = !kind.ends || below(3) == 0;
        std::string reply;
        // Somebody else's listening, or a crash, ends the waiting for one.
        if (!leaves && kind.query == "listen") {
            EXPECT_TRUE(wait_until([&] {
                close(load->service->connect_segf());
                return !client.is_waiting();
            }));
        }
        if (!leaves) {
            // Archives and traces wait for each other.
            reply = client.read_all(100);
            ++load->whole_replies;
        } else if (int way = below(4); way > 0) {
            size_t enough = static_cast<size_t>(below(way == 1 ? 400 : 190));
            // A trace may have to wait for another one, and a quiet one says no more.
            enough = std::min<size_t>(enough, 170);
            if (kind.query != "listen" && !kind.type.empty())
                reply = client.read_until(
                    [enough](const std::string &text) { return text.size() >= enough; }, 60);
            if (way == 2) {
                linger reset = {1, 0};
                setsockopt(client.fd(), SOL_SOCKET, SO_LINGER, &reset, sizeof reset);
            }
        }
        client.close();
        std::string fault = fault_of(kind, load->subject, reply, !leaves);
        if (!fault.empty()) {
            ADD_FAILURE() << fault << ": " << kind.path << " " << kind.query << "\n"
                          << reply.substr(0, 1000);
        }
    }
}

TEST(ServiceLoad, ManyClientsGetWellFormedRepliesAndNothingIsLeftOfThem) {
    run_in_sandbox(
        [] {
            TempDir dir;
            ServiceLog log;
            Traffic traffic;
            sandbox_bind(
                dir.file("probe", "#!/bin/sh\necho probe text\nexec /bin/sleep 1000\n", 0755),
                "/usr/bin/iostat");
            Background process({fixture_path("behave"), "sleep"});
            process.read_line();
            Service service({.core_program = cheap_core_writer(dir), .run = log.run()});

            std::string pid = std::to_string(process.pid());
            Load load = {.service = &service,
                         .kinds = all_kinds(pid),
                         .subject = pid,
                         .left = is_slow_machine() ? 120 : 2000};
            // One that is there from beginning to end.
            Client archive = service.request("/cgi/debug.tgz", "");
            std::vector<std::thread> clients;
            for (unsigned seed = 1; seed <= (is_slow_machine() ? 6 : 16); ++seed)
                clients.emplace_back(make_requests, &load, seed);
            for (std::thread &client : clients)
                client.join();
            // The kinds of requests are drawn with fixed seeds; which thread makes how many of them
            // is a matter of chance, but more than these are always such as have a whole reply.
            EXPECT_LT(40, load.whole_replies);
            std::string packed = body_of(archive.read_all());
            EXPECT_LT(10u, read_tar(gunzip(packed)).size());
            // The client that still waits for a core gets one.
            close(service.connect_segf());
            EXPECT_TRUE(service.is_at_rest(30))
                << service.descriptors() << " descriptors, " << service.threads() << " threads, "
                << service.children() << " children";
            EXPECT_TRUE(nothing_is_traced());
            EXPECT_TRUE(runs_free(process.pid()));
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

// ---- Clients that do not read

// Waits until so much has come, unread, that the sender must be about to wait for its reader.
bool is_flooded(const Client &client) {
    return wait_until([&] {
        int waiting = 0;
        return ioctl(client.fd(), FIONREAD, &waiting) == 0 && waiting > 30000;
    });
}

TEST(ServiceLoad, ClientsThatStopReadingHoldUpNobodyElse) {
    run_in_sandbox(
        [] {
            TempDir dir;
            const size_t flood_size = more_than_buffers_hold();
            std::string size = std::to_string(flood_size);
            std::string flood =
                "/bin/dd if=/dev/zero bs=65536 count=" + std::to_string(flood_size / 65536) +
                " 2>/dev/null\n";
            std::string writer = dir.file(
                "writer",
                "#!/bin/sh\necho CORELEN " + size + " bytes, of processes:$3 >&2\n" + flood, 0755);
            sandbox_bind(
                dir.file("ps",
                         "#!/bin/sh\n[ -e " + dir / "short" + " ] && exec echo short\n" + flood,
                         0755),
                "/bin/ps");
            Background process({fixture_path("behave"), "sleep"});
            Service service({.core_program = writer});

            Client listing = service.request(DEBUG_CGI, "cmd=ps");
            Client samples = service.request(DEBUG_CGI, "cmd=rtrace&interval=0&trace=smaps");
            Client capture =
                service.request(DEBUG_CGI, "cmd=pcapdump&duration=1&totalsize=" + size);
            Client archive = service.request("/cgi/debug.tar", "");
            for (Client *client : {&listing, &samples, &capture, &archive})
                ASSERT_TRUE(is_flooded(*client));
            (void)dir.file("short", "");

            EXPECT_EQ(BAD_REQUEST, service.reply(DEBUG_CGI, "cmd=pcap", 5));
            EXPECT_EQ(ok_header("text/plain", "psdump.txt") + "short\n",
                      service.reply(DEBUG_CGI, "cmd=ps", 10));
            EXPECT_EQ(BUSY, service.reply("/cgi/debug.tgz", "", 5));
            Client more = service.request(DEBUG_CGI, "cmd=rtrace&interval=1");
            more.read_until([](const std::string &text) { return text.size() > 1000; });
            more.close();
            Client trace =
                service.request(DEBUG_CGI, "cmd=strace&pid=" + std::to_string(process.pid()));
            trace.read_until_text("pause(");
            trace.close();

            // Those that go on get all of it.
            EXPECT_EQ(flood_size, body_of(listing.read_all()).size());
            EXPECT_EQ(flood_size, body_of(capture.read_all()).size());
            std::vector<TarMember> members = read_tar(body_of(archive.read_all()));
            EXPECT_TRUE(std::any_of(members.begin(), members.end(), [&](const TarMember &member) {
                return member.data.size() == flood_size;
            }));
            samples.close();
            EXPECT_TRUE(service.is_at_rest());
        },
        WITH_ETH0);
}

TEST(ServiceLoad, AClientThatDoesNotReadItsTraceHoldsUpOnlyOtherTraces) {
    run_in_sandbox([] {
        Background talker({fixture_path("behave"), "talk"});
        std::string pid = std::to_string(talker.pid());
        Service service;
        Client stuck = service.request(DEBUG_CGI, "cmd=strace&pid=" + pid);
        ASSERT_TRUE(is_flooded(stuck));
        Client queued = service.request(DEBUG_CGI, "cmd=strace&pid=" + pid);
        queued.read_until_text("\r\n\r\n");
        EXPECT_EQ(BAD_REQUEST, service.reply(DEBUG_CGI, "cmd=pcap", 5));
        EXPECT_TRUE(begins_with(service.reply(DEBUG_CGI, "cmd=ps", 10),
                                ok_header("text/plain", "psdump.txt")));
        // The next one has its turn once the first has gone.
        stuck.close();
        queued.read_until_text("getppid");
        queued.close();
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(runs_free(talker.pid()));
    });
}

TEST(ServiceLoad, ATraceWhoseReaderIsItselfTracedAndStoppedEndsAndLetsAllGoOn) {
    run_in_sandbox([] {
        int ends[2];
        ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
        RunOptions reads;
        reads.before_exec = [&ends] { dup2(ends[0], 0); };
        // As a web server reads what its CGI program has to say.
        Background reader({"/bin/dd", "of=/dev/null", "bs=4096"}, reads);
        // Its monitor begins when nobody else wants the processor.
        Service service;
        std::vector<std::unique_ptr<Background>> talkers;
        for (int i = 0; i < 4; ++i) {
            std::vector<std::string> talker = {fixture_path("behave"), "call"};
            talkers.push_back(std::make_unique<Background>(talker));
        }
        std::string message = std::string(DEBUG_CGI) + '\0' + "cmd=strace" + '\0';
        ASSERT_EQ(0, sockhand_send(service.cgi_socket().c_str(), message.data(),
                                   static_cast<int>(message.size()), ends[1]));
        close(ends[0]);
        close(ends[1]);
        // The end of the reply is the end of its reader.
        EXPECT_EQ(0, reader.wait(60).exit_status);
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(nothing_is_traced());
        EXPECT_TRUE(runs_free(talkers[0]->pid()));
    });
}

// ---- Messages and senders of all kinds

std::string random_query(std::mt19937 *random) {
    auto below = [random](size_t limit) { return (*random)() % limit; };
    const std::vector<std::string> pieces = {"cmd=",
                                             "ps",
                                             "psx",
                                             "pcapdump",
                                             "strace",
                                             "rtrace",
                                             "coredump",
                                             "&",
                                             "pid=",
                                             ",",
                                             "=",
                                             "%00",
                                             "%0a",
                                             "%0d%0a",
                                             "%",
                                             "%f",
                                             "%zz",
                                             "+",
                                             "-1",
                                             "0",
                                             "2147483648",
                                             "-2147483649",
                                             "99999999999999999999",
                                             "trace=",
                                             "interval=",
                                             "duration=",
                                             "totalsize=",
                                             "\n",
                                             "\xff",
                                             std::string(31, 'n'),
                                             std::string(32, 'n'),
                                             std::string(33, 'n'),
                                             "\"",
                                             "'",
                                             "\\"};
    const std::vector<std::string> beginnings = {
        "",     "cmd=strace&pid=",       "cmd=coredump&pid=", "cmd=rtrace&interval=1&trace=",
        "cmd=", "cmd=pcapdump&duration="};
    std::string query = beginnings[below(beginnings.size())];
    size_t size = below(4) == 0 ? 4095 : below(300);
    switch (below(3)) {
        case 0:
            while (query.size() < size)
                query += static_cast<char>(1 + below(255));
            break;
        case 1:
            query += std::string(size, ',');
            break;
        default:
            while (query.size() < size)
                query += pieces[below(pieces.size())];
    }
    return query;
}

TEST(ServiceLoad, HostileQueriesGetAReplyAndLeaveNothingBehind) {
    run_in_sandbox(
        [] {
            TempDir dir;
            ServiceLog log;
            Traffic traffic;
            Background process({fixture_path("behave"), "sleep"});
            Service service({.core_program = cheap_core_writer(dir), .run = log.run()});
            std::mt19937 random(4);
            for (int i = 0; i < rounds(300); ++i) {
                // With "cmd" or without a slash: nobody asks for an archive.
                std::string path = "debug.cgi";
                std::string message = path + '\0' + random_query(&random) + '\0';
                message.resize(std::min<size_t>(message.size(), 4095));
                Client client = service.send(message);
                // A client that waits for a core hears nothing, until the next one comes.
                if (message.find("cmd=coredump") != std::string::npos)
                    close(service.connect_segf());
                std::string reply = client.read_until_text("\r\n\r\n");
                EXPECT_TRUE(begins_with(reply, "HTTP/1.0 200 OK\r\nCache-Control") ||
                            begins_with(BAD_REQUEST, reply) || begins_with(SERVER_ERROR, reply))
                    << message << "\n"
                    << reply;
            }
            EXPECT_EQ(SERVER_ERROR, service.send(std::string(4095, 'p')).read_all());
            EXPECT_EQ(SERVER_ERROR, service.send("p").read_all());
            close(service.connect_segf());
            // Dozens of traces have had to wait for each other.
            EXPECT_TRUE(service.is_at_rest(60))
                << service.descriptors() << " descriptors, " << service.threads() << " threads, "
                << service.children() << " children";
            EXPECT_EQ("", log.report());
        },
        WITH_ETH0);
}

// Sends `size` bytes with the descriptors `fds`, and leaves the connection open.
int send_raw(const Service &service, size_t size, const std::vector<int> &fds) {
    int sender = service.connect_cgi();
    EXPECT_GE(sender, 0);
    std::string bytes(size, 'x');
    alignas(cmsghdr) char control[CMSG_SPACE(8 * sizeof(int))] = {};
    iovec piece = {bytes.data(), bytes.size()};
    msghdr message = {};
    message.msg_iov = &piece;
    message.msg_iovlen = 1;
    if (!fds.empty()) {
        message.msg_control = control;
        message.msg_controllen = CMSG_SPACE(fds.size() * sizeof(int));
        cmsghdr *header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(fds.size() * sizeof(int));
        memcpy(CMSG_DATA(header), fds.data(), fds.size() * sizeof(int));
    }
    EXPECT_EQ(static_cast<ssize_t>(size), sendmsg(sender, &message, MSG_NOSIGNAL));
    return sender;
}

TEST(ServiceLoad, SendersThatSayNothingOrTheWrongThingNeitherStopTheServiceNorLeakDescriptors) {
    run_in_sandbox([] {
        Service service;
        std::vector<int> open_ends;
        for (int i = 0; i < 100; ++i) {
            int pair[2];
            ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair));
            open_ends.push_back(service.connect_cgi());
            open_ends.push_back(send_raw(service, 10, {}));
            open_ends.push_back(send_raw(service, 5000, {pair[0]}));
            open_ends.push_back(send_raw(service, 10, {pair[0], pair[0], pair[0]}));
            close(service.connect_cgi());
            // All that the service got of it is closed again.
            close(pair[0]);
            char byte;
            (void)fcntl(pair[1], F_SETFL, O_NONBLOCK);
            EXPECT_TRUE(wait_until([&] { return read(pair[1], &byte, 1) != -1; }));
            close(pair[1]);
            ASSERT_EQ(BAD_REQUEST, service.reply(DEBUG_CGI, "cmd=pcap", 5));
        }
        for (int fd : open_ends)
            close(fd);
        EXPECT_TRUE(service.is_at_rest());
    });
}

// ---- No descriptors left

// Clock ticks of processor time that `pid` has used.
long processor_time(pid_t pid) {
    std::string stat = read_whole_file("/proc/" + std::to_string(pid) + "/stat");
    size_t at = stat.rfind(')');
    for (int field = 2; field < 14; ++field)
        at = stat.find(' ', at + 1);
    long user, system;
    EXPECT_EQ(2, sscanf(stat.c_str() + at, "%ld %ld", &user, &system));
    return user + system;
}

TEST(ServiceLoad, AServiceOutOfDescriptorsWaitsForSomeWithoutSpinningAndRecovers) {
    run_in_sandbox([] {
        ServiceLog log;
        Service service({.run = log.run()});
        Client trace = service.request(DEBUG_CGI, "cmd=rtrace&interval=1&trace=meminfo");
        trace.read_until_text("MemTotal");

        service.limit_descriptors(8);  // all of them in use
        long before = processor_time(service.pid());
        // It can accept neither cores nor senders, nor take what these send.
        std::vector<int> senders;
        for (int i = 0; i < 3; ++i) {
            senders.push_back(service.connect_segf());
            senders.push_back(service.connect_cgi());
        }
        Client refused = service.request(DEBUG_CGI, "cmd=pcap");
        EXPECT_EQ("", refused.read_all());
        sleep(2);
        long used = processor_time(service.pid()) - before;
        EXPECT_LT(used, sysconf(_SC_CLK_TCK)) << "clock ticks in two seconds";

        service.limit_descriptors(1024);
        EXPECT_EQ(BAD_REQUEST, service.reply(DEBUG_CGI, "cmd=pcap"));
        std::string listing = service.reply(DEBUG_CGI, "cmd=ps");
        EXPECT_NE(std::string::npos, listing.find("PID")) << listing;
        for (int fd : senders)
            close(fd);
        trace.close();
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_EQ("", log.report());
    });
}

}  // namespace
