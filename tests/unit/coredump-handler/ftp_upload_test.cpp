// The pieces of an upload; whole ones are in tests/system.
#include "coredump-handler/ftp_upload.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>

#include "coredump-handler/curl_functions.h"
#include "support/temp_dir.h"
#include "util/unique_fd.h"

namespace {

// Standard input is `fd` while this lives.
class StandardInput {
  public:
    explicit StandardInput(int fd) : saved_(dup(STDIN_FILENO)) { dup2(fd, STDIN_FILENO); }
    ~StandardInput() { dup2(saved_.get(), STDIN_FILENO); }

  private:
    UniqueFd saved_;
};

}  // namespace

TEST(ReadCore, GivesWhatThereIsUpToTheRoom) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    UniqueFd in(ends[0]), out(ends[1]);
    StandardInput replaced(in.get());
    ASSERT_EQ(10, write(out.get(), "0123456789", 10));
    char buf[16] = {};
    EXPECT_EQ(6u, read_core(buf, 2, 3, nullptr));
    EXPECT_STREQ("012345", buf);
    // Less than the room: more may come later.
    EXPECT_EQ(4u, read_core(buf, 1, 16, nullptr));
    EXPECT_EQ("6789", std::string(buf, 4));
    out.reset();
    EXPECT_EQ(0u, read_core(buf, 1, 16, nullptr));
}

TEST(ReadCore, SurvivesSignals) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    UniqueFd in(ends[0]), out(ends[1]);
    StandardInput replaced(in.get());
    static volatile sig_atomic_t signals;
    static int writer;
    signals = 0;
    writer = out.get();
    struct sigaction action = {};
    // The tenth one brings something to read.
    action.sa_handler = [](int) {
        signals = signals + 1;
        if (signals == 10)
            (void)!write(writer, "x", 1);
    };
    struct sigaction before;
    ASSERT_EQ(0, sigaction(SIGALRM, &action, &before));
    const itimerval often = {{0, 5000}, {0, 5000}};
    setitimer(ITIMER_REAL, &often, nullptr);
    char byte = '?';
    EXPECT_EQ(1u, read_core(&byte, 1, 1, nullptr));
    const itimerval never = {};
    setitimer(ITIMER_REAL, &never, nullptr);
    sigaction(SIGALRM, &before, nullptr);
    EXPECT_EQ('x', byte);
}

TEST(ReadCore, AbortsTheTransferWhenTheReadFails) {
    TempDir dir;
    UniqueFd fd(open(dir.path().c_str(), O_RDONLY | O_CLOEXEC));
    StandardInput replaced(fd.get());
    char buf[16];
    EXPECT_EQ(static_cast<size_t>(CURL_READFUNC_ABORT), read_core(buf, 1, sizeof buf, nullptr));
    EXPECT_EQ(0x10000000u, read_core(buf, 1, sizeof buf, nullptr));
}

TEST(UploadCore, FailsWithoutAUrl) {
    CoreConfig config;
    config.use_ftp = true;
    EXPECT_FALSE(upload_core(config, "core"));
}

TEST(LoadCurl, FindsEveryFunction) {
    CurlFunctions curl = {};
    ASSERT_TRUE(load_curl(&curl));
    curl_slist *list = curl.slist_append(nullptr, "RNFR a");
    ASSERT_NE(nullptr, list);
    EXPECT_STREQ("RNFR a", list->data);
    curl.slist_free_all(list);
}
