#include "trace/trace_request.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

constexpr pid_t NOBODY = 99999999;  // no process has such a number

struct Piece {
    std::string text;
    uint32_t len;
    bool operator==(const Piece &) const = default;
};

struct Event {
    pid_t pid;
    int kind;
    unsigned long value;
    const SyscallRecord *record;
    size_t pieces_before;
};

std::vector<Piece> pieces;
std::vector<Event> events;
uint32_t output_result;

uint32_t collect(intptr_t cookie, const char *text, uint32_t len) {
    EXPECT_EQ(cookie, 17);
    const bool is_text = static_cast<int32_t>(len) > 0;
    pieces.push_back({is_text ? std::string(text, len) : "", len});
    return output_result;
}

uint32_t note_event(TraceRequest *, intptr_t cookie, pid_t pid, int kind, unsigned long value,
                    const SyscallRecord *record) {
    EXPECT_EQ(cookie, 17);
    events.push_back({pid, kind, value, record, pieces.size()});
    return 0;
}

Piece piece(const std::string &text) {
    return {text, static_cast<uint32_t>(text.size())};
}

class Request : public testing::Test {
  protected:
    Request() {
        pieces.clear();
        events.clear();
        output_result = 1;
        request.output_cb = collect;
        request.event_cb = note_event;
        request.cookie = 17;
        request.buf = buf;
        request.buf_size = sizeof(buf);
    }

    char buf[64] = {};
    TraceRequest request = {};
};

// A child whose only open descriptor is 0, a copy of `fd`; it waits to be killed.
class QuietChild {
  public:
    explicit QuietChild(int fd) {
        int ready[2];
        EXPECT_EQ(pipe(ready), 0);
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            // The pipe's end becomes 1 and is closed as the last of all.
            if (dup2(ready[1], 1) != 1 || (fd != 0 && dup2(fd, 0) != 0))
                _exit(1);
            for (int other = 2; other < 4096; other++)
                close(other);
            close(1);
            for (;;)
                pause();
        }
        close(ready[1]);
        char byte;
        EXPECT_EQ(read(ready[0], &byte, 1), 0);  // its end tells that all are closed
        close(ready[0]);
    }
    ~QuietChild() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    QuietChild(const QuietChild &) = delete;
    QuietChild &operator=(const QuietChild &) = delete;

    pid_t pid() const { return pid_; }

  private:
    pid_t pid_;
};

}  // namespace

TEST(PidIndex, IsThePositionOfTheFirstThatEquals) {
    const pid_t pids[] = {7, -1, 9, 7, 9};
    EXPECT_EQ(pid_index(7, pids, 5), 0);
    EXPECT_EQ(pid_index(9, pids, 5), 2);
    EXPECT_EQ(pid_index(-1, pids, 5), 1);
    EXPECT_EQ(pid_index(8, pids, 5), -1);
    EXPECT_EQ(pid_index(9, pids, 2), -1);
}

TEST(PidIndex, IsMinusOneForAnEmptyTable) {
    const pid_t pids[] = {7};
    EXPECT_EQ(pid_index(7, pids, 0), -1);
    EXPECT_EQ(pid_index(7, pids, -3), -1);
    EXPECT_EQ(pid_index(7, nullptr, 0), -1);
}

TEST_F(Request, UsesTheMachinesOwnBackendUnlessItBringsOne) {
    EXPECT_EQ(&trace_backend(&request), &native_backend());
    request.backend = &MIPS_BACKEND;
    EXPECT_EQ(&trace_backend(&request), &MIPS_BACKEND);
}

TEST_F(Request, KnowsTheNamesOfItsProcesses) {
    pid_t pids[] = {5, 6};
    TracedProcess processes[3] = {};
    strcpy(processes[1].name, "worker");
    request.pids = pids;
    request.nr_pids = 2;
    EXPECT_STREQ(trace_process_name(&request, 6), "");
    request.records = processes;
    EXPECT_STREQ(trace_process_name(&request, 6), "worker");
    EXPECT_STREQ(trace_process_name(&request, 5), "");
    EXPECT_STREQ(trace_process_name(&request, 7), "");
}

