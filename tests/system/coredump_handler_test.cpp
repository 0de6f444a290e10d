// The applet coredump-handler: its arguments, its choice, and the hand-over to the debug service.
#include <errno.h>
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "core_runs.h"
#include "support/refused_calls.h"

namespace {

const std::vector<std::string> UNLIMITED = {"core.1234", "18446744073709551615", "!usr!bin", "app"};

// Priorities as they are sent: the facility of users' programs, which is the default, and the
// level.
constexpr int USER_ERROR = 11;
constexpr int USER_INFO = 14;

void expect_logged(SystemLog &log, int priority, const std::string &message) {
    const std::vector<LogLine> lines = log.read_lines();
    ASSERT_EQ(1u, lines.size()) << message;
    EXPECT_EQ(priority, lines[0].priority);
    EXPECT_EQ("coredump-handler", lines[0].tag);
    EXPECT_EQ("", lines[0].pid);
    EXPECT_EQ(message, lines[0].message);
}

// The core is not looked at.
void expect_core_ignored(const std::vector<std::string> &args, int exit_status) {
    FakeService service;
    HandlerRun run(made_up_core(100000), args);
    run.expect_end(exit_status);
    EXPECT_EQ(0, run.taken());
    EXPECT_FALSE(service.has_caller(0));
}

void expect_refused(CoreDevice &device, const std::vector<std::string> &args,
                    const std::string &message) {
    expect_core_ignored(args, 1);
    expect_logged(device.log, USER_ERROR, message);
}

void expect_disabled(CoreDevice &device, const std::vector<std::string> &args,
                     const std::string &message) {
    expect_core_ignored(args, 0);
    expect_logged(device.log, USER_INFO, message);
}

// With these arguments the core reaches the service, silently.
void expect_handed_over(CoreDevice &device, const std::vector<std::string> &args) {
    FakeService service;
    const std::string core = made_up_core(20000);
    HandlerRun run(core, args);
    Connection connection = service.take_caller();
    EXPECT_TRUE(core == connection.take(core.size()));
    connection.hang_up();
    run.expect_end(0);
    EXPECT_TRUE(device.log.read_lines().empty());
}

void expect_service_chosen(CoreDevice &device, const std::string &config) {
    SCOPED_TRACE(config);
    device.configure(config);
    expect_handed_over(device, UNLIMITED);
}

// An upload that has no URL fails at once.
void expect_ftp_chosen_without_url(CoreDevice &device, const std::string &config) {
    SCOPED_TRACE(config);
    device.configure(config);
    expect_core_ignored(UNLIMITED, 1);
    EXPECT_TRUE(device.log.read_lines().empty());
}

std::string page_size_less(long less) {
    return std::to_string(sysconf(_SC_PAGESIZE) - less);
}

}  // namespace

TEST(CoredumpArguments, TwoOrThreeAreTheWrongNumber) {
    run_in_sandbox([] {
        CoreDevice device;
        for (const std::vector<std::string> &args :
             {std::vector<std::string>{"core.1", "0"}, {"core.1", "0", "!bin"}, {"", "", ""}})
            expect_refused(device, args, "wrong number of arguments");
    });
}

TEST(CoredumpArguments, EachMissingOneHasItsOwnMessage) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_refused(device, {"core.1", "0", "!bin", ""}, "executable name argument missing");
        expect_refused(device, {"core.1", "0", "", "app"}, "executable path argument missing");
        expect_refused(device, {"core.1", "", "!bin", "app"}, "core file size argument missing");
    });
}

TEST(CoredumpArguments, TheFirstFaultFromTheEndIsTold) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_refused(device, {"", "", "", ""}, "executable name argument missing");
        expect_refused(device, {"", "", "", "app"}, "executable path argument missing");
        expect_refused(device, {"", "", "!bin", "app"}, "core file size argument missing");
    });
}

TEST(CoredumpArguments, ALimitWithAUnitOrASignOnlyCannotBeParsed) {
    run_in_sandbox([] {
        CoreDevice device;
        for (const char *limit : {"4k", "1M", "+", "-", "unlimited", "18446744073709551616"}) {
            expect_refused(device, {"core.1", limit, "!bin", "app"},
                           "core file size limit parsing error");
        }
    });
}

