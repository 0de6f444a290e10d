// The bytes of the classic pcap file format, version 2.4, for Ethernet frames.
//
// A stream is one global header, then records: a record header and the bytes of a frame. Every
// field is little-endian. All functions here are pure.
#pragma once

#include <stdint.h>

#include <array>

constexpr uint32_t PCAP_GLOBAL_HEADER_SIZE = 24;
constexpr uint32_t PCAP_RECORD_HEADER_SIZE = 16;

struct PcapRecord {
    uint32_t seconds;  // wall-clock time of reception
    uint32_t microseconds;
    uint32_t captured_length;  // bytes that follow the header
    uint32_t original_length;
};

std::array<uint8_t, PCAP_GLOBAL_HEADER_SIZE> pcap_global_header();
std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> pcap_record_header(const PcapRecord &record);

// The record header of a filler: time 0, both lengths `data_length`. As many zero bytes follow it.
std::array<uint8_t, PCAP_RECORD_HEADER_SIZE> pcap_filler_header(uint32_t data_length);

// A stream that is to have an exact size lacks `remainder` bytes. Returns how many of them the next
// filler record takes, its header included: all, or as many as leave room for another whole record.
// A remainder that is itself too small for a record header is returned as it is.
uint32_t pcap_filler_size(uint32_t remainder);