TEST_F(Request, PrintsThroughTheOutputCallback) {
    EXPECT_EQ(trace_printf(&request, "%d %s", 12, "pieces"), 9);
    EXPECT_EQ(pieces, std::vector<Piece>{piece("12 pieces")});
}

TEST_F(Request, DropsTextThatDoesNotFitWhole) {
    const std::string fits(63, 'x');
    const std::string too_long(64, 'y');
    EXPECT_EQ(trace_printf(&request, "%s", fits.c_str()), 63);
    EXPECT_EQ(trace_printf(&request, "%s", too_long.c_str()), 64);
    EXPECT_EQ(pieces, std::vector<Piece>{piece(fits)});
}

TEST_F(Request, DropsEmptyText) {
    EXPECT_EQ(trace_printf(&request, "%s", ""), 0);
    EXPECT_TRUE(pieces.empty());
}

TEST_F(Request, DropsTextWithoutACallback) {
    request.output_cb = nullptr;
    EXPECT_EQ(trace_printf(&request, "%d", 123), 3);
    trace_list_fds(&request, getpid());
    EXPECT_TRUE(pieces.empty());
}

TEST_F(Request, ListsTheDescriptorsOfAProcessPieceByPiece) {
    const UniqueFd null(open("/dev/null", O_RDONLY | O_CLOEXEC));
    const QuietChild child(null.get());
    pid_t pid = child.pid();
    TracedProcess process = {};
    strcpy(process.name, "worker");
    request.pids = &pid;
    request.nr_pids = 1;
    request.records = &process;
    trace_list_fds(&request, pid);
    EXPECT_EQ(pieces,
              (std::vector<Piece>{piece("\n[" + std::to_string(pid) + " worker] 1 open fds:\n"),
                                  piece("0\t"), piece("/dev/null"), piece("\n")}));
}

TEST_F(Request, GoesOnWithAListWhenTheCallbackAsksForTheEnd) {
    const UniqueFd null(open("/dev/null", O_RDONLY | O_CLOEXEC));
    const QuietChild child(null.get());
    output_result = 0;
    trace_list_fds(&request, child.pid());
    EXPECT_EQ(pieces.size(), 4U);
}

TEST_F(Request, CutsTheTextOfAFileToTheBuffer) {
    const TempDir dir;
    const std::string path = dir.file(std::string(80, 'f'), "");
    const UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    const QuietChild child(file.get());
    trace_list_fds(&request, child.pid());
    ASSERT_EQ(pieces.size(), 4U);
    EXPECT_EQ(pieces[2], piece(path.substr(0, 63)));
}