TEST(CoredumpArguments, ALimitOfNothingDisablesCoresAndNamesTheExecutable) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_disabled(device, {"core.1234", "0", "!usr!bin", "app"},
                        "core dumps disabled for '/usr/bin/app'");
        // No character in it is special.
        expect_disabled(device, {"core.1234", "0", "!a%s!!b c", "%n!d"},
                        "core dumps disabled for '/a%s//b c/%n!d'");
    });
}

TEST(CoredumpArguments, ALimitOfAPagePassesAndOneByteLessIsDisabled) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_disabled(device, {"core.1", page_size_less(1), "!bin", "app"},
                        "core dumps disabled for '/bin/app'");
        expect_handed_over(device, {"core.1", page_size_less(0), "!bin", "app"});
    });
}

TEST(CoredumpArguments, UnlimitedPassesAsTheKernelsOf32And64BitsTellIt) {
    run_in_sandbox([] {
        CoreDevice device;
        for (const char *limit : {"2147483647", "4294967295", "18446744073709551615"})
            expect_handed_over(device, {"core.1", limit, "!bin", "app"});
    });
}

TEST(CoredumpArguments, NoneOrOneIsNotChecked) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_handed_over(device, {});
        expect_handed_over(device, {"core.1"});
        expect_handed_over(device, {""});
    });
}

TEST(CoredumpArguments, LinesAreLoggedUnderTheNameOfTheExecutable) {
    run_in_sandbox([] {
        CoreDevice device;
        EXPECT_EQ(1, run_fieldkit({"coredump-handler", "core", "0"}).exit_status);
        const LogLine line = device.log.read_line();
        EXPECT_EQ(USER_ERROR, line.priority);
        EXPECT_EQ("fieldkit", line.tag);
    });
}

TEST(CoredumpChoice, IsTheServiceWithoutAConfigurationFile) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_handed_over(device, UNLIMITED);
    });
}

TEST(CoredumpChoice, IsTheServiceUnlessTheValueBeginsWithFtp) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_service_chosen(device, "");
        expect_service_chosen(device, "[CoreHandlerFtp]\nTargetURL = ftp://127.0.0.1\n");
        expect_service_chosen(device, "[Any]\nCoreHandler = Socket\n");
        expect_service_chosen(device, "[Any]\nCoreHandler = ftp\n");
    });
}

TEST(CoredumpChoice, IsFtpForTheValueFtpsAsWell) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_ftp_chosen_without_url(device, "[Any]\nCoreHandler = FTP\n");
        expect_ftp_chosen_without_url(device, "[Any]\nCoreHandler = FTPS\n");
    });
}

TEST(CoredumpChoice, AnFtpSectionBeforeTheChoiceIsIgnored) {
    run_in_sandbox([] {
        CoreDevice device;
        expect_ftp_chosen_without_url(
            device, "[CoreHandlerFtp]\nTargetURL = ftp://127.0.0.1\n[Any]\nCoreHandler = FTP\n");
    });
}

TEST(CoredumpService, GetsTheCoreAsItIsAndNoEndBeforeItAnswers) {
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        const std::string core = made_up_core((3 << 20) + 7);
        HandlerRun run(core, UNLIMITED);
        Connection connection = service.take_caller();
        EXPECT_TRUE(core == connection.take(core.size()));
        EXPECT_FALSE(connection.stirs(500));
        const double answered = now_s();
        connection.say("123456789 and more than anybody reads");
        EXPECT_EQ("", connection.take_all());
        run.expect_end(0);
        EXPECT_LT(now_s() - answered, 4);
        EXPECT_TRUE(device.log.read_lines().empty());
    });
}

TEST(CoredumpService, ThatNeverAnswersDelaysTheEndByFiveSeconds) {
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        HandlerRun run("core", UNLIMITED);
        Connection connection = service.take_caller();
        EXPECT_EQ("core", connection.take(4));
        const double taken = now_s();
        EXPECT_EQ("", connection.take_all());
        EXPECT_GT(now_s() - taken, 4.5);
        run.expect_end(0);
        EXPECT_LT(now_s() - taken, 15);
    });
}

TEST(CoredumpService, ThatHangsUpAtOnceIsAsGoodAsOneThatTakesTheCore) {
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        HandlerRun run(made_up_core(3 << 20), UNLIMITED);
        service.take_caller().hang_up();
        const double left = now_s();
        run.expect_end(0);
        EXPECT_LT(now_s() - left, 4);
        EXPECT_LT(run.taken(), 3 << 20);
        EXPECT_TRUE(device.log.read_lines().empty());
    });
}

