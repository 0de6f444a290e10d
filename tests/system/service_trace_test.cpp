// Requests that go on until the client has enough: system-call traces, resource traces, captures.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sockhand.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include "support/far_network.h"
#include "support/packets.h"
#include "support/process_state.h"
#include "support/replies.h"
#include "support/rtrace_stream.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/service.h"
#include "support/temp_dir.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true};

std::string trace_header() {
    return ok_header("text/plain", "stracedump.txt");
}

std::string trace_query(pid_t pid) {
    return "cmd=strace&pid=" + std::to_string(pid);
}

bool is_traced(pid_t pid) {
    const std::string tracer = status_field(pid, "TracerPid:");
    return !tracer.empty() && std::stoi(tracer) != 0;
}

bool expect_traced(pid_t pid) {
    return wait_until([&] { return is_traced(pid); });
}

bool expect_free(pid_t pid) {
    return wait_until([&] { return runs_free(pid); });
}

// A process that does nothing, and has come to that.
class Sleeper : public Background {
  public:
    explicit Sleeper(const RunOptions &options = {})
        : Background({fixture_path("behave"), "sleep"}, options) {
        read_line();
    }
};

// A client that asked for a trace, which has hold of the process by now.
Client start_trace(Service &service, const Background &process) {
    Client client = service.request("/x", trace_query(process.pid()));
    EXPECT_TRUE(expect_traced(process.pid()));
    return client;
}

void expect_end_of_trace(const Service &service, const Background &process) {
    EXPECT_TRUE(service.is_at_rest());
    EXPECT_TRUE(expect_free(process.pid()));
}

int lines_with(const std::string &text, const std::string &part) {
    int count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1))
        ++count;
    return count;
}

TEST(ServiceTraces, ClosingTheBrowserEndsTheTraceOfABusyProcess) {
    run_in_sandbox([] {
        Service service;
        Background process({fixture_path("behave"), "call"});
        process.read_line();
        Client client = service.request("/x", trace_query(process.pid()));
        EXPECT_EQ(trace_header(),
                  client.read_until_text("getppid").substr(0, trace_header().size()));
        client.close();
        expect_end_of_trace(service, process);
    });
}

TEST(ServiceTraces, ClosingTheBrowserEndsTheTraceOfAQuietProcess) {
    run_in_sandbox([] {
        Service service;
        Sleeper process;
        Client client = start_trace(service, process);
        client.close();
        expect_end_of_trace(service, process);
    });
}

// Once there has been a trace, its wake-up signal does nothing but end the wait of whoever gets it.
TEST(ServiceTraces, ASignalToTheServiceAfterATraceIsToldAndChangesNothing) {
    run_in_sandbox([] {
        const TempDir dir;
        const std::string errors = dir.file("errors", "");
        ServiceOptions options;
        options.run.before_exec = [&] { dup2(open(errors.c_str(), O_WRONLY), STDERR_FILENO); };
        Service service(options);
        Sleeper process;
        start_trace(service, process).close();
        expect_end_of_trace(service, process);
        service.process().send_signal(SIGUSR1);
        const std::string message = "select: Interrupted system call\n";
        EXPECT_TRUE(wait_until([&] { return read_whole_file(errors) == message; }))
            << read_whole_file(errors);
        EXPECT_EQ(BAD_REQUEST, service.reply("/x", "cmd=pcap"));
    });
}

TEST(ServiceTraces, ABrowserThatSaysAnythingEndsTheTraceToo) {
    run_in_sandbox([] {
        Service service;
        Sleeper process;
        Client client = start_trace(service, process);
        ASSERT_EQ(1, write(client.fd(), "x", 1));
        (void)client.read_all();
        expect_end_of_trace(service, process);
    });
}