// A socket's description has a length that counts what did not fit.
TEST_F(Request, HandsOutNoMoreOfADescriptionThanIsInTheBuffer) {
    const TempDir dir;
    const std::string path = dir / std::string(60, 's');
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
    const UniqueFd server(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_EQ(bind(server.get(), reinterpret_cast<sockaddr *>(&address), sizeof(address)), 0);
    struct stat info;
    ASSERT_EQ(fstat(server.get(), &info), 0);
    char whole[256];
    snprintf(whole, sizeof(whole), "socket:[%lu][%s]", static_cast<unsigned long>(info.st_ino),
             path.c_str());
    ASSERT_GT(strlen(whole), sizeof(buf));

    const QuietChild child(server.get());
    trace_list_fds(&request, child.pid());
    ASSERT_EQ(pieces.size(), 4U);
    EXPECT_EQ(pieces[2], piece(std::string(whole).substr(0, 63)));
}

// A callback closes the descriptor between its listing and its reading.
TEST_F(Request, HandsOnTheMinusOneOfADescriptorThatHasGone) {
    static int doomed;
    doomed = dup(0) >= 0 ? fcntl(0, F_DUPFD, 300) : -1;
    ASSERT_EQ(doomed, 300);
    request.output_cb = [](intptr_t cookie, const char *text, uint32_t len) -> uint32_t {
        if (doomed >= 0 && std::string(text, len > 0 && len < 64 ? len : 0) == "300\t") {
            close(doomed);
            doomed = -1;
        }
        return collect(cookie, text, len);
    };
    trace_list_fds(&request, getpid());
    EXPECT_EQ(doomed, -1);
    bool found = false;
    for (size_t i = 0; i + 2 < pieces.size(); i++) {
        if (pieces[i].text == "300\t") {
            found = true;
            EXPECT_EQ(pieces[i + 1].len, 0xffffffffU);
            EXPECT_EQ(pieces[i + 2], piece("\n"));
        }
    }
    EXPECT_TRUE(found);
}

TEST_F(Request, HasAHeadingForAnEmptyList) {
    trace_list_fds(&request, NOBODY);
    EXPECT_EQ(pieces, std::vector<Piece>{piece("\n[99999999 ] 0 open fds:\n")});
}

TEST_F(Request, ListsAtMost1024Descriptors) {
    rlimit before;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    if (before.rlim_max < 1200)
        GTEST_SKIP() << "only " << before.rlim_max << " descriptors are allowed";
    rlimit enough = before;
    enough.rlim_cur = 1200;
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &enough), 0);
    const int first = open("/dev/null", O_RDONLY | O_CLOEXEC);
    int last = first;
    while (last < 1100)
        last = fcntl(first, F_DUPFD_CLOEXEC, last + 1);
    trace_list_fds(&request, getpid());
    for (int fd = first; fd <= last; fd++)
        close(fd);
    setrlimit(RLIMIT_NOFILE, &before);
    EXPECT_EQ(pieces.size(), 1 + 3 * 1024U);
    EXPECT_NE(pieces[0].text.find("] 1024 open fds:\n"), std::string::npos);
}

TEST_F(Request, TellsOfAnExitCallWithItsArgument) {
    const SyscallRecord record = {};
    trace_event(&request, NOBODY, TRACE_EVENT_CALL, 0xfffffff7, &record);
    ASSERT_EQ(events.size(), 1U);
    EXPECT_EQ(events[0].pid, NOBODY);
    EXPECT_EQ(events[0].kind, 2);
    EXPECT_EQ(events[0].value, 0xfffffff7U);
    EXPECT_EQ(events[0].record, &record);
    EXPECT_TRUE(pieces.empty());
}

TEST_F(Request, ListsDescriptorsAheadOfTheEvent) {
    request.flags = TRACE_LIST_FDS;
    trace_event(&request, NOBODY, TRACE_EVENT_CALL, 3, nullptr);
    ASSERT_EQ(events.size(), 1U);
    EXPECT_EQ(events[0].pieces_before, 1U);
    EXPECT_EQ(pieces, std::vector<Piece>{piece("\n[99999999 ] 0 open fds:\n")});
}

TEST_F(Request, ListsDescriptorsAtAnExitAlsoWithoutAnEventCallback) {
    request.flags = TRACE_LIST_FDS;
    request.event_cb = nullptr;
    trace_event(&request, NOBODY, TRACE_EVENT_CALL, 3, nullptr);
    EXPECT_EQ(pieces.size(), 1U);
}

TEST_F(Request, AsksTheKernelForTheValueOfAnExitEvent) {
    const pid_t pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        ptrace(PTRACE_TRACEME, 0, 0, 0);
        raise(SIGSTOP);
        syscall(SYS_exit_group, 7);
    }
    int status;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_EQ(ptrace(PTRACE_SETOPTIONS, pid, 0, PTRACE_O_TRACEEXIT), 0);
    ASSERT_EQ(ptrace(PTRACE_CONT, pid, 0, 0), 0);
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFSTOPPED(status));
    trace_event(&request, pid, TRACE_EVENT_STOP, 12345, nullptr);
    ptrace(PTRACE_CONT, pid, 0, 0);
    waitpid(pid, &status, 0);
    ASSERT_EQ(events.size(), 1U);
    EXPECT_EQ(events[0].kind, 1);
    EXPECT_EQ(events[0].value, 0x700U);
    EXPECT_EQ(events[0].record, nullptr);
}
