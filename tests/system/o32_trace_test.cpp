// The applet tstrace on 32-bit MIPS: whole lines, for calls whose arguments are all known. They are
// those of fixtures/o32_calls.c, which is to be read beside this. Nothing of it is compiled for
// other machines.
#if defined(__mips__)
#include <gtest/gtest.h>
#include <unistd.h>

#include "support/temp_dir.h"
#include "tracers.h"

namespace {

std::string own_name() {
    return shown_name(fixture_path("o32_calls"));
}

// The working directory of the fixture, with the file that it opens.
class O32Trace : public testing::Test {
  protected:
    O32Trace() { dir.file("data", "hello"); }

    RunOptions options() const {
        RunOptions options;
        options.before_exec = [this] {
            if (chdir(dir.path().c_str()) != 0)
                _exit(126);
        };
        return options;
    }

    std::string trace(const std::string &group) const {
        RunResult result = run_fieldkit({"tstrace", fixture_path("o32_calls"), group}, options());
        EXPECT_EQ(result.exit_status, 0);
        EXPECT_EQ(result.err, "");
        return result.out;
    }

    TempDir dir;
};

// What stands before each call of a trace of the fixture: "[PID NAME] [PC RA] ". The calls of most
// groups come from the same place, so this does not change.
std::string prefix_in(const std::string &trace) {
    size_t mark = trace.find("unused18(1, 2, 3, 4, 5, 6)\n");
    if (mark == std::string::npos) {
        ADD_FAILURE() << "no call 4018 in " << trace;
        return "?";
    }
    size_t start = trace.rfind('\n', mark);
    start = start == std::string::npos ? 0 : start + 1;
    return trace.substr(start, mark - start);
}

std::string pid_in(const std::string &trace) {
    std::string prefix = prefix_in(trace);
    return prefix.substr(1, prefix.find(' ') - 1);
}

std::string replace_all(std::string text, const std::string &what, const std::string &by) {
    for (size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
        text.replace(at, what.size(), by);
    return text;
}

// The part of a trace that is the group's, with the prefix still in front of its lines.
std::string part_of_group(const std::string &trace) {
    std::string prefix = prefix_in(trace), start = prefix + "unused18(1, 2, 3, 4, 5, 6) = 89\n";
    size_t from = trace.find(start);
    if (from == std::string::npos) {
        ADD_FAILURE() << "no exit of call 4018 in " << trace;
        return "";
    }
    from += start.size();
    size_t to = trace.find(prefix + "unused28(6, 5, 4, 3, 2, 1)\n", from);
    return trace.substr(from, to == std::string::npos ? to : to - from);
}

std::string without_inodes(const std::string &text) {
    return std::regex_replace(text, std::regex("(pipe|socket):\\[[0-9]+\\]"), "$1:[INODE]");
}

std::string calls_in(const std::string &trace) {
    return without_inodes(replace_all(part_of_group(trace), prefix_in(trace), ""));
}

// Text whose prefixes need not be the same.
std::string without_prefixes(const std::string &text) {
    return std::regex_replace(text,
                              std::regex("\\[[0-9]+ [^\\]]*\\] (\\[[0-9a-f]+ [0-9a-f]+\\] )?"), "");
}

// A call at its entry and at its exit.
std::string both(const std::string &call, const std::string &result) {
    return call + "\n" + call + " = " + result + "\n";
}

// ---- Calls ----

TEST_F(O32Trace, ShowsTheAddressBehindTheCallAndThatOfItsReturn) {
    std::string text = part_of_group(trace("place"));
    std::smatch found;
    ASSERT_TRUE(std::regex_search(
        text, found,
        std::regex("^\\[[0-9]+ [^\\]]*\\] \\[([0-9a-f]+) ([0-9a-f]+)\\] unused18\\(([0-9]+), "
                   "([0-9]+), ")))
        << text;
    EXPECT_EQ(std::stoul(found[1], nullptr, 16), std::stoul(found[3]));
    EXPECT_EQ(std::stoul(found[2], nullptr, 16), std::stoul(found[4]));
}

TEST_F(O32Trace, ShowsAllBitsSetForAnArgumentOnAStackThatCannotBeRead) {
    EXPECT_EQ(without_prefixes(part_of_group(trace("stack"))),
              both("unused18(268439532, 22, 33, 44, 5, 4294967295)", "89"));
}

TEST_F(O32Trace, ShowsCallsOnFiles) {
    std::string data = dir / "data";
    EXPECT_EQ(calls_in(trace("files")),
              both("open(\"missing\", 2, 420)", "2") + both("open(\"data\", 0, -1)", "5") +
                  "read(5 " + data + ", 0x10000100, 5)\nread(5 " + data + ", \"hello\", 5) = 5\n" +
                  both("read(5 " + data + ", 0x10000100, 5)", "0") +
                  // An error is a number above 0 like any other result.
                  "read(77, 0x10000100, 5)\n"
                  "read(77, \"hello\\x0\\x0\\x0\\x0\", 5) = 9\n" +
                  both("write(3 /dev/null, \"hello\", 5)", "5") +
                  both("write(77, \"hello\", 5)", "9") + both("lseek(5 " + data + ", -2, 2)", "3") +
                  both("lseek(77, 1, 0)", "9") + "close(5 " + data + ")\nclose(5) = 0\n" +
                  both("close(77)", "9") + both("access(\"missing\", 0x4)", "2") +
                  both("access(\"data\", 0xab)", "22") + both("stat(\"data\", 0x10000200)", "0") +
                  both("lstat(\"missing\", 0x10000200)", "2") +
                  both("fstat(3 /dev/null, 0x10000200)", "0") + both("fstat(77, 0x10000200)", "9") +
                  both("ioctl(3 /dev/null, -2147483647, 10000200, a, bc, def)", "25"));
}

TEST_F(O32Trace, ShowsCallsOnMemoryWithTheirResultsInHexadecimal) {
    std::string text = calls_in(trace("memory"));
    EXPECT_EQ(
        std::regex_replace(text, std::regex("brk\\(0x1234\\) = 0x[0-9a-f]+"),
                           "brk(0x1234) = ADDRESS"),
        both("mmap2(0x10010000, 4096, 0x3, 0x812, -1, 0)", "0x10010000") +
            both("mmap2(0x0, 0, 0x1, 0x802, -1, 7)", "0x16") +
            both("mmap(0x10020000, 4096, 0x1, 0x12, 4 " + dir / "data" + ", 0)", "0x10020000") +
            both("munmap(0x10020000, 4096)", "0") + both("munmap(0x10000001, 4294967295)", "22") +
            both("brk(0x1234)", "ADDRESS"));
}

TEST_F(O32Trace, ShowsCallsOnTimeAndWaiting) {
    EXPECT_EQ(
        calls_in(trace("times")),
        both("time(0x1)", "14") + both("gettimeofday(0x10000300, 0x10000308)", "0") +
            both("settimeofday(0x1, 0x0)", "14") + both("nanosleep({ 0, 1000 }, { 7, 8 })", "0") +
            both("nanosleep({ -1, 0 }, { 7, 8 })", "22") +
            both("nanosleep({ -1, -1 }, { -1, -1 })", "14") + both("poll(0x0, 0, 5)", "0") +
            both("poll(0x10000300, -1, -2)", "22") + both("waitpid(0x-1, 0x10000300, 1)", "10"));
}

TEST_F(O32Trace, NamesTheOldPtraceRequestsOnly) {
    std::string expected;
    for (const char *request : {"PTRACE_PEEKTEXT", "PTRACE_PEEKDATA", "PTRACE_PEEKUSER",
                                "PTRACE_POKETEXT", "PTRACE_POKEDATA", "PTRACE_POKEUSER",
                                "PTRACE_ATTACH", "PTRACE_SYSCALL", "7", "8", "17", "16896", "-1"})
        expected += both("ptrace(" + std::string(request) + ", 2147483632, 0xabc, 0xdef)", "3");
    expected += both("ptrace(0, 11, 0x22, 0xffffffff)", "1");
    EXPECT_EQ(calls_in(trace("ptrace")), expected);
}

TEST_F(O32Trace, ShowsNumbersThatTheKernelDoesNotKnowAndNoneOutOfRange) {
    std::string expected;
    for (const char *name : {"unused18", "reserved221", "perf_counter_open", "Linux_syscalls",
                             "64_Linux", "64_Linux_syscalls", "Linux", "read", "perf_counter_open",
                             "Linux_syscalls", "N32_Linux", "N32_Linux_syscalls"})
        expected += both(std::string(name) + "(11, 22, 33, 44, 55, 66)", "89");
    expected +=
        both("unused18(4294967295, 2147483648, 2147483647, 0, 4294967294, 2147483649)", "89");
    // The number of an indirect call is its first argument.
    expected += both("syscall(4006, 77, 33, 44, 55, 66)", "9");
    // The names from 4279 on are one ahead of the kernel's: this is its openat.
    expected += both("mkdirat(4294967196, 268435456, 0, 0, 5, 6)", "2");
    // Marks in the list of names, and behind them the names of another convention. Their order of
    // arguments is never read's.
    expected += both("Linux_syscalls(1, 22, 33, 44, 4294967295, 66)", "ERROR");
    expected += both("O32_Linux(77, 0, 0, 0, 55, 66)", "9");
    expected += both("O32_Linux_syscalls(77, 0, 0, 0, 0, 66)", "9");
    expected += both("Linux(4294967295, 22, 33, 44, 55, 66)", "ERROR");
    expected += both("read(77, 0, 33, 44, 55, 66)", "ERROR");
    // Calls that a kernel can be built without: the arguments are wrong, or the call is missing.
    std::regex optional("((?:Linux_syscalls\\(1, |Linux\\(4|read\\(77, ).* = )(22|89)\n");
    EXPECT_EQ(std::regex_replace(calls_in(trace("numbers")), optional, "$1ERROR\n"), expected);
}

// ---- Sockets ----

TEST_F(O32Trace, ShowsTheDirectSocketCalls) {
    std::string expected =
        both("socket(1, 1, 0)", "7") + both("socket(77, 4294967295, 0)", "22") +
        both("bind(5 socket:[INODE], 0x1, 110)", "14") +
        both("bind(3 /dev/null, 0x10000000, -1)", "95") + both("connect(77, 0x10000000, -1)", "9") +
        both("sendto(5 socket:[INODE], \"ping\", 4, 0x0, 0x0, 0)", "4") +
        both("sendto(77, \"ping\", 4, 0x44, 0x55, -66)", "9") +
        "recvfrom(6 socket:[INODE], \"....\", 0x0, 0x0, 0x0)\n"
        "recvfrom(6 socket:[INODE], \"ping\", 0x0, 0x0, 0x0) = 4\n" +
        both("recvfrom(77, \"pi\", 0x44, 0x55, 0x66)", "9") +
        both("sendmsg(5 socket:[INODE], 0x1, 40)", "14") +
        both("recvmsg(6 socket:[INODE], 0x1, 64)", "14") +
        both("setsockopt(5 socket:[INODE], 65535, 9999, 0x10000000, 0x4)", "99") +
        both("shutdown(5 socket:[INODE], 2)", "0") + both("shutdown(3 /dev/null, -1)", "95");
    for (const char *name :
         {"accept", "getpeername", "getsockname", "getsockopt", "listen", "recv", "send"})
        expected += both(std::string(name) + "(77, 22, 33, 44, 55, 66)", "9");
    EXPECT_EQ(calls_in(trace("sockets")), expected);
}

TEST_F(O32Trace, ShowsTheMultiplexedSocketCallsWithTheRegistersInPlaceOfTheirArguments) {
    auto generic = [](const std::string &name, int subcall, const std::string &result) {
        return both(name + "(" + std::to_string(subcall) + ", 268436480, 4, 44, 55, 66)", result);
    };
    EXPECT_EQ(
        calls_in(trace("socketcall")),
        generic("(null)", 0, "22") + both("socket(1, 268436480, 4)", "124") +
            both("bind(2 pipe:[INODE], 0x10000400, 4)", "9") +
            both("connect(3 /dev/null, 0x10000400, 4)", "9") +
            both("listen(4, 268436480, 4, 44, 55, 66)", "9") + generic("accept", 5, "9") +
            generic("getsockname", 6, "9") + generic("getpeername", 7, "9") +
            generic("socketpair", 8, "14") + generic("send", 9, "9") + generic("recv", 10, "9") +
            both("sendto(11, \"M\\x0\\x0\\x0\", 4, 0x2c, 0x37, 66)", "9") +
            both("recvfrom(12, \"M\\x0\\x0\\x0\", 0x2c, 0x37, 0x42)", "9") +
            both("shutdown(13, 268436480)", "9") +
            both("setsockopt(14, 268436480, 4, 0x2c, 0x37)", "9") + generic("getsockopt", 15, "9") +
            both("sendmsg(16, 0x10000400, 4)", "9") + both("recvmsg(17, 0x10000400, 4)", "9") +
            generic("accept4", 18, "9") + generic("(null)", 19, "9") + generic("(null)", 21, "22") +
            // The name is that of the low five bits.
            generic("socket", 33, "22"));
}

// ---- Strings ----

TEST_F(O32Trace, ShowsStringsOfEveryLengthAndContent) {
    auto write_line = [](const std::string &shown, int length, const std::string &result) {
        return both("write(3 /dev/null, \"" + shown + "\", " + std::to_string(length) + ")",
                    result);
    };
    auto access_line = [](const std::string &shown, const std::string &result) {
        return both("access(\"" + shown + "\", 0x0)", result);
    };
    const std::string first_31 = "0123456789abcdefghijklmnopqrstu", first_32 = first_31 + "v";
    const std::string first_64 = first_32 + "wxyzABCDEFGHIJKLMNOPQRSTUVWXYZ-+";
    EXPECT_EQ(calls_in(trace("strings")),
              access_line("", "2") + access_line(first_31, "2") + access_line(first_32, "2") +
                  access_line(first_32, "2") +
                  // Counted ones. With those below 0 the data would pass the end of memory.
                  write_line("", 0, "0") + write_line("0", 1, "1") +
                  write_line(first_32, 32, "32") + write_line(first_32 + "w", 33, "33") +
                  write_line(first_64, 64, "64") + write_line(first_32, 65, "65") +
                  write_line(first_32, 100, "100") + write_line(first_32, -1, "14") +
                  write_line("", -2, "14") +
                  // Characters of every kind.
                  write_line(R"(\x1\x1b\n\r\t\x7f"\\xff\x80\x0 ~A)", 14, "14") +
                  access_line(R"(\x1\x1b\n\r\t\x7f"\\xff\x80)", "2") +
                  write_line(R"(\xff\xff\xff\xff\xff)", 5, "5") +
                  access_line(R"(\xff\xff\xff\xff\xff)", "2") +
                  // At the end of a page with nothing behind it.
                  write_line("12345", 8, "8") + write_line("12345", 5, "5") +
                  access_line("12345", "2") + access_line("1234", "2") + access_line("", "2") +
                  // Nowhere.
                  write_line("", 5, "5") + access_line("", "14") + access_line("", "14"));
}

// ---- Signals ----

std::string signal_text(const std::string &pid, const std::string &number_and_name) {
    return "\n[" + pid + " " + own_name() + "] ---  SIGNAL " + number_and_name + " ---\n\n";
}

TEST_F(O32Trace, ShowsSignalsByTheNumbersAndNamesOfTheMachine) {
    std::string text = trace("signals"), pid = pid_in(text), expected;
    for (const char *shown :
         {"1 SIGHUP",     "2 SIGINT",   "3 SIGQUIT",  "4 SIGILL",   "6 SIGIOT",   "7 SIGEMT",
          "8 SIGFPE",     "10 SIGBUS",  "11 SIGSEGV", "12 SIGSYS",  "13 SIGPIPE", "14 SIGALRM",
          "15 SIGTERM",   "16 SIGUSR1", "17 SIGUSR2", "18 SIGCHLD", "19 SIGPWR",  "20 SIGWINCH",
          "21 SIGURG",    "22 SIGIO",   "24 SIGTSTP", "25 SIGCONT", "26 SIGTTIN", "27 SIGTTOU",
          "28 SIGVTALRM", "29 SIGPROF", "30 SIGXCPU", "31 SIGXFSZ", "34 Invalid"}) {
        std::string number = std::string(shown, strcspn(shown, " "));
        expected += both("kill(" + pid + ", " + number + ", 33, 44, 55, 66)", "0") +
                    signal_text(pid, shown);
    }
    EXPECT_EQ(calls_in(text), expected);
}

// So many lines of a tracer, without pid and places in front.
std::string read_lines(Background &tracer, int count) {
    std::string text;
    for (int i = 0; i < count && !testing::Test::HasFailure(); ++i)
        text += tracer.read_line() + "\n";
    return without_inodes(without_prefixes(text));
}

// Traces a group from inside its only call on. It has then been entered again, which shows as
// `entry`; a signal interrupts it, which shows as `exit`, and it is entered once more.
void expect_interruption(const std::string &group, const RunOptions &options,
                         const std::string &entry, const std::string &exit) {
    Background process({fixture_path("o32_calls"), group}, options);
    ASSERT_EQ(process.read_line(), "ready");
    ASSERT_TRUE(wait_for_state(process.pid(), 'S'));
    Background tracer({fieldkit_path(), "tstrace", "-p", std::to_string(process.pid())});
    EXPECT_EQ(read_lines(tracer, 1), entry + "\n");
    process.send_signal(16);
    EXPECT_EQ(read_lines(tracer, 5), exit + "\n\n---  SIGNAL 16 SIGUSR1 ---\n\n" + entry + "\n");
    tracer.send_signal(SIGINT);
    EXPECT_EQ(tracer.wait().exit_status, 0);
    EXPECT_TRUE(runs_free(process.pid()));
}

TEST_F(O32Trace, ShowsTheKernelsOwnCodesAsResultsOfInterruptedCalls) {
    expect_interruption("pause", options(), "pause(11, 22, 33, 44, 55, 66)",
                        "pause(11, 22, 33, 44, 55, 66) = 514");
    // A sleep goes on as another call.
    expect_interruption("sleep", options(), "restart_syscall(268435456, 0, 33, 44, 55, 66)",
                        "restart_syscall(268435456, 0, 33, 44, 55, 66) = 516");
    // The code is taken for the number of bytes that were read: the first 32 are shown.
    std::string zeros = replace_all(std::string(32 - strlen("as it was"), '0'), "0", "\\x0");
    expect_interruption("read", options(), "read(0 pipe:[INODE], 0x10000000, 4)",
                        "read(0 pipe:[INODE], \"as it was" + zeros + "\", 4) = 512");
}

TEST_F(O32Trace, ShowsAStopFromOutsideAndTheContinuation) {
    Background process({fixture_path("o32_calls"), "pause"}, options());
    ASSERT_EQ(process.read_line(), "ready");
    ASSERT_TRUE(wait_for_state(process.pid(), 'S'));
    Background tracer({fieldkit_path(), "tstrace", "-p", std::to_string(process.pid())});
    EXPECT_EQ(read_lines(tracer, 1), "pause(11, 22, 33, 44, 55, 66)\n");
    process.send_signal(23);
    EXPECT_EQ(read_lines(tracer, 4),
              "pause(11, 22, 33, 44, 55, 66) = 514\n\n---  SIGNAL 23 SIGSTOP ---\n\n");
    EXPECT_TRUE(wait_for_state(process.pid(), 't'));
    process.send_signal(25);
    EXPECT_EQ(read_lines(tracer, 4),
              "\n---  SIGNAL 25 SIGCONT ---\n\npause(11, 22, 33, 44, 55, 66)\n");
    tracer.send_signal(SIGINT);
    EXPECT_EQ(tracer.wait().exit_status, 0);
    EXPECT_TRUE(runs_free(process.pid()));
}

// ---- Ends ----

// Writes a text with its terminator over the start of a buffer.
void overwrite_start(std::string &buffer, const std::string &text) {
    std::string with_end = text + '\0';
    if (buffer.size() < with_end.size())
        buffer.resize(with_end.size());
    buffer.replace(0, with_end.size(), with_end);
}

// The listing that a trace has from `start` on, as it stands there with its inodes.
std::string listing_at(const std::string &trace, size_t start) {
    std::smatch found;
    std::string text = trace.substr(start);
    std::regex listing("^\n\\[[0-9]+ [^\\]]*\\] 5 open fds:\n(?:[0-4]\t.*\n){5}");
    return std::regex_search(text, found, listing) ? found.str() : "";
}

TEST_F(O32Trace, ListsTheDescriptorsAtTheExitCallAndAtTheExitEvent) {
    const std::pair<const char *, const char *> ends[] = {{"exit", "exit(7)"},
                                                          {"exit_group", "exit_group(-8)"}};
    for (const auto &[group, call] : ends) {
        std::string text = trace(group), part = part_of_group(text);
        std::string listing = listing_at(part, 0);
        ASSERT_EQ(without_inodes(listing), "\n[" + pid_in(text) + " " + own_name() +
                                               "] 5 open fds:\n"
                                               "0\tpipe:[INODE]\n"
                                               "1\tpipe:[INODE]\n"
                                               "2\tpipe:[INODE]\n"
                                               "3\t/dev/null\n"
                                               "4\t" +
                                               dir / "data" + "\n")
            << part;
        // Each piece of the listing goes over the start of the line, which comes after it.
        std::string line = prefix_in(text) + call, buffer = line;
        size_t head = listing.find('\n', 1) + 1;
        overwrite_start(buffer, listing.substr(0, head));
        for (size_t at = head; at < listing.size();) {
            size_t tab = listing.find('\t', at), end = listing.find('\n', at);
            overwrite_start(buffer, listing.substr(at, tab + 1 - at));
            overwrite_start(buffer, listing.substr(tab + 1, end - tab - 1));
            overwrite_start(buffer, "\n");
            at = end + 1;
        }
        EXPECT_EQ(part, listing + buffer.substr(0, line.size()) + "\n" + listing);
    }
}

TEST_F(O32Trace, ShowsTheSignalThatAProcessDiesOf) {
    std::string text = trace("term"), part = part_of_group(text), pid = pid_in(text);
    std::string shown = prefix_in(text) + "kill(" + pid + ", 15, 33, 44, 55, 66)";
    std::string start = shown + "\n" + shown + " = 0\n" + signal_text(pid, "15 SIGTERM");
    EXPECT_EQ(part.substr(0, start.size()), start);
    EXPECT_NE(listing_at(part, start.size()), "");
    EXPECT_EQ(part.substr(start.size()), listing_at(part, start.size()));
}

TEST_F(O32Trace, ShowsNoExitOfACallInWhichAProcessIsKilled) {
    std::string text = trace("kill"), part = part_of_group(text);
    std::string start = prefix_in(text) + "kill(" + pid_in(text) + ", 9, 33, 44, 55, 66)\n";
    EXPECT_EQ(part.substr(0, start.size()), start);
    EXPECT_NE(listing_at(part, start.size()), "");
    EXPECT_EQ(part.substr(start.size()), listing_at(part, start.size()));
}

}  // namespace
#endif
