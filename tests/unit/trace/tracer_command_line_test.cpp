#include "trace/tracer_command_line.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/temp_dir.h"

namespace {

// ---- find_in_path ----

class FindInPath : public testing::Test {
  protected:
    void SetUp() override {
        const char *path = getenv("PATH");
        had_path_ = path != nullptr;
        path_ = had_path_ ? path : "";
    }
    void TearDown() override {
        if (had_path_)
            setenv("PATH", path_.c_str(), 1);
        else
            unsetenv("PATH");
    }

    // What is found, or "none".
    static std::string found(const std::string &command) {
        UniqueBlock<char> path = find_in_path(command.c_str());
        return path != nullptr ? path.get() : "none";
    }

    TempDir dir_;

  private:
    bool had_path_ = false;
    std::string path_;
};

TEST_F(FindInPath, TakesTheFirstDirectoryThatHasTheFile) {
    std::string first = dir_.file("first/other", "");
    dir_.file("second/tool", "");
    dir_.file("third/tool", "");
    setenv("PATH", (dir_ / "first:" + dir_ / "second:" + dir_ / "third").c_str(), 1);
    EXPECT_EQ(found("tool"), dir_ / "second/tool");
    EXPECT_EQ(found("other"), first);
    EXPECT_EQ(found("nothing"), "none");
}

TEST_F(FindInPath, TakesAFileWithoutExecutePermission) {
    std::string path = dir_.file("tool", "", 0600);
    setenv("PATH", dir_.path().c_str(), 1);
    EXPECT_EQ(found("tool"), path);
}

TEST_F(FindInPath, PassesOverDirectories) {
    dir_.file("first/tool/file", "");
    dir_.file("second/tool", "");
    setenv("PATH", (dir_ / "first:" + dir_ / "second").c_str(), 1);
    EXPECT_EQ(found("tool"), dir_ / "second/tool");
    EXPECT_EQ(found(""), "none");
}

TEST_F(FindInPath, TakesAnEmptyElementForTheEmptyString) {
    std::string tool = dir_.file("tool", "");
    // A slash is put behind it as behind any other: the name is then looked up from the root.
    std::string from_root = tool.substr(1);
    for (const char *path : {"", ":", ":/nonexistent", "/nonexistent:", "/nonexistent::/none"}) {
        setenv("PATH", path, 1);
        EXPECT_EQ(found(from_root), tool) << path;
    }
    setenv("PATH", "/nonexistent", 1);
    EXPECT_EQ(found(from_root), "none");
}

TEST_F(FindInPath, LooksUpAnAbsoluteNameFromTheRootOnly) {
    std::string tool = dir_.file("tool", "");
    setenv("PATH", "", 1);
    EXPECT_EQ(found(tool), "//" + tool);
    EXPECT_EQ(found(dir_ / "nothing"), "none");
}

TEST_F(FindInPath, LooksUpADottedNameFromTheWorkingDirectoryOnly) {
    dir_.file("here/tool", "");
    dir_.file("tool", "");
    dir_.file("here/.hidden", "");
    int back = open(".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ASSERT_EQ(chdir((dir_ / "here").c_str()), 0);
    setenv("PATH", dir_.path().c_str(), 1);
    EXPECT_EQ(found("./tool"), dir_ / "here//./tool");
    EXPECT_EQ(found("../tool"), dir_ / "here//../tool");
    EXPECT_EQ(found(".hidden"), dir_ / "here//.hidden");
    EXPECT_EQ(found("./nothing"), "none");
    ASSERT_EQ(fchdir(back), 0);
    close(back);
}

TEST_F(FindInPath, WithoutPathLooksIntoTheUsualDirectories) {
    unsetenv("PATH");
    EXPECT_EQ(found("sh"), "/bin/sh");
    EXPECT_EQ(found("nosuchcommand"), "none");
}

TEST_F(FindInPath, PassesOverADirectoryThatMakesTheNameTooLong) {
    std::string tool = dir_.file("tool", "");
    // Directory and command of 4095 characters together are looked up, of 4096 are not. The kernel
    // takes no path of more than 4095 itself, so the first has to be one that fits otherwise: what
    // is seen is that neither keeps the next directory from being searched.
    for (size_t len : {4090u, 4091u, 4092u, 5000u}) {
        setenv("PATH", (std::string(len, '/') + ":" + dir_.path()).c_str(), 1);
        EXPECT_EQ(found("tool"), tool) << len;
    }
    EXPECT_EQ(found(std::string(5000, 'x')), "none");
    std::string slashes(4094 - strlen("tool") - dir_.path().size(), '/');
    setenv("PATH", (slashes + dir_.path()).c_str(), 1);
    EXPECT_EQ(found("tool"), slashes + tool) << "4094 characters and the slash";
    setenv("PATH", ("//" + slashes + dir_.path()).c_str(), 1);
    EXPECT_EQ(found("tool"), "none");
}

// ---- parse_tracer_options ----

struct Parsed {
    int error;
    std::vector<pid_t> pids;
    std::vector<std::string> command;
};

Parsed parse(std::vector<std::string> words) {
    words.insert(words.begin(), "tstrace");
    std::vector<char *> argv;
    for (std::string &word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    TracerOptions options;
    Parsed parsed;
    parsed.error = parse_tracer_options(static_cast<int>(words.size()), argv.data(), &options);
    for (int i = 0; i < options.nr_pids; ++i)
        parsed.pids.push_back(options.pids.get()[i]);
    for (char **word = options.command; word != nullptr && *word != nullptr; ++word)
        parsed.command.push_back(*word);
    return parsed;
}

using Words = std::vector<std::string>;
using Pids = std::vector<pid_t>;

TEST(TracerOptionsOf, APidAreItsNumberInThreeNotations) {
    EXPECT_EQ(parse({"-p", "12"}).pids, Pids({12}));
    EXPECT_EQ(parse({"-p", "0x10"}).pids, Pids({16}));
    EXPECT_EQ(parse({"-p", "010"}).pids, Pids({8}));
    EXPECT_EQ(parse({"-p", "junk"}).pids, Pids({0}));
}

TEST(TracerOptionsOf, SeveralPidsKeepTheirOrderAndTheCommandAside) {
    Parsed parsed = parse({"-p", "12", "-p", "0x10", "ls", "-p", "3"});
    EXPECT_EQ(parsed.error, 0);
    EXPECT_EQ(parsed.pids, Pids({12, 16}));
    EXPECT_EQ(parsed.command, Words({"ls", "-p", "3"}));
}

TEST(TracerOptionsOf, ManyPidsHoldThemAll) {
    Words words;
    Pids pids;
    for (int i = 1; i <= 3000; ++i) {
        words.push_back("-p");
        words.push_back(std::to_string(i));
        pids.push_back(i);
    }
    EXPECT_EQ(parse(words).pids, pids);
}

TEST(TracerOptionsOf, ACommandEndsTheOptions) {
    Parsed parsed = parse({"cat", "-x", "-p"});
    EXPECT_EQ(parsed.error, 0);
    EXPECT_EQ(parsed.pids, Pids());
    EXPECT_EQ(parsed.command, Words({"cat", "-x", "-p"}));
    EXPECT_EQ(parse({""}).error, 0) << "a word that does not begin with a dash";
}

TEST(TracerOptionsOf, GluedCharactersAreNotLookedAt) {
    EXPECT_EQ(parse({"-p1234", "5"}).pids, Pids({5}));
    EXPECT_EQ(parse({"-p1234"}).error, -EINVAL) << "an option without a value";
}

TEST(TracerOptionsOf, APidOptionWithoutAValueEndTheOptions) {
    EXPECT_EQ(parse({"-p"}).error, -EINVAL);
    Parsed parsed = parse({"-p", "7", "-p"});
    EXPECT_EQ(parsed.error, 0);
    EXPECT_EQ(parsed.pids, Pids({7}));
    EXPECT_EQ(parsed.command, Words());
}

TEST(TracerOptionsOf, NothingOrAnUnknownOptionAskForTheUsage) {
    EXPECT_EQ(parse({}).error, -EINVAL);
    EXPECT_EQ(parse({"-x"}).error, -EINVAL);
    EXPECT_EQ(parse({"-"}).error, -EINVAL);
    EXPECT_EQ(parse({"--"}).error, -EINVAL);
    EXPECT_EQ(parse({"-p", "1", "-h"}).error, -EINVAL);
    EXPECT_EQ(parse({"-P", "1"}).error, -EINVAL);
}

// ---- trace_write_cb ----

TEST(TraceWriteCb, WritesTheTextAndWantsMore) {
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    EXPECT_EQ(trace_write_cb(fds[1], "some text", 4), 1u);
    EXPECT_EQ(trace_write_cb(fds[1], nullptr, 0), 1u) << "a poll";
    EXPECT_EQ(trace_write_cb(fds[1], "gone", static_cast<uint32_t>(-1)), 1u) << "no text";
    close(fds[1]);
    char text[16];
    EXPECT_EQ(read(fds[0], text, sizeof text), 4);
    EXPECT_EQ(std::string(text, 4), "some");
    close(fds[0]);
}

TEST(TraceWriteCb, GoesOnAfterAFailedWrite) {
    EXPECT_EQ(trace_write_cb(-1, "text", 4), 1u);
}

}  // namespace
