// The stream of a capture is that of the plain way, but for the time fields, however the frames
// came.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/if_packet.h>
#include <net/if.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/syscall.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "capture_run.h"
#include "pcap/capture.h"
#include "plain_capture.h"
#include "support/packets.h"
#include "support/run_program.h"
#include "support/sandbox.h"
#include "support/slow_machine.h"
#include "support/temp_dir.h"

namespace {

// Frames of these types never pass the filter below, or only their first 100 bytes do.
constexpr uint16_t HIDDEN_ETHER_TYPE = 0x88b6;
constexpr uint16_t CUT_ETHER_TYPE = 0x88b7;

sock_filter filter_code[] = {
    BPF_STMT(BPF_LD | BPF_H | BPF_ABS, 12),
    BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, HIDDEN_ETHER_TYPE, 0, 1),
    BPF_STMT(BPF_RET | BPF_K, 0),
    BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, CUT_ETHER_TYPE, 0, 1),
    BPF_STMT(BPF_RET | BPF_K, 100),
    BPF_STMT(BPF_RET | BPF_K, 0xffffffff),
};
const sock_fprog FILTER = {.len = 6, .filter = filter_code};

// As send_frame(), with one socket for all frames and one search for each interface, which is
// another socket: closing one takes the kernel some milliseconds.
void send_quickly(const std::string &interface, const std::string &frame) {
    static const int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
    static std::map<std::string, unsigned> indexes;
    unsigned &index = indexes[interface];
    if (index == 0)
        index = if_nametoindex(interface.c_str());
    sockaddr_ll to = {};
    to.sll_family = AF_PACKET;
    to.sll_ifindex = static_cast<int>(index);
    EXPECT_EQ(
        static_cast<ssize_t>(frame.size()),
        sendto(fd, frame.data(), frame.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof to))
        << strerror(errno);
}

std::string without_times(std::string stream) {
    size_t at = 24;
    for (const PcapTestRecord &record : parse_pcap(stream).records) {
        stream.replace(at, 8, 8, '\0');
        at += 16 + record.data.size();
    }
    return stream;
}

// The same frames, seen by the capture under test and by the plain one.
class Captures {
  public:
    explicit Captures(CaptureOptions options)
        : options_(options), tested_(options), plain_([&] {
              options.capture = plain_capture;
              return options;
          }()) {}

    CaptureRun &tested() { return tested_; }
    bool ended() const { return ended_; }

    // While that one is held up, only the plain one is read from.
    void set_held(bool held) { held_ = held; }

    // Sends a frame of which a capture sees `size` bytes, `copies` times, or nothing if that is 0.
    void send(const std::string &interface, const std::string &frame, size_t size, int copies = 1) {
        send_quickly(interface, frame);
        const size_t captured =
            options_.cut_length != 0 ? options_.cut_length : std::min<size_t>(size, 1536);
        for (int i = 0; i < copies && size > 0 && !ended_; ++i) {
            ended_ = options_.size_limit != 0 && size_ + 48 + captured >= options_.size_limit;
            size_ += ended_ ? 0 : 16 + captured;
            // The plain one's socket does not hold many large frames.
            unseen_ += 2000 + size;
        }
        if (unseen_ > 50000)
            catch_up();
    }
    void send(const std::string &interface, const std::string &frame) {
        send(interface, frame, frame.size());
    }

    // Of what is to be in the streams by now: all, if the size limit has been reached.
    void expect_same() {
        catch_up();
        const std::string ours = without_times(tested_.read_until(0));
        const std::string plain = without_times(plain_.read_until(0));
        EXPECT_EQ(ended_ ? options_.size_limit : size_, plain.size());
        EXPECT_EQ(plain.size(), ours.size());
        const auto differ = std::mismatch(plain.begin(), plain.end(), ours.begin(), ours.end());
        EXPECT_TRUE(plain == ours) << "from byte " << differ.first - plain.begin() << " on";
    }

