// The bytes of the classic pcap file format.
#include "pcap/pcap_format.h"

namespace {

constexpr uint32_t MAGIC = 0xa1b2c3d4;  // also says that times are in microseconds
constexpr uint16_t MAJOR_VERSION = 2;
constexpr uint16_t MINOR_VERSION = 4;
// Of the stream as a whole; records may be cut shorter without changing it.
constexpr uint32_t SNAPSHOT_LENGTH = 65535;
constexpr uint32_t LINK_TYPE_ETHERNET = 1;

// Well below the snapshot length: readers refuse records that are longer than that.
constexpr uint32_t LARGEST_FILLER = 32767;
constexpr uint32_t HALF_FILLER = 16383;

// The device and its readers are little-endian; other hosts must write the same bytes.
uint8_t *put_le16(uint8_t *at, uint16_t value) {
    *at++ = static_cast<uint8_t>(value & 0xff);
    *at++ = static_cast<uint8_t>(value >> 8);
    return at;
}

uint8_t *put_le32(uint8_t *at, uint32_t value) {
    at = put_le16(at, static_cast<uint16_t>(value & 0xffff));
    return put_le16(at, static_cast<uint16_t>(value >> 16));
}

}  // namespace

std::array<uint8_t, PCAP_GLOBAL_HEADER_SIZE> pcap_global_header() {
    std::array<uint8_t, PCAP_GLOBAL_HEADER_SIZE> header;
    uint8_t *at = put_le32(header.data(), MAGIC);
    at = put_le16(at, MAJOR_VERSION);
    at = put_le16(at, MINOR_VERSION);
    at = put_le32(at, 0);  // time-zone offset: times are UTC
    at = put_le32(at, 0);  // accuracy of the time stamps: nobody fills it in
    at = put_le32(at, SNAPSHOT_LENGTH);
    put_le32(at, LINK_TYPE_ETHERNET);
    return header;
}

std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> pcap_record_header(const PcapRecord &record) {
    std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> header;
    uint8_t *at = put_le32(header.data(), record.seconds);
    at = put_le32(at, record.microseconds);
    at = put_le32(at, record.captured_length);
    put_le32(at, record.original_length);
    return header;
}

std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> pcap_filler_header(uint32_t data_length) {
    return pcap_record_header({.seconds = 0,
                               .microseconds = 0,
                               .captured_length = data_length,
                               .original_length = data_length});
}

uint32_t pcap_filler_size(uint32_t remainder) {
    if (remainder <= LARGEST_FILLER)
        return remainder;
    if (remainder - LARGEST_FILLER < PCAP_RECORD_HEADER_SIZE)
        return HALF_FILLER;
    return LARGEST_FILLER;
}
