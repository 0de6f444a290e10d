// What a trace does when there is no memory for its buffer.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <vector>

#include "rtrace/df_table.h"
#include "rtrace/probes.h"
#include "support/temp_dir.h"

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool OWN_ALLOCATOR = true;
#else
constexpr bool OWN_ALLOCATOR = false;
#endif

// While it lives, nothing of the size of the buffer can be allocated.
class MemoryShortage {
  public:
    MemoryShortage() {
        held_.reserve(10000);
        unsigned long pages = 0;
        std::ifstream("/proc/self/statm") >> pages;
        getrlimit(RLIMIT_AS, &before_);
        const rlimit limit = {pages * static_cast<unsigned long>(sysconf(_SC_PAGESIZE)),
                              before_.rlim_max};
        setrlimit(RLIMIT_AS, &limit);
        // What the allocator has in reserve.
        while (void *block = malloc(204800))
            held_.push_back(block);
    }
    ~MemoryShortage() {
        setrlimit(RLIMIT_AS, &before_);
        for (void *block : held_)
            free(block);
    }

  private:
    rlimit before_;
    std::vector<void *> held_;
};

class WithoutMemory : public testing::Test {
  protected:
    void SetUp() override {
        if (OWN_ALLOCATOR)
            GTEST_SKIP() << "the sanitizer's allocator ends the program instead";
        stream_.fd = open((dir_.file("stream", "")).c_str(), O_WRONLY | O_CLOEXEC);
    }
    void TearDown() override {
        if (stream_.fd >= 0)
            close(stream_.fd);
    }
    std::string sent() { return read_whole_file(dir_ / "stream"); }

    TempDir dir_;
    RecordStream stream_ = {.fd = -1};
};

TEST_F(WithoutMemory, AFileFailsAndSendsNothing) {
    const std::string path = dir_.file("file", "x");
    bool result;
    {
        MemoryShortage shortage;
        result = send_file_records(&stream_, 8, path.c_str(), 1);
    }
    EXPECT_FALSE(result);
    EXPECT_EQ("", sent());
    EXPECT_TRUE(send_file_records(&stream_, 8, path.c_str(), 1)) << "there is memory again";
}

TEST_F(WithoutMemory, TheTableFailsAndSendsNothing) {
    bool result;
    {
        MemoryShortage shortage;
        result = send_df_table(&stream_, 9, "/proc/mounts");
    }
    EXPECT_FALSE(result);
    EXPECT_EQ("", sent());
}

TEST_F(WithoutMemory, OutputOfProbesWaitsForAnotherPass) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    Probes probes;
    probes.count = 1;
    probes.started[0].record_type = 1;
    probes.started[0].read_end.reset(ends[0]);
    probes.started[0].write_end.reset(ends[1]);
    ASSERT_EQ(1, write(ends[1], "x", 1));
    bool result;
    const auto start = std::chrono::steady_clock::now();
    {
        MemoryShortage shortage;
        result = pump_probes(&probes, 1, &stream_);
    }
    EXPECT_TRUE(result);
    EXPECT_EQ("", sent());
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
    EXPECT_TRUE(pump_probes(&probes, 0, &stream_));
    EXPECT_EQ(21U, sent().size());
}

}  // namespace