    // Of the streams to their ends, and of the results.
    void expect_same_end() {
        catch_up();
        if (!ended_)
            set_link_up("eth0", false);
        const std::string ours = without_times(tested_.read_all());
        const std::string plain = without_times(plain_.read_all());
        EXPECT_TRUE(plain == ours) << plain.size() << " and " << ours.size() << " bytes";
        EXPECT_EQ(plain_.result(), tested_.result());
        if (!ended_)
            set_link_up("eth0", true);
    }

  private:
    void catch_up() {
        unseen_ = 0;
        plain_.read_until(ended_ ? SIZE_MAX : size_);
        if (!held_)
            tested_.read_until(ended_ ? SIZE_MAX : size_);
    }

    CaptureOptions options_;
    CaptureRun tested_;
    CaptureRun plain_;
    size_t size_ = 24;
    size_t unseen_ = 0;
    bool ended_ = false;
    bool held_ = false;
};

enum class Way { RING, NO_RING, NO_MAPPING };

// Takes from this process what a ring needs. Says whether the machine can do that.
bool allow(Way way) {
#ifdef __NR_setsockopt
    if (way == Way::NO_RING)
        return refuse_call(__NR_setsockopt, ENOMEM, CallArgument{2, PACKET_RX_RING});
#endif
    if (way == Way::NO_MAPPING) {
#ifdef __NR_mmap2
        return refuse_call(__NR_mmap2, ENOMEM, CallArgument{3, MAP_SHARED});
#else
        return refuse_call(__NR_mmap, ENOMEM, CallArgument{3, MAP_SHARED});
#endif
    }
    return way == Way::RING;
}

bool has_ring() {
    return read_whole_file("/proc/self/maps").find("socket:[") != std::string::npos;
}

std::string random_frame(std::mt19937 *random, size_t longest) {
    constexpr uint16_t TYPES[] = {TEST_ETHER_TYPE, TEST_ETHER_TYPE, HIDDEN_ETHER_TYPE,
                                  CUT_ETHER_TYPE};
    // Short ones are as likely as long ones.
    const size_t limit = (*random)() % 2 != 0 ? 200 : longest;
    std::string payload((*random)() % (limit - 13), '\0');
    for (char &byte : payload)
        byte = static_cast<char>((*random)());
    return make_frame(TYPES[(*random)() % 4], payload);
}

size_t filtered_size(const std::string &frame) {
    if (frame[13] == static_cast<char>(HIDDEN_ETHER_TYPE & 0xff))
        return 0;
    return frame[13] == static_cast<char>(CUT_ETHER_TYPE & 0xff)
               ? std::min<size_t>(100, frame.size())
               : frame.size();
}

void expect_same_random_frames(Way way) {
    run_in_sandbox(
        [way] {
            if (!allow(way))
                GTEST_SKIP() << "seccomp: " << strerror(errno);
            sandbox_shell("ip link set eth0 mtu 8986 && ip link set eth1 mtu 8986");
            std::mt19937 random(1);
            for (uint32_t cut_length : {0u, 1u, 90u, 1536u}) {
                for (const sock_fprog *filter :
                     {static_cast<const sock_fprog *>(nullptr), &FILTER}) {
                    SCOPED_TRACE(std::to_string(cut_length) +
                                 (filter != nullptr ? ", filter" : ""));
                    Captures captures({.cut_length = cut_length, .filter = filter});
                    EXPECT_EQ(way == Way::RING, has_ring());
                    for (int i = 0; i < rounds(300); ++i) {
                        const std::string frame = random_frame(&random, 9000);
                        captures.send(random() % 4 == 0 ? "eth0" : "eth1", frame,
                                      filter != nullptr ? filtered_size(frame) : frame.size());
                    }
                    captures.expect_same();
                    captures.expect_same_end();
                }
            }
        },
        WITH_ETH0);
}

// ---- A capture that is held up while frames gather