TEST(CoredumpService, ThatHangsUpHalfWayEndsTheCopy) {
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        const std::string core = made_up_core(3 << 20);
        HandlerRun run(core, UNLIMITED);
        Connection connection = service.take_caller();
        EXPECT_TRUE(core.substr(0, 100000) == connection.take(100000));
        connection.hang_up();
        const double left = now_s();
        run.expect_end(0);
        EXPECT_LT(now_s() - left, 4);
        EXPECT_LT(run.taken(), 3 << 20);
    });
}

TEST(CoredumpService, ThatCannotBeReachedIsNamedOnStandardError) {
    run_in_sandbox([] {
        CoreDevice device;
        RunResult result = HandlerRun("core", UNLIMITED).wait();
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ("connect to /var/run/dbg-cgi/ctrl-segf-socket failed\n", result.err);
        // A socket that has been left behind.
        FakeService().leave_behind();
        HandlerRun run("core", UNLIMITED);
        result = run.wait();
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("connect to /var/run/dbg-cgi/ctrl-segf-socket failed\n", result.err);
        EXPECT_EQ(0, run.taken());
        EXPECT_TRUE(device.log.read_lines().empty());
    });
}

TEST(CoredumpService, IsLeftSilentlyWhenThereIsNoSocket) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    run_in_sandbox([] {
        CoreDevice device;
        HandlerRun run("core", UNLIMITED, [] { (void)refuse_call(SYS_socket, EMFILE); });
        run.expect_end(1);
        EXPECT_EQ(0, run.taken());
    });
}

TEST(CoredumpService, GetsTheCoreAlsoWhenTheWaitForItsAnswerFails) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        HandlerRun run("core", UNLIMITED, [] { (void)refuse_call(SYS_poll, EINTR); });
        Connection connection = service.take_caller();
        EXPECT_EQ("core", connection.take_all());
        const RunResult result = run.wait();
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ("select(): Interrupted system call\n", result.err);
    });
}

TEST(CoredumpStart, LeavesNoSocketInThePlaceOfAClosedStream) {
    run_in_sandbox([] {
        namespace fs = std::filesystem;
        CoreDevice device;
        FakeService service;
        HandlerRun run("core", UNLIMITED, start_as_the_kernel_does);
        Connection connection = service.take_caller();
        EXPECT_EQ("core", connection.take(4));
        const std::string fds = "/proc/" + std::to_string(run.pid()) + "/fd/";
        EXPECT_EQ("/dev/null", fs::read_symlink(fds + "1"));
        EXPECT_EQ("/dev/null", fs::read_symlink(fds + "2"));
        EXPECT_EQ("socket:", fs::read_symlink(fds + "3").string().substr(0, 7));
        EXPECT_FALSE(fs::exists(fs::symlink_status(fds + "4")));
        EXPECT_EQ("/", fs::read_symlink("/proc/" + std::to_string(run.pid()) + "/cwd"));
        connection.hang_up();
        run.expect_end(0);
    });
}

TEST(CoredumpStart, MixesNoMessageIntoTheCore) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        // The wait fails, which is told on standard error.
        HandlerRun run("core", UNLIMITED, [] {
            close(STDERR_FILENO);
            (void)refuse_call(SYS_poll, EINTR);
        });
        EXPECT_EQ("core", service.take_caller().take_all());
        run.expect_end(0);
    });
}

TEST(CoredumpStart, LogsWithoutTheStreamsThatTheKernelDoesNotOpen) {
    run_in_sandbox([] {
        CoreDevice device;
        HandlerRun run("core", {"core.1", "0", "!usr!bin", "app"}, start_as_the_kernel_does);
        run.expect_end(0);
        expect_logged(device.log, USER_INFO, "core dumps disabled for '/usr/bin/app'");
    });
}

TEST(CoredumpStart, TakesNoCoreFromAClosedStandardInput) {
    run_in_sandbox([] {
        CoreDevice device;
        FakeService service;
        HandlerRun run("core", UNLIMITED, [] { close(STDIN_FILENO); });
        Connection connection = service.take_caller();
        EXPECT_FALSE(connection.stirs(100));
        connection.say("x");
        EXPECT_EQ("", connection.take_all());
        run.expect_end(0);
    });
}
