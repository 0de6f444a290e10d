#include "pcap/pcap_format.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "support/packets.h"

namespace {

template <typename Bytes>
std::string text_of(const Bytes &bytes) {
    return std::string(bytes.begin(), bytes.end());
}

// The sizes of the filler records for a remainder.
std::vector<uint32_t> filler_plan(uint32_t remainder) {
    std::vector<uint32_t> ret;
    while (remainder > 0) {
        uint32_t size = pcap_filler_size(remainder);
        if (size == 0 || size > remainder) {
            ADD_FAILURE() << "filler of " << size << " for " << remainder;
            break;
        }
        ret.push_back(size);
        remainder -= size;
    }
    return ret;
}

}  // namespace

TEST(PcapGlobalHeader, IsLittleEndianVersion2Point4ForEthernet) {
    EXPECT_EQ(from_hex("d4c3b2a1 0200 0400 00000000 00000000 ffff0000 01000000"),
              text_of(pcap_global_header()));
}

TEST(PcapRecordHeader, HoldsTheTimeAndBothLengthsInLittleEndianOrder) {
    EXPECT_EQ(from_hex("04030201 0f0e0d0c 00060000 ea050000"),
              text_of(pcap_record_header({.seconds = 0x01020304,
                                          .microseconds = 0x0c0d0e0f,
                                          .captured_length = 1536,
                                          .original_length = 1514})));
    EXPECT_EQ(from_hex("ffffffff fefffff0 fdffffff fcffff7f"),
              text_of(pcap_record_header({.seconds = 0xffffffff,
                                          .microseconds = 0xf0fffffe,
                                          .captured_length = 0xfffffffd,
                                          .original_length = 0x7ffffffc})));
}

TEST(PcapFillerHeader, HasTimeZeroAndTheSameLengthTwice) {
    EXPECT_EQ(from_hex("00000000 00000000 c0030000 c0030000"), text_of(pcap_filler_header(960)));
    EXPECT_EQ(from_hex("00000000 00000000 00000000 00000000"), text_of(pcap_filler_header(0)));
}

TEST(PcapFillerSize, FillsUpToTheLimitWithoutARemainderBelowARecordHeader) {
    const struct {
        uint32_t remainder;
        std::vector<uint32_t> sizes;
    } CASES[] = {
        {0, {}},
        {16, {16}},
        {17, {17}},
        {33, {33}},
        {976, {976}},
        {32767, {32767}},
        {32768, {16383, 16385}},
        {32769, {16383, 16386}},
        {32770, {16383, 16387}},
        {32781, {16383, 16398}},
        {32782, {16383, 16399}},
        {32783, {32767, 16}},
        {32784, {32767, 17}},
        {65534, {32767, 32767}},
        {65535, {32767, 16383, 16385}},
        {65549, {32767, 16383, 16399}},
        {65550, {32767, 32767, 16}},
    };
    for (const auto &row : CASES)
        EXPECT_EQ(row.sizes, filler_plan(row.remainder)) << row.remainder;
}

TEST(PcapFillerSize, ARemainderOf32770Takes16383AndThen16387Bytes) {
    EXPECT_EQ(16383u, pcap_filler_size(32770));
    EXPECT_EQ(16387u, pcap_filler_size(32770 - 16383));
}

TEST(PcapFillerSize, SumsUpExactlyForEveryRemainder) {
    for (uint32_t remainder = 16; remainder < 140000; ++remainder) {
        uint32_t sum = 0;
        for (uint32_t size : filler_plan(remainder)) {
            ASSERT_GE(size, 16u) << remainder;
            ASSERT_LE(size, 32767u) << remainder;
            sum += size;
        }
        ASSERT_EQ(remainder, sum);
    }
}

TEST(PcapFillerSize, ARemainderTooSmallForAHeaderIsTakenAsItIs) {
    for (uint32_t remainder = 1; remainder < 16; ++remainder)
        EXPECT_EQ(remainder, pcap_filler_size(remainder));
}

TEST(PcapFillerSize, EndsForTheLargestRemainder) {
    uint64_t sum = 0;
    for (uint32_t size : filler_plan(0xffffffff))
        sum += size;
    EXPECT_EQ(0xffffffffu, sum);
}

TEST(PcapFillers, AreReadAsWholeRecordsToTheVeryEnd) {
    for (uint32_t remainder : {16u, 17u, 32767u, 32768u, 32775u, 32782u, 32783u, 200000u}) {
        std::string stream = text_of(pcap_global_header());
        for (uint32_t size : filler_plan(remainder))
            stream += text_of(pcap_filler_header(size - 16)) + std::string(size - 16, '\0');
        ASSERT_EQ(24 + remainder, stream.size());
        PcapTestStream parsed = parse_pcap(stream);
        EXPECT_EQ("", parsed.rest) << remainder;
        for (const PcapTestRecord &record : parsed.records) {
            EXPECT_EQ(0u, record.seconds);
            EXPECT_EQ(record.captured_length, record.original_length);
        }
    }
}