TEST(ServiceTraces, ATraceWhoseProcessesAllExitEndsTheReplyAfterTheLastText) {
    run_in_sandbox([] {
        Service service;
        Background first({fixture_path("behave"), "exit", "3", "wait"});
        Background second({fixture_path("behave"), "exit", "4", "wait"});
        Client client =
            service.request("/x", trace_query(first.pid()) + "," + std::to_string(second.pid()));
        EXPECT_TRUE(expect_traced(first.pid()) && expect_traced(second.pid()));
        first.write_input("go\n");
        EXPECT_EQ(3, first.wait().exit_status);
        client.read_until_text("exit_group(3)");
        second.write_input("go\n");
        EXPECT_EQ(4, second.wait().exit_status);
        const std::string text = body_of(client.read_all(), trace_header());
        EXPECT_EQ(1, lines_with(text, "exit_group(3)")) << text;
        EXPECT_EQ(1, lines_with(text, "exit_group(4)")) << text;
        EXPECT_EQ('\n', text.back());
        // The watcher has ended without a client that closes.
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, ATraceWithoutProcessesIsOfAllButInitTheServiceAndItsParent) {
    run_in_sandbox([] {
        Service service;
        Sleeper first, second;
        Client client = service.request("/x", "cmd=strace");
        EXPECT_TRUE(expect_traced(first.pid()) && expect_traced(second.pid()));
        EXPECT_FALSE(is_traced(1));
        EXPECT_FALSE(is_traced(service.pid()));
        EXPECT_FALSE(is_traced(getpid()));
        client.close();
        EXPECT_TRUE(service.is_at_rest());
        EXPECT_TRUE(expect_free(first.pid()) && expect_free(second.pid()));
    });
}

TEST(ServiceTraces, TheIgnoredProcessIsLeftAlone) {
    run_in_sandbox([] {
        Sleeper ignored, other;
        Service service({.options = {"-i", std::to_string(ignored.pid())}});
        Client client = service.request("/x", "cmd=strace");
        EXPECT_TRUE(expect_traced(other.pid()));
        EXPECT_FALSE(is_traced(ignored.pid()));
        client.close();
        EXPECT_TRUE(service.is_at_rest());
        // Asked for by its id it is traced nevertheless.
        Client by_id = start_trace(service, ignored);
        by_id.close();
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, ProcessesAreTracedByName) {
    run_in_sandbox([] {
        Service service;
        Sleeper first({.argv0 = "/usr/bin/media"}), second({.argv0 = "/usr/bin/media"}), other;
        Client client = service.request("/x", "cmd=strace&pid=nobody,+media+,2147483647");
        EXPECT_TRUE(expect_traced(first.pid()) && expect_traced(second.pid()));
        EXPECT_FALSE(is_traced(other.pid()));
        client.close();
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, ATraceOfNobodyIsABadRequest) {
    run_in_sandbox([] {
        Service service;
        for (const char *pids : {"", ",,", "nobody", "2147483647"})
            EXPECT_EQ(BAD_REQUEST, service.reply("/x", std::string("cmd=strace&pid=") + pids));
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, TheServiceItselfCannotBeTracedAndSurvivesTheTrial) {
    run_in_sandbox([] {
        Service service;
        Background process({fixture_path("behave"), "exit", "5", "wait"});
        Client client =
            service.request("/x", trace_query(service.pid()) + "," + std::to_string(process.pid()));
        EXPECT_TRUE(expect_traced(process.pid()));
        process.write_input("go\n");
        EXPECT_EQ(5, process.wait().exit_status);
        body_of(client.read_all(), trace_header());
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, TracesComeOneAfterAnother) {
    run_in_sandbox([] {
        Service service;
        Sleeper process;
        Client first = start_trace(service, process);
        const int threads = service.threads();
        // The others have their headers, and wait for the end of the first.
        Client second = service.request("/x", trace_query(process.pid()));
        Client third = service.request("/x", trace_query(process.pid()));
        EXPECT_EQ(trace_header(), second.read_until_text("\r\n\r\n"));
        EXPECT_EQ(trace_header(), third.read_until_text("\r\n\r\n"));
        // Whoever leaves is not waited for.
        third.close();
        second.close();
        EXPECT_TRUE(wait_until([&] { return service.threads() == threads; }));
        EXPECT_TRUE(is_traced(process.pid()));
        first.close();
        expect_end_of_trace(service, process);
        Client last = start_trace(service, process);
    });
}

// The records of a resource trace as far as `count` of them.
std::vector<RtraceTestRecord> receive_records(Client &client, size_t count) {
    const std::string header = ok_header("application/octet-stream", "rtrace");
    client.read_until([&](const std::string &received) {
        return received.size() > header.size() &&
               parse_rtrace(received.substr(header.size())).records.size() >= count;
    });
    return parse_rtrace(body_of(client.read_until_text(""), header)).records;
}

TEST(ServiceTraces, AResourceTraceRunsUntilItsClientLeaves) {
    run_in_sandbox([] {
        Service service;
        Client client = service.request("/x", "cmd=rtrace&interval=1&trace=filenr,meminfo");
        std::vector<RtraceTestRecord> records = receive_records(client, 5);
        ASSERT_GE(records.size(), 5u);
        client.close();
        EXPECT_TRUE(service.is_at_rest());
    });
}

TEST(ServiceTraces, AResourceTraceWithoutAKnownItemSamplesTheFastSet) {
    run_in_sandbox([] {
        Service service;
        std::vector<std::string> outlines;
        for (const char *trace : {"&trace=fast", "", "&trace=no,such,item"}) {
            Client client = service.request("/x", std::string("cmd=rtrace") + trace);
            std::vector<RtraceTestRecord> records = receive_records(client, 4);
            std::string outline;
            for (size_t i = 0; i < 4 && i < records.size(); ++i)
                outline += std::to_string(records[i].type) + ' ';
            outlines.push_back(outline);
            client.close();
            EXPECT_TRUE(service.is_at_rest());
        }
        EXPECT_EQ(outlines[0], outlines[1]);
        EXPECT_EQ(outlines[0], outlines[2]);
    });
}

TEST(ServiceTraces, ACaptureHidesTheConnectionOfItsClient) {
    run_in_sandbox(
        [] {
            Service service;
            FarNetwork far;
            TcpConnection connection;
            far.connect_to_us(&connection);
            const std::string message = std::string("/x") + '\0' + "cmd=pcapdump" + '\0';
            ASSERT_EQ(0, sockhand_send(service.cgi_socket().c_str(), message.data(),
                                       static_cast<int>(message.size()), connection.server));
            close(std::exchange(connection.server, -1));
            Client client(std::exchange(connection.client, -1));
            const std::string header = ok_header("application/octet-stream", "pcapdump.cap");
            // Each frame that is seen makes one or two more on the wire, with its data and the
            // answer to that.
            size_t seen = 0;
            for (size_t i = 1; i <= 20; ++i) {
                send_frame("eth0", test_frame(100, 'x'));
                std::string received = client.read_until([&](const std::string &text) {
                    seen = text.size() > header.size()
                               ? frames_of(text.substr(header.size())).size()
                               : 0;
                    return seen >= i;
                });
                if (i == 1)
                    body_of(received, header);
            }
            std::string received = client.read_until_text("");
            for (const std::string &frame : frames_of(received.substr(header.size()))) {
                const bool is_tcp = frame.size() > 23 &&
                                    frame.substr(12, 2) == "\x08" + std::string(1, '\0') &&
                                    frame[23] == 6;
                EXPECT_FALSE(is_tcp) << "a frame of " << frame.size() << " bytes";
            }
        },
        WITH_ETH0);
}

TEST(ServiceTraces, ACaptureEndsWithItsTimeAndItsSize) {
    run_in_sandbox(
        [] {
            Service service;
            const std::string header = ok_header("application/octet-stream", "pcapdump.cap");
            EXPECT_EQ(2000u,
                      body_of(service.reply("/x", "cmd=pcapdump&duration=1&totalsize=2000"), header)
                          .size());
            EXPECT_EQ(24u, body_of(service.reply("/x", "cmd=pcapdump&duration=1"), header).size());
            EXPECT_TRUE(service.is_at_rest());
        },
        WITH_ETH0);
}

TEST(ServiceTraces, ACaptureWithoutLimitsRunsUntilItsClientLeaves) {
    run_in_sandbox(
        [] {
            Service service;
            const std::string header = ok_header("application/octet-stream", "pcapdump.cap");
            Client client = service.request("/x", "cmd=pcapdump&duration=-3&totalsize=abc");
            client.read_until(
                [&](const std::string &received) { return received.size() >= header.size() + 24; });
            EXPECT_TRUE(client.is_waiting());
            client.close();
            // It notices when it has something to write.
            EXPECT_TRUE(wait_until([&] {
                send_frame("eth0", test_frame(100, 'x'));
                return service.is_at_rest(0);
            }));
        },
        WITH_ETH0);
}

TEST(ServiceTraces, ACaptureWithoutItsInterfaceHasNoFrames) {
    run_in_sandbox([] {
        Service service;
        EXPECT_EQ(24u, body_of(service.reply("/x", "cmd=pcapdump&duration=1"),
                               ok_header("application/octet-stream", "pcapdump.cap"))
                           .size());
        EXPECT_TRUE(service.is_at_rest());
    });
}

}  // namespace