std::atomic<int> holding;
std::atomic<int> hold_until_readable;
void hold(int) {
    ++holding;
    char byte;
    (void)!read(hold_until_readable, &byte, 1);
}

class Hold {
  public:
    explicit Hold(CaptureRun *run) {
        EXPECT_EQ(0, pipe2(pipe_, O_CLOEXEC));
        hold_until_readable = pipe_[0];
        struct sigaction action = {};
        action.sa_handler = hold;
        EXPECT_EQ(0, sigaction(SIGUSR1, &action, nullptr));
        const int before = holding;
        EXPECT_EQ(0, pthread_kill(run->thread().native_handle(), SIGUSR1));
        EXPECT_TRUE(wait_until([&] { return holding > before; }));
    }
    ~Hold() {
        close(pipe_[0]);
        close(pipe_[1]);
    }
    Hold(const Hold &) = delete;
    Hold &operator=(const Hold &) = delete;

    void release() const { EXPECT_EQ(1, write(pipe_[1], "x", 1)); }

  private:
    int pipe_[2] = {-1, -1};
};

std::string numbered_frame(size_t size, unsigned number) {
    std::string frame = test_frame(size, 'n');
    for (size_t i = 0; i < 4; ++i)
        frame[14 + i] = static_cast<char>(number >> (8 * i) & 0xff);
    return frame;
}

unsigned number_of(const std::string &frame) {
    unsigned ret = 0;
    for (size_t i = 0; i < 4; ++i)
        ret |= unsigned{static_cast<uint8_t>(frame.at(14 + i))} << (8 * i);
    return ret;
}

}  // namespace

TEST(CaptureEquality, RandomFramesWithAndWithoutCutAndFilter) {
    expect_same_random_frames(Way::RING);
}

TEST(CaptureEquality, RandomFramesWhenTheKernelRefusesARing) {
    expect_same_random_frames(Way::NO_RING);
}

TEST(CaptureEquality, RandomFramesWhenARingCannotBeMapped) {
    expect_same_random_frames(Way::NO_MAPPING);
}

TEST(CaptureEquality, SizeLimitsAtEveryEdge) {
    run_in_sandbox(
        [] {
            const std::vector<std::string> frames = {test_frame(60, 'a'), test_frame(300, 'b'),
                                                     test_frame(1514, 'c'), test_frame(14, 'd')};
            for (uint32_t cut_length : {0u, 20u, 1536u}) {
                std::set<uint32_t> limits = {1, 24, 25, 39, 40, 41, 40000};
                uint32_t size = 24;
                for (const std::string &frame : frames) {
                    const auto captured =
                        cut_length != 0 ? cut_length : static_cast<uint32_t>(frame.size());
                    for (uint32_t extra : {0u, 47u, 48u, 49u})
                        limits.insert(size + captured + extra);
                    size += 16 + captured;
                }
                for (uint32_t limit : limits) {
                    SCOPED_TRACE(std::to_string(cut_length) + ", " + std::to_string(limit));
                    Captures captures({.size_limit = limit, .cut_length = cut_length});
                    for (const std::string &frame : frames)
                        captures.send("eth1", frame);
                    captures.expect_same_end();
                }
            }
        },
        WITH_ETH0);
}

TEST(CaptureEquality, ASizeLimitWithinABacklog) {
    run_in_sandbox(
        [] {
            for (uint32_t cut_length : {0u, 1000u}) {
                for (uint32_t limit : {70000u, 131072u, 150001u}) {
                    SCOPED_TRACE(std::to_string(cut_length) + ", " + std::to_string(limit));
                    Captures captures({.size_limit = limit, .cut_length = cut_length});
                    const Hold held(&captures.tested());
                    captures.set_held(true);
                    for (unsigned i = 0; !captures.ended(); ++i)
                        captures.send("eth1", numbered_frame(1000 + i % 500, i));
                    held.release();
                    captures.set_held(false);
                    captures.expect_same();
                    captures.expect_same_end();
                }
            }
        },
        WITH_ETH0);
}

