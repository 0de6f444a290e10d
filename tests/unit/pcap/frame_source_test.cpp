// Where a capture has its frames from, in either way: through a ring and without one.
#include "pcap/frame_source.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <array>
#include <string>

#include "support/packets.h"
#include "support/sandbox.h"

namespace {

const SandboxOptions WITH_ETH0 = {.eth0 = true};

constexpr int MANY = 6;

// The next frame of this length, of which there is one.
std::string frame_of_length(FrameSource *source, size_t wanted) {
    std::array<uint8_t, FRAME_SIZE> bytes;
    uint32_t length;
    for (;;) {
        pollfd readable = {.fd = source->socket_fd.get(), .events = POLLIN, .revents = 0};
        if (poll(&readable, 1, 10000) != 1)
            return "(none)";
        if (take_frame(source, bytes.data(), FRAME_SIZE, &length) == Taken::FRAME &&
            length == wanted)
            return std::string(reinterpret_cast<const char *>(bytes.data()), length);
    }
}

TEST(FrameSource, OfManyOnlySomeHaveARingAndAllSeeTheFrames) {
    run_in_sandbox(
        [] {
            std::array<FrameSource, MANY> sources;
            int rings = 0;
            for (FrameSource &source : sources) {
                ASSERT_EQ(0, open_frame_source("eth0", nullptr, &source));
                rings += source.ring.valid();
            }
            if (rings == 0)
                GTEST_SKIP() << "this kernel has no rings for packet sockets";
            EXPECT_EQ(4, rings);
            const std::string frame = test_frame(777, 'x');
            send_frame("eth1", frame);
            for (FrameSource &source : sources)
                EXPECT_EQ(frame, frame_of_length(&source, 777));
        },
        WITH_ETH0);
}

TEST(FrameSource, AnotherOneCanHaveTheRingOfOneThatHasEnded) {
    run_in_sandbox(
        [] {
            for (int i = 0; i < MANY; ++i) {
                FrameSource source;
                ASSERT_EQ(0, open_frame_source("eth0", nullptr, &source));
                if (!source.ring.valid())
                    GTEST_SKIP() << "this kernel has no rings for packet sockets";
            }
            // One that was not to be had takes none from the others.
            for (int i = 0; i < MANY; ++i) {
                FrameRing ring;
                ring.open(-1);
                EXPECT_FALSE(ring.valid());
            }
            FrameSource source;
            ASSERT_EQ(0, open_frame_source("eth0", nullptr, &source));
            EXPECT_TRUE(source.ring.valid());
        },
        WITH_ETH0);
}

}  // namespace