TEST(CaptureEquality, TaggedFrames) {
    run_in_sandbox(
        [] {
            for (uint32_t cut_length : {0u, 70u}) {
                Captures captures({.cut_length = cut_length});
                const std::string tag = from_hex("8100 0007");
                std::string frame = test_frame(60, 't');
                const size_t received = frame.size();
                frame.insert(12, tag);
                // What comes in is seen without its tag, what goes out with it.
                captures.send("eth1", frame, received);
                captures.send("eth0", frame);
                captures.expect_same();
                // A tag within a tag.
                frame.insert(12, tag);
                captures.send("eth1", frame, received + 4);
                captures.expect_same();
                captures.expect_same_end();
            }
        },
        WITH_ETH0);
}

TEST(CaptureEquality, FramesOfAllInterfaces) {
    run_in_sandbox(
        [] {
            Captures captures({.interface = "nosuch", .size_limit = 4000});
            for (unsigned i = 0; !captures.ended(); ++i) {
                // As one end sends it and as the other receives it.
                captures.send("eth1", numbered_frame(200, i), 200, 2);
                captures.send("lo", numbered_frame(64 + i, i), 64 + i, 2);
            }
            captures.expect_same();
            captures.expect_same_end();
        },
        WITH_ETH0);
}

TEST(CaptureEquality, AnInterfaceThatIsDownAlready) {
    run_in_sandbox(
        [] {
            set_link_up("eth0", false);
            for (uint32_t size_limit : {0u, 500u}) {
                Captures captures({.size_limit = size_limit});
                captures.expect_same_end();
                set_link_up("eth0", false);
            }
        },
        WITH_ETH0);
}

TEST(CaptureRing, GoesRoundManyTimesWithoutLosingAFrame) {
    run_in_sandbox(
        [] {
            // More than the largest ring has slots.
            constexpr unsigned COUNT = 6000;
            CaptureRun run({.cut_length = 30});
            EXPECT_TRUE(has_ring());
            for (unsigned i = 0; i < COUNT; ++i) {
                send_quickly("eth1", numbered_frame(60, i));
                if (i % 100 == 99)
                    run.read_until(24 + (i + 1) * 46);
            }
            const std::vector<std::string> frames = frames_of(run.read_until(24 + COUNT * 46));
            ASSERT_EQ(COUNT, frames.size());
            for (unsigned i = 0; i < COUNT; ++i)
                ASSERT_EQ(numbered_frame(60, i).substr(0, 30), frames[i]);
        },
        WITH_ETH0);
}

TEST(CaptureRing, LosesTheLatestFramesWhenItIsFullAndThenGoesOn) {
    run_in_sandbox(
        [] {
            constexpr unsigned COUNT = 6000;
            CaptureRun run({});
            const Hold held(&run);
            for (unsigned i = 0; i < COUNT; ++i)
                send_quickly("eth1", numbered_frame(200, i));
            held.release();
            // There is room again: a later one comes through.
            unsigned last = COUNT;
            std::vector<std::string> frames;
            while (frames.empty() || number_of(frames.back()) < COUNT) {
                send_quickly("eth1", numbered_frame(200, last++));
                const size_t so_far = run.read_until(0).size();
                frames = frames_of(run.read_until(so_far + 1));
            }
            const auto kept = std::find_if(frames.begin(), frames.end(), [](const auto &frame) {
                return number_of(frame) >= COUNT;
            });
            // It held a good deal, in order, and lost the rest.
            EXPECT_LT(100, kept - frames.begin());
            EXPECT_GT(COUNT, kept - frames.begin());
            unsigned number = 0;
            for (auto frame = frames.begin(); frame != kept; ++frame)
                ASSERT_EQ(numbered_frame(200, number++), *frame);
            for (auto frame = kept; frame != frames.end(); ++frame)
                ASSERT_EQ(numbered_frame(200, number_of(*frame)), *frame);
        },
        WITH_ETH0);
}
